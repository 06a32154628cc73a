#include "tidelink/core/ServerReconnect.h"

#include "platform/Config.h"
#include "platform/Trace.h"
#include "tidelink/core/Brokering.h"
#include "tidelink/core/LinkManager.h"

namespace tidelink {

using namespace platform;

namespace {
constexpr const char* kCat = "TideLink";
constexpr const char* kMaxReconnectEntry = "TideLinkClientMaxReconnectForDirect";
constexpr int64_t kDefaultMaxReconnect = 10;
}  // namespace

const char* Describe(ConnectionStatus status) {
    switch (status) {
        case ConnectionStatus::Connected: return "Connected";
        case ConnectionStatus::Failed: return "Failed";
        case ConnectionStatus::Reconnecting: return "Reconnecting";
    }
    return "unknown";
}

ClientIdentity ClientIdentity::Current() {
    return {GetClientName(), GetClientVersion(), GetTideLinkProtocolVersion()};
}

void to_json(Value& j, const ClientIdentity& r) {
    j = Value::object();
    j["name"] = ToUTF8(r.mName);
    j["appVersion"] = ToUTF8(r.mAppVersion);
    j["protoVersion"] = ToUTF8(r.mProtoVersion);
}

void from_json(const Value& j, ClientIdentity& r) {
    auto read = [&](const char* key) {
        auto it = j.find(key);
        return it != j.end() && it->is_string() ? ToUTF16(it->get_ref<const std::string&>()) : WString();
    };
    if (!j.is_object()) throw nlohmann::json::type_error::create(302, "client identity must be an object", &j);
    r = {read("name"), read("appVersion"), read("protoVersion")};
}

struct ServerReconnect::DirectLink {
    SessionPtr session;
    RPCClientPtr client;
    ~DirectLink() {
        if (session) session->Close();
    }
};

ServerReconnect::ServerReconnect(RPCClientPtr linkManager, std::string hostAddress, uint16_t port,
                                 std::string connectName, std::string connectWithVersionName,
                                 std::string createLinkName, std::string createHeadedLinkName,
                                 std::string createFarlandLinkName, bool supportsReconnect)
    : mHostAddress(std::move(hostAddress)), mConnectionPort(port), mConnectName(std::move(connectName)),
      mConnectWithVersionName(std::move(connectWithVersionName)), mCreateLinkName(std::move(createLinkName)),
      mCreateHeadedLinkName(std::move(createHeadedLinkName)),
      mCreateFarlandLinkName(std::move(createFarlandLinkName)), mSupportsReconnect(supportsReconnect),
      mRPCServer(GetSharedRPCServer()), mLinkManager(std::move(linkManager)),
      mDirect(std::make_shared<DirectLink>()) {}

ServerReconnectPtr ServerReconnect::Finish(ServerReconnect* object) {
    ServerReconnectPtr self(object);
    self->mWeakSelf = self;
    return self;
}

ServerReconnectPtr ServerReconnect::Create(RPCClientPtr linkManager, std::string hostAddress, uint16_t port,
                                           std::string connectName, std::string connectWithVersionName,
                                           std::string createLinkName, std::string createHeadedLinkName,
                                           std::string createFarlandLinkName, bool supportsReconnect) {
    return Finish(new ServerReconnect(std::move(linkManager), std::move(hostAddress), port,
                                      std::move(connectName), std::move(connectWithVersionName),
                                      std::move(createLinkName), std::move(createHeadedLinkName),
                                      std::move(createFarlandLinkName), supportsReconnect));
}

ServerReconnectPtr ServerReconnect::Create(RPCClientPtr linkManager, std::string hostAddress, uint16_t port,
                                           std::string connectName, std::string connectWithVersionName,
                                           std::string createLinkName, std::string createHeadedLinkName,
                                           bool supportsReconnect) {
    return Create(std::move(linkManager), std::move(hostAddress), port, std::move(connectName),
                  std::move(connectWithVersionName), std::move(createLinkName),
                  std::move(createHeadedLinkName), std::string(), supportsReconnect);
}

ServerReconnectPtr ServerReconnect::Create(RPCClientPtr linkManager, bool supportsReconnect) {
    return Create(std::move(linkManager), std::string(), 0, std::string(), std::string(), std::string(),
                  std::string(), std::string(), supportsReconnect);
}

ServerReconnectPtr ServerReconnect::Create(const ServerReconnectPtr& other) {
    auto copy = Finish(new ServerReconnect(other->GetRPCClient(), other->mHostAddress, other->mConnectionPort,
                                           other->mConnectName, other->mConnectWithVersionName,
                                           other->mCreateLinkName, other->mCreateHeadedLinkName,
                                           other->mCreateFarlandLinkName, other->mSupportsReconnect));
    std::shared_ptr<DirectLink> link;
    {
        std::lock_guard lock(other->mStateMutex);
        link = other->mDirect;
    }
    const auto direct = other->Direct();
    const auto target = other->GetReconnectTarget();
    {
        std::lock_guard lock(copy->mStateMutex);
        copy->mDirect = link;
        copy->mReconnectTarget = target;
    }
    if (direct.session) {
        // Its own close handler, so that the copy notices the loss too.
        std::weak_ptr<ServerReconnect> weak = copy;
        const Guid id = direct.session->AddCloseHandler([weak](const SessionPtr&, TransportError) {
            if (auto self = weak.lock()) self->OnSessionClose();
        });
        std::lock_guard lock(copy->mStateMutex);
        copy->mCloseHandlerId = id;
    }
    return copy;
}

ServerReconnect::~ServerReconnect() {
    mDestroying.store(1);
    std::map<std::string, std::pair<Call, Call>> entries;
    {
        RecursiveMutex::Guard lock(mServerCallbackLock, "ServerReconnect::~ServerReconnect");
        entries.swap(mServerCallbacks);
    }
    auto direct = Direct();
    for (const auto& [name, calls] : entries) {
        MessageRegistrar::Instance()->UnRegister(name);
        if (direct.client) direct.client->SendNotification(calls.second);
    }
    Guid closeHandler;
    {
        std::lock_guard lock(mStateMutex);
        closeHandler = mCloseHandlerId;
    }
    if (direct.session && !closeHandler.IsNil()) direct.session->RemoveCloseHandler(closeHandler);
    // Messages still held back would otherwise never complete.
    std::deque<PendingMessage> pending;
    {
        RecursiveMutex::Guard lock(mPendingLock, "ServerReconnect::~ServerReconnect");
        pending.swap(mPending);
    }
    if (!pending.empty()) {
        auto executor = GetSharedExecutor();
        for (auto& m : pending) {
            if (!m.mIsRequest || !m.mFail) continue;
            executor->Post([fail = std::move(m.mFail)] { fail(kErrorConnectFailed, u"Connection closed", 0); });
        }
    }
}

// ---- accessors ---------------------------------------------------------------------------

ServerReconnect::DirectRefs ServerReconnect::Direct() const {
    std::lock_guard lock(mStateMutex);
    return {mDirect->session, mDirect->client};
}

void ServerReconnect::SetDirectSession(SessionPtr session) {
    Guid oldHandler;
    SessionPtr oldSession;
    RPCClientPtr client;
    {
        std::lock_guard lock(mStateMutex);
        oldHandler = mCloseHandlerId;
        oldSession = mDirect->session;
        client = mDirect->client;
        mCloseHandlerId = Guid();
    }
    if (oldSession && !oldHandler.IsNil()) oldSession->RemoveCloseHandler(oldHandler);
    // A new link object: copies made from the old one keep the old session.
    auto link = std::make_shared<DirectLink>();
    link->session = session;
    link->client = client;
    {
        std::lock_guard lock(mStateMutex);
        mDirect = link;
    }
    if (!session) return;
    WeakSelf weak = mWeakSelf;
    const Guid id = session->AddCloseHandler([weak](const SessionPtr&, TransportError) {
        if (auto self = weak.lock()) self->OnSessionClose();
    });
    std::lock_guard lock(mStateMutex);
    mCloseHandlerId = id;
}

void ServerReconnect::SetDirectRPCClient(RPCClientPtr client) {
    std::lock_guard lock(mStateMutex);
    mDirect->client = std::move(client);
}

SessionPtr ServerReconnect::GetDirectSession() const { return Direct().session; }
RPCClientPtr ServerReconnect::GetDirectRPCClient() const { return Direct().client; }

RPCClientPtr ServerReconnect::GetRPCClient() const {
    std::lock_guard lock(mStateMutex);
    return mLinkManager;
}

SessionPtr ServerReconnect::GetSession() const {
    auto client = GetRPCClient();
    return client ? client->GetSession() : nullptr;
}

SocketTransportPtr ServerReconnect::GetTransporter() const {
    auto client = GetRPCClient();
    return client ? client->GetTransporter() : nullptr;
}

void ServerReconnect::SetReconnectProject(const File& file) {
    {
        std::lock_guard lock(mStateMutex);
        mReconnectTarget.mProjectFile = file;
    }
    RegisterNotification();
}

void ServerReconnect::SetReconnectFarlandAsset(const FarlandAssetRequestInfo& request) {
    {
        std::lock_guard lock(mStateMutex);
        mReconnectTarget.mFarlandAssetInfo = request;
    }
    RegisterNotification();
}

void ServerReconnect::SetReconnectFarlandProduction(const FarlandProductionRequestInfo& request) {
    std::lock_guard lock(mStateMutex);
    mFarlandProduction = request;
}

GenericAssetRequestInfo ServerReconnect::GetReconnectTarget() const {
    std::lock_guard lock(mStateMutex);
    return mReconnectTarget;
}

FarlandProductionRequestInfo ServerReconnect::GetReconnectFarlandProduction() const {
    std::lock_guard lock(mStateMutex);
    return mFarlandProduction;
}

void ServerReconnect::SetServerProgress(ServerProgressFn fn) {
    std::lock_guard lock(mStateMutex);
    mServerProgress = std::move(fn);
}

Guid ServerReconnect::GetNotificationID() const {
    std::lock_guard lock(mStateMutex);
    return mNotificationId;
}

int32_t ServerReconnect::GetSessionCloseCount() const {
    RecursiveMutex::Guard lock(mPendingLock, "ServerReconnect::GetSessionCloseCount");
    return mSessionCloseCount;
}

bool ServerReconnect::IsReconnecting() const {
    RecursiveMutex::Guard lock(mPendingLock, "ServerReconnect::IsReconnecting");
    return mReconnectingCount > 0;
}

Value ServerReconnect::SharedServerEndpoint() {
    auto server = GetSharedServer();
    Value endpoint = Value::object();
    endpoint["address"] = server ? server->GetAddress() : std::string("127.0.0.1");
    endpoint["port"] = server ? server->GetPort() : 0;
    return endpoint;
}

// ---- sending -----------------------------------------------------------------------------

RequestId ServerReconnect::SendDirectRequest(const Call& call, SuccessFn ok, FailureFn fail, bool force,
                                             uint64_t extra) {
    {
        RecursiveMutex::Guard lock(mPendingLock, "ServerReconnect::SendDirectRequest");
        if (mReconnectingCount > 0 && !force) {
            mPending.push_back({true, call, std::move(ok), std::move(fail)});
            return 0;
        }
    }
    if (auto client = Direct().client) return client->SendRequest(call, std::move(ok), std::move(fail), extra);
    // No connection to send on: the caller still hears back, once, from the executor.
    TL_TRACE(kCat, 5) << "No direct connection for " << call.name;
    if (fail) {
        GetSharedExecutor()->Post([fail = std::move(fail), extra] {
            fail(kErrorConnectFailed, u"Not connected to the server", extra);
        });
    }
    return 0;
}

void ServerReconnect::SendDirectNotification(const Call& call) {
    {
        RecursiveMutex::Guard lock(mPendingLock, "ServerReconnect::SendDirectNotification");
        if (mReconnectingCount > 0) {
            mPending.push_back({false, call, nullptr, nullptr});
            return;
        }
    }
    if (auto client = Direct().client) client->SendNotification(call);
}

void ServerReconnect::FreePendingMessages() {
    RecursiveMutex::Guard lock(mPendingLock, "ServerReconnect::FreePendingMessages");
    auto client = Direct().client;
    while (!mPending.empty()) {
        PendingMessage m = std::move(mPending.front());
        mPending.pop_front();
        if (client) {
            if (m.mIsRequest) {
                client->SendRequest(m.mCall, std::move(m.mOk), std::move(m.mFail), 0);
            } else {
                client->SendNotification(m.mCall);
            }
        } else if (m.mIsRequest && m.mFail) {
            GetSharedExecutor()->Post([fail = std::move(m.mFail)] {
                fail(kErrorConnectFailed, u"Not connected to the server", 0);
            });
        }
    }
    if (mReconnectingCount > 0) --mReconnectingCount;
}

// ---- status callbacks --------------------------------------------------------------------

Guid ServerReconnect::AddGenericStatusCallback(GenericStatusCallback callback) {
    const Guid id = Guid::New();
    RecursiveMutex::Guard lock(mStatusLock, "ServerReconnect::AddGenericStatusCallback");
    mStatusCallbacks.emplace_back(id, std::move(callback));
    return id;
}

Guid ServerReconnect::AddStatusCallback(StatusCallback callback) {
    return AddGenericStatusCallback(
        [callback = std::move(callback)](ConnectionStatus status, const WString& name, const GenericAssetInfo& asset) {
            callback(status, name, asset.mProjectFile);
        });
}

void ServerReconnect::RemoveStatusCallback(const Guid& id) {
    RecursiveMutex::Guard lock(mStatusLock, "ServerReconnect::RemoveStatusCallback");
    std::erase_if(mStatusCallbacks, [&](const auto& e) { return e.first == id; });
}

void ServerReconnect::CallStatusCallbacks(ConnectionStatus status, const WString& name,
                                          const GenericAssetInfo& asset) {
    std::vector<std::pair<Guid, GenericStatusCallback>> copy;
    {
        RecursiveMutex::Guard lock(mStatusLock, "ServerReconnect::CallStatusCallbacks");
        copy = mStatusCallbacks;
    }
    for (auto& [id, callback] : copy) {
        try {
            callback(status, name, asset);
        } catch (const std::exception& e) {
            TL_TRACE(kCat, 0) << "A status callback threw: " << e.what();
        }
    }
}

// ---- notifications registered with the peer -----------------------------------------------

void ServerReconnect::AddServerCallback(const std::string& name, MessageHandlerPtr handler, Call registerCall,
                                        Call unregisterCall) {
    MessageRegistrar::Instance()->Register(name, std::move(handler));
    {
        RecursiveMutex::Guard lock(mServerCallbackLock, "ServerReconnect::AddServerCallback");
        mServerCallbacks[name] = {registerCall, std::move(unregisterCall)};
    }
    if (auto client = Direct().client) client->SendNotification(registerCall);
}

void ServerReconnect::RemoveServerCallback(const std::string& name) {
    MessageRegistrar::Instance()->UnRegister(name);
    std::optional<Call> unregisterCall;
    {
        RecursiveMutex::Guard lock(mServerCallbackLock, "ServerReconnect::RemoveServerCallback");
        auto it = mServerCallbacks.find(name);
        if (it != mServerCallbacks.end()) {
            unregisterCall = std::move(it->second.second);
            mServerCallbacks.erase(it);
        }
    }
    if (!unregisterCall) return;
    if (auto client = Direct().client) client->SendNotification(*unregisterCall);
}

void ServerReconnect::UnRegisterNotification() {
    Guid id;
    {
        std::lock_guard lock(mStateMutex);
        id = mNotificationId;
        mNotificationId = Guid();
    }
    if (!id.IsNil()) RemoveServerCallback(id.ToString());
}

void ServerReconnect::RegisterNotification() {
    UnRegisterNotification();
    if (!mSupportsReconnect) return;
    const Guid id = Guid::New();
    GenericAssetRequestInfo target;
    {
        std::lock_guard lock(mStateMutex);
        mNotificationId = id;
        target = mReconnectTarget;
    }
    const std::string name = id.ToString();
    const Value endpoint = SharedServerEndpoint();
    Call registerCall, unregisterCall;
    if (target.mFarlandAssetInfo.mAssetIdentifier.empty()) {
        const Value args = Value::array({name, endpoint, target.mProjectFile.string()});
        registerCall = BuildCall("com.quenlo.tidelink.RegisterServerStatusChange", args);
        unregisterCall = BuildCall("com.quenlo.tidelink.UnRegisterServerStatusChange", args);
    } else {
        const Value args = Value::array({name, endpoint, Value(target.mFarlandAssetInfo.GetAssetInfo())});
        registerCall = BuildCall("com.quenlo.tidelink.RegisterFarlandServerStatusChange", args);
        unregisterCall = BuildCall("com.quenlo.tidelink.UnRegisterFarlandServerStatusChange", args);
    }
    WeakSelf weak = mWeakSelf;
    auto handler = std::make_shared<FunctionNotificationHandler>([weak](const Value& args) {
        if (!args.is_array() || args.empty() || !args[0].is_number_integer()) return;
        const int64_t value = args[0].get<int64_t>();
        if (value < INT32_MIN || value > INT32_MAX) return;
        if (auto self = weak.lock(); self && !self->Destroying()) self->OnStatusChange(static_cast<int32_t>(value));
    });
    AddServerCallback(name, std::move(handler), std::move(registerCall), std::move(unregisterCall));
}

// ---- loss and reconnection -----------------------------------------------------------------

void ServerReconnect::OnSessionClose() {
    int32_t closes = 0;
    bool reconnecting = false;
    {
        RecursiveMutex::Guard lock(mPendingLock, "ServerReconnect::OnSessionClose");
        reconnecting = mReconnectingCount > 0;
        closes = ++mSessionCloseCount;
    }
    if (Destroying() || reconnecting) return;
    const int64_t limit = GetDebugEntryInt(kMaxReconnectEntry, kDefaultMaxReconnect);
    TL_TRACE(kCat, 5) << "Direct session closed (" << closes << " so far, limit " << limit << ")";
    if (limit < 0 || closes <= limit) {
        OnStatusChange(2);
    } else {
        OnReconnectionFailed(-1, u"Server went missing");
    }
}

void ServerReconnect::OnStatusChange(int32_t value) {
    if (value != 2 || Destroying()) return;
    {
        RecursiveMutex::Guard lock(mPendingLock, "ServerReconnect::OnStatusChange");
        // One reconnection at a time: a second report of the same loss joins the running one.
        if (mReconnectingCount > 0) return;
        ++mReconnectingCount;
    }
    TL_TRACE(kCat, 4) << "Server went away; reconnecting";
    CallStatusCallbacks(ConnectionStatus::Reconnecting, WString(), GenericAssetInfo());
    if (mConnectWithVersionName.empty()) {
        WeakSelf weak = mWeakSelf;
        GetSharedExecutor()->Post([weak] {
            if (auto self = weak.lock()) self->OnReconnectionFailed(-1, u"Server has disconnected");
        });
        return;
    }
    WeakSelf weak = mWeakSelf;
    // Finding the link manager may block (it may have to be started again): off the transport.
    GetSharedExecutor()->Post([weak] {
        auto self = weak.lock();
        if (!self || self->Destroying()) return;
        auto client = self->LinkManagerClient();
        if (!client) return self->OnReconnectionFailed(-1, u"Unable to launch tidelinkmanager");
        client->SendRequest(
            BuildCall(self->mConnectWithVersionName, Value::array({Value(ClientIdentity::Current())})),
            [weak](const Value&, RequestId) {
                if (auto s = weak.lock(); s && !s->Destroying()) s->ReconnectLinkManagerOK();
            },
            [weak](int32_t, const WString&, RequestId id) {
                if (auto s = weak.lock(); s && !s->Destroying()) s->ReconnectWithVersionFailed(id);
            });
    });
}

RPCClientPtr ServerReconnect::LinkManagerClient() {
    RPCClientPtr client = GetRPCClient();
    if (client && client->GetSession() && client->GetSession()->IsOpen()) return client;
    // The link manager went away too: find (or start) it again.
    try {
        client = LaunchTidelinkManagerRPC();
    } catch (const LinkError& e) {
        TL_TRACE(kCat, 2) << "Reconnection cannot reach the link manager: " << e.what();
        return nullptr;
    }
    std::lock_guard lock(mStateMutex);
    mLinkManager = client;
    return client;
}

FailureFn ServerReconnect::ReconnectFailure() {
    WeakSelf weak = mWeakSelf;
    return [weak](int32_t code, const WString& message, RequestId) {
        if (auto s = weak.lock(); s && !s->Destroying()) s->OnReconnectionFailed(code, message);
    };
}

void ServerReconnect::ReconnectWithVersionFailed(RequestId failedId) {
    WeakSelf weak = mWeakSelf;
    GetRPCClient()->SendRequest(
        BuildCall(mConnectName, Value::array({ToUTF8(GetClientName())})),
        [weak](const Value&, RequestId) {
            if (auto s = weak.lock(); s && !s->Destroying()) s->ReconnectLinkManagerOK();
        },
        ReconnectFailure(), failedId);
}

void ServerReconnect::ReconnectLinkManagerOK() {
    const auto target = GetReconnectTarget();
    Value endpoint = Value::object();
    endpoint["address"] = mHostAddress.empty() ? GetAddressForTideLinkManager() : mHostAddress;
    auto client = GetRPCClient();
    auto session = client ? client->GetSession() : nullptr;
    endpoint["port"] = session ? session->GetRemotePort() : mConnectionPort;
    Call call;
    if (target.mFarlandAssetInfo.mAssetIdentifier.empty()) {
        call = BuildCall(mCreateLinkName, Value::array({target.mProjectFile.string(), endpoint, false}));
    } else {
        call = BuildCall(mCreateFarlandLinkName,
                         Value::array({Value(target.mFarlandAssetInfo.GetAssetInfo()), endpoint, false}));
    }
    WeakSelf weak = mWeakSelf;
    client->SendRequest(
        call,
        [weak](const Value& reply, RequestId) {
            if (auto s = weak.lock(); s && !s->Destroying()) s->ReconnectLinkOK(reply);
        },
        ReconnectFailure());
}

void ServerReconnect::ReconnectLinkOK(const Value& reply) {
    ServerConnection connection;
    try {
        connection = ReplyValue<ServerConnection>(reply);
    } catch (const nlohmann::json::exception& e) {
        return OnReconnectionFailed(kErrorProtocol, ToUTF16(e.what()));
    }
    WeakSelf weak = mWeakSelf;
    // Opening a session waits for the peer's hello: not on a transport thread.
    GetSharedExecutor()->Post([weak, connection] {
        auto self = weak.lock();
        if (!self || self->Destroying()) return;
        auto session = connection.mPort == 0
                           ? nullptr
                           : ClientStart(GetSharedTransport(), connection.mAddress, connection.mPort);
        if (!session) return self->OnReconnectionFailed(kErrorConnectFailed, u"Cannot reach the server");
        self->SetDirectSession(session);
        auto client = std::make_shared<RPCClient>(session, "DirectClient");
        self->SetDirectRPCClient(client);
        client->SendRequest(
            BuildCall("com.quenlo.tidelink.ConnectToServerWithVersion",
                      Value::array({Value(ClientIdentity::Current())})),
            [weak](const Value&, RequestId) {
                if (auto s = weak.lock(); s && !s->Destroying()) s->ReconnectConnected();
            },
            [weak, client](int32_t, const WString&, RequestId id) {
                auto s = weak.lock();
                if (!s || s->Destroying()) return;
                client->SendRequest(
                    BuildCall("com.quenlo.tidelink.ConnectToServer",
                              Value::array({ToUTF8(GetClientName()), Guid::New().ToString()})),
                    [weak](const Value&, RequestId) {
                        if (auto s2 = weak.lock(); s2 && !s2->Destroying()) s2->ReconnectConnected();
                    },
                    s->ReconnectFailure(), id);
            });
    });
}

void ServerReconnect::ReconnectConnected() {
    const auto target = GetReconnectTarget();
    auto client = GetDirectRPCClient();
    if (!client) return OnReconnectionFailed(kErrorConnectFailed, u"Not connected to the server");
    Call call = target.mFarlandAssetInfo.mAssetIdentifier.empty()
                    ? BuildCall("com.quenlo.tidelink.OpenProject", Value::array({target.mProjectFile.string()}))
                    : BuildCall("com.quenlo.tidelink.OpenFarlandAsset",
                                Value::array({Value(target.mFarlandAssetInfo)}));
    WeakSelf weak = mWeakSelf;
    client->SendRequest(
        call,
        [weak](const Value& reply, RequestId) {
            if (auto s = weak.lock(); s && !s->Destroying()) s->ReconnectOpened(reply);
        },
        ReconnectFailure());
}

void ServerReconnect::ReconnectOpened(const Value& reply) {
    const auto target = GetReconnectTarget();
    WString name;
    GenericAssetInfo asset;
    try {
        const Value& value = reply.is_object() && reply.contains("value") ? reply["value"] : Value();
        if (target.mFarlandAssetInfo.mAssetIdentifier.empty()) {
            asset.mProjectFile = target.mProjectFile;
            // Peers answer with the project's name, or with the whole project description.
            if (value.is_string()) {
                name = value.get<WString>();
            } else if (value.is_object()) {
                if (auto it = value.find("name"); it != value.end() && it->is_string()) name = it->get<WString>();
                if (auto it = value.find("file"); it != value.end() && it->is_string() && !it->get_ref<const std::string&>().empty()) {
                    asset.mProjectFile = File(it->get<std::string>());
                }
            }
        } else {
            asset.mFarlandAssetInfo = target.mFarlandAssetInfo.GetAssetInfo();
            if (value.is_object()) {
                if (auto it = value.find("name"); it != value.end() && it->is_string()) name = it->get<WString>();
                if (auto it = value.find("farlandAssetInfo"); it != value.end()) {
                    asset.mFarlandAssetInfo = it->get<FarlandAssetInfo>();
                }
            }
        }
    } catch (const nlohmann::json::exception& e) {
        return OnReconnectionFailed(kErrorProtocol, ToUTF16(e.what()));
    }
    TL_TRACE(kCat, 4) << "Reconnected to " << ToUTF8(name);
    CallStatusCallbacks(ConnectionStatus::Connected, name, asset);
    RegisterNotification();
    FreePendingMessages();
}

void ServerReconnect::OnReconnectionFailed(int32_t code, const WString& message) {
    if (Destroying()) return;
    TL_TRACE(kCat, 2) << "Reconnection failed (" << code << "): " << ToUTF8(message);
    CallStatusCallbacks(ConnectionStatus::Failed, WString(), GenericAssetInfo());
    FreePendingMessages();
}

}  // namespace tidelink
