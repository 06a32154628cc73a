// The wire format of sessions (see docs/wire.md).
//
// A session starts with a hello from the connecting side (magic, wire version, the user's session
// secret) answered by an acknowledgement. After that each message is one frame: a 4-byte
// little-endian length, then that many bytes of MessagePack holding an array:
//   [0, id, name, args]          request
//   [1, id, error, result]       reply; error is nil or [code, message]
//   [2, name, args]              notification
// Every length is checked before anything is allocated and every decode is bounds-checked.
#pragma once

#include <array>
#include <cstdint>
#include <stdexcept>
#include <string>
#include <vector>

#include "platform/Export.h"
#include "platform/Serialization.h"

namespace tidelink::platform::wire {

inline constexpr uint16_t kWireVersion = 1;
inline constexpr uint32_t kMaxFrameSize = 16u * 1024u * 1024u;
inline constexpr size_t kMaxNameLength = 1024;
inline constexpr size_t kSecretSize = 32;
inline constexpr size_t kHelloSize = 8 + kSecretSize;
inline constexpr size_t kAckSize = 8;
inline constexpr size_t kFrameHeaderSize = 4;

enum class Kind : uint8_t { Request = 0, Reply = 1, Notification = 2 };

// Acknowledgement status.
enum class HelloStatus : uint16_t { Ok = 0, VersionMismatch = 1 };

struct Message {
    Kind kind = Kind::Request;
    uint64_t id = 0;
    std::string name;      // request, notification
    Value args;            // request, notification: always an array
    bool isError = false;  // reply
    int32_t errorCode = 0;
    std::string errorMessage;
    Value result;  // reply
};

class TIDELINK_EXPORT WireError : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

using Buffer = std::vector<uint8_t>;
using Secret = std::array<uint8_t, kSecretSize>;

// Each appends one complete frame to |out|. Throws WireError when the frame would exceed
// kMaxFrameSize or the name is not acceptable; |out| is then left as it was.
TIDELINK_EXPORT void AppendRequest(Buffer& out, uint64_t id, const std::string& name, const Value& args);
TIDELINK_EXPORT void AppendNotification(Buffer& out, const std::string& name, const Value& args);
TIDELINK_EXPORT void AppendReply(Buffer& out, uint64_t id, const Value& result);
TIDELINK_EXPORT void AppendErrorReply(Buffer& out, uint64_t id, int32_t code, const std::string& message);

// Length of the frame body announced at |data| (4 bytes). Throws WireError for 0 or more than
// kMaxFrameSize.
TIDELINK_EXPORT uint32_t ReadFrameLength(const uint8_t* data);
// Decodes one frame body. Throws WireError naming what is wrong.
TIDELINK_EXPORT Message DecodeBody(const uint8_t* data, size_t size);

// One MessagePack value to and from the tree (the encoding of every argument and result).
// DecodeValue reads exactly [data, data + size): nesting is limited to kMaxValueDepth, declared
// counts are checked against the bytes that remain before anything is reserved, map keys must be
// strings and must not repeat. Throws WireError.
TIDELINK_EXPORT void EncodeValue(Buffer& out, const Value& value);
TIDELINK_EXPORT Value DecodeValue(const uint8_t* data, size_t size, size_t maxDepth = kMaxValueDepth);

TIDELINK_EXPORT Buffer MakeHello(const Secret& secret);
// Checks a hello; returns Ok, VersionMismatch, or throws WireError for a bad magic or secret.
TIDELINK_EXPORT HelloStatus CheckHello(const uint8_t* data, const Secret& secret);
TIDELINK_EXPORT Buffer MakeAck(HelloStatus status);
// Returns the status of an acknowledgement; throws WireError for a bad magic.
TIDELINK_EXPORT HelloStatus ReadAck(const uint8_t* data);

}  // namespace tidelink::platform::wire
