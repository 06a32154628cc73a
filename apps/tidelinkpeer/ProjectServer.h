// The reference peer's answers about the items of open projects (docs/peer.md, "Items and
// sources"): containers, sources, created sources and items, the XML form of items, snapshots,
// and the source requests (XML description, runtime GUID, links, metadata, captions).
//
// One object serves every open project of the peer: the message names are registered once.
// Handlers run on transport threads and only queue the work on the peer service's project queue,
// so these requests keep their order with the opening and closing of projects; every request is
// answered exactly once from there. The Farland forms are refused: this peer serves no remote
// productions.
//
// Lifetime: Stop (or the destructor) unregisters every name and waits for handlers that are
// running; queued work holds the object through a shared pointer.
#pragma once

#include <filesystem>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "PeerService.h"
#include "tidelink/peers/ServerProject.h"

namespace tidelink::peer {

using platform::ResponderPtr;

class ProjectServer final : public server::Project, public std::enable_shared_from_this<ProjectServer> {
public:
    // What ShowSource, SendFile and CreateItemsFromXML left behind (also traced at level 3).
    struct Event {
        std::string what;  // "ShowSource", "SendFile", "CreateItemsFromXML"
        std::filesystem::path project;
        std::string detail;  // the source id, the file, or what was added or went wrong
        bool ok = true;
    };

    // Limits of what hosts may leave with the peer.
    static constexpr size_t kMaxMetadataBytes = 1u << 20;
    static constexpr size_t kMaxKeptEntries = 1024;
    static constexpr size_t kMaxEvents = 256;

    // Registers the project messages (through the base class) and the source messages on
    // |registrar| (the process's when null).
    static std::shared_ptr<ProjectServer> Create(std::shared_ptr<PeerService> service,
                                                 platform::MessageRegistrarPtr registrar);
    ~ProjectServer() override;

    // Unregisters everything and waits for running handlers. Idempotent.
    void Stop();

    // The source messages this object registers besides the base class's eleven.
    static const std::vector<std::string>& SourceMessageNames();

    // Handles a source message (also what the registered handlers call); |reply| runs once.
    void HandleSourceMessage(const std::string& name, const platform::Value& args, ReplyFn reply);

    std::vector<Event> Events() const;

    // What the project requests do, run where they are called (the handlers run them on the
    // project queue). Refusals come back as outcomes, never as exceptions.
    Outcome ContainerOf(const File& project, const Guid& containerID);
    Outcome SourceOf(const File& project, const Guid& sourceID);
    Outcome Linked(const File& project, const Guid& sourceID);
    Outcome Snapshot(const File& project, const Guid& sourceID);
    Outcome ItemsAsXml(const File& project, const std::vector<Guid>& ids);
    Outcome NewSource(const File& project, const SourceInfo& info);
    Outcome NewSourceFromXml(const File& project, const std::string& xml, const SourceInfo& info,
                             const FarlandProductionInfo& production);
    Outcome AddItemsFromXml(const std::string& xml);
    Outcome Show(const File& project, const Guid& sourceID);

    // server::Project
    void GetContainer(const ResponderPtr& responder, const File& project, const Guid& containerID) override;
    void GetSource(const ResponderPtr& responder, const File& project, const Guid& sourceID) override;
    void GetFarlandSource(const ResponderPtr& responder, const GenericAssetInfo& asset, const Guid& sourceID) override;
    void CreateSource(const ResponderPtr& responder, const File& project, const SourceInfo& info) override;
    void CreateSourceFromXML(const ResponderPtr& responder, const File& project, const std::string& xml,
                             const SourceInfo& info, const FarlandProductionInfo& production) override;
    void CreateItemsFromXML(const std::string& xml) override;
    void ShowSource(const File& project, const Guid& sourceID) override;
    void SendFile(const File& project, const File& file) override;
    void IsSourceLinked(const ResponderPtr& responder, const File& project, const Guid& sourceID) override;
    void GetItemsAsXML(const ResponderPtr& responder, const File& project, const std::vector<Guid>& ids) override;
    void GetProjectSnapshot(const ResponderPtr& responder, const File& project, const Guid& sourceID) override;

private:
    ProjectServer(std::shared_ptr<PeerService> service, platform::MessageRegistrarPtr registrar);

    // Queues |work| on the project queue and answers |responder| with its outcome.
    void Answer(const char* name, const ResponderPtr& responder, std::function<Outcome()> work);
    static Outcome Guarded(const std::function<Outcome()>& work);
    void Record(Event event);
    // Adds one composition to the open project |file| and answers its SourceInfo. Throws ProjectError.
    Outcome AddComposition(const File& file, const std::string& name, Composition comp);

    Outcome SourceRequest(const std::string& name, const platform::Value& args);

    const std::shared_ptr<PeerService> mService;
    const platform::MessageRegistrarPtr mRegistrar;
    // A GUID of this run of the peer: runtime GUIDs of sources derive from it.
    const Guid mRunId;

    mutable std::mutex mMutex;  // guards what follows
    bool mStopped = false;
    std::map<std::filesystem::path, std::string> mMetadata;  // SetXMP, per project file
    std::map<std::pair<std::filesystem::path, Guid>, platform::Value> mCaptionSelections;
    std::vector<Event> mEvents;
};

}  // namespace tidelink::peer
