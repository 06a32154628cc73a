#include "platform/Transport.h"

#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/socket.h>

#include <boost/asio.hpp>
#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <thread>

#include "platform/SessionSecret.h"
#include "platform/Sync.h"
#include "platform/Trace.h"
#include "platform/Wire.h"

namespace tidelink::platform {

namespace asio = boost::asio;
using asio::ip::tcp;

namespace {

constexpr const char* kCat = "transport";
constexpr int kHandshakeTimeoutMs = 5000;
constexpr size_t kMaxQueuedBytes = 256u * 1024u * 1024u;  // unsent output before a peer counts as stuck
constexpr size_t kMaxSessionsPerServer = 4096;
constexpr size_t kInitialReadBuffer = 64 * 1024;

std::atomic<RequestId> gNextRequestId{1};

// Replies made while a session handles a batch of incoming messages are gathered and sent with
// one write at the end of the batch (the session whose batch this thread is handling).
thread_local const void* tReplyBatchOwner = nullptr;
constexpr size_t kMaxReplyBatch = 256 * 1024;

struct Pending {
    SuccessFn ok;
    FailureFn fail;
    uint64_t correlate = 0;
};

// Outside code runs through here: an exception from a callback must neither skip the callbacks
// after it nor end a session's read loop.
template <class F, class... Args>
void SafeCall(const char* what, const F& f, Args&&... args) {
    try {
        f(std::forward<Args>(args)...);
    } catch (const std::exception& e) {
        TL_TRACE(kCat, 0) << what << " threw: " << e.what();
    } catch (...) {
        TL_TRACE(kCat, 0) << what << " threw an unknown exception";
    }
}

int32_t CodeFor(TransportError reason) {
    return reason == TransportError::Shutdown ? kErrorTransportShutdown : kErrorSessionClosed;
}

WString MessageFor(TransportError reason) {
    return ToUTF16(std::string("Session closed: ") + Describe(reason));
}

}  // namespace

const char* Describe(TransportError e) {
    switch (e) {
        case TransportError::ClosedByPeer: return "connection closed by the other side";
        case TransportError::ProtocolError: return "protocol error";
        case TransportError::LocalClose: return "closed locally";
        case TransportError::Shutdown: return "transport shut down";
        case TransportError::Overloaded: return "the other side stopped reading";
    }
    return "unknown";
}

namespace detail {

class TransportCore {
public:
    TransportCore() : mIo(std::make_shared<asio::io_context>()), mWork(asio::make_work_guard(*mIo)) {
        // One thread by default: handing each event from the thread that polled to another costs
        // more than the work itself (measured: half the round-trip time). Handlers must not block;
        // TIDELINK_IO_THREADS raises the count for hosts that cannot promise that.
        unsigned n = 1;
        if (const char* env = std::getenv("TIDELINK_IO_THREADS")) {
            n = static_cast<unsigned>(std::clamp(std::atoi(env), 1, 16));
        }
        for (unsigned i = 0; i < n; ++i) {
            mThreads.emplace_back([io = mIo] {
                MarkTransportThread();
                for (;;) {
                    try {
                        io->run();
                        return;
                    } catch (const std::exception& e) {
                        TL_TRACE(kCat, 0) << "Uncaught exception on a transport thread: " << e.what();
                    }
                }
            });
        }
    }
    ~TransportCore() {
        mWork.reset();
        mIo->stop();
        for (auto& t : mThreads) {
            if (t.get_id() == std::this_thread::get_id()) {
                t.detach();  // the last holder let go on this thread; it ends once this handler returns
            } else {
                t.join();
            }
        }
    }
    asio::io_context& Io() { return *mIo; }

private:
    std::shared_ptr<asio::io_context> mIo;
    asio::executor_work_guard<asio::io_context::executor_type> mWork;
    std::vector<std::thread> mThreads;
};

class SessionImpl : public std::enable_shared_from_this<SessionImpl> {
public:
    SessionImpl(SocketTransportPtr transport, asio::io_context& io, tcp::socket socket, bool serverSide)
        : mTransport(std::move(transport)),
          mIo(io),
          mStrand(asio::make_strand(io)),
          mSocket(std::move(socket)),
          mHelloTimer(mStrand),
          mAuthenticated(!serverSide) {
        boost::system::error_code ec;
        mRemote = mSocket.remote_endpoint(ec);
        mLocal = mSocket.local_endpoint(ec);
        mFd = mSocket.native_handle();
        mReadBuf.resize(kInitialReadBuffer);
    }

