#include "Notifier.h"

#include <atomic>
#include <chrono>
#include <vector>

#include "platform/Process.h"
#include "platform/Sync.h"
#include "platform/Trace.h"

namespace tidelink::peer {

using namespace platform;

namespace {
constexpr const char* kCat = "TideLinkPeer";

std::string KeyOf(const ServerConnection& c) { return c.mAddress + ":" + std::to_string(c.mPort); }
}  // namespace

struct EndpointNotifier::Endpoint {
    ServerConnection where;
    ExecutorPtr queue;
    std::atomic<bool> closed{false};
    SessionPtr session;  // touched only by tasks of |queue| (and by Close once the queue is idle)
};

EndpointNotifier::EndpointNotifier(SocketTransportPtr transport, ExecutorPtr executor)
    : mTransport(std::move(transport)), mExecutor(std::move(executor)) {}

EndpointNotifier::~EndpointNotifier() { Close(); }

void EndpointNotifier::SetUnreachableHandler(UnreachableFn fn) {
    std::lock_guard lock(mMutex);
    mOnUnreachable = std::move(fn);
}

std::shared_ptr<EndpointNotifier::Endpoint> EndpointNotifier::Get(const ServerConnection& endpoint) {
    auto& slot = mEndpoints[KeyOf(endpoint)];
    if (!slot) {
        slot = std::make_shared<Endpoint>();
        slot->where = endpoint;
        slot->queue = CreateSubExecutor(mExecutor, 1);
    }
    return slot;
}

SessionPtr EndpointNotifier::Connect(Endpoint& ep, const SocketTransportPtr& transport) {
    if (ep.session && ep.session->IsOpen()) return ep.session;
    ep.session = ClientStart(transport, ep.where.mAddress, ep.where.mPort);
    if (!ep.session) {
        TL_TRACE(kCat, 3) << "Cannot reach the endpoint " << KeyOf(ep.where);
    } else {
        TL_TRACE(kCat, 6) << "Connected to the endpoint " << KeyOf(ep.where);
    }
    return ep.session;
}

void EndpointNotifier::Send(const ServerConnection& endpoint, Call call) {
    std::shared_ptr<Endpoint> ep;
    {
        std::lock_guard lock(mMutex);
        if (mClosed) return;
        ep = Get(endpoint);
    }
    std::weak_ptr<EndpointNotifier> weak = shared_from_this();
    ep->queue->Post([ep, weak, transport = mTransport, call = std::move(call)] {
        if (ep->closed.load()) return;
        if (auto session = Connect(*ep, transport)) {
            session->SendNotification(call);
            return;
        }
        UnreachableFn fn;
        if (auto self = weak.lock()) {
            std::lock_guard lock(self->mMutex);
            fn = self->mOnUnreachable;
        }
        if (fn) fn(ep->where);
    });
}

bool EndpointNotifier::Flush(int timeoutMs) {
    std::vector<std::shared_ptr<Endpoint>> endpoints;
    {
        std::lock_guard lock(mMutex);
        for (const auto& [key, ep] : mEndpoints) endpoints.push_back(ep);
    }
    auto confirmed = std::make_shared<std::atomic<bool>>(true);
    std::vector<std::shared_ptr<Gate>> gates;
    for (const auto& ep : endpoints) {
        auto gate = std::make_shared<Gate>();
        gates.push_back(gate);
        ep->queue->Post([ep, gate, confirmed] {
            SessionPtr session = ep->closed.load() ? nullptr : ep->session;
            if (!session || !session->IsOpen()) {
                gate->Open();
                return;
            }
            session->SendRequest(
                BuildCall(kNotificationBarrierMessage), [gate](const Value&, RequestId) { gate->Open(); },
                [gate, confirmed](int32_t code, const WString&, RequestId) {
                    // Any answer of the host confirms; only a lost session does not.
                    if (code == kErrorConnectFailed || code == kErrorSessionClosed || code == kErrorTransportShutdown) {
                        confirmed->store(false);
                    }
                    gate->Open();
                });
        });
    }
    const double deadline = NowSeconds() + timeoutMs / 1000.0;
    for (const auto& gate : gates) {
        const double left = deadline - NowSeconds();
        if (!gate->Wait(left > 0 ? static_cast<int>(left * 1000) + 1 : 0)) confirmed->store(false);
    }
    return confirmed->load();
}

void EndpointNotifier::Close() {
    std::map<std::string, std::shared_ptr<Endpoint>> endpoints;
    {
        std::lock_guard lock(mMutex);
        mClosed = true;
        endpoints.swap(mEndpoints);
        mOnUnreachable = nullptr;
    }
    for (auto& entry : endpoints) {
        const std::shared_ptr<Endpoint> ep = entry.second;
        ep->closed.store(true);
        ep->queue->Post([ep] {
            if (ep->session) ep->session->Close();
            ep->session.reset();
        });
    }
    for (auto& [key, ep] : endpoints) ep->queue->WaitUntilIdle();
}

size_t EndpointNotifier::EndpointCount() const {
    std::lock_guard lock(mMutex);
    return mEndpoints.size();
}

}  // namespace tidelink::peer
