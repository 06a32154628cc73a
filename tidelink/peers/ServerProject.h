// The peer's side of the project requests: a peer application derives from server::Project and
// answers the requests hosts send through tidelink::Project.
//
// Constructing the object registers one handler per message with the process's message
// registrar (or with the registrar given, for a peer that answers through a registrar of its
// own); each handler reads the arguments and calls the matching virtual operation. Requests
// whose arguments do not fit are refused with -10004 and a message naming the request. Request
// operations answer through the responder, from any thread, once.
//
// A deriving class must call StopServing() first thing in its destructor, so that no handler
// reaches a half-destroyed object; StopServing waits for handlers that are running.
#pragma once

#include <memory>
#include <shared_mutex>
#include <string>
#include <vector>

#include "platform/Export.h"
#include "platform/Guid.h"
#include "platform/Rpc.h"
#include "tidelink/peers/LinkRecords.h"
#include "tidelink/peers/ProjectProtocol.h"

namespace tidelink::server {

using platform::ResponderPtr;

class TIDELINK_EXPORT Project {
public:
    Project();
    // Registers on |registrar| instead of the process's (null: the process's).
    explicit Project(platform::MessageRegistrarPtr registrar);
    virtual ~Project();
    Project(const Project&) = delete;
    Project& operator=(const Project&) = delete;

    virtual void GetContainer(const ResponderPtr& responder, const File& project, const Guid& containerID) = 0;
    virtual void GetSource(const ResponderPtr& responder, const File& project, const Guid& sourceID) = 0;
    virtual void GetFarlandSource(const ResponderPtr& responder, const GenericAssetInfo& asset,
                                  const Guid& sourceID) = 0;
    virtual void CreateSource(const ResponderPtr& responder, const File& project, const SourceInfo& info) = 0;
    virtual void CreateSourceFromXML(const ResponderPtr& responder, const File& project, const std::string& xml,
                                     const SourceInfo& info, const FarlandProductionInfo& production) = 0;
    // Does nothing unless overridden.
    virtual void CreateItemsFromXML(const std::string& xml);
    virtual void ShowSource(const File& project, const Guid& sourceID) = 0;
    virtual void SendFile(const File& project, const File& file) = 0;
    virtual void IsSourceLinked(const ResponderPtr& responder, const File& project, const Guid& sourceID) = 0;
    // Answer -1 "Unimplemented." unless overridden.
    virtual void GetItemsAsXML(const ResponderPtr& responder, const File& project, const std::vector<Guid>& ids);
    // Answers -1 "unimplemented" unless overridden.
    virtual void GetProjectSnapshot(const ResponderPtr& responder, const File& project, const Guid& sourceID);

    // The names this object answers.
    static const std::vector<std::string>& MessageNames();

protected:
    // Unregisters every handler and waits for those running. Idempotent.
    void StopServing();

private:
    struct Gate;
    std::shared_ptr<Gate> mGate;
};

}  // namespace tidelink::server
