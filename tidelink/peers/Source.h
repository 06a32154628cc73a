// The host's handle on one linked item of a peer project (a composition, sequence, media file or
// template) that it treats like a media clip. Format and times come from its description without
// traffic; everything else is a request to the peer through the shared connection.
//
// A source is named by its project file and id (plain), or by a remote-production asset
// (Farland); every request has both forms. When the peer restarts, the source asks for its
// description again and hands the host a new Source through its creation callback only when the
// description changed.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/Export.h"
#include "platform/Guid.h"
#include "tidelink/core/ConnectionStatus.h"
#include "tidelink/core/ServerReconnect.h"
#include "tidelink/peers/LinkRecords.h"
#include "tidelink/render/Renderers.h"

namespace tidelink {

class Source;
using SourcePtr = std::shared_ptr<Source>;

struct TIDELINK_EXPORT CaptionTrackInfo {
    int64_t mTrackIndex = 0;
    bool mIsActive = false;
    uint32_t mStreamFormat = 0;
    std::string mUIDescription;
    friend bool operator==(const CaptionTrackInfo&, const CaptionTrackInfo&) = default;
};

struct TIDELINK_EXPORT CaptionData {
    uint32_t mVersion = 0;
    std::string mLegacyCaptionXML;
    std::vector<CaptionTrackInfo> mTracks;
    friend bool operator==(const CaptionData&, const CaptionData&) = default;
};

struct TIDELINK_EXPORT CaptionSelectionData {
    uint32_t mVersion = 0;
    int32_t mSelectedTrackForBurnIn = 0;
    std::vector<int64_t> mSelectedTracksForEmbedding;
    friend bool operator==(const CaptionSelectionData&, const CaptionSelectionData&) = default;
};

TIDELINK_EXPORT void to_json(platform::Value& j, const CaptionTrackInfo& r);
TIDELINK_EXPORT void from_json(const platform::Value& j, CaptionTrackInfo& r);
TIDELINK_EXPORT void to_json(platform::Value& j, const CaptionData& r);
TIDELINK_EXPORT void from_json(const platform::Value& j, CaptionData& r);
TIDELINK_EXPORT void to_json(platform::Value& j, const CaptionSelectionData& r);
TIDELINK_EXPORT void from_json(const platform::Value& j, CaptionSelectionData& r);

class TIDELINK_EXPORT Source {
public:
    using Callback = std::function<void(ConnectionStatus, SourcePtr)>;
    using GuidFunction = std::function<void(const Guid&)>;

    static SourcePtr CreateSource(ServerReconnectPtr reconnect, Callback callback);
    static SourcePtr CreateFarlandSource(ServerReconnectPtr reconnect, Callback callback);
    virtual ~Source();

    void Init(const SourceInfo& info, GuidFunction fn = {});

    // True for a source addressed by a remote-production asset.
    static bool IsFarland(const SourceInfo& info);
    bool IsFarland() const { return IsFarland(mInfo); }

