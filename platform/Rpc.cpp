#include "platform/Rpc.h"

#include "platform/Trace.h"

namespace tidelink::platform {

RPCClient::RPCClient(SessionPtr session, std::string name)
    : mSession(std::move(session)), mName(std::move(name)) {}

RequestId RPCClient::SendRequest(const Call& call, SuccessFn ok, FailureFn fail, uint64_t correlate) {
    if (!mSession) {
        // Still completes on another thread, as every request does.
        static const auto executor = CreateCPUBoundExecutor();
        executor->Post([fail = std::move(fail), correlate] {
            if (fail) fail(kErrorConnectFailed, u"Not connected", correlate);
        });
        return 0;
    }
    return mSession->SendRequest(call, std::move(ok), std::move(fail), correlate);
}

void RPCClient::SendNotification(const Call& call) {
    if (mSession) mSession->SendNotification(call);
}

void RPCClient::CancelRequest(RequestId id, bool) {
    if (mSession) mSession->CancelRequest(id);
}

// ---- Responder ----

Responder::Responder(std::weak_ptr<Session> session, RequestId id, std::string name)
    : mSession(std::move(session)), mId(id), mName(std::move(name)) {}

Responder::~Responder() {
    if (!mAnswered.load()) {
        SendError(kErrorRequestRefused, ToUTF16("No answer from the handler of \"" + mName + "\""));
    }
}

bool Responder::Claim() {
    bool expected = false;
    if (mAnswered.compare_exchange_strong(expected, true)) return true;
    TL_TRACE("rpc", 1) << "Second answer to \"" << mName << "\" ignored";
    return false;
}

void Responder::SendGeneralResult(const Value& result) {
    if (!Claim()) return;
    Value reply = Value::object();
    reply["value"] = result;
    if (auto s = mSession.lock()) s->SendReply(mId, reply);
}

void Responder::SendResult(const Value& reply) {
    if (!Claim()) return;
    if (auto s = mSession.lock()) s->SendReply(mId, reply);
}

void Responder::SendError(int32_t code, const WString& message) {
    if (!Claim()) return;
    if (auto s = mSession.lock()) s->SendErrorReply(mId, code, ToUTF8(message));
}

// ---- handlers ----

void MessageHandler::HandleRequest(const ResponderPtr& responder, const Value&) {
    responder->SendError(kErrorRequestRefused,
                         ToUTF16("\"" + responder->Name() + "\" is a notification, not a request"));
}

void MessageHandler::HandleNotification(const Value&) {}

void MessageHandler::HandleRequestFrom(const SessionPtr&, const ResponderPtr& responder,
                                       const Value& args) {
    HandleRequest(responder, args);
}

void MessageHandler::HandleNotificationFrom(const SessionPtr&, const Value& args) {
    HandleNotification(args);
}

// ---- registrar ----

std::shared_ptr<MessageRegistrar> MessageRegistrar::Instance() {
    static auto* instance = new std::shared_ptr<MessageRegistrar>(Create());
    return *instance;
}

std::shared_ptr<MessageRegistrar> MessageRegistrar::Create() {
    return std::shared_ptr<MessageRegistrar>(new MessageRegistrar());
}

void MessageRegistrar::Register(const std::string& name, MessageHandlerPtr handler) {
    std::unique_lock lock(mMutex);
    mHandlers[name] = std::move(handler);
}

void MessageRegistrar::UnRegister(const std::string& name) {
    MessageHandlerPtr drop;  // released outside the lock
    std::unique_lock lock(mMutex);
    auto it = mHandlers.find(name);
    if (it == mHandlers.end()) return;
    drop = std::move(it->second);
    mHandlers.erase(it);
}

bool MessageRegistrar::IsRegistered(const std::string& name) const { return Find(name) != nullptr; }

MessageHandlerPtr MessageRegistrar::Find(const std::string& name) const {
    std::shared_lock lock(mMutex);
    auto it = mHandlers.find(name);
    return it == mHandlers.end() ? nullptr : it->second;
}

void MessageRegistrar::OnRequest(const SessionPtr& session, RequestId id, const std::string& name,
                                 const Value& args) {
    auto responder = std::make_shared<Responder>(session, id, name);
    auto handler = Find(name);
    if (!handler) {
        TL_TRACE("rpc", 3) << "Request for unknown message \"" << name << "\"";
        responder->SendError(kErrorRequestRefused, ToUTF16("No handler for message \"" + name + "\""));
        return;
    }
    try {
        handler->HandleRequestFrom(session, responder, args);
    } catch (const std::exception& e) {
        TL_TRACE("rpc", 1) << "Handler of \"" << name << "\" failed: " << e.what();
        responder->SendError(kErrorRequestRefused,
                             ToUTF16("Bad request \"" + name + "\": " + e.what()));
    }
}

void MessageRegistrar::OnNotification(const SessionPtr& session, const std::string& name,
                                      const Value& args) {
    auto handler = Find(name);
    if (!handler) {
        TL_TRACE("rpc", 3) << "Notification for unknown message \"" << name << "\" dropped";
        return;
    }
    try {
        handler->HandleNotificationFrom(session, args);
    } catch (const std::exception& e) {
        TL_TRACE("rpc", 1) << "Handler of notification \"" << name << "\" failed: " << e.what();
    }
}

// ---- server ----

RPCServer::RPCServer(ListeningServerPtr server, std::string name, MessageRegistrarPtr registrar)
    : mServer(std::move(server)), mName(std::move(name)), mRegistrar(std::move(registrar)) {
    if (mServer) mServer->SetDispatcher(mRegistrar);
}

}  // namespace tidelink::platform
