// The messages the reference peer answers (docs/peer.md): connecting, opening, creating and
// closing projects, progress and status registrations. The service owns the open projects.
//
// Threading: Handle may be called from any thread and never blocks: connect requests and the
// font request are answered at once; every other message goes to one serial project queue (so
// opens, closes and registrations apply in arrival order) and is answered from there. Replies and
// notifications are never sent with a lock of the service held. Shutdown blocks; it must not run
// on a transport thread.
#pragma once

#include <atomic>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "Notifier.h"
#include "PeerRole.h"
#include "ProjectModel.h"
#include "platform/Executor.h"
#include "platform/Rpc.h"
#include "tidelink/core/Brokering.h"
#include "tidelink/peers/LinkRecords.h"

namespace tidelink::peer {

// Message names, all with the prefix "com.quenlo.tidelink.".
inline constexpr const char* kConnectWithVersionMessage = "com.quenlo.tidelink.ConnectToServerWithVersion";
inline constexpr const char* kConnectMessage = "com.quenlo.tidelink.ConnectToServer";
inline constexpr const char* kOpenProjectMessage = "com.quenlo.tidelink.OpenProject";
inline constexpr const char* kOpenProjectWithJSONMessage = "com.quenlo.tidelink.OpenProjectWithJSON";
inline constexpr const char* kCreateProjectMessage = "com.quenlo.tidelink.CreateProject";
inline constexpr const char* kGetOpenProjectMessage = "com.quenlo.tidelink.GetOpenProject";
inline constexpr const char* kCloseProjectMessage = "com.quenlo.tidelink.CloseProject";
inline constexpr const char* kRuntimeFontChangeMessage = "com.quenlo.tidelink.RuntimeFontChange";
inline constexpr const char* kRegisterProgressMessage = "com.quenlo.tidelink.RegisterServerProgress";
inline constexpr const char* kUnRegisterProgressMessage = "com.quenlo.tidelink.UnRegisterServerProgress";
inline constexpr const char* kRegisterStatusMessage = "com.quenlo.tidelink.RegisterServerStatusChange";
inline constexpr const char* kUnRegisterStatusMessage = "com.quenlo.tidelink.UnRegisterServerStatusChange";
inline constexpr const char* kRegisterFarlandStatusMessage = "com.quenlo.tidelink.RegisterFarlandServerStatusChange";
inline constexpr const char* kUnRegisterFarlandStatusMessage = "com.quenlo.tidelink.UnRegisterFarlandServerStatusChange";

// The value of a status-change notification that tells a host its project (or the peer) is gone.
inline constexpr int64_t kStatusGone = 2;
// Error code of every refusal of the peer.
inline constexpr int32_t kPeerError = -1;

// The answer to one request: a "value" or an error.
struct Outcome {
    bool ok = false;
    platform::Value value;
    int32_t code = 0;
    platform::WString message;

    static Outcome Ok(platform::Value v) { return Outcome{true, std::move(v), 0, {}}; }
    static Outcome Error(const std::string& message) {
        return Outcome{false, nullptr, kPeerError, platform::ToUTF16(message)};
    }
};
using ReplyFn = std::function<void(Outcome)>;

class PeerService : public std::enable_shared_from_this<PeerService> {
public:
    // Registration limits (a host registers a handful; more is a runaway).
    static constexpr size_t kMaxRegistrations = 4096;

    // |executor| runs the project queue; |sink| carries notifications to hosts.
    static std::shared_ptr<PeerService> Create(PeerRole role, platform::ExecutorPtr executor,
                                               std::shared_ptr<NotificationSink> sink);
    ~PeerService();

    const PeerRole& Role() const { return mRole; }
    static const std::vector<std::string>& MessageNames();

    // Registers every message name on |registrar| (each name answers as request and as
    // notification), respectively removes them.
    void Register(const platform::MessageRegistrarPtr& registrar);
    void Unregister(const platform::MessageRegistrarPtr& registrar);