    ~SessionImpl() {
        boost::system::error_code ec;
        mSocket.close(ec);
    }

    void Start(std::function<void(const std::shared_ptr<SessionImpl>&)> onAuthenticated) {
        mOnAuthenticated = std::move(onAuthenticated);
        asio::post(mStrand, [self = shared_from_this()] {
            if (!self->mAuthenticated) {
                self->mHelloTimer.expires_after(std::chrono::milliseconds(kHandshakeTimeoutMs));
                self->mHelloTimer.async_wait([weak = std::weak_ptr<SessionImpl>(self)](auto ec) {
                    auto s = weak.lock();
                    if (!ec && s && !s->mAuthenticated) {
                        TL_TRACE(kCat, 1) << "Closing connection from port " << s->mRemote.port()
                                          << ": no hello within " << kHandshakeTimeoutMs << " ms";
                        s->Disconnect(TransportError::ProtocolError);
                    }
                });
            }
            self->StartRead();
        });
    }

    bool IsOpen() const {
        std::lock_guard lock(mMutex);
        return !mClosed;
    }
    bool IsAuthenticated() const { return mAuthenticated; }

    void Disconnect(TransportError reason) {
        std::unordered_map<RequestId, Pending> pending;
        std::map<Guid, CloseHandler> handlers;
        std::shared_ptr<MessageDispatcher> dispatcher;  // released here, breaking cycles through it
        {
            std::lock_guard lock(mMutex);
            if (mClosed) return;
            mClosed = true;
            pending.swap(mPending);
            handlers.swap(mCloseHandlers);
            dispatcher.swap(mDispatcher);
            mAliases.clear();
        }
        {
            std::lock_guard lock(mWriteMutex);
            mWriteClosed = true;
            mQueued.clear();
        }
        TL_TRACE(kCat, 5) << "Session " << mLocal.port() << "<->" << mRemote.port()
                          << " closed: " << Describe(reason);
        auto self = shared_from_this();
        asio::post(mStrand, [self] {
            std::lock_guard lock(self->mWriteMutex);
            boost::system::error_code ec;
            self->mSocket.shutdown(tcp::socket::shutdown_both, ec);
            self->mSocket.close(ec);
            self->mHelloTimer.cancel();
        });
        // Failures and close handlers run on a transport thread, never inside the caller's locks.
        asio::post(mIo, [self, reason, pending = std::move(pending), handlers = std::move(handlers)] {
            const int32_t code = CodeFor(reason);
            const WString message = MessageFor(reason);
            for (const auto& [id, p] : pending) {
                if (p.fail) SafeCall("A failure function", p.fail, code, message, p.correlate ? p.correlate : id);
            }
            SessionPtr handle = self->mHandle.lock();
            for (const auto& [guid, h] : handlers) SafeCall("A close handler", h, handle, reason);
            if (self->mOnClosed) self->mOnClosed(self.get());
        });
    }

    Guid AddCloseHandler(CloseHandler handler) {
        const Guid id = Guid::New();
        {
            std::lock_guard lock(mMutex);
            if (!mClosed) {
                mCloseHandlers.emplace(id, std::move(handler));
                return id;
            }
        }
        asio::post(mIo, [self = shared_from_this(), handler = std::move(handler)] {
            SafeCall("A close handler", handler, self->mHandle.lock(), TransportError::LocalClose);
        });
        return id;
    }

    void RemoveCloseHandler(const Guid& id) {
        std::lock_guard lock(mMutex);
        mCloseHandlers.erase(id);
    }

    RequestId SendRequest(const Call& call, SuccessFn ok, FailureFn fail, uint64_t correlate) {
        const RequestId id = gNextRequestId.fetch_add(1);
        const RequestId reported = correlate ? correlate : id;
        {
            std::unique_lock lock(mMutex);
            if (mClosed) {
                lock.unlock();
                PostFailure(std::move(fail), kErrorConnectFailed, u"Session is closed", reported);
                return id;
            }
            mPending.emplace(id, Pending{std::move(ok), std::move(fail), correlate});
            if (correlate) mAliases[correlate] = id;
        }
        thread_local wire::Buffer frame;
        frame.clear();
        try {
            wire::AppendRequest(frame, id, call.name, call.args);
        } catch (const wire::WireError& e) {
            TL_TRACE(kCat, 1) << "Cannot send request " << call.name << ": " << e.what();
            if (auto p = TakePending(id)) {
                PostFailure(std::move(p->fail), kErrorRequestRefused, ToUTF16(e.what()), reported);
            }
            return id;
        }
        Write(frame.data(), frame.size());
        return id;
    }

