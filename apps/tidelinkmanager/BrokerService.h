// The link manager's broker: finds the installed peer applications by their manifests, answers the
// connect requests of hosts with their descriptions, starts one process per application (or per
// named server and instance) on demand and answers link requests with its address once it has
// announced itself. See docs/brokering.md for the rules.
//
// Threading: the handlers only count a request and post it to the broker's own thread, which owns
// the tables and a steady timer that watches the starts; nothing blocks a transport thread.
// Answers are sent outside the lock. After OnStop returns no task of the broker runs again.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "ManagerService.h"
#include "platform/Serialization.h"

namespace tidelink::manager {

struct BrokerServiceOptions {
    // Folders searched for manifests, in order; the first manifest of a role wins.
    std::vector<std::string> manifestFolders;
    // Relative executables of manifests are taken from this folder (the manager's own).
    std::string executableFolder;
    // Seconds a started peer has to announce itself.
    double startTimeoutSeconds = 20.0;
};

// The folders of TIDELINK_PEERS_PATH (colon-separated), then <exe folder>/../share/tidelink/peers
// and <exe folder>/../../share/tidelink/peers; the start limit from TIDELINK_PEER_START_TIMEOUT.
BrokerServiceOptions BrokerServiceOptionsFromEnvironment();

class BrokerService final : public ManagerModule {
public:
    explicit BrokerService(BrokerServiceOptions options);
    ~BrokerService() override;

    void Register(ManagerService& service) override;
    // A peer's registering session closing means the peer is gone.
    void OnSessionClosed(const platform::SessionPtr& session) override;
    // "broker": {"peers", "starts", "requests", "last"}.
    void AddInfo(platform::Value& info) override;
    // Fails waiting requests, closes the peers' sessions and sends SIGTERM to the processes the
    // broker started and that still run.
    void OnStop() override;

    struct Impl;

private:
    std::shared_ptr<Impl> mImpl;
};

}  // namespace tidelink::manager
