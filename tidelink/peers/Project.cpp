#include "tidelink/peers/Project.h"

#include "platform/Desktop.h"
#include "platform/Trace.h"

namespace tidelink {

using namespace platform;

Project::Project(ServerReconnectPtr reconnect, OpenCallback openCallback)
    : mReconnect(std::move(reconnect)), mOpenCallback(std::move(openCallback)) {}

ProjectPtr Project::Create(ServerReconnectPtr reconnect, OpenCallback openCallback) {
    ProjectPtr project(new Project(std::move(reconnect), std::move(openCallback)));
    std::weak_ptr<Project> weak = project;
    project->mStatusCallbackID = project->mReconnect->AddStatusCallback(
        [weak](ConnectionStatus status, const WString& name, const File& file) {
            if (auto self = weak.lock()) self->ReconnectStatus(status, name, file);
        });
    return project;
}

Project::~Project() { mReconnect->RemoveStatusCallback(mStatusCallbackID); }

void Project::Init(const WString& name, const FarlandProductionRequestInfo& production) {
    std::lock_guard lock(mMutex);
    mName = name;
    mProduction = production;
}

void Project::Init(const WString& name, const File& file) {
    std::lock_guard lock(mMutex);
    mName = name;
    mProjectFile = file;
}

WString Project::GetName() const {
    std::lock_guard lock(mMutex);
    return mName;
}

File Project::GetFile() const {
    std::lock_guard lock(mMutex);
    return mProjectFile;
}

FarlandProductionRequestInfo Project::GetFarlandProductionRequestInfo() const {
    std::lock_guard lock(mMutex);
    return mProduction;
}

MissingAssets Project::GetMissingAssets() const {
    std::lock_guard lock(mMutex);
    return mMissingAssets;
}

void Project::SetMissingAssets(const MissingAssets& missing) {
    std::lock_guard lock(mMutex);
    mMissingAssets = missing;
}

bool Project::IsFarlandProduction() const {
    std::lock_guard lock(mMutex);
    return !mProduction.mProductionIdentifier.empty() || mProduction.mCreateNewProduction;
}

void Project::ReconnectStatus(ConnectionStatus status, const WString& name, const File& file) {
    switch (status) {
        case ConnectionStatus::Failed:
            if (mOpenCallback) mOpenCallback(ConnectionStatus::Failed, nullptr);
            break;
        case ConnectionStatus::Connected: {
            std::lock_guard lock(mMutex);
            mName = name;
            mProjectFile = file;
            break;
        }
        case ConnectionStatus::Reconnecting:
            break;
    }
}

}  // namespace tidelink

// ---- requests ---------------------------------------------------------------------------------