    void SendNotification(const Call& call) {
        thread_local wire::Buffer frame;
        frame.clear();
        try {
            wire::AppendNotification(frame, call.name, call.args);
        } catch (const wire::WireError& e) {
            TL_TRACE(kCat, 1) << "Cannot send notification " << call.name << ": " << e.what();
            return;
        }
        if (!Write(frame.data(), frame.size())) {
            TL_TRACE(kCat, 5) << "Notification " << call.name << " dropped: session closed";
        }
    }

    bool CancelRequest(RequestId id) {
        std::lock_guard lock(mMutex);
        if (mPending.erase(id) != 0) return true;
        auto alias = mAliases.find(id);
        if (alias != mAliases.end()) {
            const RequestId real = alias->second;
            mAliases.erase(alias);
            return mPending.erase(real) != 0;
        }
        return false;
    }

    void SendReply(RequestId id, const Value& result) {
        try {
            SendFrame([&](wire::Buffer& frame) { wire::AppendReply(frame, id, result); });
        } catch (const wire::WireError& e) {
            TL_TRACE(kCat, 1) << "Cannot send reply: " << e.what();
            SendErrorReply(id, kErrorRequestRefused, e.what());
        }
    }

    void SendErrorReply(RequestId id, int32_t code, const std::string& message) {
        SendFrame([&](wire::Buffer& frame) {
            wire::AppendErrorReply(frame, id, code, message.substr(0, 64 * 1024));
        });
    }

    // Appends one reply frame: to the batch when this thread handles the session's batch (sent
    // at its end, or now once the batch is large), otherwise straight to the socket. A failing
    // append leaves the batch as it was.
    template <class Append>
    void SendFrame(const Append& append) {
        if (tReplyBatchOwner == this) {
            append(mReplyBatch);
            if (mReplyBatch.size() >= kMaxReplyBatch) FlushReplies();
            return;
        }
        thread_local wire::Buffer scratch;
        scratch.clear();
        append(scratch);
        Write(scratch.data(), scratch.size());
    }

    void SetDispatcher(std::shared_ptr<MessageDispatcher> d) {
        std::lock_guard lock(mMutex);
        mDispatcher = std::move(d);
    }

    size_t PendingCount() const {
        std::lock_guard lock(mMutex);
        return mPending.size();
    }

    SocketTransportPtr mTransport;  // first member: released last
    asio::io_context& mIo;
    asio::strand<asio::io_context::executor_type> mStrand;
    tcp::socket mSocket;
    asio::steady_timer mHelloTimer;
    tcp::endpoint mRemote;
    tcp::endpoint mLocal;
    std::weak_ptr<Session> mHandle;
    std::function<void(SessionImpl*)> mOnClosed;

private:
    std::optional<Pending> TakePending(RequestId id) {
        std::lock_guard lock(mMutex);
        auto it = mPending.find(id);
        if (it == mPending.end()) return std::nullopt;
        Pending p = std::move(it->second);
        if (p.correlate) mAliases.erase(p.correlate);
        mPending.erase(it);
        return p;
    }

    void PostFailure(FailureFn fail, int32_t code, WString message, RequestId id) {
        if (!fail) return;
        asio::post(mIo, [fail = std::move(fail), code, message = std::move(message), id] {
            SafeCall("A failure function", fail, code, message, id);
        });
    }

    // Sends at once from the calling thread when nothing is queued; otherwise queues behind the
    // write in progress. Returns false when the session is closed.
    bool Write(const uint8_t* data, size_t size) {
        std::unique_lock lock(mWriteMutex);
        if (mWriteClosed) return false;
        if (mWriting) {
            if (mQueued.size() + size > kMaxQueuedBytes) {
                lock.unlock();
                TL_TRACE(kCat, 0) << "Closing session to port " << mRemote.port()
                                  << ": more than " << kMaxQueuedBytes << " bytes unsent";
                Disconnect(TransportError::Overloaded);
                return false;
            }
            mQueued.insert(mQueued.end(), data, data + size);
            return true;
        }
        size_t sent = 0;
        while (sent < size) {
            const ssize_t n = ::send(mFd, data + sent, size - sent, MSG_DONTWAIT | MSG_NOSIGNAL);
            if (n > 0) {
                sent += static_cast<size_t>(n);
                continue;
            }
            if (n < 0 && errno == EINTR) continue;
            if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) break;
            lock.unlock();
            Disconnect(TransportError::ClosedByPeer);
            return false;
        }
        if (sent == size) return true;
        mOut.assign(data + sent, data + size);
        mWriting = true;
        lock.unlock();
        asio::post(mStrand, [self = shared_from_this()] { self->ContinueWrite(); });
        return true;
    }

