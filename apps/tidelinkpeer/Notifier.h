// Outgoing notifications of the peer to hosts' endpoints (progress and status changes).
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "platform/Executor.h"
#include "platform/Rpc.h"
#include "platform/Transport.h"
#include "tidelink/core/Brokering.h"

namespace tidelink::peer {

// Request sent after notifications to learn that they were handled. Hosts need not answer it:
// the "no handler" error reply they give by default is the confirmation, since a session
// handles its messages in order.
inline constexpr const char* kNotificationBarrierMessage = "com.quenlo.tidelink.PeerNotificationBarrier";

class NotificationSink {
public:
    virtual ~NotificationSink() = default;
    // Queues |call| as a notification to |endpoint|; returns at once. Calls to one endpoint are
    // delivered in the order they were queued.
    virtual void Send(const ServerConnection& endpoint, platform::Call call) = 0;
    // Blocks until every endpoint has handled what was queued before the call, or |timeoutMs|
    // passed. True when all confirmed. Not on a transport thread.
    virtual bool Flush(int timeoutMs) = 0;
    // Drops what is still queued after the calls under way and closes every session. Afterwards
    // Send does nothing. Not on a transport thread.
    virtual void Close() = 0;
};

// Opens one client session per endpoint (on first use, again after it closed) and sends on it.
// Each endpoint has its own serial queue on |executor|, so a host that does not answer its hello
// (ClientStart waits up to 5 s) holds up only its own notifications; no transport thread ever
// waits. When an endpoint cannot be reached, |onUnreachable| runs on that queue (no lock held).
class EndpointNotifier final : public NotificationSink,
                               public std::enable_shared_from_this<EndpointNotifier> {
public:
    using UnreachableFn = std::function<void(const ServerConnection&)>;
    EndpointNotifier(platform::SocketTransportPtr transport, platform::ExecutorPtr executor);
    ~EndpointNotifier() override;

    void SetUnreachableHandler(UnreachableFn fn);
    void Send(const ServerConnection& endpoint, platform::Call call) override;
    bool Flush(int timeoutMs) override;
    void Close() override;

    size_t EndpointCount() const;

private:
    struct Endpoint;
    std::shared_ptr<Endpoint> Get(const ServerConnection& endpoint);
    static platform::SessionPtr Connect(Endpoint& ep, const platform::SocketTransportPtr& transport);

    platform::SocketTransportPtr mTransport;
    platform::ExecutorPtr mExecutor;
    mutable std::mutex mMutex;
    bool mClosed = false;
    UnreachableFn mOnUnreachable;
    std::map<std::string, std::shared_ptr<Endpoint>> mEndpoints;
};

}  // namespace tidelink::peer
