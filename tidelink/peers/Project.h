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
#include "tidelink/peers/Source.h"

namespace tidelink {

class Project;
class Container;
using ProjectPtr = std::shared_ptr<Project>;
using ContainerPtr = std::shared_ptr<Container>;

// A bin or folder of a project, with the items it holds. After a reconnection it asks again and
// hands its callback a new Container only when anything differs (name, id, items in order).
class TIDELINK_EXPORT Container {
public:
    using Callback = std::function<void(ConnectionStatus, ContainerPtr)>;

    static ContainerPtr Create(ServerReconnectPtr reconnect, Callback callback);
    virtual ~Container();
    virtual void Init(const File& project, const ItemInfo& self, const std::vector<ItemInfo>& contained);

    WString GetName() const { return mSelf.mName; }
    Guid GetID() const { return mSelf.mID; }
    std::vector<ItemInfo> GetContainedItems() const { return mContained; }

protected:
    Container(ServerReconnectPtr reconnect, Callback callback);
    void ReconnectStatus(ConnectionStatus status, const WString& message, const File& file);

private:
    std::weak_ptr<Container> mWeakSelf;
    ServerReconnectPtr mReconnect;
    Callback mCallback;
    File mProjectFile;
    ItemInfo mSelf;
    std::vector<ItemInfo> mContained;
    Guid mStatusCallbackID;
};

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

    void GetContainer(Container::Callback callback, const Guid& id);
    void GetSource(Source::Callback callback, const Guid& id);
    void CreateSource(Source::Callback callback, const WString& name, const platform::RatioTime& duration,
                      const platform::PixelAspectRatio& pixelAspectRatio, const platform::RectT<int>& frameRect,
                      const platform::FrameRate& frameRate, const platform::AudioChannelLayout& audioLayout,
                      const platform::FrameRate& audioRate, bool dropFrame);
    void CreateSourceFromXML(Source::Callback callback, const std::string& xml, const WString& name,
                             const platform::RatioTime& duration, const platform::PixelAspectRatio& pixelAspectRatio,
                             const platform::RectT<int>& frameRect, const platform::FrameRate& frameRate,
                             const platform::AudioChannelLayout& audioLayout, const platform::FrameRate& audioRate,
                             bool dropFrame);
    void CreateSourceFromXML(Source::Callback callback, const WString& xml, const WString& name,
                             const platform::RatioTime& duration, const platform::PixelAspectRatio& pixelAspectRatio,
                             const platform::RectT<int>& frameRect, const platform::FrameRate& frameRate,
                             const platform::AudioChannelLayout& audioLayout, const platform::FrameRate& audioRate,
                             bool dropFrame);
    void CreateItemsFromXML(const std::string& xml);
    void CreateItemsFromXML(const WString& xml);
    // Asks the peer to show the source; the callback is released without being called.
    void ShowSource(Source::Callback callback, const Guid& id);
    void SendFile(const File& file);
    void IsSourceLinked(std::function<void(ConnectionStatus, bool)> callback, const Guid& id);
    void GetItemsAsXML(std::function<void(ConnectionStatus, std::string)> callback, const std::vector<Guid>& ids);
    void GetProjectSnapshot(
        std::function<void(ConnectionStatus, projectprotocol::ProjectInfo, SourceInfo)> callback, const Guid& id);
    void RuntimeFontChange(std::function<void(ConnectionStatus, uint32_t)> callback);

    const ServerReconnectPtr& GetReconnect() const { return mReconnect; }

protected:
    Project(ServerReconnectPtr reconnect, OpenCallback openCallback);
    void ReconnectStatus(ConnectionStatus status, const WString& name, const File& file);
    SourceInfo NewSourceInfo(const WString& name, const platform::RatioTime& duration,
                             const platform::PixelAspectRatio& pixelAspectRatio, const platform::RectT<int>& frameRect,
                             const platform::FrameRate& frameRate, const platform::AudioChannelLayout& audioLayout,
                             const platform::FrameRate& audioRate, bool dropFrame) const;
    void SendSourceRequest(const platform::Call& call, Source::Callback callback);

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