    void FlushReplies() {
        if (mReplyBatch.empty()) return;
        Write(mReplyBatch.data(), mReplyBatch.size());
        mReplyBatch.clear();
    }

    // Marks this thread as handling the session's batch for as long as it lives.
    struct BatchScope {
        explicit BatchScope(SessionImpl* s) : session(s), previous(tReplyBatchOwner) { tReplyBatchOwner = s; }
        ~BatchScope() {
            tReplyBatchOwner = previous;
            session->FlushReplies();
        }
        SessionImpl* session;
        const void* previous;
    };

    void ContinueWrite() {
        asio::async_write(mSocket, asio::buffer(mOut),
                          asio::bind_executor(mStrand, [self = shared_from_this()](auto ec, size_t) {
                              std::unique_lock lock(self->mWriteMutex);
                              self->mOut.clear();
                              if (ec || self->mWriteClosed) {
                                  self->mWriting = false;
                                  lock.unlock();
                                  if (ec) self->Disconnect(TransportError::ClosedByPeer);
                                  return;
                              }
                              if (self->mQueued.empty()) {
                                  self->mWriting = false;
                                  return;
                              }
                              self->mOut.swap(self->mQueued);
                              lock.unlock();
                              self->ContinueWrite();
                          }));
    }

    void StartRead() {
        if (mReadBuf.size() - mReadLen < 4096) mReadBuf.resize(mReadBuf.size() * 2);
        mSocket.async_read_some(
            asio::buffer(mReadBuf.data() + mReadLen, mReadBuf.size() - mReadLen),
            asio::bind_executor(mStrand, [self = shared_from_this()](auto ec, size_t n) {
                self->OnRead(ec, n);
            }));
    }

    void OnRead(const boost::system::error_code& ec, size_t n) {
        if (ec) {
            Disconnect(TransportError::ClosedByPeer);
            return;
        }
        mReadLen += n;
        size_t pos = 0;
        BatchScope batch(this);
        try {
            if (!mAuthenticated) {
                if (mReadLen < wire::kHelloSize) return StartRead();
                const auto secret = GetSessionSecret();
                if (!secret) throw wire::WireError("no session secret available");
                const auto status = wire::CheckHello(mReadBuf.data(), *secret);
                const auto ack = wire::MakeAck(status);
                if (status != wire::HelloStatus::Ok) {
                    Write(ack.data(), ack.size());
                    throw wire::WireError("wire version mismatch");
                }
                mHelloTimer.cancel();
                mAuthenticated = true;
                pos = wire::kHelloSize;
                Write(ack.data(), ack.size());
                if (mOnAuthenticated) mOnAuthenticated(shared_from_this());
            }
            while (mReadLen - pos >= wire::kFrameHeaderSize) {
                const uint32_t len = wire::ReadFrameLength(mReadBuf.data() + pos);
                const size_t total = wire::kFrameHeaderSize + len;
                // Incomplete: wait for more. The buffer grows with what actually arrives, never
                // to the announced size up front, so a bare header cannot reserve 16 MiB.
                if (mReadLen - pos < total) break;
                wire::Message m = wire::DecodeBody(mReadBuf.data() + pos + wire::kFrameHeaderSize, len);
                pos += total;
                Handle(std::move(m));
                if (!IsOpen()) return;
            }
        } catch (const wire::WireError& e) {
            TL_TRACE(kCat, 0) << "Closing connection from port " << mRemote.port() << ": " << e.what();
            Disconnect(TransportError::ProtocolError);
            return;
        }
        if (pos > 0) {
            std::memmove(mReadBuf.data(), mReadBuf.data() + pos, mReadLen - pos);
            mReadLen -= pos;
        }
        // Give back the memory of an exceptionally large message once it has been handled.
        if (mReadBuf.size() > 4 * kInitialReadBuffer && mReadLen < kInitialReadBuffer) {
            mReadBuf.resize(kInitialReadBuffer);
            mReadBuf.shrink_to_fit();
        }
        StartRead();
    }

