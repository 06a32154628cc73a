// Remote procedure calls over sessions: named requests with positional arguments, replies, and
// one-way notifications.
//
// Threading: all classes may be used from any thread. Handlers run on transport threads, one
// message of a session at a time; they must not block (post long work to an executor and answer
// through the Responder later, from any thread).
#pragma once

#include <functional>
#include <memory>
#include <shared_mutex>
#include <string>
#include <unordered_map>

#include "platform/Export.h"
#include "platform/Serialization.h"
#include "platform/Transport.h"

namespace tidelink::platform {

class TIDELINK_EXPORT RPCClient {
public:
    RPCClient(SessionPtr session, std::string name);

    // See Session::SendRequest. With a null session the failure function runs with -10001.
    RequestId SendRequest(const Call& call, SuccessFn ok, FailureFn fail, uint64_t correlate = 0);
    void SendNotification(const Call& call);
    // With |silent| true (the only mode the library uses) neither function runs afterwards.
    void CancelRequest(RequestId id, bool silent = true);

    SessionPtr GetSession() const { return mSession; }
    SocketTransportPtr GetTransporter() const { return mSession ? mSession->GetTransport() : nullptr; }
    const std::string& GetName() const { return mName; }

private:
    SessionPtr mSession;
    std::string mName;
};
using RPCClientPtr = std::shared_ptr<RPCClient>;

// Answers one incoming request, exactly once. A Responder dropped without an answer answers
// with error -10004, so the caller is never left waiting.
class TIDELINK_EXPORT Responder {
public:
    Responder(std::weak_ptr<Session> session, RequestId id, std::string name);
    ~Responder();
    Responder(const Responder&) = delete;
    Responder& operator=(const Responder&) = delete;

    // Replies {"value": result}.
    void SendGeneralResult(const Value& result);
    // Replies with an object as it stands (for replies that carry more than "value").
    void SendResult(const Value& reply);
    void SendError(int32_t code, const WString& message);
    bool Answered() const { return mAnswered.load(); }
    const std::string& Name() const { return mName; }

private:
    bool Claim();
    std::weak_ptr<Session> mSession;
    RequestId mId;
    std::string mName;
    std::atomic<bool> mAnswered{false};
};
using ResponderPtr = std::shared_ptr<Responder>;

class TIDELINK_EXPORT MessageHandler {
public:
    virtual ~MessageHandler() = default;
    // A request for a notification handler is refused with -10004; a notification for a request
    // handler is dropped.
    virtual void HandleRequest(const ResponderPtr& responder, const Value& args);
    virtual void HandleNotification(const Value& args);
    // The same, told which session the message came on (a broker accounts per connection). By
    // default they forward to the two above.
    virtual void HandleRequestFrom(const SessionPtr& session, const ResponderPtr& responder,
                                   const Value& args);
    virtual void HandleNotificationFrom(const SessionPtr& session, const Value& args);
};
using MessageHandlerPtr = std::shared_ptr<MessageHandler>;

class TIDELINK_EXPORT FunctionRequestHandler : public MessageHandler {
public:
    using Fn = std::function<void(const ResponderPtr&, const Value& args)>;
    explicit FunctionRequestHandler(Fn fn) : mFn(std::move(fn)) {}
    void HandleRequest(const ResponderPtr& responder, const Value& args) override { mFn(responder, args); }

private:
    Fn mFn;
};

class TIDELINK_EXPORT FunctionNotificationHandler : public MessageHandler {
public:
    using Fn = std::function<void(const Value& args)>;
    explicit FunctionNotificationHandler(Fn fn) : mFn(std::move(fn)) {}
    void HandleNotification(const Value& args) override { mFn(args); }

private:
    Fn mFn;
};

// Handlers that need the session a message came on.
class TIDELINK_EXPORT SessionRequestHandler : public MessageHandler {
public:
    using Fn = std::function<void(const SessionPtr&, const ResponderPtr&, const Value& args)>;
    explicit SessionRequestHandler(Fn fn) : mFn(std::move(fn)) {}
    void HandleRequestFrom(const SessionPtr& session, const ResponderPtr& responder,
                           const Value& args) override {
        mFn(session, responder, args);
    }

private:
    Fn mFn;
};

class TIDELINK_EXPORT SessionNotificationHandler : public MessageHandler {
public:
    using Fn = std::function<void(const SessionPtr&, const Value& args)>;
    explicit SessionNotificationHandler(Fn fn) : mFn(std::move(fn)) {}
    void HandleNotificationFrom(const SessionPtr& session, const Value& args) override {
        mFn(session, args);
    }

private:
    Fn mFn;
};

// Maps message names to handlers. Instance() is the process-wide registrar the RPC servers use
// by default; a component that must stay apart (the link manager run inside a test) makes its own.
// A handler that throws while handling a request answers -10004 with the exception's text.
class TIDELINK_EXPORT MessageRegistrar : public MessageDispatcher,
                                         public std::enable_shared_from_this<MessageRegistrar> {
public:
    static std::shared_ptr<MessageRegistrar> Instance();
    static std::shared_ptr<MessageRegistrar> Create();

    // Replaces any handler registered under |name|.
    void Register(const std::string& name, MessageHandlerPtr handler);
    void UnRegister(const std::string& name);
    bool IsRegistered(const std::string& name) const;

    void OnRequest(const SessionPtr& session, RequestId id, const std::string& name,
                   const Value& args) override;
    void OnNotification(const SessionPtr& session, const std::string& name, const Value& args) override;

private:
    MessageRegistrar() = default;
    MessageHandlerPtr Find(const std::string& name) const;
    mutable std::shared_mutex mMutex;
    std::unordered_map<std::string, MessageHandlerPtr> mHandlers;
};
using MessageRegistrarPtr = std::shared_ptr<MessageRegistrar>;

// Dispatches every session of a listening server through a registrar.
class TIDELINK_EXPORT RPCServer {
public:
    RPCServer(ListeningServerPtr server, std::string name,
              MessageRegistrarPtr registrar = MessageRegistrar::Instance());
    ListeningServerPtr GetServer() const { return mServer; }
    const std::string& GetName() const { return mName; }
    const MessageRegistrarPtr& GetRegistrar() const { return mRegistrar; }

private:
    ListeningServerPtr mServer;
    std::string mName;
    MessageRegistrarPtr mRegistrar;
};
using RPCServerPtr = std::shared_ptr<RPCServer>;

// A success function that reads "value" of the reply as T (absent: T{}) and calls |fn|. When the
// value cannot be read as T, |onError| runs instead with -10003 (so exactly one of the two runs).
template <class T>
SuccessFn OKHandler(std::function<void(T)> fn, FailureFn onError = nullptr) {
    return [fn = std::move(fn), onError = std::move(onError)](const Value& reply, RequestId id) {
        T value{};
        try {
            value = ReplyValue<T>(reply);
        } catch (const nlohmann::json::exception& e) {
            if (onError) onError(kErrorProtocol, ToUTF16(std::string("Malformed reply: ") + e.what()), id);
            return;
        }
        fn(std::move(value));
    };
}

}  // namespace tidelink::platform
