#include "ProjectServer.h"

#include <boost/uuid/name_generator_sha1.hpp>
#include <boost/uuid/uuid.hpp>

#include "Arguments.h"
#include "ItemsXml.h"
#include "SourceDescription.h"
#include "platform/Trace.h"
#include "tidelink/peers/Source.h"

namespace tidelink::peer {

using namespace platform;
namespace fs = std::filesystem;

namespace {

constexpr const char* kCat = "TideLinkPeer";
constexpr const char* kNoFarland = "This peer serves no Farland productions";

std::string Message(const char* name) { return std::string(kMessagePrefix) + name; }

const std::string kGetXMLDescription = Message("GetXMLDescription");
const std::string kGetRuntimeGuid = Message("GetRuntimeGuid");
const std::string kDoesSourceContainLink = Message("DoesSourceContainLink");
const std::string kRenderXMP = Message("RenderXMP");
const std::string kSetXMP = Message("SetXMP");
const std::string kGetCaptionData = Message("GetCaptionData");
const std::string kSetCaptionSelectionData = Message("SetCaptionSelectionData");

class SourceHandler final : public MessageHandler {
public:
    SourceHandler(std::weak_ptr<ProjectServer> server, std::string name)
        : mServer(std::move(server)), mName(std::move(name)) {}

    void HandleRequest(const ResponderPtr& responder, const Value& args) override {
        auto server = mServer.lock();
        if (!server) return responder->SendError(kPeerError, u"The peer is shutting down");
        server->HandleSourceMessage(mName, args, [responder](Outcome o) {
            if (o.ok) {
                responder->SendGeneralResult(o.value);
            } else {
                responder->SendError(o.code, o.message);
            }
        });
    }