    void Handle(wire::Message&& m) {
        if (m.kind == wire::Kind::Reply) {
            auto p = TakePending(m.id);
            if (!p) return;  // cancelled, or a reply nobody asked for
            const RequestId reported = p->correlate ? p->correlate : m.id;
            if (m.isError) {
                if (p->fail) SafeCall("A failure function", p->fail, m.errorCode, ToUTF16(m.errorMessage), reported);
            } else if (p->ok) {
                SafeCall("A success function", p->ok, m.result, reported);
            }
            return;
        }
        std::shared_ptr<MessageDispatcher> dispatcher;
        {
            std::lock_guard lock(mMutex);
            dispatcher = mDispatcher;
        }
        SessionPtr handle = mHandle.lock();
        if (m.kind == wire::Kind::Request) {
            if (!dispatcher || !handle) {
                SendErrorReply(m.id, kErrorRequestRefused, "No handler for message \"" + m.name + "\"");
                return;
            }
            SafeCall("A request dispatcher", [&] { dispatcher->OnRequest(handle, m.id, m.name, m.args); });
        } else if (dispatcher && handle) {
            SafeCall("A notification dispatcher", [&] { dispatcher->OnNotification(handle, m.name, m.args); });
        } else {
            TL_TRACE(kCat, 3) << "Notification " << m.name << " dropped: no handler";
        }
    }

    std::function<void(const std::shared_ptr<SessionImpl>&)> mOnAuthenticated;
    int mFd = -1;
    std::atomic<bool> mAuthenticated;

    mutable std::mutex mMutex;  // pending table, aliases, close handlers, dispatcher, closed flag
    bool mClosed = false;
    std::unordered_map<RequestId, Pending> mPending;
    std::unordered_map<uint64_t, RequestId> mAliases;
    std::map<Guid, CloseHandler> mCloseHandlers;
    std::shared_ptr<MessageDispatcher> mDispatcher;

    std::mutex mWriteMutex;  // output buffers and the socket descriptor's validity
    bool mWriteClosed = false;
    bool mWriting = false;
    wire::Buffer mOut;
    wire::Buffer mQueued;

    std::vector<uint8_t> mReadBuf;  // strand only
    wire::Buffer mReplyBatch;       // strand only
    size_t mReadLen = 0;
};

}  // namespace detail

// ---- Session ----

Session::~Session() {
    if (mImpl) mImpl->Disconnect(TransportError::LocalClose);
}
bool Session::IsOpen() const { return mImpl->IsOpen(); }
void Session::Close() { mImpl->Disconnect(TransportError::LocalClose); }
Guid Session::AddCloseHandler(CloseHandler h) { return mImpl->AddCloseHandler(std::move(h)); }
void Session::RemoveCloseHandler(const Guid& id) { mImpl->RemoveCloseHandler(id); }
RequestId Session::SendRequest(const Call& call, SuccessFn ok, FailureFn fail, uint64_t correlate) {
    return mImpl->SendRequest(call, std::move(ok), std::move(fail), correlate);
}
void Session::SendNotification(const Call& call) { mImpl->SendNotification(call); }
bool Session::CancelRequest(RequestId id) { return mImpl->CancelRequest(id); }
void Session::SendReply(RequestId id, const Value& result) { mImpl->SendReply(id, result); }
void Session::SendErrorReply(RequestId id, int32_t code, const std::string& message) {
    mImpl->SendErrorReply(id, code, message);
}
void Session::SetDispatcher(std::shared_ptr<MessageDispatcher> d) { mImpl->SetDispatcher(std::move(d)); }
SocketTransportPtr Session::GetTransport() const { return mImpl->mTransport; }
std::string Session::GetRemoteAddress() const { return mImpl->mRemote.address().to_string(); }
uint16_t Session::GetRemotePort() const { return mImpl->mRemote.port(); }
uint16_t Session::GetLocalPort() const { return mImpl->mLocal.port(); }
size_t Session::PendingRequestCount() const { return mImpl->PendingCount(); }

// ---- ListeningServer ----

