#include "tidelink/peers/ServerProject.h"

#include "platform/Trace.h"
#include "platform/Transport.h"

namespace tidelink::server {

using namespace platform;

// Lets handlers reach the object only while it serves.
struct Project::Gate {
    std::shared_mutex mutex;
    Project* project = nullptr;
    MessageRegistrarPtr registrar;
};

namespace {

constexpr const char* kPrefix = "com.quenlo.tidelink.";

std::string Name(const char* operation) { return std::string(kPrefix) + operation; }

File ReadFile(const Value& v) { return File(v.get<std::string>()); }

const Value& Arg(const Value& args, size_t i) {
    if (!args.is_array() || i >= args.size()) throw std::out_of_range("missing argument " + std::to_string(i + 1));
    return args[i];
}

// Handles a message as a request or as a notification, whichever way it arrives.
class Handler final : public MessageHandler {
public:
    using RequestFn = std::function<void(Project&, const ResponderPtr&, const Value&)>;
    using NotifyFn = std::function<void(Project&, const Value&)>;

    Handler(std::shared_ptr<void> gate, std::shared_mutex& mutex, Project*& project, std::string name,
            RequestFn request, NotifyFn notify)
        : mKeep(std::move(gate)), mMutex(mutex), mProject(project), mName(std::move(name)),
          mRequest(std::move(request)), mNotify(std::move(notify)) {}

    void HandleRequest(const ResponderPtr& responder, const Value& args) override {
        std::shared_lock lock(mMutex);
        if (!mProject) return responder->SendError(kErrorRequestRefused, u"The project is closing");
        try {
            if (mRequest) {
                mRequest(*mProject, responder, args);
            } else {
                mNotify(*mProject, args);
                responder->SendGeneralResult(true);
            }
        } catch (const std::exception& e) {
            if (!responder->Answered()) {
                responder->SendError(kErrorRequestRefused, ToUTF16("Bad arguments for " + mName + ": " + e.what()));
            }
        }
    }

    void HandleNotification(const Value& args) override {
        std::shared_lock lock(mMutex);
        if (!mProject) return;
        try {
            if (mNotify) {
                mNotify(*mProject, args);
            } else {
                // A request sent as a notification: nobody waits for the answer.
                mRequest(*mProject, std::make_shared<Responder>(std::weak_ptr<Session>(), 0, mName), args);
            }
        } catch (const std::exception& e) {
            TL_TRACE("tidelink", 2) << "Bad arguments for " << mName << ": " << e.what();
        }
    }

private:
    std::shared_ptr<void> mKeep;
    std::shared_mutex& mMutex;
    Project*& mProject;
    std::string mName;
    RequestFn mRequest;
    NotifyFn mNotify;
};

}  // namespace

const std::vector<std::string>& Project::MessageNames() {
    static const std::vector<std::string> names = {
        Name("GetContainer"),     Name("GetSource"),          Name("GetFarlandSource"), Name("CreateSource"),
        Name("CreateSourceFromXML"), Name("CreateItemsFromXML"), Name("ShowSource"),    Name("SendFile"),
        Name("IsSourceLinked"),   Name("GetItemsAsXML"),      Name("GetProjectSnapshot")};
    return names;
}

Project::Project() : Project(nullptr) {}

Project::Project(MessageRegistrarPtr registrar) : mGate(std::make_shared<Gate>()) {
    mGate->project = this;
    if (!registrar) registrar = MessageRegistrar::Instance();
    mGate->registrar = registrar;
    auto add = [&](const char* op, Handler::RequestFn request, Handler::NotifyFn notify) {
        registrar->Register(Name(op), std::make_shared<Handler>(mGate, mGate->mutex, mGate->project, Name(op),
                                                                std::move(request), std::move(notify)));
    };
    add("GetContainer", [](Project& p, const ResponderPtr& r, const Value& a) {
        p.GetContainer(r, ReadFile(Arg(a, 0)), Arg(a, 1).get<Guid>());
    }, nullptr);
    add("GetSource", [](Project& p, const ResponderPtr& r, const Value& a) {
        p.GetSource(r, ReadFile(Arg(a, 0)), Arg(a, 1).get<Guid>());
    }, nullptr);
    add("GetFarlandSource", [](Project& p, const ResponderPtr& r, const Value& a) {
        p.GetFarlandSource(r, Arg(a, 0).get<GenericAssetInfo>(), Arg(a, 1).get<Guid>());
    }, nullptr);
    add("CreateSource", [](Project& p, const ResponderPtr& r, const Value& a) {
        p.CreateSource(r, ReadFile(Arg(a, 0)), Arg(a, 1).get<SourceInfo>());
    }, nullptr);
    add("CreateSourceFromXML", [](Project& p, const ResponderPtr& r, const Value& a) {
        p.CreateSourceFromXML(r, ReadFile(Arg(a, 0)), Arg(a, 1).get<std::string>(), Arg(a, 2).get<SourceInfo>(),
                              Arg(a, 3).get<FarlandProductionInfo>());
    }, nullptr);
    add("CreateItemsFromXML", nullptr, [](Project& p, const Value& a) { p.CreateItemsFromXML(Arg(a, 0).get<std::string>()); });
    add("ShowSource", nullptr, [](Project& p, const Value& a) { p.ShowSource(ReadFile(Arg(a, 0)), Arg(a, 1).get<Guid>()); });
    add("SendFile", nullptr, [](Project& p, const Value& a) { p.SendFile(ReadFile(Arg(a, 0)), ReadFile(Arg(a, 1))); });
    add("IsSourceLinked", [](Project& p, const ResponderPtr& r, const Value& a) {
        p.IsSourceLinked(r, ReadFile(Arg(a, 0)), Arg(a, 1).get<Guid>());
    }, nullptr);
    add("GetItemsAsXML", [](Project& p, const ResponderPtr& r, const Value& a) {
        p.GetItemsAsXML(r, ReadFile(Arg(a, 0)), Arg(a, 1).get<std::vector<Guid>>());
    }, nullptr);
    add("GetProjectSnapshot", [](Project& p, const ResponderPtr& r, const Value& a) {
        p.GetProjectSnapshot(r, ReadFile(Arg(a, 0)), Arg(a, 1).get<Guid>());
    }, nullptr);
}

Project::~Project() { StopServing(); }

void Project::StopServing() {
    {
        std::unique_lock lock(mGate->mutex);
        if (!mGate->project) return;
        mGate->project = nullptr;
    }
    for (const auto& name : MessageNames()) mGate->registrar->UnRegister(name);
}

void Project::CreateItemsFromXML(const std::string&) {}

void Project::GetItemsAsXML(const ResponderPtr& responder, const File&, const std::vector<Guid>&) {
    responder->SendError(-1, u"Unimplemented.");
}

void Project::GetProjectSnapshot(const ResponderPtr& responder, const File&, const Guid&) {
    responder->SendError(-1, u"unimplemented");
}

}  // namespace tidelink::server
