// Shared binary data between processes, through the link manager: a producer allocates a
// shared-memory buffer, fills it and publishes it under a GUID; a consumer is told when data for
// a GUID arrive, maps them without copying, reads them and lets them go.
//
// Threading: every function may be called from any thread. Availability callbacks run on the
// delivery executor (the library's shared executor), never on the caller's thread and never under
// a lock of this module. A reference refers to its local server without owning it: release every
// reference before the last UninitializeClient.
#pragma once

#include <cstdint>
#include <memory>
#include <stdexcept>
#include <string>

#include <boost/function.hpp>
#include <boost/shared_ptr.hpp>
#include <boost/weak_ptr.hpp>

#include "platform/Executor.h"
#include "platform/Export.h"
#include "platform/Guid.h"
#include "platform/SharedMemory.h"

namespace processcoordination {

using tidelink::platform::Guid;

// Result codes.
inline constexpr int kResultOK = 0;
inline constexpr int kResultNotAvailable = -1;      // also: refused, not wanted, failed request
inline constexpr int kResultNotImplemented = -2;    // BeginBinaryDataGeneration
inline constexpr int kResultBadArgument = -3;
inline constexpr int kResultNoAnswer = -4;          // no answer, or the connection was lost
inline constexpr int kResultNoClient = -5;
inline constexpr int kResultCancelled = -6;

// Read-only data held by the link manager. This process's hold ends when its last handle on the
// file is released.
class TIDELINK_EXPORT BinaryReference {
public:
    virtual ~BinaryReference();
    virtual uint64_t GetSize() = 0;
    // Maps the data; null when the file cannot be mapped. Calls nest: each needs one unmap.
    virtual const void* MapIntoCurrentProcess() = 0;
    // Undoes one MapIntoCurrentProcess; |inData| must be the address it returned.
    virtual void UnmapFromCurrentProcess(const void* inData) = 0;

protected:
    BinaryReference() = default;

public:
    BinaryReference(const BinaryReference&) = default;
    BinaryReference& operator=(const BinaryReference&) = default;
};

// Data being produced; filled through MapIntoCurrentProcess and given to PutCompletedBinaryData.
class TIDELINK_EXPORT WritableBinaryReference {
public:
    virtual ~WritableBinaryReference();
    virtual uint64_t GetSize() = 0;
    virtual void* MapIntoCurrentProcess() = 0;
    virtual void UnmapFromCurrentProcess(void* inData) = 0;

protected:
    WritableBinaryReference() = default;

public:
    WritableBinaryReference(const WritableBinaryReference&) = default;
    WritableBinaryReference& operator=(const WritableBinaryReference&) = default;
};

using BinaryReferencePtr = boost::shared_ptr<BinaryReference>;
using WritableBinaryReferencePtr = boost::shared_ptr<WritableBinaryReference>;
// Called once per registration: the reference is set only when |result| is 0.
using AvailabilityCallback =
    boost::function<void(const Guid& identifier, BinaryReferencePtr reference, int result)>;
// Called when the link manager has acknowledged a when-available request.
using RegistrationCallback = boost::function<void()>;

// Raised by a broken contract (an unmap with an address that was not mapped).
class TIDELINK_EXPORT ContractViolation : public std::logic_error {
public:
    ContractViolation();
};

TIDELINK_EXPORT bool InitializeClient();
TIDELINK_EXPORT void UninitializeClient();
TIDELINK_EXPORT int IsBinaryDataCurrentlyAvailable(const Guid& identifier);
TIDELINK_EXPORT int IsBinaryDataCurrentlyWanted(const Guid& identifier);
TIDELINK_EXPORT int GetBinaryDataIfAvailable(const Guid& identifier, BinaryReferencePtr& out);
// 0 when the request went out; |callback| then runs exactly once (data, error, cancel or lost
// connection). Otherwise |callback| has run (or will run) with -1.
TIDELINK_EXPORT int GetBinaryDataWithAsyncNotification(const Guid& identifier, AvailabilityCallback callback,
                                                       RegistrationCallback registered = {});
TIDELINK_EXPORT int GetBinaryDataOrRegisterNotification(const Guid& identifier, AvailabilityCallback callback,
                                                        BinaryReferencePtr& out,
                                                        RegistrationCallback registered = {});
TIDELINK_EXPORT void CancelAllOutstandingNotifications(const Guid& identifier, int code);
TIDELINK_EXPORT void FlushAllNotifications();
TIDELINK_EXPORT tidelink::platform::ExecutorPtr GetDeliveryExecutor();
TIDELINK_EXPORT int GetWritableBinaryData(uint64_t size, WritableBinaryReferencePtr& out);
TIDELINK_EXPORT int PutCompletedBinaryData(const Guid& identifier, WritableBinaryReferencePtr reference,
                                           bool handOver);
// The shared-memory name of writable data and its size (false for a reference made elsewhere or
// already handed over): what a producer needs to be told to write into a buffer the caller owns.
TIDELINK_EXPORT bool DescribeWritableBinaryData(const WritableBinaryReferencePtr& reference, std::string& name,
                                                uint64_t& size);
TIDELINK_EXPORT int PutBinaryDataGenerationError(const Guid& identifier, int error);
TIDELINK_EXPORT int MakeBinaryDataAlias(const Guid& identifier, BinaryReferencePtr reference, const Guid& alias);
TIDELINK_EXPORT int BeginBinaryDataGeneration(const Guid& identifier, bool flag);

// The process-wide cache of open mappings. Get returns a cached mapping of |name| of exactly
// |size| bytes (writable when asked) or opens one; null when it cannot be mapped. Return keeps
// mappings of 100,000 to 33,177,600 bytes, at most 100 of them and 26,214,400 bytes in total,
// most recently returned first.
inline constexpr uint64_t kCacheMinBytes = 100000;
inline constexpr uint64_t kCacheMaxBytes = 33177600;
inline constexpr size_t kCacheMaxEntries = 100;
inline constexpr uint64_t kCacheTotalBytes = 26214400;
TIDELINK_EXPORT std::unique_ptr<tidelink::platform::MemoryMappedFile> GetCachedMemoryMappedFile(
    const std::string& name, uint64_t size, bool writable);
TIDELINK_EXPORT void ReturnCachedMemoryMappedFile(const std::string& name,
                                                  std::unique_ptr<tidelink::platform::MemoryMappedFile> file);

// What the cache holds and has done (for tests, the benchmark and diagnostics).
struct MappedFileCacheStats {
    size_t entries = 0;
    uint64_t bytes = 0;
    uint64_t hits = 0;
    uint64_t mappingsCreated = 0;
};
TIDELINK_EXPORT MappedFileCacheStats GetMappedFileCacheStats();
// Unmaps everything cached.
TIDELINK_EXPORT void ClearMappedFileCache();

}  // namespace processcoordination