namespace tidelink {

namespace {
constexpr const char* kPrefix = "com.quenlo.tidelink.";
std::string Message(const char* name) { return std::string(kPrefix) + name; }
}  // namespace

void Project::SendSourceRequest(const Call& call, Source::Callback callback) {
    auto reconnect = mReconnect;
    auto shared = std::make_shared<Source::Callback>(std::move(callback));
    mReconnect->SendDirectRequest(
        call,
        OKHandler<SourceInfo>(
            [reconnect, shared](SourceInfo info) {
                SourcePtr source = Source::IsFarland(info) ? Source::CreateFarlandSource(reconnect, *shared)
                                                           : Source::CreateSource(reconnect, *shared);
                source->Init(info);
                (*shared)(ConnectionStatus::Connected, source);
            },
            [shared](int32_t, const WString&, RequestId) { (*shared)(ConnectionStatus::Failed, nullptr); }),
        [shared](int32_t, const WString&, RequestId) { (*shared)(ConnectionStatus::Failed, nullptr); }, false, 0);
}

void Project::GetSource(Source::Callback callback, const Guid& id) {
    if (IsFarlandProduction()) {
        const auto production = GetFarlandProductionRequestInfo();
        GenericAssetInfo asset(FarlandAssetInfo{production.mProductionIdentifier, production.mRevision, id.ToString()});
        return SendSourceRequest(BuildCall(Message("GetFarlandSource"), Value::array({Value(asset), id.ToString()})),
                                 std::move(callback));
    }
    SendSourceRequest(BuildCall(Message("GetSource"), Value::array({GetFile().string(), id.ToString()})),
                      std::move(callback));
}

SourceInfo Project::NewSourceInfo(const WString& name, const RatioTime& duration, const PixelAspectRatio& par,
                                  const RectT<int>& frameRect, const FrameRate& frameRate,
                                  const AudioChannelLayout& audioLayout, const FrameRate& audioRate,
                                  bool dropFrame) const {
    SourceInfo info;
    info.mName = name;
    info.mDuration = duration;
    info.mPixelAspectRatio = par;
    info.mFrameRect = frameRect;
    info.mFrameRate = frameRate;
    info.mAudioChannelLayout = audioLayout;
    info.mAudioSampleRate = audioRate;
    info.mIsDropFrame = dropFrame;
    info.mFarlandProductionRequestInfo = GetFarlandProductionRequestInfo();
    return info;
}

void Project::CreateSource(Source::Callback callback, const WString& name, const RatioTime& duration,
                           const PixelAspectRatio& par, const RectT<int>& frameRect, const FrameRate& frameRate,
                           const AudioChannelLayout& audioLayout, const FrameRate& audioRate, bool dropFrame) {
    const SourceInfo info = NewSourceInfo(name, duration, par, frameRect, frameRate, audioLayout, audioRate, dropFrame);
    SendSourceRequest(BuildCall(Message("CreateSource"), Value::array({GetFile().string(), Value(info)})),
                      std::move(callback));
}

void Project::CreateSourceFromXML(Source::Callback callback, const std::string& xml, const WString& name,
                                  const RatioTime& duration, const PixelAspectRatio& par, const RectT<int>& frameRect,
                                  const FrameRate& frameRate, const AudioChannelLayout& audioLayout,
                                  const FrameRate& audioRate, bool dropFrame) {
    const SourceInfo info = NewSourceInfo(name, duration, par, frameRect, frameRate, audioLayout, audioRate, dropFrame);
    const FarlandProductionInfo production =
        IsFarlandProduction() ? GetFarlandProductionRequestInfo().GetProductionInfo() : FarlandProductionInfo();
    SendSourceRequest(BuildCall(Message("CreateSourceFromXML"),
                                Value::array({GetFile().string(), xml, Value(info), Value(production)})),
                      std::move(callback));
}

void Project::CreateSourceFromXML(Source::Callback callback, const WString& xml, const WString& name,
                                  const RatioTime& duration, const PixelAspectRatio& par, const RectT<int>& frameRect,
                                  const FrameRate& frameRate, const AudioChannelLayout& audioLayout,
                                  const FrameRate& audioRate, bool dropFrame) {
    CreateSourceFromXML(std::move(callback), ToUTF8(xml), name, duration, par, frameRect, frameRate, audioLayout,
                        audioRate, dropFrame);
}

void Project::CreateItemsFromXML(const std::string& xml) {
    mReconnect->SendDirectNotification(BuildCall(Message("CreateItemsFromXML"), Value::array({xml})));
}

void Project::CreateItemsFromXML(const WString& xml) { CreateItemsFromXML(ToUTF8(xml)); }

void Project::ShowSource(Source::Callback callback, const Guid& id) {
    AllowAnyProcessToTakeForeground();
    mReconnect->SendDirectNotification(
        BuildCall(Message("ShowSource"), Value::array({GetFile().string(), id.ToString()})));
    callback = nullptr;
}

void Project::SendFile(const File& file) {
    mReconnect->SendDirectNotification(BuildCall(Message("SendFile"), Value::array({GetFile().string(), file.string()})));
}

void Project::IsSourceLinked(std::function<void(ConnectionStatus, bool)> callback, const Guid& id) {
    mReconnect->SendDirectRequest(
        BuildCall(Message("IsSourceLinked"), Value::array({GetFile().string(), id.ToString()})),
        OKHandler<bool>([callback](bool b) { callback(ConnectionStatus::Connected, b); },
                        [callback](int32_t, const WString&, RequestId) { callback(ConnectionStatus::Failed, false); }),
        [callback](int32_t, const WString&, RequestId) { callback(ConnectionStatus::Failed, false); }, false, 0);
}

void Project::GetItemsAsXML(std::function<void(ConnectionStatus, std::string)> callback, const std::vector<Guid>& ids) {
    Value list = Value::array();
    for (const auto& id : ids) list.push_back(id.ToString());
    auto failed = [callback](int32_t, const WString&, RequestId) { callback(ConnectionStatus::Failed, std::string()); };
    mReconnect->SendDirectRequest(
        BuildCall(Message("GetItemsAsXML"), Value::array({GetFile().string(), list})),
        OKHandler<std::string>([callback](std::string s) { callback(ConnectionStatus::Connected, std::move(s)); }, failed),
        failed, false, 0);
}

void Project::GetProjectSnapshot(std::function<void(ConnectionStatus, projectprotocol::ProjectInfo, SourceInfo)> callback,
                                 const Guid& id) {
    auto failed = [callback](int32_t, const WString&, RequestId) {
        callback(ConnectionStatus::Failed, projectprotocol::ProjectInfo(), SourceInfo());
    };
    mReconnect->SendDirectRequest(
        BuildCall(Message("GetProjectSnapshot"), Value::array({GetFile().string(), id.ToString()})),
        [callback, failed](const Value& reply, RequestId rid) {
            projectprotocol::ProjectInfo project;
            SourceInfo source;
            try {
                const Value value = reply.value("value", Value::object());
                project = value.at("project").get<projectprotocol::ProjectInfo>();
                source = value.at("source").get<SourceInfo>();
            } catch (const std::exception& e) {
                return failed(kErrorProtocol, ToUTF16(e.what()), rid);
            }
            callback(ConnectionStatus::Connected, project, source);
        },
        failed, false, 0);
}

void Project::RuntimeFontChange(std::function<void(ConnectionStatus, uint32_t)> callback) {
    auto failed = [callback](int32_t, const WString&, RequestId) { callback(ConnectionStatus::Failed, 0xFFFFFFFFu); };
    mReconnect->SendDirectRequest(
        BuildCall(Message("RuntimeFontChange")),
        OKHandler<uint32_t>([callback](uint32_t v) { callback(ConnectionStatus::Connected, v); }, failed), failed,
        false, 0);
}

void Project::GetContainer(Container::Callback callback, const Guid& id) {
    auto reconnect = mReconnect;
    const File file = GetFile();
    auto failed = [callback](int32_t, const WString&, RequestId) { callback(ConnectionStatus::Failed, nullptr); };
    mReconnect->SendDirectRequest(
        BuildCall(Message("GetContainer"), Value::array({file.string(), id.ToString()})),
        [reconnect, file, callback, failed](const Value& reply, RequestId rid) {
            ItemInfo self;
            std::vector<ItemInfo> items;
            try {
                const Value value = reply.value("value", Value::object());
                self = value.at("iteminfo").get<ItemInfo>();
                items = value.at("containeditems").get<std::vector<ItemInfo>>();
            } catch (const std::exception& e) {
                return failed(kErrorProtocol, ToUTF16(e.what()), rid);
            }
            auto container = Container::Create(reconnect, callback);
            container->Init(file, self, items);
            callback(ConnectionStatus::Connected, container);
        },
        failed, false, 0);
}

// ---- Container --------------------------------------------------------------------------------

Container::Container(ServerReconnectPtr reconnect, Callback callback)
    : mReconnect(std::move(reconnect)), mCallback(std::move(callback)) {}

ContainerPtr Container::Create(ServerReconnectPtr reconnect, Callback callback) {
    ContainerPtr container(new Container(std::move(reconnect), std::move(callback)));
    container->mWeakSelf = container;
    std::weak_ptr<Container> weak = container;
    container->mStatusCallbackID = container->mReconnect->AddStatusCallback(
        [weak](ConnectionStatus status, const WString& message, const File& file) {
            if (auto self = weak.lock()) self->ReconnectStatus(status, message, file);
        });
    return container;
}

Container::~Container() { mReconnect->RemoveStatusCallback(mStatusCallbackID); }

void Container::Init(const File& project, const ItemInfo& self, const std::vector<ItemInfo>& contained) {
    mProjectFile = project;
    mSelf = self;
    mContained = contained;
}

void Container::ReconnectStatus(ConnectionStatus status, const WString&, const File& file) {
    if (status == ConnectionStatus::Failed) {
        if (mCallback) mCallback(ConnectionStatus::Failed, nullptr);
        return;
    }
    if (status != ConnectionStatus::Connected) return;
    std::weak_ptr<Container> weak = mWeakSelf;
    const File project = file.empty() ? mProjectFile : file;
    mReconnect->SendDirectRequest(
        BuildCall(Message("GetContainer"), Value::array({project.string(), mSelf.mID.ToString()})),
        [weak, project](const Value& reply, RequestId) {
            auto self = weak.lock();
            if (!self) return;
            ItemInfo item;
            std::vector<ItemInfo> items;
            try {
                const Value value = reply.value("value", Value::object());
                item = value.at("iteminfo").get<ItemInfo>();
                items = value.at("containeditems").get<std::vector<ItemInfo>>();
            } catch (const std::exception&) {
                if (self->mCallback) self->mCallback(ConnectionStatus::Failed, nullptr);
                return;
            }
            if (item == self->mSelf && items == self->mContained) return;
            auto replacement = Create(self->mReconnect, self->mCallback);
            replacement->Init(project, item, items);
            if (self->mCallback) self->mCallback(ConnectionStatus::Connected, replacement);
        },
        [weak](int32_t, const WString&, RequestId) {
            if (auto self = weak.lock(); self && self->mCallback) self->mCallback(ConnectionStatus::Failed, nullptr);
        });
}

}  // namespace tidelink
