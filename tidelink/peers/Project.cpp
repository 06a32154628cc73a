#include "tidelink/peers/Project.h"

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