struct ListeningServer::Impl : std::enable_shared_from_this<ListeningServer::Impl> {
    Impl(SocketTransportPtr t, asio::io_context& context)
        : transport(std::move(t)), io(context), strand(asio::make_strand(io)), acceptor(strand), retry(strand) {}

    void Accept() {
        acceptor.async_accept(io, asio::bind_executor(strand, [self = shared_from_this()](
                                                                  auto ec, tcp::socket socket) {
            self->OnAccept(ec, std::move(socket));
        }));
    }

    void OnAccept(const boost::system::error_code& ec, tcp::socket socket) {
        if (stopped) return;
        if (ec) {
            if (ec == asio::error::operation_aborted) return;
            // Out of descriptors: wait instead of spinning on a failing accept.
            TL_TRACE(kCat, 0) << "Accept failed: " << ec.message();
            retry.expires_after(std::chrono::milliseconds(100));
            retry.async_wait([self = shared_from_this()](auto e) {
                if (!e && !self->stopped) self->Accept();
            });
            return;
        }
        boost::system::error_code opt;
        socket.set_option(tcp::no_delay(true), opt);
        socket.non_blocking(true, opt);
        {
            std::lock_guard lock(mutex);
            if (sessions.size() >= kMaxSessionsPerServer) {
                TL_TRACE(kCat, 0) << "Refusing connection: " << sessions.size() << " sessions open";
                socket.close(opt);
                return Accept();
            }
        }
        auto impl = std::make_shared<detail::SessionImpl>(transport, io, std::move(socket), true);
        auto handle = SessionPtr(new Session());
        handle->mImpl = impl;
        impl->mHandle = handle;
        std::weak_ptr<Impl> weak = shared_from_this();
        impl->mOnClosed = [weak](detail::SessionImpl* closed) {
            if (auto self = weak.lock()) {
                SessionPtr drop;  // released outside the lock
                std::lock_guard lock(self->mutex);
                auto it = self->sessions.find(closed);
                if (it != self->sessions.end()) {
                    drop = std::move(it->second);
                    self->sessions.erase(it);
                }
            }
        };
        std::shared_ptr<MessageDispatcher> d;
        {
            std::lock_guard lock(mutex);
            sessions.emplace(impl.get(), handle);
            d = dispatcher;
        }
        impl->SetDispatcher(d);
        impl->Start([weak](const std::shared_ptr<detail::SessionImpl>& s) {
            auto self = weak.lock();
            if (!self) return;
            std::function<void(const SessionPtr&)> h;
            {
                std::lock_guard lock(self->mutex);
                h = self->sessionHandler;
            }
            if (auto accepted = s->mHandle.lock(); h && accepted) SafeCall("A session handler", h, accepted);
        });
        Accept();
    }

    void Stop() {
        std::map<detail::SessionImpl*, SessionPtr> drop;
        {
            std::lock_guard lock(mutex);
            if (stopped) return;
            stopped = true;
            drop.swap(sessions);
        }
        asio::post(strand, [self = shared_from_this()] {
            boost::system::error_code ec;
            self->acceptor.close(ec);
            self->retry.cancel();
        });
        for (auto& [impl, handle] : drop) impl->Disconnect(TransportError::Shutdown);
    }

    SocketTransportPtr transport;
    asio::io_context& io;
    asio::strand<asio::io_context::executor_type> strand;
    tcp::acceptor acceptor;
    asio::steady_timer retry;
    std::string address;
    uint16_t port = 0;
    std::atomic<bool> stopped{false};
    mutable std::mutex mutex;
    std::map<detail::SessionImpl*, SessionPtr> sessions;
    std::shared_ptr<MessageDispatcher> dispatcher;
    std::function<void(const SessionPtr&)> sessionHandler;
};

ListeningServer::~ListeningServer() { mImpl->Stop(); }
uint16_t ListeningServer::GetPort() const { return mImpl->port; }
std::string ListeningServer::GetAddress() const { return mImpl->address; }
void ListeningServer::SetDispatcher(std::shared_ptr<MessageDispatcher> d) {
    std::lock_guard lock(mImpl->mutex);
    mImpl->dispatcher = std::move(d);
}
void ListeningServer::SetSessionHandler(std::function<void(const SessionPtr&)> h) {
    std::lock_guard lock(mImpl->mutex);
    mImpl->sessionHandler = std::move(h);
}
void ListeningServer::Stop() { mImpl->Stop(); }
size_t ListeningServer::SessionCount() const {
    std::lock_guard lock(mImpl->mutex);
    size_t n = 0;
    for (const auto& [impl, handle] : mImpl->sessions) n += impl->IsAuthenticated() ? 1 : 0;
    return n;
}

