#include "Host.h"

#include <filesystem>
#include <algorithm>
#include <iostream>
#include <mutex>

#include "platform/Config.h"
#include "platform/Trace.h"
#include "tidelink/core/LinkManager.h"
#include "tidelink/peers/PeerServers.h"

namespace tidelink::cli {

using namespace platform;

namespace {

// Generous: a cold start launches the link manager and the application.
constexpr double kConnectSeconds = 90.0;
constexpr double kOpenSeconds = 120.0;

// The library reports failures to callbacks without the peer's reason; it does trace it. The
// host keeps the latest such line so that it can tell the user why.
class ReasonCatcher {
public:
    ReasonCatcher() {
        SetTraceSink([this](std::string_view category, int level, std::string_view line) {
            if (category == "Server" && line.find("failed (") != std::string_view::npos) {
                std::lock_guard lock(mMutex);
                mLast = std::string(line);
            }
            if (TraceWanted(category, level)) std::cerr << "[" << category << ":" << level << "] " << line << "\n";
        });
        SetTraceSelection("Server:" + std::to_string(std::max(4, sUserLevel)) + ",*:" + std::to_string(sUserLevel));
    }
    ~ReasonCatcher() { SetTraceSink(nullptr); }

    // The peer's words, without our prefix: "Project request failed (-1): <reason>".
    std::string Reason() {
        std::lock_guard lock(mMutex);
        const auto colon = mLast.find("): ");
        return colon == std::string::npos ? std::string() : mLast.substr(colon + 3);
    }

    static void SetUserLevel(int level) { sUserLevel = level; }

private:
    static bool TraceWanted(std::string_view, int level) { return level <= sUserLevel; }
    static inline int sUserLevel = 0;
    std::mutex mMutex;
    std::string mLast;
};

template <class T, class Factory>
std::shared_ptr<T> ConnectTo(const char* name, Factory factory) {
    Await<std::shared_ptr<T>> connected;
    factory(connected.Callback());
    auto result = connected.Wait(kConnectSeconds);
    if (!result) throw HostError{std::string("The ") + name + " application did not answer"};
    if (result->first != ConnectionStatus::Connected || !result->second) {
        throw HostError{std::string("Cannot reach the ") + name +
                        " application: is it installed? (the link manager could not connect it)"};
    }
    return result->second;
}

}  // namespace

void SetTraceLevel(int level) { ReasonCatcher::SetUserLevel(level); }

std::optional<Application> ApplicationForFile(const std::string& path) {
    const std::string ext = std::filesystem::path(path).extension().string();
    if (ext == ".kstproj") return Application::Kestrel;
    if (ext == ".ospproj") return Application::Osprey;
    if (ext == ".pufproj") return Application::Puffin;
    return std::nullopt;
}

const char* ApplicationName(Application app) {
    switch (app) {
        case Application::Kestrel: return "Kestrel";
        case Application::Osprey: return "Osprey";
        case Application::Puffin: return "Puffin";
    }
    return "?";
}

ProjectPtr OpenProjectFile(const std::string& path, const OpenOptions& options, ServerPtr* serverOut) {
    const auto app = ApplicationForFile(path);
    if (!app) {
        throw HostError{"Unknown project type '" + std::filesystem::path(path).extension().string() +
                        "' of " + path + " (expected .kstproj, .ospproj or .pufproj)"};
    }
    std::error_code ec;
    const auto absolute = std::filesystem::absolute(path, ec);
    if (ec || !std::filesystem::is_regular_file(absolute, ec)) throw HostError{"No such project file: " + path};

    // Reach the link manager first: its failure has a precise message.
    try {
        LaunchTidelinkManagerRPC();
    } catch (const LinkError& e) {
        throw HostError{e.what()};
    }
    ReasonCatcher reasons;
    const char* name = ApplicationName(*app);
    GenericServerPtr generic;
    switch (*app) {
        case Application::Kestrel:
            generic = ConnectTo<KestrelServer>(
                name, [](auto cb) { KestrelServer::CreateTideLinkServer(cb); });
            break;
        case Application::Osprey:
            generic = ConnectTo<OspreyServer>(
                name, [](auto cb) { OspreyServer::CreateTideLinkServer(cb); });
            break;
        case Application::Puffin:
            generic = ConnectTo<PuffinServer>(
                name, [](auto cb) { PuffinServer::CreateTideLinkServer(cb); });
            break;
    }

    Await<ServerPtr> linked;
    generic->CreateLink(linked.Callback());
    auto link = linked.Wait(kConnectSeconds);
    if (!link || link->first != ConnectionStatus::Connected) throw HostError{std::string("Cannot link to ") + name};
    ServerPtr server = link->second;
    if (options.verbose) {
        server->SetProgressCallback([](const std::string& message, double fraction, const std::vector<WString>& args) {
            std::string text = ToUTF8(args.empty() ? Localize(message) : Localize(message, args[0]));
            if (fraction >= 0) text += " (" + std::to_string(static_cast<int>(fraction * 100)) + "%)";
            std::cerr << text << "\n";
        });
    }

    Await<ProjectPtr> opened;
    server->OpenProject(opened.Callback(), absolute);
    auto project = opened.Wait(kOpenSeconds);
    if (!project) throw HostError{std::string("The ") + name + " application did not open " + path + " in time"};
    if (project->first != ConnectionStatus::Connected || !project->second) {
        std::string reason = reasons.Reason();
        throw HostError{"The project could not be opened" + (reason.empty() ? std::string(".") : ": " + reason)};
    }
    if (serverOut) *serverOut = server;
    return project->second;
}

}  // namespace tidelink::cli
