// A peer server's description (ServerInfo) and the peer-server object handed to hosts (Server):
// through it a host opens, creates or finds projects on the peer, opens remote-production assets
// as sources, asks for a font refresh and watches progress messages.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/Export.h"
#include "platform/Guid.h"
#include "platform/Serialization.h"
#include "tidelink/core/ConnectionStatus.h"
#include "tidelink/core/ServerReconnect.h"
#include "tidelink/peers/LinkRecords.h"

namespace tidelink {

class Project;
class Source;
using ProjectPtr = std::shared_ptr<Project>;
using SourcePtr = std::shared_ptr<Source>;
using SourceTypes = std::map<WString, WString>;

class TIDELINK_EXPORT ServerInfo {
public:
    ServerInfo() = default;
    virtual ~ServerInfo() = default;

    virtual WString GetName() const { return mName; }
    virtual int32_t GetAPIVersion() const { return mAPIVersion; }
    virtual WString GetAppVersion() const { return mAppVersion; }
    // Copies the source types (name to file extension) into |out|.
    virtual void GetSourceTypes(SourceTypes& out) const { out = mSourceTypes; }
    virtual bool SupportsRemoteLinking() const { return mSupportsRemoteLinking; }

    void Init(const WString& name, int32_t apiVersion, const WString& appVersion,
              const SourceTypes& sourceTypes, bool supportsRemoteLinking);

protected:
    WString mName;
    int32_t mAPIVersion = 0;
    WString mAppVersion;
    SourceTypes mSourceTypes;
    bool mSupportsRemoteLinking = false;
};

// The description a peer or the link manager sends: {"servername", "serverapiversion",
// "serverappversion", "sourcetypes", "supportsremotelinking"}.
struct TIDELINK_EXPORT ServerDescription {
    WString mName;
    int32_t mAPIVersion = 0;
    WString mAppVersion;
    SourceTypes mSourceTypes;
    bool mSupportsRemoteLinking = false;
};
TIDELINK_EXPORT void to_json(platform::Value& j, const ServerDescription& r);
// Throws the serializer's type_error when |j| is not an object or a member has the wrong kind.
TIDELINK_EXPORT void from_json(const platform::Value& j, ServerDescription& r);

enum class ServerConnectionType : uint32_t {
    // Projects are opened through the create-link request; the link reconnects.
    Default = 0,
    // As Default, but the link does not reconnect.
    NoReconnect = 1,
    // Projects are opened in the peer's interactive instance (create-headed-link request).
    Headed = 2,
};

class Server;
using ServerPtr = std::shared_ptr<Server>;

class TIDELINK_EXPORT Server : public ServerInfo {
public:
    using CreationCallback = std::function<void(ConnectionStatus, ServerPtr)>;
    using ProjectCallback = std::function<void(ConnectionStatus, ProjectPtr)>;
    using SourceCallback = std::function<void(ConnectionStatus, SourcePtr)>;
    using FontCallback = std::function<void(ConnectionStatus, uint32_t)>;
    // A localisation key with its default text ("$$$/key=Text"), a fraction (-1 indeterminate,
    // 1 success, 0 failure) and the arguments of the text.
    using ProgressFn = std::function<void(const std::string& message, double fraction,
                                          const std::vector<WString>& args)>;

    Server(const ServerInfo& info, ServerReconnectPtr link, ServerConnectionType type,
           CreationCallback callback, bool direct);
    ~Server() override;

    void Init(std::weak_ptr<Server> self, const WString& name, int32_t apiVersion, const WString& appVersion,
              const SourceTypes& sourceTypes, bool supportsRemoteLinking);

    void OpenProject(ProjectCallback callback, const File& file);
    void OpenProjectWithJSON(ProjectCallback callback, const File& file, const std::string& json);
    void CreateProject(ProjectCallback callback, const File& directory, const WString& projectName);
    void GetOpenProject(ProjectCallback callback, const FarlandProductionRequestInfo& request);
    void OpenFarlandAsset(SourceCallback callback, const FarlandAssetRequestInfo& request);
    void RuntimeFontChange(FontCallback callback);
    void SetProgressCallback(ProgressFn progress);

    const ServerReconnectPtr& GetLink() const { return mLink; }
    ServerConnectionType GetConnectionType() const { return mConnectionType; }
    bool IsDirect() const { return mDirect; }
    bool IsInitialized() const { return mInitialized; }
    const platform::Guid& GetProgressID() const { return mProgressID; }

private:
    using Continuation = std::function<void(const ServerReconnectPtr&)>;
    using Failure = std::function<void()>;

    // Obtains the connection for an operation and runs |next| on it, or |failed|.
    enum class Route { CreateLink, Headed, HeadedUnlessDirect, Farland };
    void ObtainConnection(Route route, const platform::Value& target, Continuation next, Failure failed);
    static void ConnectOnLink(std::weak_ptr<Server> weak, const ServerReconnectPtr& link,
                              Continuation next, Failure failed);
    void RegisterProgress(const ServerReconnectPtr& link);
    void Report(const char* message, double fraction, std::vector<WString> args = {});
    static void Report(const std::weak_ptr<Server>& weak, const char* message, double fraction,
                       std::vector<WString> args = {});
    // Obtains the connection, then sends |call|, whose answer is a project.
    void OpenOnConnection(Route route, const platform::Value& target, platform::Call call, ProjectCallback callback,
                          bool reportConnecting, FarlandServerConnectInfo connectInfo);
    // The continuation shared by the operations that answer with a project.
    // Runs whether or not the server is still there; only progress needs it.
    static void SendProjectRequest(const std::weak_ptr<Server>& weak, const ServerReconnectPtr& link,
                                   platform::Call call, ProjectCallback callback, bool reportConnecting,
                                   FarlandServerConnectInfo connectInfo);
    platform::Value Endpoint() const;

    ServerReconnectPtr mLink;
    CreationCallback mCreationCallback;
    bool mInitialized = false;
    platform::RPCServerPtr mRPCServer;
    ServerConnectionType mConnectionType;
    platform::Guid mProgressID;
    mutable std::mutex mProgressMutex;
    ProgressFn mProgress;
    bool mDirect;
    std::weak_ptr<Server> mWeakSelf;
};

}  // namespace tidelink