// ---- SocketTransport ----

SocketTransport::SocketTransport(ExecutorPtr executor)
    : mExecutor(std::move(executor)), mCore(std::make_shared<detail::TransportCore>()) {}

SocketTransport::~SocketTransport() = default;

SocketTransportPtr SocketTransport::Create(ExecutorPtr executor) {
    return SocketTransportPtr(new SocketTransport(std::move(executor)));
}

void SocketTransport::Post(std::function<void()> task) { asio::post(mCore->Io(), std::move(task)); }

SessionPtr SocketTransport::ClientStart(const std::string& address, uint16_t port) {
    boost::system::error_code ec;
    const auto ip = asio::ip::make_address(address, ec);
    if (ec || port == 0) return nullptr;
    const auto secret = GetSessionSecret();
    if (!secret) return nullptr;
    tcp::socket socket(mCore->Io());
    socket.connect(tcp::endpoint(ip, port), ec);
    if (ec) {
        TL_TRACE(kCat, 6) << "Cannot connect to " << address << ":" << port << ": " << ec.message();
        return nullptr;
    }
    socket.set_option(tcp::no_delay(true), ec);
    const auto hello = wire::MakeHello(*secret);
    asio::write(socket, asio::buffer(hello), ec);
    if (ec) return nullptr;
    // The acknowledgement, within the handshake limit.
    uint8_t ack[wire::kAckSize];
    size_t got = 0;
    const double deadline = std::chrono::duration<double>(
        std::chrono::steady_clock::now().time_since_epoch()).count() + kHandshakeTimeoutMs / 1000.0;
    while (got < sizeof(ack)) {
        const double left = deadline - std::chrono::duration<double>(
            std::chrono::steady_clock::now().time_since_epoch()).count();
        if (left <= 0) {
            TL_TRACE(kCat, 1) << "No hello acknowledgement from port " << port;
            return nullptr;
        }
        pollfd pfd{socket.native_handle(), POLLIN, 0};
        const int rc = ::poll(&pfd, 1, static_cast<int>(left * 1000) + 1);
        if (rc < 0 && errno == EINTR) continue;
        if (rc <= 0) continue;
        const ssize_t n = ::recv(socket.native_handle(), ack + got, sizeof(ack) - got, 0);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) {
            TL_TRACE(kCat, 1) << "Port " << port << " closed the connection during the hello";
            return nullptr;
        }
        got += static_cast<size_t>(n);
    }
    try {
        if (wire::ReadAck(ack) != wire::HelloStatus::Ok) {
            TL_TRACE(kCat, 0) << "Port " << port << " speaks another wire version";
            return nullptr;
        }
    } catch (const wire::WireError& e) {
        TL_TRACE(kCat, 0) << "Port " << port << ": " << e.what();
        return nullptr;
    }
    socket.non_blocking(true, ec);
    auto impl = std::make_shared<detail::SessionImpl>(shared_from_this(), mCore->Io(), std::move(socket), false);
    auto handle = SessionPtr(new Session());
    handle->mImpl = impl;
    impl->mHandle = handle;
    impl->Start(nullptr);
    return handle;
}

ListeningServerPtr SocketTransport::ServerStart(uint16_t port, bool loopbackOnly) {
    auto impl = std::make_shared<ListeningServer::Impl>(shared_from_this(), mCore->Io());
    boost::system::error_code ec;
    const auto ip = loopbackOnly ? asio::ip::address(asio::ip::address_v4::loopback())
                                 : asio::ip::address(asio::ip::address_v4::any());
    const tcp::endpoint ep(ip, port);
    impl->acceptor.open(ep.protocol(), ec);
    if (!ec) impl->acceptor.bind(ep, ec);
    if (!ec) impl->acceptor.listen(asio::socket_base::max_listen_connections, ec);
    if (ec) {
        TL_TRACE(kCat, 0) << "Cannot listen on port " << port << ": " << ec.message();
        return nullptr;
    }
    const auto local = impl->acceptor.local_endpoint(ec);
    impl->port = local.port();
    impl->address = local.address().to_string();
    asio::post(impl->strand, [impl] { impl->Accept(); });
    return ListeningServerPtr(new ListeningServer(impl));
}

}  // namespace tidelink::platform
