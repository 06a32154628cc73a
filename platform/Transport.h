// Loopback socket sessions.
//
// A SocketTransport owns the I/O threads on which every session's reads, replies, failures and
// close handlers run ("transport threads"). Sessions keep their transport alive; the transport
// goes when its last session and listening server have gone.
//
// Threading: every Session method may be called from any thread. Callbacks (reply and failure
// functions, incoming requests, close handlers) run on transport threads, never on the caller's
// thread and never with a lock of the session held. The messages of one session are handled one
// at a time, in arrival order.
//
// Failure codes passed to failure functions:
//   -10001  no session: the connection could not be opened (or the session was already closed
//           when the request was sent)
//   -10002  the session closed before the reply arrived
//   -10003  protocol error: the peer sent something malformed, or a reply could not be read
//   -10004  the request was refused: it could not be encoded or exceeds the size limit, no handler
//           is registered under its name, its arguments did not fit the handler, or the handler
//           dropped it without answering
//   -10005  the local transport shut down with the request pending
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/Executor.h"
#include "platform/Export.h"
#include "platform/Guid.h"
#include "platform/Serialization.h"
#include "platform/Strings.h"

namespace tidelink::platform {

inline constexpr int32_t kErrorConnectFailed = -10001;
inline constexpr int32_t kErrorSessionClosed = -10002;
inline constexpr int32_t kErrorProtocol = -10003;
inline constexpr int32_t kErrorRequestRefused = -10004;
inline constexpr int32_t kErrorTransportShutdown = -10005;

// Why a session closed.
enum class TransportError : int32_t {
    ClosedByPeer = 1,    // the other side closed or the connection broke
    ProtocolError = 2,   // malformed input, failed hello, or an unanswered hello
    LocalClose = 3,      // Close() was called here
    Shutdown = 4,        // the transport or listening server stopped
    Overloaded = 5,      // the peer stopped reading and our output queue overflowed
};

TIDELINK_EXPORT const char* Describe(TransportError e);

using RequestId = uint64_t;
using SuccessFn = std::function<void(const Value& reply, RequestId id)>;
using FailureFn = std::function<void(int32_t code, const WString& message, RequestId id)>;

class Session;
class SocketTransport;
class ListeningServer;
using SessionPtr = std::shared_ptr<Session>;
using SocketTransportPtr = std::shared_ptr<SocketTransport>;
using ListeningServerPtr = std::shared_ptr<ListeningServer>;
using CloseHandler = std::function<void(const SessionPtr& session, TransportError reason)>;

// Receives the requests and notifications that arrive on a session.
class TIDELINK_EXPORT MessageDispatcher {
public:
    virtual ~MessageDispatcher() = default;
    virtual void OnRequest(const SessionPtr& session, RequestId id, const std::string& name,
                           const Value& args) = 0;
    virtual void OnNotification(const SessionPtr& session, const std::string& name,
                                const Value& args) = 0;
};

namespace detail {
class SessionImpl;
class TransportCore;
}  // namespace detail

class TIDELINK_EXPORT Session {
public:
    ~Session();
    Session(const Session&) = delete;
    Session& operator=(const Session&) = delete;

    bool IsOpen() const;
    // Closes the session; pending requests fail with -10002 and close handlers run (on a
    // transport thread). Idempotent.
    void Close();

    // Runs |handler| once when the session closes (at once, on a transport thread, if it already
    // has). The GUID removes it again.
    Guid AddCloseHandler(CloseHandler handler);
    void RemoveCloseHandler(const Guid& id);

    // Returns the request id at once. Later exactly one of |ok| and |fail| runs on a transport
    // thread, unless the request is cancelled first. The functions receive |correlate| as the
    // request id when it is non-zero (a fallback request passes the id of the request it replaces,
    // and cancelling that id cancels the fallback too), otherwise the new id.
    RequestId SendRequest(const Call& call, SuccessFn ok, FailureFn fail, uint64_t correlate = 0);
    // One-way; dropped (with a trace line) when the session is closed or the call cannot be sent.
    void SendNotification(const Call& call);
    // Afterwards neither function of the request runs. Returns false when it was not pending.
    bool CancelRequest(RequestId id);

    // Answers for incoming requests.
    void SendReply(RequestId id, const Value& result);
    void SendErrorReply(RequestId id, int32_t code, const std::string& message);

    // Where incoming requests and notifications go. Without a dispatcher requests are refused
    // with -10004 and notifications are dropped. The session holds the dispatcher until it
    // closes: a dispatcher that holds the session must hold it weakly.
    void SetDispatcher(std::shared_ptr<MessageDispatcher> dispatcher);

    SocketTransportPtr GetTransport() const;
    std::string GetRemoteAddress() const;
    uint16_t GetRemotePort() const;
    uint16_t GetLocalPort() const;
    size_t PendingRequestCount() const;

private:
    friend class detail::SessionImpl;
    friend class SocketTransport;
    friend class ListeningServer;
    Session() = default;
    std::shared_ptr<detail::SessionImpl> mImpl;
};

class TIDELINK_EXPORT ListeningServer {
public:
    ~ListeningServer();
    ListeningServer(const ListeningServer&) = delete;
    ListeningServer& operator=(const ListeningServer&) = delete;

    uint16_t GetPort() const;
    std::string GetAddress() const;
    // Applies to sessions accepted from now on.
    void SetDispatcher(std::shared_ptr<MessageDispatcher> dispatcher);
    // Called (on a transport thread) for each session once its hello is accepted.
    void SetSessionHandler(std::function<void(const SessionPtr&)> handler);
    // Stops accepting and closes every session it accepted. Idempotent.
    void Stop();
    size_t SessionCount() const;

private:
    friend class SocketTransport;
    struct Impl;
    explicit ListeningServer(std::shared_ptr<Impl> impl) : mImpl(std::move(impl)) {}
    std::shared_ptr<Impl> mImpl;
};

class TIDELINK_EXPORT SocketTransport : public std::enable_shared_from_this<SocketTransport> {
public:
    static SocketTransportPtr Create(ExecutorPtr executor);
    ~SocketTransport();

    // Connects and completes the hello. Returns null when nothing listens there, the hello is
    // refused or not answered within 5 seconds.
    SessionPtr ClientStart(const std::string& address, uint16_t port);
    // Listens on |port| (0 = any free port), on 127.0.0.1 only when |loopbackOnly|.
    // Returns null when the address cannot be bound.
    ListeningServerPtr ServerStart(uint16_t port, bool loopbackOnly);

    ExecutorPtr GetExecutor() const { return mExecutor; }
    // Runs |task| on a transport thread.
    void Post(std::function<void()> task);

private:
    SocketTransport(ExecutorPtr executor);
    ExecutorPtr mExecutor;
    std::shared_ptr<detail::TransportCore> mCore;
};

// The platform's spellings of the two factory calls.
inline SessionPtr ClientStart(const SocketTransportPtr& t, const std::string& address, uint16_t port) {
    return t ? t->ClientStart(address, port) : nullptr;
}
inline ListeningServerPtr ServerStart(const SocketTransportPtr& t, uint16_t port, bool loopbackOnly) {
    return t ? t->ServerStart(port, loopbackOnly) : nullptr;
}

}  // namespace tidelink::platform
