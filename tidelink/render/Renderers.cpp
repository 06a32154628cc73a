#include "tidelink/render/Renderers.h"

#include <sstream>

#include "platform/Trace.h"
#include "platform/Transport.h"
#include "processcoordination/Protocol.h"
#include "tidelink/core/LinkManager.h"

namespace tidelink {

using namespace platform;
namespace pc = processcoordination;

namespace {

constexpr const char* kCat = "TideLink";
constexpr int kLevel = 10;
constexpr const char* kPrefix = "com.quenlo.tidelink.";

std::string Message(const char* name) { return std::string(kPrefix) + name; }

Value TimeValue(const RatioTime& t) { return RatioTimeToValue(t); }

// Where a frame's failure is delivered: the coordination client's delivery executor, or the
// library's shared executor when the process has no client (the failure is then -5).
ExecutorPtr Delivery() {
    if (auto executor = pc::GetDeliveryExecutor()) return executor;
    return GetSharedExecutor();
}

// Sends |call| once the coordination client's registration is acknowledged; a failed send
// completes the frame through the coordination client with the mapped code.
pc::RegistrationCallback SendOnRegistration(const ServerReconnectPtr& reconnect, Call call, const Guid& frameID) {
    return [reconnect, call = std::move(call), frameID] {
        reconnect->SendDirectRequest(
            call, [](const Value&, RequestId) {},
            [frameID](int32_t code, const WString& text, RequestId) {
                TL_TRACE(kCat, 4) << "Render request for " << frameID.ToString() << " failed (" << code
                                  << "): " << ToUTF8(text);
                const int mapped = MapRenderError(code);
                if (mapped != 0) pc::CancelAllOutstandingNotifications(frameID, mapped);
            });
    };
}

// Registers |frameID| and arranges for |send| to run once the link manager has acknowledged it.
void RegisterAndSend(pc::AvailabilityCallback callback, const Guid& frameID, pc::RegistrationCallback send) {
    const int result = pc::GetBinaryDataWithAsyncNotification(frameID, callback, std::move(send));
    if (result != 0) {
        Delivery()->Post([callback, frameID, result] { callback(frameID, nullptr, result); });
    }
}

}  // namespace

int MapRenderError(int32_t code) {
    switch (code) {
        case kErrorTransportShutdown: return 0;
        case kErrorRequestRefused: return -3;
        case kErrorSessionClosed: return -2;
        case kErrorConnectFailed: return -5;
        default: return -1;
    }
}

// ---- VideoRenderer ---------------------------------------------------------------------------

VideoRenderer::VideoRenderer(ServerReconnectPtr reconnect, const File& project, const Guid& source,
                             const VideoRenderOptions& options, bool useSessions)
    : mReconnect(std::move(reconnect)), mOptions(options), mUseSessions(useSessions),
      mClientInitialized(pc::InitializeClient()), mRequestedAsset(project, source) {
    TL_TRACE(kCat, kLevel) << "VideoRenderer:ctor, this=" << this << ", project=" << project.string()
                           << ", source=" << source.ToString() << ", sessions=" << useSessions << "\n";
}

VideoRenderer::VideoRenderer(ServerReconnectPtr reconnect, const FarlandAssetRequestInfo& asset,
                             const VideoRenderOptions& options, bool useSessions)
    : mReconnect(std::move(reconnect)), mOptions(options), mUseSessions(useSessions),
      mClientInitialized(pc::InitializeClient()), mRequestedAsset(asset) {
    TL_TRACE(kCat, kLevel) << "VideoRenderer:ctor, this=" << this
                           << ", farland production=" << asset.mProductionIdentifier
                           << ", asset=" << asset.mAssetIdentifier << ", sessions=" << useSessions << "\n";
}

VideoRenderer::~VideoRenderer() {
    const Guid session = GetSessionID();
    TL_TRACE(kCat, kLevel) << "VideoRenderer:dtor, this=" << this << Describe() << "\n";
    if (!session.IsNil()) {
        mReconnect->SendDirectNotification(
            BuildCall(Message("DisposeVideoRenderingSession"), Value::array({session.ToString()})));
    }
    if (!mStatusCallbackID.IsNil()) mReconnect->RemoveStatusCallback(mStatusCallbackID);
    if (mClientInitialized) pc::UninitializeClient();
}

std::string VideoRenderer::Describe() const {
    const auto asset = GetRequestedAssetInfo();
    std::ostringstream s;
    s << ", project=" << asset.mProjectFile.string() << ", source=" << asset.mProjectFileSourceID.ToString()
      << ", sessions=" << mUseSessions << ", session=" << GetSessionID().ToString()
      << ", production=" << asset.mFarlandAssetInfo.mProductionIdentifier
      << ", asset=" << asset.mFarlandAssetInfo.mAssetIdentifier;
    return s.str();
}

bool VideoRenderer::IsFarland(const GenericAssetRequestInfo& asset) const {
    return !asset.mFarlandAssetInfo.mProductionIdentifier.empty();
}

Guid VideoRenderer::GetSessionID() const {
    std::lock_guard lock(mMutex);
    return mSessionID;
}

void VideoRenderer::SetSessionID(const Guid& id) {
    std::lock_guard lock(mMutex);
    mSessionID = id;
}

GenericAssetRequestInfo VideoRenderer::GetRequestedAssetInfo() const {
    std::lock_guard lock(mMutex);
    return mRequestedAsset;
}

void VideoRenderer::SetRequestedAssetInfo(const GenericAssetRequestInfo& asset) {
    std::lock_guard lock(mMutex);
    mRequestedAsset = asset;
}

Call VideoRenderer::SessionRequest() const {
    const auto asset = GetRequestedAssetInfo();
    if (IsFarland(asset)) {
        return BuildCall(Message("CreateFarlandVideoRenderingSession"),
                         Value::array({Value(asset.mFarlandAssetInfo), Value(mOptions)}));
    }
    return BuildCall(Message("CreateVideoRenderingSession"),
                     Value::array({asset.mProjectFile.string(), asset.mProjectFileSourceID.ToString(), Value(mOptions)}));
}

void VideoRenderer::Start(const VideoRendererPtr& self, StartCallback callback) {
    TL_TRACE(kCat, kLevel) << "VideoRenderer:Start, this=" << this << Describe() << "\n";
    std::weak_ptr<VideoRenderer> weak = self;
    mStatusCallbackID = mReconnect->AddGenericStatusCallback(
        [weak](ConnectionStatus status, const WString& name, const GenericAssetInfo& asset) {
            StaticReconnectStatus(weak, status, name, asset);
        });
    if (!mUseSessions) {
        GetSharedExecutor()->Post([self, callback] { callback(ConnectionStatus::Connected, self); });
        return;
    }
    mReconnect->SendDirectRequest(
        SessionRequest(), [self, callback](const Value& reply, RequestId) { StaticOnVideoSessionOK(self, callback, reply); },
        [self, callback](int32_t err, const WString& text, RequestId) {
            StaticOnVideoSessionFailed(self, callback, err, text);
        });
}

void VideoRenderer::StaticOnVideoSessionOK(const VideoRendererPtr& self, const StartCallback& callback,
                                           const Value& reply) {
    Guid session;
    try {
        session = ReplyValue<Guid>(reply);
    } catch (const nlohmann::json::exception& e) {
        return StaticOnVideoSessionFailed(self, callback, kErrorProtocol, ToUTF16(e.what()));
    }
    self->SetSessionID(session);
    TL_TRACE(kCat, kLevel) << "VideoRenderer:StaticOnVideoSessionOK, this=" << self.get() << self->Describe() << "\n";
    callback(ConnectionStatus::Connected, self);
}

void VideoRenderer::StaticOnVideoSessionFailed(const VideoRendererPtr& self, const StartCallback& callback,
                                               int32_t err, const WString& errtxt) {
    self->SetSessionID(Guid());
    TL_TRACE(kCat, kLevel) << "VideoRenderer:StaticOnVideoSessionFailed, this=" << self.get() << self->Describe()
                           << ", err=" << err << ", errtxt=" << ToUTF8(errtxt) << "\n";
    callback(ConnectionStatus::Failed, nullptr);
}

void VideoRenderer::RenderVideo(pc::AvailabilityCallback callback, const Guid& frameID, const RatioTime& time) {
    GenericAssetRequestInfo asset;
    Guid session;
    {
        std::lock_guard lock(mMutex);
        asset = mRequestedAsset;
        session = mSessionID;
    }
    Call call;
    if (!session.IsNil()) {
        TL_TRACE(kCat, kLevel) << "VideoRenderer:RenderVideo, this=" << this << ", session=" << session.ToString()
                               << ", frameid=" << frameID.ToString() << "frame=" << time.numerator() << "/"
                               << time.denominator() << "\n";
        call = BuildCall(Message("RenderSessionVideo"),
                         Value::array({asset.mProjectFile.string(), asset.mProjectFileSourceID.ToString(),
                                       frameID.ToString(), TimeValue(time), session.ToString()}));
    } else if (IsFarland(asset)) {
        call = BuildCall(Message("RenderVideoForFarland"),
                         Value::array({Value(asset.mFarlandAssetInfo), frameID.ToString(), TimeValue(time), Value(mOptions)}));
    } else {
        call = BuildCall(Message("RenderVideo"),
                         Value::array({asset.mProjectFile.string(), asset.mProjectFileSourceID.ToString(),
                                       frameID.ToString(), TimeValue(time), Value(mOptions)}));
    }
    RegisterAndSend(std::move(callback), frameID, SendOnRegistration(mReconnect, std::move(call), frameID));
}

void VideoRenderer::RenderVideoDirect(DirectCallback callback, const Guid& frameID, const RatioTime& time,
                                      const RenderDestination& destination) {
    GenericAssetRequestInfo asset;
    Guid session;
    {
        std::lock_guard lock(mMutex);
        asset = mRequestedAsset;
        session = mSessionID;
    }
    const Value description = {{"result", 0}, {"filename", destination.mFileName}, {"size", destination.mSize}};
    Call call = session.IsNil()
                    ? BuildCall(Message("RenderVideoDirect"),
                                Value::array({asset.mProjectFile.string(), asset.mProjectFileSourceID.ToString(),
                                              frameID.ToString(), TimeValue(time), Value(mOptions), description}))
                    : BuildCall(Message("RenderSessionVideoDirect"),
                                Value::array({asset.mProjectFile.string(), asset.mProjectFileSourceID.ToString(),
                                              frameID.ToString(), TimeValue(time), description, session.ToString()}));
    mReconnect->SendDirectRequest(
        call, [callback, frameID](const Value&, RequestId) { callback(frameID, 0); },
        [callback, frameID](int32_t, const WString&, RequestId) { callback(frameID, -1); });
}

void VideoRenderer::CancelVideoRender(const Guid& frameID) {
    pc::CancelAllOutstandingNotifications(frameID, pc::kResultCancelled);
    mReconnect->SendDirectNotification(BuildCall(Message("CancelVideoRender"), Value::array({frameID.ToString()})));
}

void VideoRenderer::StaticReconnectStatus(const std::weak_ptr<VideoRenderer>& weak, ConnectionStatus status,
                                          const WString& newName, const GenericAssetInfo& asset) {
    if (auto self = weak.lock()) self->ReconnectStatus(status, newName, asset);
}

void VideoRenderer::ReconnectStatus(ConnectionStatus status, const WString& newName, const GenericAssetInfo& asset) {
    TL_TRACE(kCat, kLevel) << "VideoRenderer:ReconnectStatus, this=" << this << Describe()
                           << ", status=" << static_cast<int>(status) << ", newName=" << ToUTF8(newName) << "\n";
    SetSessionID(Guid());
    if (status != ConnectionStatus::Connected) return;
    {
        std::lock_guard lock(mMutex);
        // The project may have moved or been renamed while the peer was away.
        if (!IsFarland(mRequestedAsset) && !asset.mProjectFile.empty()) mRequestedAsset.mProjectFile = asset.mProjectFile;
    }
    if (!mUseSessions) return;
    std::weak_ptr<VideoRenderer> weak = weak_from_this();
    mReconnect->SendDirectRequest(
        SessionRequest(), [weak](const Value& reply, RequestId) { StaticOnVideoSessionReconnectOK(weak, reply); },
        [weak](int32_t err, const WString& text, RequestId) { StaticOnVideoSessionReconnectFailed(weak, err, text); });
}

void VideoRenderer::StaticOnVideoSessionReconnectOK(const std::weak_ptr<VideoRenderer>& weak, const Value& reply) {
    auto self = weak.lock();
    if (!self) {
        TL_TRACE(kCat, kLevel) << "VideoRenderer:StaticOnVideoSessionReconnectOK: called after renderer destroyed\n";
        return;
    }
    try {
        self->SetSessionID(ReplyValue<Guid>(reply));
    } catch (const nlohmann::json::exception& e) {
        return StaticOnVideoSessionReconnectFailed(weak, kErrorProtocol, ToUTF16(e.what()));
    }
    TL_TRACE(kCat, kLevel) << "VideoRenderer:StaticOnVideoSessionReconnectOK, this=" << self.get() << self->Describe()
                           << "\n";
}

void VideoRenderer::StaticOnVideoSessionReconnectFailed(const std::weak_ptr<VideoRenderer>& weak, int32_t err,
                                                        const WString& errtxt) {
    auto self = weak.lock();
    if (!self) {
        TL_TRACE(kCat, kLevel) << "VideoRenderer:StaticOnVideoSessionReconnectFailed: called after renderer destroyed\n";
        return;
    }
    self->SetSessionID(Guid());
    TL_TRACE(kCat, kLevel) << "VideoRenderer:StaticOnVideoSessionReconnectFailed, now going without sessions, this="
                           << self.get() << self->Describe() << ", err=" << err << ", errtxt=" << ToUTF8(errtxt)
                           << "\n";
}

// ---- AudioRenderer ---------------------------------------------------------------------------

AudioRenderer::AudioRenderer(ServerReconnectPtr reconnect, const Guid& session)
    : mReconnect(std::move(reconnect)), mSessionID(session), mClientInitialized(pc::InitializeClient()) {}

AudioRenderer::~AudioRenderer() {
    mReconnect->SendDirectNotification(
        BuildCall(Message("DisposeAudioRenderingSession"), Value::array({mSessionID.ToString()})));
    if (mClientInitialized) pc::UninitializeClient();
}

void AudioRenderer::RenderAudio(pc::AvailabilityCallback callback, const Guid& frameID) {
    Call call = BuildCall(Message("RenderAudio"), Value::array({mSessionID.ToString(), frameID.ToString()}));
    RegisterAndSend(std::move(callback), frameID, SendOnRegistration(mReconnect, std::move(call), frameID));
}

void AudioRenderer::RenderAudioAtTime(pc::AvailabilityCallback callback, const Guid& frameID, const RatioTime& time) {
    const int result = pc::GetBinaryDataWithAsyncNotification(frameID, callback);
    if (result != 0) {
        Delivery()->Post([callback, frameID, result] { callback(frameID, nullptr, result); });
        return;
    }
    SendOnRegistration(mReconnect,
                       BuildCall(Message("RenderAudioAtTime"),
                                 Value::array({mSessionID.ToString(), frameID.ToString(), TimeValue(time)})),
                       frameID)();
}

void AudioRenderer::CancelAudioRender(const Guid& frameID) {
    pc::CancelAllOutstandingNotifications(frameID, pc::kResultCancelled);
    mReconnect->SendDirectNotification(
        BuildCall(Message("CancelAudioRender"), Value::array({mSessionID.ToString(), frameID.ToString()})));
}

}  // namespace tidelink
