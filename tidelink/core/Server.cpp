#include "tidelink/core/Server.h"

#include "platform/Config.h"
#include "platform/Trace.h"
#include "platform/media/ValueAccess.h"
#include "tidelink/core/Brokering.h"
#include "tidelink/core/LinkManager.h"
#include "tidelink/peers/Project.h"
#include "tidelink/peers/Source.h"

namespace tidelink {

using namespace platform;

namespace {
constexpr const char* kCat = "Server";
constexpr const char* kConnectingToServer = "$$$/tidelink/tidelink/ConnectingToServer=Connecting to Tide Link server...";
constexpr const char* kConnectingToServerOK = "$$$/tidelink/tidelink/ConnectingToServerOK=Connected to Tide Link server.";
constexpr const char* kConnectingToServerFailed =
    "$$$/tidelink/tidelink/ConnectingToServerFailed=Connecting to Tide Link server failed.";
constexpr const char* kConnectingToProject = "$$$/tidelink/tidelink/ConnectingToProject=Connecting to project...";
constexpr const char* kConnectingToProjectOK = "$$$/tidelink/tidelink/ConnectingToProjectOK=Connected to @0";
constexpr const char* kOpenProjectFailed = "$$$/tidelink/tidelink/OpenProjectFailed=The project could not be opened.";
}  // namespace

void ServerInfo::Init(const WString& name, int32_t apiVersion, const WString& appVersion,
                      const SourceTypes& sourceTypes, bool supportsRemoteLinking) {
    mName = name;
    mAPIVersion = apiVersion;
    mAppVersion = appVersion;
    mSourceTypes = sourceTypes;
    mSupportsRemoteLinking = supportsRemoteLinking;
}

void to_json(Value& j, const ServerDescription& r) {
    j = Value::object();
    j["servername"] = ToUTF8(r.mName);
    j["serverapiversion"] = r.mAPIVersion;
    j["serverappversion"] = ToUTF8(r.mAppVersion);
    Value types = Value::object();
    for (const auto& [name, extension] : r.mSourceTypes) types[ToUTF8(name)] = ToUTF8(extension);
    j["sourcetypes"] = std::move(types);
    j["supportsremotelinking"] = r.mSupportsRemoteLinking;
}

void from_json(const Value& j, ServerDescription& r) {
    RequireObject(j);
    ServerDescription out;
    if (const Value* v = FindMember(j, "servername")) out.mName = ReadWString(*v);
    if (const Value* v = FindMember(j, "serverapiversion")) out.mAPIVersion = ReadInteger<int32_t>(*v);
    if (const Value* v = FindMember(j, "serverappversion")) out.mAppVersion = ReadWString(*v);
    if (const Value* v = FindMember(j, "sourcetypes"); v && !v->is_null()) {
        RequireObject(*v);
        for (const auto& [name, extension] : v->items()) out.mSourceTypes[ToUTF16(name)] = ReadWString(extension);
    }
    if (const Value* v = FindMember(j, "supportsremotelinking"); v && !v->is_null()) {
        out.mSupportsRemoteLinking = ReadBool(*v);
    }
    r = std::move(out);
}

Server::Server(const ServerInfo& info, ServerReconnectPtr link, ServerConnectionType type,
               CreationCallback callback, bool direct)
    : ServerInfo(info), mLink(std::move(link)), mCreationCallback(std::move(callback)),
      mConnectionType(type), mProgressID(Guid::New()), mDirect(direct) {}

Server::~Server() = default;

void Server::Init(std::weak_ptr<Server> self, const WString& name, int32_t apiVersion, const WString& appVersion,
                  const SourceTypes& sourceTypes, bool supportsRemoteLinking) {
    mWeakSelf = std::move(self);
    ServerInfo::Init(name, apiVersion, appVersion, sourceTypes, supportsRemoteLinking);
    mRPCServer = GetSharedRPCServer();
    mInitialized = true;
}

void Server::SetProgressCallback(ProgressFn progress) {
    std::lock_guard lock(mProgressMutex);
    mProgress = std::move(progress);
}

void Server::Report(const char* message, double fraction, std::vector<WString> args) {
    ProgressFn progress;
    {
        std::lock_guard lock(mProgressMutex);
        progress = mProgress;
    }
    if (progress) progress(message, fraction, args);
}

void Server::Report(const std::weak_ptr<Server>& weak, const char* message, double fraction,
                    std::vector<WString> args) {
    if (auto self = weak.lock()) self->Report(message, fraction, std::move(args));
}

Value Server::Endpoint() const {
    Value endpoint = Value::object();
    endpoint["address"] = mLink->GetHostAddress();
    endpoint["port"] = mLink->GetConnectionPort();
    return endpoint;
}

// ---- obtaining the connection ---------------------------------------------------------------

void Server::ObtainConnection(Route route, const Value& target, Continuation next, Failure failed) {
    Report(kConnectingToServer, -1.0);
    auto linkManager = mLink->GetRPCClient();
    Call call;
    if (route == Route::HeadedUnlessDirect && mDirect) {
        return ConnectOnLink(mWeakSelf, mLink, std::move(next), std::move(failed));
    }
    if (route == Route::Headed || route == Route::HeadedUnlessDirect ||
        mConnectionType == ServerConnectionType::Headed) {
        call = BuildCall(mLink->GetHeadedConnect(), Value::array({Endpoint()}));
    } else if (route == Route::Farland) {
        call = BuildCall(mLink->GetFarlandReconnect(), Value::array({target, Endpoint(), true}));
    } else if (!mDirect) {
        call = BuildCall(mLink->GetReconnect(),
                         Value::array({target, Endpoint(), mConnectionType == ServerConnectionType::NoReconnect}));
    } else {
        return ConnectOnLink(mWeakSelf, mLink, std::move(next), std::move(failed));
    }

    std::weak_ptr<Server> weak = mWeakSelf;
    auto linkFailed = [weak, failed](int32_t code, const WString& message, RequestId) {
        TL_TRACE(kCat, 4) << "Link request failed (" << code << "): " << ToUTF8(message);
        Report(weak, kConnectingToServerFailed, 0.0);
        failed();
    };
    if (!linkManager) {
        GetSharedExecutor()->Post([linkFailed] { linkFailed(kErrorConnectFailed, u"No link manager", 0); });
        return;
    }
    ServerReconnectPtr original = mLink;
    linkManager->SendRequest(
        call,
        [weak, original, next, failed, linkFailed](const Value& reply, RequestId id) {
            ServerConnection connection;
            try {
                connection = ReplyValue<ServerConnection>(reply);
            } catch (const nlohmann::json::exception& e) {
                return linkFailed(kErrorProtocol, ToUTF16(e.what()), id);
            }
            // Opening the session waits for the peer's hello: not on a transport thread.
            GetSharedExecutor()->Post([weak, original, next, failed, linkFailed, connection, id] {
                auto session = connection.mPort == 0
                                   ? nullptr
                                   : ClientStart(GetSharedTransport(), connection.mAddress, connection.mPort);
                if (!session) return linkFailed(kErrorConnectFailed, u"Cannot reach the server", id);
                auto link = ServerReconnect::Create(original);
                link->SetDirectSession(session);
                link->SetDirectRPCClient(std::make_shared<RPCClient>(session, "DirectClient"));
                ConnectOnLink(weak, link, next, failed);
            });
        },
        linkFailed);
}

void Server::ConnectOnLink(std::weak_ptr<Server> weak, const ServerReconnectPtr& link, Continuation next,
                           Failure failed) {
    auto connected = [weak, link, next](const Value&, RequestId) {
        if (auto self = weak.lock()) {
            self->Report(kConnectingToServerOK, 1.0);
            self->RegisterProgress(link);
        }
        next(link);
    };
    link->SendDirectRequest(
        BuildCall("com.quenlo.tidelink.ConnectToServerWithVersion", Value::array({Value(ClientIdentity::Current())})),
        connected,
        [link, connected, failed](int32_t, const WString&, RequestId id) {
            link->SendDirectRequest(
                BuildCall("com.quenlo.tidelink.ConnectToServer",
                          Value::array({ToUTF8(GetClientName()), Guid::New().ToString()})),
                connected, [failed](int32_t, const WString&, RequestId) { failed(); }, false, id);
        });
}

void Server::RegisterProgress(const ServerReconnectPtr& link) {
    const std::string name = mProgressID.ToString();
    const Value registration = Value::array({name, ServerReconnect::SharedServerEndpoint()});
    std::weak_ptr<Server> weak = mWeakSelf;
    auto handler = std::make_shared<FunctionNotificationHandler>([weak](const Value& args) {
        auto self = weak.lock();
        if (!self || !args.is_array() || args.size() < 2) return;
        try {
            const std::string message = args[0].get<std::string>();
            const double fraction = args[1].get<double>();
            std::vector<WString> list;
            if (args.size() > 2 && args[2].is_array()) {
                for (const auto& a : args[2]) list.push_back(a.get<WString>());
            }
            ProgressFn progress;
            {
                std::lock_guard lock(self->mProgressMutex);
                progress = self->mProgress;
            }
            if (progress) progress(message, fraction, list);
        } catch (const nlohmann::json::exception& e) {
            TL_TRACE(kCat, 3) << "Ignoring a malformed progress message: " << e.what();
        }
    });
    link->AddServerCallback(name, std::move(handler), BuildCall("com.quenlo.tidelink.RegisterServerProgress", registration),
                            BuildCall("com.quenlo.tidelink.UnRegisterServerProgress", registration));
}

// ---- operations ------------------------------------------------------------------------

void Server::SendProjectRequest(const std::weak_ptr<Server>& weak, const ServerReconnectPtr& link, Call call,
                                ProjectCallback callback, bool reportConnecting, FarlandServerConnectInfo connectInfo) {
    if (reportConnecting) Report(weak, kConnectingToProject, -1.0);
    auto shared = std::make_shared<ProjectCallback>(std::move(callback));
    auto fail = [weak, shared](int32_t code, const WString& message, RequestId) {
        TL_TRACE(kCat, 4) << "Project request failed (" << code << "): " << ToUTF8(message);
        Report(weak, kOpenProjectFailed, 0.0);
        (*shared)(ConnectionStatus::Failed, nullptr);
    };
    link->SendDirectRequest(
        call,
        [weak, link, shared, fail, connectInfo](const Value& reply, RequestId id) {
            projectprotocol::ProjectInfo info;
            try {
                info = ReplyValue<projectprotocol::ProjectInfo>(reply);
            } catch (const nlohmann::json::exception& e) {
                return fail(kErrorProtocol, ToUTF16(e.what()), id);
            }
            auto project = Project::Create(link, *shared);
            if (!info.mFarlandProductionInfo.mProductionIdentifier.empty()) {
                FarlandProductionRequestInfo request;
                request.mServerConnectInfo = connectInfo;
                request.mProductionIdentifier = info.mFarlandProductionInfo.mProductionIdentifier;
                request.mRevision = info.mFarlandProductionInfo.mRevision;
                request.mDisplayName = info.mFarlandProductionInfo.mDisplayName;
                request.mCreateNewProduction = false;
                link->SetReconnectFarlandProduction(request);
                project->Init(info.mName, request);
            } else {
                link->SetReconnectProject(info.mFile);
                project->Init(info.mName, info.mFile);
            }
            project->SetMissingAssets(info.mMissingAssets);
            Report(weak, kConnectingToProjectOK, 1.0, {info.mName});
            (*shared)(ConnectionStatus::Connected, project);
        },
        fail);
}

void Server::OpenOnConnection(Route route, const Value& target, Call call, ProjectCallback callback,
                              bool reportConnecting, FarlandServerConnectInfo connectInfo) {
    std::weak_ptr<Server> weak = mWeakSelf;
    auto shared = std::make_shared<ProjectCallback>(std::move(callback));
    ObtainConnection(
        route, target,
        [weak, shared, call = std::move(call), reportConnecting, connectInfo](const ServerReconnectPtr& link) {
            SendProjectRequest(weak, link, call, *shared, reportConnecting, connectInfo);
        },
        [shared] { (*shared)(ConnectionStatus::Failed, nullptr); });
}

void Server::OpenProject(ProjectCallback callback, const File& file) {
    TL_TRACE(kCat, 7) << "OpenProject called with project: " << file.string();
    OpenOnConnection(Route::CreateLink, file.string(),
                     BuildCall("com.quenlo.tidelink.OpenProject", Value::array({file.string()})), std::move(callback),
                     true, {});
}

void Server::OpenProjectWithJSON(ProjectCallback callback, const File& file, const std::string& json) {
    TL_TRACE(kCat, 7) << "OpenProjectWithJSON called with project: " << file.string();
    OpenOnConnection(Route::CreateLink, file.string(),
                     BuildCall("com.quenlo.tidelink.OpenProjectWithJSON", Value::array({file.string(), json})),
                     std::move(callback), true, {});
}

void Server::CreateProject(ProjectCallback callback, const File& directory, const WString& projectName) {
    OpenOnConnection(Route::Headed, Value(),
                     BuildCall("com.quenlo.tidelink.CreateProject",
                               Value::array({directory.string(), ToUTF8(projectName)})),
                     std::move(callback), false, {});
}

void Server::GetOpenProject(ProjectCallback callback, const FarlandProductionRequestInfo& request) {
    OpenOnConnection(Route::HeadedUnlessDirect, Value(),
                     BuildCall("com.quenlo.tidelink.GetOpenProject", Value::array({Value(request)})),
                     std::move(callback), false, request.mServerConnectInfo);
}

void Server::RuntimeFontChange(FontCallback callback) {
    auto shared = std::make_shared<FontCallback>(std::move(callback));
    mLink->SendDirectRequest(
        BuildCall("com.quenlo.tidelink.RuntimeFontChange"),
        OKHandler<uint32_t>([shared](uint32_t value) { (*shared)(ConnectionStatus::Connected, value); },
                            [shared](int32_t, const WString&, RequestId) {
                                (*shared)(ConnectionStatus::Failed, 0xFFFFFFFFu);
                            }),
        [shared](int32_t, const WString&, RequestId) { (*shared)(ConnectionStatus::Failed, 0xFFFFFFFFu); });
}

void Server::OpenFarlandAsset(SourceCallback callback, const FarlandAssetRequestInfo& request) {
    auto shared = std::make_shared<SourceCallback>(std::move(callback));
    auto failed = [shared] { (*shared)(ConnectionStatus::Failed, nullptr); };
    ObtainConnection(
        Route::Farland, Value(request.GetAssetInfo()),
        [shared, request, failed](const ServerReconnectPtr& link) {
            link->SendDirectRequest(
                BuildCall("com.quenlo.tidelink.OpenFarlandAsset", Value::array({Value(request)})),
                [link, shared, failed](const Value& reply, RequestId) {
                    SourceInfo info;
                    try {
                        info = ReplyValue<SourceInfo>(reply);
                    } catch (const std::exception&) {
                        return failed();
                    }
                    link->SetReconnectFarlandAsset(info.mFarlandAssetRequestInfo);
                    auto source = Source::CreateFarlandSource(link, *shared);
                    source->Init(info);
                    (*shared)(ConnectionStatus::Connected, source);
                },
                [failed](int32_t, const WString&, RequestId) { failed(); });
        },
        failed);
}

}  // namespace tidelink
