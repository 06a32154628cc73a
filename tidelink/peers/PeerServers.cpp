#include "tidelink/peers/PeerServers.h"

#include <atomic>
#include <map>

#include "platform/Config.h"
#include "platform/Process.h"
#include "platform/Trace.h"
#include "tidelink/core/LinkManager.h"

namespace tidelink {

using namespace platform;

namespace {

constexpr const char* kCat = "TideLink";
constexpr const char* kPrefix = "com.quenlo.tidelink.";

std::string Message(const char* name) { return std::string(kPrefix) + name; }

RPCClientPtr ReachLinkManager(const char* context) {
    try {
        return LaunchTidelinkManagerRPC();
    } catch (const LinkError& e) {
        TL_TRACE(kCat, 1) << context << ": " << e.what();
        return nullptr;
    }
}

void Describe(ServerInfo& info, const ServerDescription& d) {
    info.Init(d.mName, d.mAPIVersion, d.mAppVersion, d.mSourceTypes, d.mSupportsRemoteLinking);
}

}  // namespace

// ---- GenericServer -------------------------------------------------------------------------

GenericServer::GenericServer(RPCClientPtr linkManager, ServerConnectionType type, std::string connectName,
                             std::string connectWithVersionName, std::string createLinkName,
                             std::string createHeadedLinkName, std::string createFarlandLinkName)
    : mLinkManager(std::move(linkManager)), mCreateHeadedLinkName(std::move(createHeadedLinkName)),
      mConnectName(std::move(connectName)), mConnectWithVersionName(std::move(connectWithVersionName)),
      mCreateLinkName(std::move(createLinkName)), mCreateFarlandLinkName(std::move(createFarlandLinkName)),
      mConnectionType(type) {}

GenericServer::~GenericServer() = default;

SessionPtr GenericServer::GetSession() const { return mLinkManager ? mLinkManager->GetSession() : nullptr; }

SocketTransportPtr GenericServer::GetTransporter() const {
    return mLinkManager ? mLinkManager->GetTransporter() : nullptr;
}

void GenericServer::Complete(ConnectionStatus status, const GenericServerPtr& server) {
    Completion completion;
    {
        std::lock_guard lock(mCompletionMutex);
        completion.swap(mCompletion);
    }
    if (completion) completion(status, status == ConnectionStatus::Connected ? server : nullptr);
}

void GenericServer::Connect(const std::function<GenericServerPtr(RPCClientPtr)>& make, Completion completion,
                            const char* context) {
    RPCClientPtr client = ReachLinkManager(context);
    GenericServerPtr server = make(client);
    {
        std::lock_guard lock(server->mCompletionMutex);
        server->mCompletion = std::move(completion);
    }
    if (!client) {
        GetSharedExecutor()->Post([server] {
            OnTidelinkManagerConnectionFailed(server, kErrorConnectFailed, u"Unable to launch tidelinkmanager");
        });
        return;
    }
    client->SendRequest(
        BuildCall(server->mConnectWithVersionName, Value::array({Value(ClientIdentity::Current())})),
        [server](const Value& reply, RequestId) { OnTidelinkManagerConnectionOK(server, reply); },
        [server](int32_t, const WString&, RequestId id) { OnTidelinkManagerConnectionWithVersionFailed(server, id); });
}

void GenericServer::OnTidelinkManagerConnectionOK(const GenericServerPtr& server, const Value& reply) {
    try {
        const auto description = ReplyValue<ServerDescription>(reply);
        Describe(*server, description);
    } catch (const nlohmann::json::exception& e) {
        // A description we cannot read: the caller still hears back, once.
        TL_TRACE(kCat, 1) << "Unreadable server description: " << e.what();
        return OnTidelinkManagerConnectionFailed(server, kErrorProtocol, ToUTF16(e.what()));
    }
    server->Complete(ConnectionStatus::Connected, server);
}

void GenericServer::OnTidelinkManagerConnectionWithVersionFailed(const GenericServerPtr& server, RequestId failedId) {
    // Whatever the reason, an application that predates the versioned request gets the old one.
    server->mLinkManager->SendRequest(
        BuildCall(server->mConnectName, Value::array({ToUTF8(GetClientName())})),
        [server](const Value& reply, RequestId) { OnTidelinkManagerConnectionOK(server, reply); },
        [server](int32_t code, const WString& message, RequestId) {
            OnTidelinkManagerConnectionFailed(server, code, message);
        },
        failedId);
}

void GenericServer::OnTidelinkManagerConnectionFailed(const GenericServerPtr& server, int32_t code,
                                                      const WString& message) {
    TL_TRACE(kCat, 3) << "Connecting to " << server->mConnectName << " failed (" << code << "): " << ToUTF8(message);
    server->Complete(ConnectionStatus::Failed, server);
}

void GenericServer::CreateLink(LinkCallback callback, ServerConnectionType type) {
    if (static_cast<uint32_t>(type) > 0xFFFFFFFEu) type = mConnectionType;
    uint16_t port = 0;
    try {
        port = GetPortForTideLinkManager();
    } catch (const LinkError& e) {
        TL_TRACE(kCat, 1) << "tidelink::GenericServer::CreateLink: " << e.what();
        GetSharedExecutor()->Post([callback] { callback(ConnectionStatus::Failed, nullptr); });
        return;
    }
    auto link = ServerReconnect::Create(mLinkManager, GetAddressForTideLinkManager(), port, mConnectName,
                                        mConnectWithVersionName, mCreateLinkName, mCreateHeadedLinkName,
                                        mCreateFarlandLinkName, type != ServerConnectionType::NoReconnect);
    auto server = std::make_shared<Server>(*this, link, type, callback, false);
    server->Init(server, GetName(), GetAPIVersion(), GetAppVersion(), mSourceTypes, SupportsRemoteLinking());
    GetSharedExecutor()->Post([callback, server] { callback(ConnectionStatus::Connected, server); });
}

// ---- brokered applications -------------------------------------------------------------------

KestrelServer::KestrelServer(RPCClientPtr linkManager, ServerConnectionType type)
    : GenericServer(std::move(linkManager), type, Message("ConnectToKestrelServer"),
                    Message("ConnectToKestrelServerWithVersion"), Message("CreateKestrelTideLink"),
                    Message("CreateKestrelHeadedLink"), Message("CreateKestrelTideLinkForFarland")) {}

void KestrelServer::CreateTideLinkServer(std::function<void(ConnectionStatus, KestrelServerPtr)> callback,
                                         ServerConnectionType type) {
    Connect([type](RPCClientPtr client) { return std::make_shared<KestrelServer>(std::move(client), type); },
            [callback](ConnectionStatus status, GenericServerPtr server) {
                callback(status, std::static_pointer_cast<KestrelServer>(server));
            },
            "tidelink::KestrelServer::CreateTideLinkServer");
}

OspreyServer::OspreyServer(RPCClientPtr linkManager, ServerConnectionType type)
    : GenericServer(std::move(linkManager), type, Message("ConnectToOspreyServer"),
                    Message("ConnectToOspreyServerWithVersion"), Message("CreateOspreyTideLink"),
                    Message("CreateOspreyHeadedLink"), Message("CreateOspreyTideLinkForFarland")) {}

void OspreyServer::CreateTideLinkServer(std::function<void(ConnectionStatus, OspreyServerPtr)> callback,
                                        ServerConnectionType type) {
    Connect([type](RPCClientPtr client) { return std::make_shared<OspreyServer>(std::move(client), type); },
            [callback](ConnectionStatus status, GenericServerPtr server) {
                callback(status, std::static_pointer_cast<OspreyServer>(server));
            },
            "tidelink::OspreyServer::CreateTideLinkServer");
}

PuffinServer::PuffinServer(RPCClientPtr linkManager, ServerConnectionType type)
    : GenericServer(std::move(linkManager), type, Message("ConnectToPuffinServer"),
                    Message("ConnectToPuffinServerWithVersion"), Message("CreatePuffinServerTideLink"),
                    Message("CreatePuffinServerHeadedLink"), std::string()) {}

void PuffinServer::CreateTideLinkServer(std::function<void(ConnectionStatus, PuffinServerPtr)> callback,
                                        ServerConnectionType type) {
    Connect([type](RPCClientPtr client) { return std::make_shared<PuffinServer>(std::move(client), type); },
            [callback](ConnectionStatus status, GenericServerPtr server) {
                callback(status, std::static_pointer_cast<PuffinServer>(server));
            },
            "tidelink::PuffinServer::CreateTideLinkServer");
}

// ---- named servers ---------------------------------------------------------------------------

namespace {

// A named-server request in flight: the client it went out on (held so that it can be cancelled)
// and whether it was cancelled (its answer may already be on its way).
struct NamedRequest {
    std::shared_ptr<RPCClient> client;
    std::atomic<bool> cancelled{false};
    std::atomic<bool> ended{false};
};

struct NamedRequests {
    std::mutex mutex;
    std::map<int64_t, std::shared_ptr<NamedRequest>> requests;
};

NamedRequests& Named() {
    static auto* requests = new NamedRequests();  // outlives every late reply
    return *requests;
}

void ForgetNamed(int64_t id) {
    std::lock_guard lock(Named().mutex);
    Named().requests.erase(id);
}

std::mutex gPloverPathMutex;
WString gPloverPath;

WString PloverPath() {
    std::lock_guard lock(gPloverPathMutex);
    return gPloverPath.empty() ? ToUTF16(GetCurrentExecutablePath()) : gPloverPath;
}

}  // namespace

int64_t CreateNamedServerConnection(const WString& serverName, const WString& serverPath,
                                    const WString& instanceArgument, std::function<void(ServerConnection)> done) {
    RPCClientPtr client = ReachLinkManager("tidelink::CreateNamedServerConnection");
    if (!client || !done) return 0;
    const std::string name = ToUTF8(serverName), path = ToUTF8(serverPath), instance = ToUTF8(instanceArgument);
    auto request = std::make_shared<NamedRequest>();
    request->client = client;
    auto shared = std::make_shared<std::function<void(ServerConnection)>>(std::move(done));
    auto end = [request, shared](RequestId id, ServerConnection connection) {
        request->ended = true;
        ForgetNamed(static_cast<int64_t>(id));
        if (!request->cancelled) (*shared)(std::move(connection));
    };
    auto finish = [end](const Value& reply, RequestId id) {
        ServerConnection connection;
        try {
            connection = ReplyValue<ServerConnection>(reply);
        } catch (const nlohmann::json::exception& e) {
            TL_TRACE(kCat, 2) << "Unreadable named server address: " << e.what();
        }
        end(id, std::move(connection));
    };
    std::weak_ptr<RPCClient> weakClient = client;
    const RequestId id = client->SendRequest(
        BuildCall(Message("CreateNamedServerLinkWithVersion"),
                  Value::array({name, path, instance, Value(ClientIdentity::Current())})),
        finish,
        [weakClient, request, name, path, instance, finish, end](int32_t, const WString&, RequestId failedId) {
            auto c = weakClient.lock();
            if (!c || request->cancelled) return end(failedId, ServerConnection{});
            c->SendRequest(BuildCall(Message("CreateNamedServerLink"), Value::array({name, path, instance})), finish,
                           [end](int32_t code, const WString& message, RequestId lastId) {
                               TL_TRACE(kCat, 3) << "Named server request failed (" << code
                                                 << "): " << ToUTF8(message);
                               // Port 0: the caller learns that no server could be had.
                               end(lastId, ServerConnection{});
                           },
                           failedId);
        });
    {
        std::lock_guard lock(Named().mutex);
        // An answer that came before this line has nothing left to forget.
        if (!request->ended) Named().requests[static_cast<int64_t>(id)] = request;
    }
    if (request->ended) ForgetNamed(static_cast<int64_t>(id));
    return static_cast<int64_t>(id);
}

void CancelNamedServerConnection(int64_t requestId) {
    std::shared_ptr<NamedRequest> request;
    {
        std::lock_guard lock(Named().mutex);
        auto it = Named().requests.find(requestId);
        if (it == Named().requests.end()) return;
        request = it->second;
        Named().requests.erase(it);
    }
    request->cancelled = true;
    request->client->CancelRequest(static_cast<RequestId>(requestId), true);
}

// ---- PloverServer ----------------------------------------------------------------------------

PloverServer::PloverServer(RPCClientPtr linkManager) : mLinkManager(std::move(linkManager)) {
    ServerInfo::Init(u"Plover", 1, u"1.0", {{u"Plover Catalog", u".plvcat"}}, false);
}

void PloverServer::SetServerPath(const WString& path) {
    std::lock_guard lock(gPloverPathMutex);
    gPloverPath = path;
}

void PloverServer::CreateTideLinkServer(std::function<void(ConnectionStatus, PloverServerPtr)> callback) {
    RPCClientPtr client = ReachLinkManager("tidelink::PloverServer::CreateTideLinkServer");
    PloverServerPtr server = client ? std::make_shared<PloverServer>(client) : nullptr;
    GetSharedExecutor()->Post([callback, server] {
        callback(server ? ConnectionStatus::Connected : ConnectionStatus::Failed, server);
    });
}

RPCClientPtr PloverServer::GetRPCClient() const {
    std::lock_guard lock(mMutex);
    return mDirectClient ? mDirectClient : mLinkManager;
}

SessionPtr PloverServer::GetSession() const {
    auto client = GetRPCClient();
    return client ? client->GetSession() : nullptr;
}

SocketTransportPtr PloverServer::GetTransporter() const {
    auto client = GetRPCClient();
    return client ? client->GetTransporter() : nullptr;
}

void PloverServer::CreateLink(LinkCallback callback) {
    PloverServerPtr self = shared_from_this();  // std::bad_weak_ptr when not shared
    const int64_t id = CreateNamedServerConnection(
        u"Plover", PloverPath(), WString(),
        [self, callback](ServerConnection connection) { CompleteServerConnection(self, connection, callback); });
    if (id == 0) {
        // No request could be sent: still one answer.
        GetSharedExecutor()->Post([callback] { callback(ConnectionStatus::Failed, nullptr); });
    }
}

void PloverServer::CompleteServerConnection(const PloverServerPtr& server, const ServerConnection& connection,
                                            LinkCallback callback) {
    if (connection.mPort == 0) return callback(ConnectionStatus::Failed, nullptr);
    // Opening the session waits for the server's hello: not on a transport thread.
    GetSharedExecutor()->Post([server, connection, callback] {
        auto session = ClientStart(GetSharedTransport(), connection.mAddress, connection.mPort);
        if (!session) return OnDirectConnectionFailed(callback);
        auto client = std::make_shared<RPCClient>(session, "DirectClient");
        {
            std::lock_guard lock(server->mMutex);
            server->mDirectSession = session;
            server->mDirectClient = client;
        }
        client->SendRequest(
            BuildCall(Message("ConnectToServerWithVersion"), Value::array({Value(ClientIdentity::Current())})),
            [server, callback](const Value& reply, RequestId) { OnDirectConnectionOK(server, reply, callback); },
            [server, callback](int32_t, const WString&, RequestId id) {
                OnDirectConnectionWithVersionFailed(server, id, callback);
            });
    });
}

void PloverServer::OnDirectConnectionWithVersionFailed(const PloverServerPtr& server, RequestId failedId,
                                                       LinkCallback callback) {
    RPCClientPtr client;
    {
        std::lock_guard lock(server->mMutex);
        client = server->mDirectClient;
    }
    client->SendRequest(
        BuildCall(Message("ConnectToServer"), Value::array({ToUTF8(GetClientName()), Guid::New().ToString()})),
        [server, callback](const Value& reply, RequestId) { OnDirectConnectionOK(server, reply, callback); },
        [callback](int32_t, const WString&, RequestId) { OnDirectConnectionFailed(callback); }, failedId);
}

void PloverServer::OnDirectConnectionOK(const PloverServerPtr& server, const Value& reply, LinkCallback callback) {
    ServerDescription description;
    try {
        description = ReplyValue<ServerDescription>(reply);
    } catch (const nlohmann::json::exception& e) {
        TL_TRACE(kCat, 1) << "Unreadable server description: " << e.what();
        return OnDirectConnectionFailed(callback);
    }
    SessionPtr session;
    RPCClientPtr client;
    {
        std::lock_guard lock(server->mMutex);
        session = server->mDirectSession;
        client = server->mDirectClient;
    }
    auto link = ServerReconnect::Create(server->mLinkManager, true);
    link->SetDirectSession(session);
    link->SetDirectRPCClient(client);
    auto linked = std::make_shared<Server>(*server, link, ServerConnectionType::Default, callback, true);
    linked->Init(linked, description.mName, description.mAPIVersion, description.mAppVersion,
                 description.mSourceTypes, description.mSupportsRemoteLinking);
    callback(ConnectionStatus::Connected, linked);
}

void PloverServer::OnDirectConnectionFailed(LinkCallback callback) { callback(ConnectionStatus::Failed, nullptr); }

}  // namespace tidelink
