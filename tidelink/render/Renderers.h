// Rendering a linked source: frames (VideoRenderer) and audio chunks (AudioRenderer) arrive as
// shared-memory references, one callback per frame or chunk on the coordination client's
// delivery executor.
//
// A frame is requested under a GUID chosen by the caller: the renderer registers with the
// coordination client for it and sends the render request only once the link manager has
// acknowledged the registration, so the data cannot arrive before the registration exists.
// Each frame's callback runs exactly once: with 0 and the reference, the peer's error, a mapped
// transport error (-3 refused, -2 session closed, -5 no connection, -1 other), -6 after a cancel,
// or -4 after a lost link-manager connection.
#pragma once

#include <functional>
#include <memory>
#include <mutex>

#include "platform/Export.h"
#include "platform/Guid.h"
#include "processcoordination/ProcessCoordination.h"
#include "tidelink/core/ConnectionStatus.h"
#include "tidelink/core/ServerReconnect.h"
#include "tidelink/peers/LinkRecords.h"
#include "tidelink/render/RenderOptions.h"


namespace tidelink {

class Source;
class VideoRenderer;
class AudioRenderer;
using VideoRendererPtr = std::shared_ptr<VideoRenderer>;
using AudioRendererPtr = std::shared_ptr<AudioRenderer>;

// Where a host wants a frame written: {"result", "filename", "size"}.
struct TIDELINK_EXPORT RenderDestination {
    std::string mFileName;
    uint64_t mSize = 0;
};

// The coordination code for a failed render request (-10005 is not reported: 0).
TIDELINK_EXPORT int MapRenderError(int32_t transportCode);

class TIDELINK_EXPORT VideoRenderer : public std::enable_shared_from_this<VideoRenderer> {
public:
    using StartCallback = std::function<void(ConnectionStatus, VideoRendererPtr)>;
    using DirectCallback = std::function<void(const Guid& frameID, int result)>;

    virtual ~VideoRenderer();

    void Start(const VideoRendererPtr& self, StartCallback callback);
    void RenderVideo(processcoordination::AvailabilityCallback callback, const Guid& frameID,
                     const platform::RatioTime& time);
    void RenderVideoDirect(DirectCallback callback, const Guid& frameID, const platform::RatioTime& time,
                           const RenderDestination& destination);
    void CancelVideoRender(const Guid& frameID);

    Guid GetSessionID() const;
    void SetSessionID(const Guid& id);
    GenericAssetRequestInfo GetRequestedAssetInfo() const;
    void SetRequestedAssetInfo(const GenericAssetRequestInfo& asset);
    const VideoRenderOptions& GetOptions() const { return mOptions; }
    bool UsesSessions() const { return mUseSessions; }

protected:
    friend class Source;
    VideoRenderer(ServerReconnectPtr reconnect, const File& project, const Guid& source,
                  const VideoRenderOptions& options, bool useSessions);
    VideoRenderer(ServerReconnectPtr reconnect, const FarlandAssetRequestInfo& asset,
                  const VideoRenderOptions& options, bool useSessions);

    void ReconnectStatus(ConnectionStatus status, const WString& newName, const GenericAssetInfo& asset);
    static void StaticReconnectStatus(const std::weak_ptr<VideoRenderer>& weak, ConnectionStatus status,
                                      const WString& newName, const GenericAssetInfo& asset);
    static void StaticOnVideoSessionOK(const VideoRendererPtr& self, const StartCallback& callback,
                                       const platform::Value& reply);
    static void StaticOnVideoSessionFailed(const VideoRendererPtr& self, const StartCallback& callback,
                                           int32_t err, const WString& errtxt);
    static void StaticOnVideoSessionReconnectOK(const std::weak_ptr<VideoRenderer>& weak,
                                                const platform::Value& reply);
    static void StaticOnVideoSessionReconnectFailed(const std::weak_ptr<VideoRenderer>& weak, int32_t err,
                                                    const WString& errtxt);

private:
    bool IsFarland(const GenericAssetRequestInfo& asset) const;
    platform::Call SessionRequest() const;
    std::string Describe() const;

    ServerReconnectPtr mReconnect;
    Guid mStatusCallbackID;
    const VideoRenderOptions mOptions;
    const bool mUseSessions;
    bool mClientInitialized = false;
    mutable std::mutex mMutex;
    Guid mSessionID;
    GenericAssetRequestInfo mRequestedAsset;
};

class TIDELINK_EXPORT AudioRenderer {
public:
    virtual ~AudioRenderer();

    void RenderAudio(processcoordination::AvailabilityCallback callback, const Guid& frameID);
    // May block until the link manager has acknowledged the registration.
    void RenderAudioAtTime(processcoordination::AvailabilityCallback callback, const Guid& frameID,
                           const platform::RatioTime& time);
    void CancelAudioRender(const Guid& frameID);
    const Guid& GetSessionID() const { return mSessionID; }

protected:
    friend class Source;
    AudioRenderer(ServerReconnectPtr reconnect, const Guid& session);

private:
    ServerReconnectPtr mReconnect;
    Guid mSessionID;
    bool mClientInitialized = false;
};

}  // namespace tidelink
