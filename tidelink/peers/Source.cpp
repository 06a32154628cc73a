#include "tidelink/peers/Source.h"

#include <algorithm>

#include "platform/Trace.h"
#include "platform/media/ValueAccess.h"
#include "tidelink/core/LinkManager.h"

namespace tidelink {

using namespace platform;

namespace {

constexpr const char* kPrefix = "com.quenlo.tidelink.";
std::string Message(const char* name) { return std::string(kPrefix) + name; }

// A reply's "value" as T, or the failure path when it cannot be read (so the caller hears once).
template <class T>
SuccessFn Reply(std::function<void(T)> ok, std::function<void()> failed) {
    return OKHandler<T>(std::move(ok), [failed](int32_t, const WString&, RequestId) { failed(); });
}

}  // namespace

// ---- caption records -----------------------------------------------------------------------

void to_json(Value& j, const CaptionTrackInfo& r) {
    j = {{"mTrackIndex", r.mTrackIndex}, {"mIsActive", r.mIsActive}, {"mStreamFormat", r.mStreamFormat},
         {"mUIDescription", r.mUIDescription}};
}

void from_json(const Value& j, CaptionTrackInfo& r) {
    RequireObject(j);
    CaptionTrackInfo out;
    if (const Value* v = FindMember(j, "mTrackIndex")) out.mTrackIndex = ReadInt64(*v);
    if (const Value* v = FindMember(j, "mIsActive")) out.mIsActive = ReadBool(*v);
    if (const Value* v = FindMember(j, "mStreamFormat")) out.mStreamFormat = ReadInteger<uint32_t>(*v);
    if (const Value* v = FindMember(j, "mUIDescription")) out.mUIDescription = ReadString(*v);
    r = std::move(out);
}

void to_json(Value& j, const CaptionData& r) {
    j = {{"mVersion", r.mVersion}, {"mLegacyCaptionXML", r.mLegacyCaptionXML}, {"mTracks", r.mTracks}};
}

void from_json(const Value& j, CaptionData& r) {
    RequireObject(j);
    CaptionData out;
    if (const Value* v = FindMember(j, "mVersion")) out.mVersion = ReadInteger<uint32_t>(*v);
    if (const Value* v = FindMember(j, "mLegacyCaptionXML")) out.mLegacyCaptionXML = ReadString(*v);
    if (const Value* v = FindMember(j, "mTracks")) out.mTracks = v->get<std::vector<CaptionTrackInfo>>();
    r = std::move(out);
}

void to_json(Value& j, const CaptionSelectionData& r) {
    j = {{"mVersion", uint64_t{r.mVersion}},
         {"mSelectedTrackForBurnIn", int64_t{r.mSelectedTrackForBurnIn}},
         {"mSelectedTracksForEmbedding", r.mSelectedTracksForEmbedding}};
}

void from_json(const Value& j, CaptionSelectionData& r) {
    RequireObject(j);
    CaptionSelectionData out;
    if (const Value* v = FindMember(j, "mVersion")) out.mVersion = ReadInteger<uint32_t>(*v);
    if (const Value* v = FindMember(j, "mSelectedTrackForBurnIn")) out.mSelectedTrackForBurnIn = ReadInteger<int32_t>(*v);
    if (const Value* v = FindMember(j, "mSelectedTracksForEmbedding")) {
        out.mSelectedTracksForEmbedding = v->get<std::vector<int64_t>>();
    }
    r = std::move(out);
}

// ---- Source --------------------------------------------------------------------------------

Source::Source(ServerReconnectPtr reconnect, Callback callback)
    : mReconnect(std::move(reconnect)), mCallback(std::move(callback)) {}

SourcePtr Source::CreateSource(ServerReconnectPtr reconnect, Callback callback) {
    SourcePtr source(new Source(std::move(reconnect), std::move(callback)));
    source->mWeakSelf = source;
    std::weak_ptr<Source> weak = source;
    source->mStatusCallbackID = source->mReconnect->AddStatusCallback(
        [weak](ConnectionStatus status, const WString& message, const File& file) {
            if (auto self = weak.lock()) self->OnReconnectStatus(status, message, file);
        });
    return source;
}

SourcePtr Source::CreateFarlandSource(ServerReconnectPtr reconnect, Callback callback) {
    SourcePtr source(new Source(std::move(reconnect), std::move(callback)));
    source->mWeakSelf = source;
    std::weak_ptr<Source> weak = source;
    source->mStatusCallbackID = source->mReconnect->AddGenericStatusCallback(
        [weak](ConnectionStatus status, const WString& message, const GenericAssetInfo& asset) {
            if (auto self = weak.lock()) self->OnFarlandReconnectStatus(status, message, asset);
        });
    return source;
}

Source::~Source() { mReconnect->RemoveStatusCallback(mStatusCallbackID); }

void Source::Init(const SourceInfo& info, GuidFunction fn) {
    mInfo = info;
    mGuidFunction = std::move(fn);
    if (!mInfo.mHasAudio) {
        if (mInfo.mAudioChannelLayout.empty()) mInfo.mAudioChannelLayout = CreateStereoChannelLayout();
        if (!mInfo.mAudioSampleRate.IsSet()) mInfo.mAudioSampleRate = FrameRate(kTicksPerSecond / 48000);
    }
}

bool Source::IsFarland(const SourceInfo& info) {
    return !info.mFarlandAssetRequestInfo.mAssetIdentifier.empty() ||
           !info.mFarlandProductionRequestInfo.mProductionIdentifier.empty() ||
           info.mFarlandProductionRequestInfo.mCreateNewProduction;
}

bool Source::HasFrozenUnstretchableRegions() const {
    if (IsFarland() || mInfo.mHasAudio || !mInfo.mHasFrozenUnstretchableRegions) return false;
    std::string ext = mInfo.mParentProjectFile.extension().string();
    std::transform(ext.begin(), ext.end(), ext.begin(), [](char c) {
        return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
    });
    return ext == ".kstgraphic";
}

void Source::Send(const char* plain, const char* farland, Value plainArgs, Value farlandArgs, SuccessFn ok,
                  FailureFn fail) {
    Call call = IsFarland() ? BuildCall(Message(farland), std::move(farlandArgs))
                            : BuildCall(Message(plain), std::move(plainArgs));
    mReconnect->SendDirectRequest(call, std::move(ok), std::move(fail), false, 0);
}

RequestId Source::SendRequest(const Call& call, SuccessFn ok, FailureFn fail) {
    return mReconnect->SendDirectRequest(call, std::move(ok), std::move(fail), false, 0);
}

void Source::SendNotification(const Call& call) { mReconnect->SendDirectNotification(call); }

void Source::GetXMLDescription(std::function<void(ConnectionStatus, WString)> callback) {
    auto failed = [callback] { callback(ConnectionStatus::Failed, WString()); };
    Send("GetXMLDescription", "farland.GetXMLDescription",
         Value::array({mInfo.mParentProjectFile.string(), mInfo.mID.ToString()}),
         Value::array({Value(mInfo.mFarlandAssetRequestInfo.GetAssetInfo())}),
         Reply<WString>([callback](WString s) { callback(ConnectionStatus::Connected, std::move(s)); }, failed),
         [failed](int32_t, const WString&, RequestId) { failed(); });
}

void Source::GetUTF8XMLDescription(std::function<void(ConnectionStatus, std::string)> callback) {
    auto failed = [callback] { callback(ConnectionStatus::Failed, std::string()); };
    Send("GetXMLDescription", "farland.GetXMLDescription",
         Value::array({mInfo.mParentProjectFile.string(), mInfo.mID.ToString()}),
         Value::array({Value(mInfo.mFarlandAssetRequestInfo.GetAssetInfo())}),
         Reply<std::string>([callback](std::string s) { callback(ConnectionStatus::Connected, std::move(s)); }, failed),
         [failed](int32_t, const WString&, RequestId) { failed(); });
}

void Source::GetRuntimeGuid(std::function<void(ConnectionStatus, Guid)> callback) {
    auto failed = [callback] { callback(ConnectionStatus::Failed, Guid()); };
    Send("GetRuntimeGuid", "farland.GetRuntimeGuid",
         Value::array({mInfo.mParentProjectFile.string(), mInfo.mID.ToString()}),
         Value::array({Value(mInfo.mFarlandAssetRequestInfo.GetAssetInfo())}),
         Reply<Guid>([callback](Guid g) { callback(ConnectionStatus::Connected, g); }, failed),
         [failed](int32_t, const WString&, RequestId) { failed(); });
}

void Source::DoesSourceContainLink(std::function<void(ConnectionStatus, bool)> callback) {
    auto failed = [callback] { callback(ConnectionStatus::Failed, false); };
    Send("DoesSourceContainLink", "farland.DoesSourceContainLink",
         Value::array({mInfo.mParentProjectFile.string(), mInfo.mID.ToString()}),
         Value::array({Value(mInfo.mFarlandAssetRequestInfo.GetAssetInfo())}),
         Reply<bool>([callback](bool b) { callback(ConnectionStatus::Connected, b); }, failed),
         [failed](int32_t, const WString&, RequestId) { failed(); });
}

void Source::RenderXMP(const RatioTime& start, const RatioTime& end,
                       std::function<void(ConnectionStatus, std::string)> callback) {
    auto failed = [callback] { callback(ConnectionStatus::Failed, std::string()); };
    Send("RenderXMP", "farland.RenderXMP",
         Value::array({mInfo.mParentProjectFile.string(), mInfo.mID.ToString(), RatioTimeToValue(start),
                       RatioTimeToValue(end)}),
         Value::array({Value(mInfo.mFarlandAssetRequestInfo.GetAssetInfo()), RatioTimeToValue(start),
                       RatioTimeToValue(end)}),
         Reply<std::string>([callback](std::string s) { callback(ConnectionStatus::Connected, std::move(s)); }, failed),
         [failed](int32_t, const WString&, RequestId) { failed(); });
}

void Source::SetXMP(std::function<void(int)> callback, const std::string& xmp) {
    Send("SetXMP", "farland.SetXMP", Value::array({mInfo.mParentProjectFile.string(), xmp}),
         Value::array({Value(mInfo.mFarlandAssetRequestInfo.GetAssetInfo()), xmp}),
         [callback](const Value&, RequestId) { callback(static_cast<int>(ConnectionStatus::Connected)); },
         [callback](int32_t, const WString&, RequestId) { callback(-1); });
}

void Source::GetCaptionData(std::function<void(ConnectionStatus, CaptionData)> callback) {
    if (IsFarland()) return;
    auto failed = [callback] { callback(ConnectionStatus::Failed, CaptionData()); };
    mReconnect->SendDirectRequest(
        BuildCall(Message("GetCaptionData"), Value::array({mInfo.mParentProjectFile.string(), mInfo.mID.ToString()})),
        Reply<CaptionData>([callback](CaptionData d) { callback(ConnectionStatus::Connected, std::move(d)); }, failed),
        [failed](int32_t, const WString&, RequestId) { failed(); });
}

void Source::SetCaptionSelectionData(const CaptionSelectionData& data,
                                     std::function<void(ConnectionStatus, bool)> callback) {
    if (IsFarland()) return;
    mReconnect->SendDirectRequest(
        BuildCall(Message("SetCaptionSelectionData"),
                  Value::array({mInfo.mParentProjectFile.string(), mInfo.mID.ToString(), Value(data)})),
        [callback](const Value&, RequestId) { callback(ConnectionStatus::Connected, true); },
        [callback](int32_t, const WString&, RequestId) { callback(ConnectionStatus::Failed, false); });
}

void Source::GetVideoRenderer(std::function<void(ConnectionStatus, VideoRendererPtr)> callback,
                              const VideoRenderOptions& options) {
    VideoRendererPtr renderer(
        IsFarland()
            ? new VideoRenderer(mReconnect, mInfo.mFarlandAssetRequestInfo, options,
                                mInfo.mSupportsVideoRenderingSessions)
            : new VideoRenderer(mReconnect, mInfo.mParentProjectFile, mInfo.mID, options,
                                mInfo.mSupportsVideoRenderingSessions));
    renderer->Start(renderer, std::move(callback));
}

void Source::GetAudioRenderer(std::function<void(ConnectionStatus, AudioRendererPtr)> callback,
                              const AudioRenderOptions& options, const RatioTime& startTime, uint32_t samplesPerBuffer) {
    auto reconnect = mReconnect;
    auto failed = [callback] { callback(ConnectionStatus::Failed, nullptr); };
    Send("CreateAudioRenderingSession", "CreateFarlandAudioRenderingSession",
         Value::array({mInfo.mParentProjectFile.string(), mInfo.mID.ToString(), Value(options),
                       RatioTimeToValue(startTime), uint64_t{samplesPerBuffer}}),
         Value::array({Value(mInfo.mFarlandAssetRequestInfo), Value(options), RatioTimeToValue(startTime),
                       uint64_t{samplesPerBuffer}}),
         Reply<Guid>(
             [callback, reconnect](Guid session) {
                 callback(ConnectionStatus::Connected, AudioRendererPtr(new AudioRenderer(reconnect, session)));
             },
             failed),
         [failed](int32_t, const WString&, RequestId) { failed(); });
}

// ---- reconnection --------------------------------------------------------------------------

void Source::OnReconnectStatus(ConnectionStatus status, const WString&, const File& file) {
    AskAgain(status, BuildCall(Message("GetSource"), Value::array({file.string(), mInfo.mID.ToString()})), false);
}

void Source::OnFarlandReconnectStatus(ConnectionStatus status, const WString&, const GenericAssetInfo& asset) {
    AskAgain(status, BuildCall(Message("GetFarlandSource"), Value::array({Value(asset), mInfo.mID.ToString()})), true);
}

void Source::AskAgain(ConnectionStatus status, const Call& call, bool farland) {
    if (status == ConnectionStatus::Failed) {
        if (mCallback) mCallback(ConnectionStatus::Failed, nullptr);
        return;
    }
    if (status != ConnectionStatus::Connected) return;
    std::weak_ptr<Source> weak = mWeakSelf;
    mReconnect->SendDirectRequest(
        call,
        [weak, farland](const Value& reply, RequestId) {
            if (auto self = weak.lock()) self->OnReplacement(reply, farland);
        },
        [weak](int32_t, const WString&, RequestId) {
            if (auto self = weak.lock(); self && self->mCallback) self->mCallback(ConnectionStatus::Failed, nullptr);
        },
        true, 0);
}

void Source::OnReplacement(const Value& reply, bool farland) {
    SourceInfo info;
    try {
        info = ReplyValue<SourceInfo>(reply);
    } catch (const std::exception& e) {
        TL_TRACE("TideLink", 2) << "Unreadable source description after reconnection: " << e.what();
        if (mCallback) mCallback(ConnectionStatus::Failed, nullptr);
        return;
    }
    // Compare as Init would have stored it, so that defaults filled in here do not count.
    SourcePtr replacement = farland ? CreateFarlandSource(mReconnect, mCallback) : CreateSource(mReconnect, mCallback);
    replacement->Init(info);
    if (replacement->GetSourceInfo() == mInfo) return;
    if (mCallback) mCallback(ConnectionStatus::Connected, replacement);
}

}  // namespace tidelink
