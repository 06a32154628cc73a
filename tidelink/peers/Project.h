// The host's handle on one project that a peer has open. All its requests go through the
// connection it shares with its server.
#pragma once

#include <functional>
#include <memory>
#include <mutex>

#include "platform/Export.h"
#include "platform/Guid.h"
#include "tidelink/core/ConnectionStatus.h"
#include "tidelink/core/ServerReconnect.h"
#include "tidelink/peers/LinkRecords.h"
#include "tidelink/peers/ProjectProtocol.h"

namespace tidelink {

class Project;
using ProjectPtr = std::shared_ptr<Project>;

class TIDELINK_EXPORT Project {
public:
    using OpenCallback = std::function<void(ConnectionStatus, ProjectPtr)>;

    // Registers for the connection's status reports; the open callback hears of a lost link
    // (Failed, no project).
    static ProjectPtr Create(ServerReconnectPtr reconnect, OpenCallback openCallback);
    virtual ~Project();

    void Init(const WString& name, const FarlandProductionRequestInfo& production);
    void Init(const WString& name, const File& file);

    WString GetName() const;
    File GetFile() const;
    FarlandProductionRequestInfo GetFarlandProductionRequestInfo() const;
    MissingAssets GetMissingAssets() const;
    void SetMissingAssets(const MissingAssets& missing);
    // True when the project is a remote production (an identifier, or one to be created).
    bool IsFarlandProduction() const;

    const ServerReconnectPtr& GetReconnect() const { return mReconnect; }

protected:
    Project(ServerReconnectPtr reconnect, OpenCallback openCallback);
    void ReconnectStatus(ConnectionStatus status, const WString& name, const File& file);

    ServerReconnectPtr mReconnect;
    OpenCallback mOpenCallback;
    mutable std::mutex mMutex;  // name, file, production and missing assets
    WString mName;
    File mProjectFile;
    FarlandProductionRequestInfo mProduction;
    platform::Guid mStatusCallbackID;
    MissingAssets mMissingAssets;
};

}  // namespace tidelink
