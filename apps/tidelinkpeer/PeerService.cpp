#include "PeerService.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <stdexcept>
#include <system_error>

#include "Arguments.h"
#include "platform/Trace.h"
#include "tidelink/peers/ProjectProtocol.h"

namespace tidelink::peer {

using namespace platform;
namespace fs = std::filesystem;

namespace {

constexpr const char* kCat = "TideLinkPeer";

// Progress messages: localisation key and default text; "@0" is the argument.
constexpr const char* kOpeningProgress = "$$$/tidelinkpeer/OpeningProject=Opening @0...";
constexpr const char* kOpenedProgress = "$$$/tidelinkpeer/ProjectOpened=Opened @0";
constexpr const char* kOpenFailedProgress = "$$$/tidelinkpeer/OpenProjectFailed=Cannot open @0";

bool EqualsIgnoringCase(const std::string& a, const std::string& b) {
    return a.size() == b.size() && std::equal(a.begin(), a.end(), b.begin(), [](char x, char y) {
               return std::tolower(static_cast<unsigned char>(x)) == std::tolower(static_cast<unsigned char>(y));
           });
}

bool SameEndpoint(const ServerConnection& a, const ServerConnection& b) { return a == b; }

std::string Describe(const ServerConnection& c) { return c.mAddress + ":" + std::to_string(c.mPort); }

// Writes |text| to a new file; fails when the file exists.
void WriteNewFile(const fs::path& file, const std::string& text) {
    FILE* f = std::fopen(file.c_str(), "wx");
    if (!f) {
        throw ProjectError(errno == EEXIST ? std::string("a file of that name exists") : std::strerror(errno));
    }
    const bool written = std::fwrite(text.data(), 1, text.size(), f) == text.size();
    const int writeErrno = errno;
    if (std::fclose(f) != 0 || !written) {
        std::error_code ec;
        fs::remove(file, ec);
        throw ProjectError(std::string("cannot write it: ") + std::strerror(written ? errno : writeErrno));
    }
}

class ServiceHandler final : public MessageHandler {
public:
    ServiceHandler(std::weak_ptr<PeerService> service, std::string name)
        : mService(std::move(service)), mName(std::move(name)) {}

    void HandleRequest(const ResponderPtr& responder, const Value& args) override {
        auto service = mService.lock();
        if (!service) return responder->SendError(kPeerError, u"The peer is shutting down");
        service->Handle(mName, args, [responder](Outcome o) {
            if (o.ok) {
                responder->SendGeneralResult(o.value);
            } else {
                responder->SendError(o.code, o.message);
            }
        });
    }

