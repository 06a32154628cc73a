// What the coordination client and the link manager's buffer service say to each other: message
// names and the two records of the exchange.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "platform/Export.h"
#include "platform/Guid.h"
#include "platform/Serialization.h"

namespace tidelinkmanager::processcoordinationprotocol {

inline constexpr const char* kIsBinaryDataCurrentlyWanted =
    "com.quenlo.processcoordination.IsBinaryDataCurrentlyWanted";
inline constexpr const char* kGetBinaryDataIfAvailable =
    "com.quenlo.processcoordination.GetBinaryDataIfAvailable";
inline constexpr const char* kGetBinaryDataWhenAvailable =
    "com.quenlo.processcoordination.GetBinaryDataWhenAvailable";
inline constexpr const char* kAllocateBinaryData = "com.quenlo.processcoordination.AllocateBinaryData";
inline constexpr const char* kPublishBinaryData = "com.quenlo.processcoordination.PublishBinaryData2";
inline constexpr const char* kPublishBinaryDataGenerationError =
    "com.quenlo.processcoordination.PublishBinaryDataGenerationError2";
inline constexpr const char* kCreateBinaryDataAlias =
    "com.quenlo.processcoordination.CreateBinaryDataAlias2";
inline constexpr const char* kDropReferenceToBinaryData =
    "com.quenlo.processcoordination.DropReferenceToBinaryData2";
inline constexpr const char* kBinaryDataArrived = "com.quenlo.processcoordination.BinaryDataArrived";

// Reply of the requests that yield data. Before an answer arrives it reads "no answer".
struct BinaryReferenceDescription {
    int32_t result = -4;
    std::string filename;
    uint64_t size = 0;
};

struct BinaryReferenceAvailable {
    tidelink::platform::Guid identifier;
    BinaryReferenceDescription reference;
};
using BinaryReferencesAvailable = std::vector<BinaryReferenceAvailable>;

// "result" is written as a signed 64-bit integer and read into 32 bits; a value outside that
// range reads as -1 rather than wrapping into another code (or into 0, success).
TIDELINK_EXPORT void to_json(tidelink::platform::Value& j, const BinaryReferenceDescription& d);
TIDELINK_EXPORT void from_json(const tidelink::platform::Value& j, BinaryReferenceDescription& d);
TIDELINK_EXPORT void to_json(tidelink::platform::Value& j, const BinaryReferenceAvailable& a);
TIDELINK_EXPORT void from_json(const tidelink::platform::Value& j, BinaryReferenceAvailable& a);

// A boolean reply value: a boolean, a non-zero integer, or the strings "true" / "false".
TIDELINK_EXPORT bool ReadBoolean(const tidelink::platform::Value& v);

}  // namespace tidelinkmanager::processcoordinationprotocol