    // Handles message |name| with |args|. A request passes |reply|, which then runs exactly once
    // (on the calling thread or the project queue); a notification passes nullptr.
    void Handle(const std::string& name, const platform::Value& args, ReplyFn reply);

    // Ends the service: later messages are refused, queued project work finishes, every status
    // registration is told kStatusGone, and the notifications are flushed (at most
    // |flushTimeoutMs|) and their sessions closed.
    void Shutdown(int flushTimeoutMs);

    // An endpoint that cannot be reached loses its registrations.
    void ForgetEndpoint(const ServerConnection& endpoint);

    // Runs |work| on the project queue, after the project messages that arrived before, and
    // passes its outcome to |reply| (exactly once, also when |work| throws). Refused once
    // shutdown began.
    void Queue(const std::string& name, std::function<Outcome()> work, ReplyFn reply);
    bool Stopping() const { return mStopping.load(); }

    // The open project that |path| names (any spelling of its file), or null. Looks the path up
    // as given first, and only then resolves it on the file system. Throws ProjectError for a
    // path that is not absolute.
    std::shared_ptr<const ProjectModel> OpenProject(const std::string& path) const;
    // The most recently opened project that is still open, or null.
    std::shared_ptr<const ProjectModel> MostRecentProject() const;
    // Puts |replacement| (a changed copy) in the place of |current| when |current| is still what
    // is open under its file; false otherwise.
    bool ReplaceOpenProject(const std::shared_ptr<const ProjectModel>& current,
                            std::shared_ptr<const ProjectModel> replacement);

    // For tests and traces.
    std::shared_ptr<const ProjectModel> FindOpenProject(const std::filesystem::path& file) const;
    std::vector<std::filesystem::path> OpenProjectFiles() const;  // most recently opened last
    size_t ProgressRegistrationCount() const;
    size_t StatusRegistrationCount() const;
    // Runs every queued project task; not from the project queue.
    void WaitUntilIdle();

    // The key under which a project is open: the absolute path with symbolic links and "."/".."
    // resolved as far as the path exists. Throws ProjectError for a relative or empty path.
    static std::filesystem::path ProjectKey(const std::string& path);

private:
    struct ProgressRegistration {
        std::string id;
        ServerConnection endpoint;
    };
    struct StatusRegistration {
        std::string id;
        ServerConnection endpoint;
        std::filesystem::path project;   // empty for Farland registrations
        FarlandAssetInfo asset;
        bool farland = false;
    };

    PeerService(PeerRole role, platform::ExecutorPtr executor, std::shared_ptr<NotificationSink> sink);

    Outcome Connect(const std::string& name, const platform::Value& args);
    Outcome Open(const platform::Value& args, bool withJSON);
    Outcome Create(const platform::Value& args);
    Outcome GetOpen(const platform::Value& args);
    Outcome Close(const platform::Value& args);
    Outcome RegisterProgress(const platform::Value& args, bool add);
    Outcome RegisterStatus(const platform::Value& args, bool add, bool farland);

    // Opens |model| (already read) and answers its description.
    Outcome Opened(std::shared_ptr<const ProjectModel> model);
    void SendProgress(const std::string& message, double fraction, const std::vector<std::string>& args);
    void SendStatusGone(const std::vector<StatusRegistration>& to);

    const PeerRole mRole;
    const platform::ExecutorPtr mQueue;
    const std::shared_ptr<NotificationSink> mSink;
    std::atomic<bool> mStopping{false};
    std::atomic<uint32_t> mFontChanges{0};

    mutable std::mutex mMutex;  // guards everything below
    std::map<std::filesystem::path, std::shared_ptr<const ProjectModel>> mOpen;
    std::vector<std::filesystem::path> mOpenOrder;  // most recently opened last
    std::vector<ProgressRegistration> mProgress;
    std::vector<StatusRegistration> mStatus;
};

}  // namespace tidelink::peer