    void HandleNotification(const Value& args) override {
        if (auto service = mService.lock()) service->Handle(mName, args, nullptr);
    }

private:
    std::weak_ptr<PeerService> mService;
    std::string mName;
};

}  // namespace

std::shared_ptr<PeerService> PeerService::Create(PeerRole role, ExecutorPtr executor,
                                                 std::shared_ptr<NotificationSink> sink) {
    return std::shared_ptr<PeerService>(new PeerService(std::move(role), std::move(executor), std::move(sink)));
}

PeerService::PeerService(PeerRole role, ExecutorPtr executor, std::shared_ptr<NotificationSink> sink)
    : mRole(std::move(role)), mQueue(CreateSubExecutor(std::move(executor), 1)), mSink(std::move(sink)) {}

PeerService::~PeerService() = default;

const std::vector<std::string>& PeerService::MessageNames() {
    static const std::vector<std::string> names = {
        kConnectWithVersionMessage, kConnectMessage,           kOpenProjectMessage,
        kOpenProjectWithJSONMessage, kCreateProjectMessage,     kGetOpenProjectMessage,
        kCloseProjectMessage,       kRuntimeFontChangeMessage, kRegisterProgressMessage,
        kUnRegisterProgressMessage, kRegisterStatusMessage,    kUnRegisterStatusMessage,
        kRegisterFarlandStatusMessage, kUnRegisterFarlandStatusMessage};
    return names;
}

void PeerService::Register(const MessageRegistrarPtr& registrar) {
    for (const auto& name : MessageNames()) {
        registrar->Register(name, std::make_shared<ServiceHandler>(weak_from_this(), name));
    }
}

void PeerService::Unregister(const MessageRegistrarPtr& registrar) {
    for (const auto& name : MessageNames()) registrar->UnRegister(name);
}

fs::path PeerService::ProjectKey(const std::string& path) {
    if (path.empty()) throw ProjectError("the path is empty");
    if (path.find('\0') != std::string::npos) throw ProjectError("the path holds a NUL character");
    const fs::path p(path);
    if (!p.is_absolute()) throw ProjectError("the path is not absolute");
    std::error_code ec;
    fs::path key = fs::weakly_canonical(p, ec);
    if (ec) key = p.lexically_normal();
    return key;
}

void PeerService::Handle(const std::string& name, const Value& args, ReplyFn reply) {
    auto answer = [&reply](Outcome o) {
        if (reply) reply(std::move(o));
    };
    if (mStopping.load()) return answer(Outcome::Error("The peer is shutting down"));
    auto self = shared_from_this();
    try {
        if (name == kConnectWithVersionMessage || name == kConnectMessage) return answer(Connect(name, args));
        if (name == kRuntimeFontChangeMessage) {
            // The number of font refreshes so far; hosts only look for a non-error answer.
            return answer(Outcome::Ok(mFontChanges.fetch_add(1) + 1));
        }
    } catch (const BadArguments& e) {
        return answer(Outcome::Error(e.what()));
    }
    std::function<Outcome()> work;
    if (name == kOpenProjectMessage) work = [self, args] { return self->Open(args, false); };
    else if (name == kOpenProjectWithJSONMessage) work = [self, args] { return self->Open(args, true); };
    else if (name == kCreateProjectMessage) work = [self, args] { return self->Create(args); };
    else if (name == kGetOpenProjectMessage) work = [self, args] { return self->GetOpen(args); };
    else if (name == kCloseProjectMessage) work = [self, args] { return self->Close(args); };
    else if (name == kRegisterProgressMessage) work = [self, args] { return self->RegisterProgress(args, true); };
    else if (name == kUnRegisterProgressMessage) work = [self, args] { return self->RegisterProgress(args, false); };
    else if (name == kRegisterStatusMessage) work = [self, args] { return self->RegisterStatus(args, true, false); };
    else if (name == kUnRegisterStatusMessage) work = [self, args] { return self->RegisterStatus(args, false, false); };
    else if (name == kRegisterFarlandStatusMessage) work = [self, args] { return self->RegisterStatus(args, true, true); };
    else if (name == kUnRegisterFarlandStatusMessage) work = [self, args] { return self->RegisterStatus(args, false, true); };
    else return answer(Outcome::Error("The peer does not answer \"" + name + "\""));
    Queue(name, std::move(work), std::move(reply));
}

void PeerService::Queue(const std::string& name, std::function<Outcome()> work, ReplyFn reply) {
    if (mStopping.load()) {
        if (reply) reply(Outcome::Error("The peer is shutting down"));
        return;
    }
    mQueue->Post([name, work = std::move(work), reply = std::move(reply)] {
        Outcome o;
        try {
            o = work();
        } catch (const BadArguments& e) {
            o = Outcome::Error(e.what());
        } catch (const std::exception& e) {
            // Not expected: every reader reports its own errors. Still an answer, never a crash.
            TL_TRACE(kCat, 0) << "Handling " << name << " failed: " << e.what();
            o = Outcome::Error("The peer could not handle " + ShortName(name) + ": " + e.what());
        }
        if (!o.ok) TL_TRACE(kCat, 3) << ShortName(name) << " refused: " << ToUTF8(o.message);
        if (reply) reply(std::move(o));
    });
}

void PeerService::WaitUntilIdle() { mQueue->WaitUntilIdle(); }

Outcome PeerService::Connect(const std::string& name, const Value& args) {
    if (name == kConnectWithVersionMessage) {
        Args a(args, name, "(client identity {\"name\", \"appVersion\", \"protoVersion\"})");
        const Value& identity = a.At(0);
        if (!identity.is_object()) a.Bad("argument 1 (the client identity) must be an object");
        std::string fields[3];
        const char* keys[3] = {"name", "appVersion", "protoVersion"};
        for (int i = 0; i < 3; ++i) {
            auto it = identity.find(keys[i]);
            if (it == identity.end() || it->is_null()) continue;
            if (!it->is_string()) a.Bad(std::string("the client identity's \"") + keys[i] + "\" must be a string");
            fields[i] = it->get<std::string>();
        }
        TL_TRACE(kCat, 3) << "Host " << fields[0] << " " << fields[1] << " (protocol " << fields[2] << ") connected";
    } else {
        Args a(args, name, "(client name, GUID)");
        const std::string client = a.Text(0, "the client name");
        if (a.Size() > 1 && !Guid::Parse(std::string_view(a.Text(1, "the GUID")))) {
            a.Bad("argument 2 (the GUID) is not a GUID");
        }
        TL_TRACE(kCat, 3) << "Host " << client << " connected (legacy)";
    }
    return Outcome::Ok(mRole.Description());
}

Outcome PeerService::Open(const Value& args, bool withJSON) {
    const std::string message = withJSON ? kOpenProjectWithJSONMessage : kOpenProjectMessage;
    Args a(args, message, withJSON ? "(project path, JSON text)" : "(project path)");
    const std::string path = a.Text(0, "the project path");
    std::string json;
    if (withJSON) {
        const Value& j = a.At(1);
        if (j.is_string()) json = j.get<std::string>();
        else if (j.is_object()) json = ToJSONText(j);  // lenient: the object itself
        else if (!j.is_null()) a.Bad("argument 2 (the JSON text) must be a string");
    }
    SendProgress(kOpeningProgress, -1.0, {path});
    std::shared_ptr<const ProjectModel> model;
    try {
        const fs::path key = ProjectKey(path);
        if (!EqualsIgnoringCase(key.extension().string(), mRole.ProjectExtension())) {
            throw ProjectError("not a " + mRole.serverName + " project (" + mRole.serverName + " opens " +
                               mRole.ProjectExtension() + " files)");
        }
        if (!withJSON) {
            std::lock_guard lock(mMutex);
            if (auto it = mOpen.find(key); it != mOpen.end()) model = it->second;
        }
        if (!model) {
            const DocumentOverrides overrides = withJSON ? ParseOverrides(json) : DocumentOverrides{};
            model = std::make_shared<const ProjectModel>(ProjectModel::Load(key, overrides));
        }
    } catch (const ProjectError& e) {
        SendProgress(kOpenFailedProgress, 0.0, {path});
        return Outcome::Error("Cannot open project " + path + ": " + e.what());
    }
    return Opened(std::move(model));
}

Outcome PeerService::Opened(std::shared_ptr<const ProjectModel> model) {
    {
        std::lock_guard lock(mMutex);
        mOpen[model->File()] = model;
        mOpenOrder.erase(std::remove(mOpenOrder.begin(), mOpenOrder.end(), model->File()), mOpenOrder.end());
        mOpenOrder.push_back(model->File());
    }
    TL_TRACE(kCat, 3) << "Opened " << model->File().string() << " (" << model->Items().size() << " items, "
                      << model->Missing().mMissingFootage.size() << " missing files)";
    SendProgress(kOpenedProgress, 1.0, {model->Name()});
    return Outcome::Ok(Value(model->Info()));
}

Outcome PeerService::Create(const Value& args) {
    Args a(args, kCreateProjectMessage, "(folder path, project name)");
    const std::string folder = a.Text(0, "the folder path");
    const std::string name = a.Text(1, "the project name");
    std::shared_ptr<const ProjectModel> model;
    try {
        const fs::path dir(folder);
        if (!dir.is_absolute()) throw ProjectError("the folder path is not absolute");
        std::error_code ec;
        if (!fs::is_directory(dir, ec)) throw ProjectError("no such folder");
        if (name.empty() || name == "." || name == ".." || name.find('/') != std::string::npos ||
            name.find('\0') != std::string::npos) {
            throw ProjectError("not a usable file name");
        }
        const std::string& extension = mRole.ProjectExtension();
        const bool hasExtension =
            name.size() > extension.size() &&
            EqualsIgnoringCase(name.substr(name.size() - extension.size()), extension);
        const fs::path file = dir / (hasExtension ? name : name + extension);
        const std::string documentName = hasExtension ? name.substr(0, name.size() - extension.size()) : name;
        WriteNewFile(file, ProjectModel::EmptyDocument(documentName));
        TL_TRACE(kCat, 3) << "Created " << file.string();
        model = std::make_shared<const ProjectModel>(ProjectModel::Load(ProjectKey(file.string())));
    } catch (const ProjectError& e) {
        return Outcome::Error("Cannot create project " + name + " in " + folder + ": " + e.what());
    }
    return Opened(std::move(model));
}

Outcome PeerService::GetOpen(const Value& args) {
    Args a(args, kGetOpenProjectMessage, "(Farland production request)");
    if (a.Size() > 0 && !a.At(0).is_null()) {
        const auto request = a.Record<FarlandProductionRequestInfo>(0, "the Farland production request");
        if (!request.IsEmpty()) {
            return Outcome::Error("Cannot get the open project: this peer serves no Farland productions");
        }
    }
    std::shared_ptr<const ProjectModel> model;
    {
        std::lock_guard lock(mMutex);
        if (!mOpenOrder.empty()) model = mOpen.at(mOpenOrder.back());
    }
    if (!model) return Outcome::Error("No project is open");
    return Outcome::Ok(Value(model->Info()));
}

Outcome PeerService::Close(const Value& args) {
    Args a(args, kCloseProjectMessage, "(project path)");
    const std::string path = a.Text(0, "the project path");
    fs::path key;
    try {
        key = ProjectKey(path);
    } catch (const ProjectError& e) {
        return Outcome::Error("Cannot close project " + path + ": " + e.what());
    }
    std::vector<StatusRegistration> told;
    {
        std::lock_guard lock(mMutex);
        if (mOpen.erase(key) == 0) return Outcome::Error("Project " + path + " is not open");
        mOpenOrder.erase(std::remove(mOpenOrder.begin(), mOpenOrder.end(), key), mOpenOrder.end());
        for (const auto& r : mStatus) {
            if (!r.farland && r.project == key) told.push_back(r);
        }
    }
    TL_TRACE(kCat, 3) << "Closed " << key.string() << "; telling " << told.size() << " registrations";
    SendStatusGone(told);
    return Outcome::Ok(true);
}

Outcome PeerService::RegisterProgress(const Value& args, bool add) {
    Args a(args, add ? kRegisterProgressMessage : kUnRegisterProgressMessage, "(progress id, endpoint)");
    const std::string id = a.Text(0, "the progress id");
    if (id.empty()) a.Bad("argument 1 (the progress id) is empty");
    const ServerConnection endpoint = a.Endpoint(1);
    std::lock_guard lock(mMutex);
    std::erase_if(mProgress, [&](const ProgressRegistration& r) { return r.id == id && SameEndpoint(r.endpoint, endpoint); });
    if (add) {
        if (mProgress.size() >= kMaxRegistrations) return Outcome::Error("Too many progress registrations");
        mProgress.push_back({id, endpoint});
    }
    return Outcome::Ok(true);
}

Outcome PeerService::RegisterStatus(const Value& args, bool add, bool farland) {
    const std::string message = farland ? (add ? kRegisterFarlandStatusMessage : kUnRegisterFarlandStatusMessage)
                                        : (add ? kRegisterStatusMessage : kUnRegisterStatusMessage);
    Args a(args, message, farland ? "(notification id, endpoint, Farland asset)" : "(notification id, endpoint, project path)");
    StatusRegistration r;
    r.id = a.Text(0, "the notification id");
    if (r.id.empty()) a.Bad("argument 1 (the notification id) is empty");
    r.endpoint = a.Endpoint(1);
    r.farland = farland;
    if (farland) {
        r.asset = a.Record<FarlandAssetInfo>(2, "the Farland asset");
    } else {
        const std::string path = a.Text(2, "the project path");
        try {
            r.project = ProjectKey(path);
        } catch (const ProjectError& e) {
            a.Bad("argument 3 (the project path): " + std::string(e.what()));
        }
    }
    std::lock_guard lock(mMutex);
    std::erase_if(mStatus, [&](const StatusRegistration& s) {
        return s.farland == farland && s.id == r.id && SameEndpoint(s.endpoint, r.endpoint);
    });
    if (add) {
        if (mStatus.size() >= kMaxRegistrations) return Outcome::Error("Too many status registrations");
        mStatus.push_back(std::move(r));
    }
    return Outcome::Ok(true);
}

void PeerService::SendProgress(const std::string& message, double fraction, const std::vector<std::string>& args) {
    std::vector<ProgressRegistration> to;
    {
        std::lock_guard lock(mMutex);
        to = mProgress;
    }
    if (!mSink) return;
    Value list = Value::array();
    for (const auto& s : args) list.push_back(s);
    for (const auto& r : to) {
        mSink->Send(r.endpoint, BuildCall(r.id, Value::array({message, fraction, list})));
    }
}

void PeerService::SendStatusGone(const std::vector<StatusRegistration>& to) {
    if (!mSink) return;
    for (const auto& r : to) mSink->Send(r.endpoint, BuildCall(r.id, Value::array({kStatusGone})));
}

void PeerService::ForgetEndpoint(const ServerConnection& endpoint) {
    size_t dropped = 0;
    {
        std::lock_guard lock(mMutex);
        dropped += std::erase_if(mProgress, [&](const ProgressRegistration& r) { return SameEndpoint(r.endpoint, endpoint); });
        dropped += std::erase_if(mStatus, [&](const StatusRegistration& r) { return SameEndpoint(r.endpoint, endpoint); });
    }
    if (dropped > 0) {
        TL_TRACE(kCat, 3) << "Dropped " << dropped << " registrations of the unreachable endpoint " << Describe(endpoint);
    }
}

void PeerService::Shutdown(int flushTimeoutMs) {
    if (mStopping.exchange(true)) return;
    mQueue->WaitUntilIdle();
    std::vector<StatusRegistration> all;
    {
        std::lock_guard lock(mMutex);
        all = mStatus;
    }
    TL_TRACE(kCat, 3) << "Shutting down; telling " << all.size() << " status registrations";
    SendStatusGone(all);
    if (mSink) {
        if (!mSink->Flush(flushTimeoutMs)) TL_TRACE(kCat, 1) << "Not every host confirmed the last notifications";
        mSink->Close();
    }
}

std::shared_ptr<const ProjectModel> PeerService::OpenProject(const std::string& path) const {
    {
        std::lock_guard lock(mMutex);
        if (auto it = mOpen.find(fs::path(path)); it != mOpen.end()) return it->second;
    }
    const fs::path key = ProjectKey(path);
    std::lock_guard lock(mMutex);
    auto it = mOpen.find(key);
    return it == mOpen.end() ? nullptr : it->second;
}

std::shared_ptr<const ProjectModel> PeerService::MostRecentProject() const {
    std::lock_guard lock(mMutex);
    return mOpenOrder.empty() ? nullptr : mOpen.at(mOpenOrder.back());
}

bool PeerService::ReplaceOpenProject(const std::shared_ptr<const ProjectModel>& current,
                                     std::shared_ptr<const ProjectModel> replacement) {
    if (!current || !replacement || current->File() != replacement->File()) return false;
    std::lock_guard lock(mMutex);
    auto it = mOpen.find(current->File());
    if (it == mOpen.end() || it->second != current) return false;
    it->second = std::move(replacement);
    return true;
}

std::shared_ptr<const ProjectModel> PeerService::FindOpenProject(const fs::path& file) const {
    std::lock_guard lock(mMutex);
    auto it = mOpen.find(file);
    return it == mOpen.end() ? nullptr : it->second;
}

std::vector<fs::path> PeerService::OpenProjectFiles() const {
    std::lock_guard lock(mMutex);
    return mOpenOrder;
}

size_t PeerService::ProgressRegistrationCount() const {
    std::lock_guard lock(mMutex);
    return mProgress.size();
}

size_t PeerService::StatusRegistrationCount() const {
    std::lock_guard lock(mMutex);
    return mStatus.size();
}

}  // namespace tidelink::peer