    void HandleNotification(const Value& args) override {
        if (auto server = mServer.lock()) server->HandleSourceMessage(mName, args, nullptr);
    }

private:
    std::weak_ptr<ProjectServer> mServer;
    std::string mName;
};

// The open project |file| names; throws ProjectError with the sentence for the host.
std::shared_ptr<const ProjectModel> OpenProjectOrThrow(PeerService& service, const std::string& file) {
    std::shared_ptr<const ProjectModel> model;
    try {
        model = service.OpenProject(file);
    } catch (const ProjectError& e) {
        throw ProjectError("Project " + file + ": " + e.what());
    }
    if (!model) throw ProjectError("Project " + file + " is not open");
    return model;
}

const Item& ItemOrThrow(const ProjectModel& model, const Guid& id) {
    const Item* item = model.Find(id);
    if (!item) throw ProjectError("The project " + model.File().string() + " has no item " + id.ToString());
    return *item;
}

const Item& SourceOrThrow(const ProjectModel& model, const Guid& id) {
    const Item& item = ItemOrThrow(model, id);
    if (item.type == ItemType::Bin) throw ProjectError("\"" + item.path + "\" is a bin, not a source");
    return item;
}

Guid NameBasedGuid(const Guid& space, const std::string& name) {
    boost::uuids::uuid ns;
    std::copy(space.Bytes().begin(), space.Bytes().end(), ns.begin());
    const boost::uuids::uuid u = boost::uuids::name_generator_sha1(ns)(name.data(), name.size());
    std::array<uint8_t, 16> bytes;
    std::copy(u.begin(), u.end(), bytes.begin());
    return Guid(bytes);
}

std::string Shorten(const std::string& s) { return s.size() <= 200 ? s : s.substr(0, 200) + "..."; }

}  // namespace

std::shared_ptr<ProjectServer> ProjectServer::Create(std::shared_ptr<PeerService> service,
                                                     MessageRegistrarPtr registrar) {
    if (!registrar) registrar = MessageRegistrar::Instance();
    std::shared_ptr<ProjectServer> server(new ProjectServer(std::move(service), registrar));
    for (const auto& name : SourceMessageNames()) {
        registrar->Register(name, std::make_shared<SourceHandler>(server, name));
    }
    return server;
}

ProjectServer::ProjectServer(std::shared_ptr<PeerService> service, MessageRegistrarPtr registrar)
    : server::Project(registrar), mService(std::move(service)), mRegistrar(std::move(registrar)), mRunId(Guid::New()) {}

ProjectServer::~ProjectServer() { Stop(); }

void ProjectServer::Stop() {
    StopServing();
    {
        std::lock_guard lock(mMutex);
        if (mStopped) return;
        mStopped = true;
    }
    for (const auto& name : SourceMessageNames()) mRegistrar->UnRegister(name);
}

const std::vector<std::string>& ProjectServer::SourceMessageNames() {
    static const std::vector<std::string> names = {
        kGetXMLDescription,        kGetRuntimeGuid,
        kDoesSourceContainLink,    kRenderXMP,
        kSetXMP,                   kGetCaptionData,
        kSetCaptionSelectionData,  Message("farland.GetXMLDescription"),
        Message("farland.GetRuntimeGuid"), Message("farland.DoesSourceContainLink"),
        Message("farland.RenderXMP"), Message("farland.SetXMP")};
    return names;
}

std::vector<ProjectServer::Event> ProjectServer::Events() const {
    std::lock_guard lock(mMutex);
    return mEvents;
}

void ProjectServer::Record(Event event) {
    TL_TRACE(kCat, event.ok ? 3 : 1) << event.what << " (" << event.project.string() << "): " << event.detail;
    std::lock_guard lock(mMutex);
    if (mEvents.size() >= kMaxEvents) mEvents.erase(mEvents.begin());
    mEvents.push_back(std::move(event));
}

Outcome ProjectServer::Guarded(const std::function<Outcome()>& work) {
    try {
        return work();
    } catch (const ProjectError& e) {
        return Outcome::Error(e.what());
    } catch (const ItemsXmlError& e) {
        return Outcome::Error(e.what());
    }
}

void ProjectServer::Answer(const char* name, const ResponderPtr& responder, std::function<Outcome()> work) {
    auto self = weak_from_this().lock();
    if (!self) return responder->SendError(kPeerError, u"The peer is shutting down");
    // |work| holds the object through |self|.
    mService->Queue(Message(name), [self, work = std::move(work)] { return work(); },
                    [responder](Outcome o) {
                        if (o.ok) {
                            responder->SendGeneralResult(o.value);
                        } else {
                            responder->SendError(o.code, o.message);
                        }
                    });
}

// ---- the requests, as they run on the project queue ----

Outcome ProjectServer::ContainerOf(const File& project, const Guid& containerID) {
    return Guarded([&] {
        const auto model = OpenProjectOrThrow(*mService, project.string());
        const Item& item = ItemOrThrow(*model, containerID);
        if (item.type != ItemType::Bin) throw ProjectError("\"" + item.path + "\" is not a bin");
        Value reply = Value::object();
        reply["iteminfo"] = Value(model->InfoOf(item));
        reply["containeditems"] = Value(model->ChildrenOf(item));
        return Outcome::Ok(std::move(reply));
    });
}

Outcome ProjectServer::SourceOf(const File& project, const Guid& sourceID) {
    return Guarded([&] {
        const auto model = OpenProjectOrThrow(*mService, project.string());
        return Outcome::Ok(Value(DescribeSource(*model, SourceOrThrow(*model, sourceID), mService->Role().serverName)));
    });
}

Outcome ProjectServer::Linked(const File& project, const Guid& sourceID) {
    return Guarded([&] {
        const auto model = OpenProjectOrThrow(*mService, project.string());
        const Item* item = model->Find(sourceID);
        return Outcome::Ok(item != nullptr && item->type != ItemType::Bin);
    });
}

Outcome ProjectServer::Snapshot(const File& project, const Guid& sourceID) {
    return Guarded([&] {
        const auto model = OpenProjectOrThrow(*mService, project.string());
        Value reply = Value::object();
        reply["project"] = Value(model->Info());
        reply["source"] = Value(DescribeSource(*model, SourceOrThrow(*model, sourceID), mService->Role().serverName));
        return Outcome::Ok(std::move(reply));
    });
}

Outcome ProjectServer::ItemsAsXml(const File& project, const std::vector<Guid>& ids) {
    return Guarded([&] {
        const auto model = OpenProjectOrThrow(*mService, project.string());
        std::vector<const Item*> items;
        for (const Guid& id : ids) {
            const Item& item = ItemOrThrow(*model, id);
            if (&item == &model->Root()) {
                for (size_t child : item.children) items.push_back(&model->Items()[child]);
            } else {
                items.push_back(&item);
            }
        }
        if (ids.empty()) {
            for (size_t child : model->Root().children) items.push_back(&model->Items()[child]);
        }
        return Outcome::Ok(WriteItemsXml(*model, items));
    });
}

Outcome ProjectServer::AddComposition(const File& file, const std::string& name, Composition comp) {
    const auto model = OpenProjectOrThrow(*mService, file.string());
    std::vector<Guid> added;
    NewItem item{ItemType::Composition, name.empty() ? std::string("Composition") : name, std::nullopt, std::move(comp),
                 "", {}};
    auto grown = std::make_shared<const ProjectModel>(model->WithItems(Guid(), {std::move(item)}, &added));
    if (!mService->ReplaceOpenProject(model, grown)) {
        throw ProjectError("Project " + file.string() + " changed while the source was made; try again");
    }
    const Item& created = *grown->Find(added.front());
    TL_TRACE(kCat, 3) << "Created \"" << created.path << "\" (" << created.id.ToString() << ") in "
                      << grown->File().string();
    return Outcome::Ok(Value(DescribeSource(*grown, created, mService->Role().serverName)));
}

Outcome ProjectServer::NewSource(const File& project, const SourceInfo& info) {
    return Guarded([&] {
        if (!info.mFarlandProductionRequestInfo.IsEmpty()) throw ProjectError(kNoFarland);
        Composition comp;
        try {
            comp = CompositionFromSourceInfo(info);
        } catch (const ProjectError& e) {
            throw ProjectError(std::string("Cannot create the source: ") + e.what());
        }
        return AddComposition(project, ToUTF8(info.mName), std::move(comp));
    });
}

Outcome ProjectServer::NewSourceFromXml(const File& project, const std::string& xml, const SourceInfo& info,
                                        const FarlandProductionInfo& production) {
    return Guarded([&] {
        if (!production.IsEmpty() || !info.mFarlandProductionRequestInfo.IsEmpty()) throw ProjectError(kNoFarland);
        // The XML's composition (in our dialect) over the requested format; XML that holds none
        // (another application's) leaves the source as CreateSource makes it.
        std::string name = ToUTF8(info.mName);
        Composition comp;
        try {
            const Composition requested = CompositionFromSourceInfo(info, false);
            const auto described = ReadCompositionXml(xml, requested, &name);
            comp = described ? *described : CompositionFromSourceInfo(info);
            ValidateComposition(comp);
        } catch (const ProjectError& e) {
            throw ProjectError(std::string("Cannot create the source: ") + e.what());
        } catch (const ItemsXmlError& e) {
            throw ProjectError(std::string("Cannot create the source: ") + e.what());
        }
        return AddComposition(project, name, std::move(comp));
    });
}

Outcome ProjectServer::AddItemsFromXml(const std::string& xml) {
    Event event{"CreateItemsFromXML", {}, {}, false};
    try {
        ItemsDocument doc = ReadItemsXml(xml);
        const auto model = doc.project.empty() ? mService->MostRecentProject() : OpenProjectOrThrow(*mService, doc.project);
        if (!model) throw ProjectError("No project is open");
        event.project = model->File();
        Guid parent;
        if (!doc.parent.empty()) {
            const auto id = Guid::Parse(std::string_view(doc.parent));
            const Item* bin = id ? model->Find(*id) : model->FindByPath(doc.parent);
            if (!bin) throw ProjectError("the project has no bin \"" + doc.parent + "\"");
            parent = bin->id;
        }
        const size_t count = doc.items.size();
        auto grown = std::make_shared<const ProjectModel>(model->WithItems(parent, std::move(doc.items)));
        if (!mService->ReplaceOpenProject(model, grown)) throw ProjectError("the project changed meanwhile");
        event.ok = true;
        event.detail = "added " + std::to_string(count) + " items";
    } catch (const std::exception& e) {
        event.detail = std::string("nothing added: ") + e.what();
    }
    Record(event);
    return event.ok ? Outcome::Ok(true) : Outcome::Error(event.detail);
}

Outcome ProjectServer::Show(const File& project, const Guid& sourceID) {
    std::string detail = sourceID.ToString();
    bool ok = false;
    try {
        const auto model = OpenProjectOrThrow(*mService, project.string());
        const Item& item = ItemOrThrow(*model, sourceID);
        detail += " \"" + item.path + "\"";
        ok = true;
    } catch (const ProjectError& e) {
        detail += std::string(" (") + e.what() + ")";
    }
    Record(Event{"ShowSource", project, detail, ok});
    return ok ? Outcome::Ok(true) : Outcome::Error(detail);
}

// ---- server::Project: queued, answered from the project queue ----

void ProjectServer::GetContainer(const ResponderPtr& responder, const File& project, const Guid& containerID) {
    Answer("GetContainer", responder, [this, project, containerID] { return ContainerOf(project, containerID); });
}

void ProjectServer::GetSource(const ResponderPtr& responder, const File& project, const Guid& sourceID) {
    Answer("GetSource", responder, [this, project, sourceID] { return SourceOf(project, sourceID); });
}

void ProjectServer::GetFarlandSource(const ResponderPtr& responder, const GenericAssetInfo&, const Guid&) {
    responder->SendError(kPeerError, ToUTF16(kNoFarland));
}

void ProjectServer::IsSourceLinked(const ResponderPtr& responder, const File& project, const Guid& sourceID) {
    Answer("IsSourceLinked", responder, [this, project, sourceID] { return Linked(project, sourceID); });
}

void ProjectServer::GetProjectSnapshot(const ResponderPtr& responder, const File& project, const Guid& sourceID) {
    Answer("GetProjectSnapshot", responder, [this, project, sourceID] { return Snapshot(project, sourceID); });
}

void ProjectServer::GetItemsAsXML(const ResponderPtr& responder, const File& project, const std::vector<Guid>& ids) {
    Answer("GetItemsAsXML", responder, [this, project, ids] { return ItemsAsXml(project, ids); });
}

void ProjectServer::CreateSource(const ResponderPtr& responder, const File& project, const SourceInfo& info) {
    Answer("CreateSource", responder, [this, project, info] { return NewSource(project, info); });
}

void ProjectServer::CreateSourceFromXML(const ResponderPtr& responder, const File& project, const std::string& xml,
                                        const SourceInfo& info, const FarlandProductionInfo& production) {
    Answer("CreateSourceFromXML", responder,
           [this, project, xml, info, production] { return NewSourceFromXml(project, xml, info, production); });
}

void ProjectServer::CreateItemsFromXML(const std::string& xml) {
    auto self = weak_from_this().lock();
    if (self) mService->Queue(Message("CreateItemsFromXML"), [self, xml] { return self->AddItemsFromXml(xml); }, nullptr);
}

void ProjectServer::ShowSource(const File& project, const Guid& sourceID) {
    // Looking the project up may touch the file system: not on the transport thread.
    auto self = weak_from_this().lock();
    if (self) mService->Queue(Message("ShowSource"), [self, project, sourceID] { return self->Show(project, sourceID); }, nullptr);
}

void ProjectServer::SendFile(const File& project, const File& file) {
    Record(Event{"SendFile", project, Shorten(file.string()), true});
}

// ---- source requests ----

void ProjectServer::HandleSourceMessage(const std::string& name, const Value& args, ReplyFn reply) {
    if (name.rfind(Message("farland."), 0) == 0) {
        if (reply) reply(Outcome::Error(kNoFarland));
        return;
    }
    auto self = weak_from_this().lock();
    if (!self) {
        if (reply) reply(Outcome::Error("The peer is shutting down"));
        return;
    }
    mService->Queue(name,
                    [self, name, args]() -> Outcome {
                        try {
                            return self->SourceRequest(name, args);
                        } catch (const ProjectError& e) {
                            return Outcome::Error(e.what());
                        }
                    },
                    std::move(reply));
}

Outcome ProjectServer::SourceRequest(const std::string& name, const Value& args) {
    if (name == kSetXMP) {
        Args a(args, name, "(project path, metadata packet)");
        const std::string path = a.Text(0, "the project path");
        std::string packet = a.Text(1, "the metadata packet");
        if (packet.size() > kMaxMetadataBytes) a.Bad("the metadata packet is larger than 1 MiB");
        const auto model = OpenProjectOrThrow(*mService, path);
        std::lock_guard lock(mMutex);
        if (mMetadata.size() >= kMaxKeptEntries && !mMetadata.count(model->File())) mMetadata.erase(mMetadata.begin());
        mMetadata[model->File()] = std::move(packet);
        return Outcome::Ok(true);
    }
    if (name == kRenderXMP) {
        Args a(args, name, "(project path, source id, start time, end time)");
        const auto model = OpenProjectOrThrow(*mService, a.Text(0, "the project path"));
        const Item& item = SourceOrThrow(*model, a.Id(1, "the source id"));
        const RatioTime start = a.Time(2, "the start time");
        const RatioTime end = a.Time(3, "the end time");
        if (end < start) a.Bad("the end time is before the start time");
        {
            std::lock_guard lock(mMutex);
            if (auto it = mMetadata.find(model->File()); it != mMetadata.end()) return Outcome::Ok(it->second);
        }
        return Outcome::Ok(MetadataPacket(*model, item, start, end));
    }
    if (name == kSetCaptionSelectionData) {
        Args a(args, name, "(project path, source id, caption selection)");
        const auto model = OpenProjectOrThrow(*mService, a.Text(0, "the project path"));
        const Item& item = SourceOrThrow(*model, a.Id(1, "the source id"));
        const auto selection = a.Record<CaptionSelectionData>(2, "the caption selection");
        std::lock_guard lock(mMutex);
        const auto key = std::make_pair(model->File(), item.id);
        if (mCaptionSelections.size() >= kMaxKeptEntries && !mCaptionSelections.count(key)) {
            mCaptionSelections.erase(mCaptionSelections.begin());
        }
        mCaptionSelections[key] = Value(selection);
        return Outcome::Ok(true);
    }
    Args a(args, name, "(project path, source id)");
    const auto model = OpenProjectOrThrow(*mService, a.Text(0, "the project path"));
    const Item& item = SourceOrThrow(*model, a.Id(1, "the source id"));
    if (name == kGetXMLDescription) return Outcome::Ok(WriteItemsXml(*model, {&item}));
    if (name == kGetRuntimeGuid) {
        return Outcome::Ok(Value(NameBasedGuid(mRunId, model->File().string() + "\n" + item.id.ToString())));
    }
    if (name == kDoesSourceContainLink) return Outcome::Ok(false);  // compositions never hold links
    if (name == kGetCaptionData) {
        CaptionData data;
        data.mVersion = 1;
        return Outcome::Ok(Value(data));
    }
    return Outcome::Error("The peer does not answer \"" + name + "\"");
}

}  // namespace tidelink::peer