    const SourceInfo& GetSourceInfo() const { return mInfo; }
    WString GetName() const { return mInfo.mName; }
    WString GetMediaProducerDescription() const { return mInfo.mMediaProducerDescription; }
    Guid GetID() const { return mInfo.mID; }
    File GetParentProjectFile() const { return mInfo.mParentProjectFile; }
    platform::RatioTime GetDuration() const { return mInfo.mDuration; }
    platform::PixelAspectRatio GetPixelAspectRatio() const { return mInfo.mPixelAspectRatio; }
    platform::AlphaChannel GetAlphaChannelType() const { return mInfo.mAlphaChannelType; }
    platform::RectT<int> GetFrameSize() const { return mInfo.mFrameRect; }
    platform::FrameRate GetFrameRate() const { return mInfo.mFrameRate; }
    std::vector<platform::PixelFormat> GetNativePixelFormats() const { return mInfo.mPixelFormatList; }
    platform::FieldType GetFieldType() const { return mInfo.mFieldType; }
    platform::FieldType GetNativeFieldType() const { return mInfo.mNativeFieldType; }
    platform::AudioChannelLayout GetAudioChannelLayout() const { return mInfo.mAudioChannelLayout; }
    platform::FrameRate GetAudioSampleRate() const { return mInfo.mAudioSampleRate; }
    Guid GetContentState() const { return mInfo.mInitialContentState; }
    bool HasAudio() const { return mInfo.mHasAudio; }
    bool HasVideo() const { return mInfo.mHasVideo; }
    platform::RatioTime GetTickCount() const { return mInfo.mCurrentTime; }
    platform::RatioTime GetWorkInPoint() const { return mInfo.mWorkInPoint; }
    platform::RatioTime GetWorkOutPoint() const { return mInfo.mWorkOutPoint; }
    float GetAlphaMatteColorR() const { return mInfo.mAlphaMatteColorR; }
    float GetAlphaMatteColorG() const { return mInfo.mAlphaMatteColorG; }
    float GetAlphaMatteColorB() const { return mInfo.mAlphaMatteColorB; }
    platform::RatioTime GetStartTime() const { return mInfo.mStartTime; }
    bool IsDropFrame() const { return mInfo.mIsDropFrame; }
    bool IsMedia() const { return mInfo.mIsMedia; }
    const CapsuleParams& GetCapsuleParams() const { return mInfo.mCapsuleParams; }
    WString GetCohortName() const { return mInfo.mCohortName; }
    bool HasFrozenUnstretchableRegions() const;

    void GetXMLDescription(std::function<void(ConnectionStatus, WString)> callback);
    void GetUTF8XMLDescription(std::function<void(ConnectionStatus, std::string)> callback);
    void GetRuntimeGuid(std::function<void(ConnectionStatus, Guid)> callback);
    void DoesSourceContainLink(std::function<void(ConnectionStatus, bool)> callback);
    void RenderXMP(const platform::RatioTime& start, const platform::RatioTime& end,
                   std::function<void(ConnectionStatus, std::string)> callback);
    void SetXMP(std::function<void(int)> callback, const std::string& xmp);
    // Plain sources only: a Farland source sends nothing and does not call back.
    void GetCaptionData(std::function<void(ConnectionStatus, CaptionData)> callback);
    void SetCaptionSelectionData(const CaptionSelectionData& data, std::function<void(ConnectionStatus, bool)> callback);

    void GetVideoRenderer(std::function<void(ConnectionStatus, VideoRendererPtr)> callback,
                          const VideoRenderOptions& options);
    void GetAudioRenderer(std::function<void(ConnectionStatus, AudioRendererPtr)> callback,
                          const AudioRenderOptions& options, const platform::RatioTime& startTime,
                          uint32_t samplesPerBuffer);

    platform::RequestId SendRequest(const platform::Call& call, platform::SuccessFn ok, platform::FailureFn fail);
    void SendNotification(const platform::Call& call);

    const ServerReconnectPtr& GetReconnect() const { return mReconnect; }

protected:
    Source(ServerReconnectPtr reconnect, Callback callback);
    void OnReconnectStatus(ConnectionStatus status, const WString& message, const File& file);
    void OnFarlandReconnectStatus(ConnectionStatus status, const WString& message, const GenericAssetInfo& asset);

private:
    // Sends the plain or Farland form: |plainArgs| follow the project file and source id;
    // |farlandArgs| follow the asset info.
    void Send(const char* plain, const char* farland, platform::Value plainArgs, platform::Value farlandArgs,
              platform::SuccessFn ok, platform::FailureFn fail);
    // After a reconnection: asks for the description again with |call| (forced past the queue).
    void AskAgain(ConnectionStatus status, const platform::Call& call, bool farland);
    void OnReplacement(const platform::Value& reply, bool farland);

    std::weak_ptr<Source> mWeakSelf;
    ServerReconnectPtr mReconnect;
    Callback mCallback;
    SourceInfo mInfo;
    Guid mStatusCallbackID;
    GuidFunction mGuidFunction;
};

}  // namespace tidelink
