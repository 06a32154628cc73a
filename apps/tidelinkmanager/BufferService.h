// The link manager's buffer service: shared-memory buffers that producers fill and publish under
// GUIDs, and that consumers are told about, map and drop. See docs/buffers.md for the rules.
//
// Threading: every method may be called from any thread. One mutex guards all tables; messages
// to clients are sent after it is released.
#pragma once

#include <cstdint>
#include <memory>

#include "ManagerService.h"
#include "platform/Serialization.h"

namespace tidelink::manager {

struct BufferServiceOptions {
    // Bytes one client may have allocated and not yet published or dropped.
    uint64_t clientCapBytes = 1ull << 30;
    // Published data handed over to the manager and claimed by nobody is released after this
    // time, or earlier, oldest first, while such data exceed |retainedCapBytes|.
    double retentionSeconds = 10.0;
    uint64_t retainedCapBytes = 512ull << 20;
    // Buffers nobody holds wait here to be handed out again at the same size.
    size_t poolMaxBuffers = 32;
    uint64_t poolMaxBytes = 512ull << 20;
    // Bounds on what one client can make the manager remember.
    size_t maxWaitsPerClient = 16384;
    size_t maxHeldPerClient = 16384;
    size_t maxErrors = 16384;
};

// Figures for the status query.
struct BufferServiceCounters {
    uint64_t buffersLive = 0;
    uint64_t bytesLive = 0;
    uint64_t buffersPooled = 0;
    uint64_t bytesPooled = 0;
    uint64_t clients = 0;
    uint64_t objectsCreated = 0;
    uint64_t allocations = 0;
};

class BufferService final : public ManagerModule,
                            public std::enable_shared_from_this<BufferService> {
public:
    explicit BufferService(BufferServiceOptions options = {});
    ~BufferService() override;

    void Register(ManagerService& service) override;
    void OnSessionClosed(const platform::SessionPtr& session) override;
    void AddInfo(platform::Value& info) override;
    // Releases every buffer, pooled or held, and removes their shared-memory objects.
    void OnStop() override;

    BufferServiceCounters Counters() const;
    // Releases unclaimed data past their retention time (also done once a second).
    void Sweep();

    struct Impl;

private:
    std::unique_ptr<Impl> mImpl;
};

// The options with the environment's overrides: TIDELINK_BUFFER_CLIENT_CAP (bytes),
// TIDELINK_BUFFER_RETENTION (seconds), TIDELINK_BUFFER_RETAINED_CAP (bytes).
BufferServiceOptions BufferServiceOptionsFromEnvironment();

// Names of this user's buffers of this suite version start with this and end with
// "-" + CSVersionPortNumberString().
std::string BufferNamePrefix();

}  // namespace tidelink::manager
