// Link set-up and recovery times with the real link manager and reference peer:
//   warm_open_ms   from KestrelServer::CreateTideLinkServer to an open project, both running
//   cold_open_ms   the same with neither the link manager nor the peer running
//   reconnect_ms   from killing the peer (SIGKILL) to the Connected status report
// Medians over repeated runs. The baseline, measured in the same run, is the cost of starting a
// trivial process and waiting for it (process_start_ms): a cold open starts two processes.
//
//   bench_links [--json] [--runs N]
//
// Without TIDELINK_SUITE_VERSION it runs a private link manager and stops it at the end.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "LinkBench.h"
#include "platform/Config.h"
#include "platform/Process.h"
#include "platform/Rpc.h"
#include "platform/Sync.h"
#include "tidelink/core/LinkManager.h"
#include "tidelink/core/Server.h"
#include "tidelink/peers/PeerServers.h"
#include "tidelink/peers/Project.h"

using namespace tidelink;
using namespace tidelink::platform;
using bench::Await;
using bench::ManagerInfo;

namespace {

const std::string kProject = std::string(TIDELINK_SOURCE_DIR) + "/examples/projects/demo.kstproj";

std::vector<uint32_t> PeerPids() {
    std::vector<uint32_t> pids;
    for (const auto& p : ManagerInfo().value("broker", Value::object()).value("peers", Value::array())) {
        pids.push_back(p.value("pid", 0u));
    }
    return pids;
}

bool WaitGone(uint32_t pid, double seconds) {
    const double end = NowSeconds() + seconds;
    while (NowSeconds() < end) {
        if (!IsProcessAlive(pid)) return true;
        SleepMilliseconds(2);
    }
    return false;
}

// Opens the demo project from scratch; returns the project (null on failure).
ProjectPtr OpenFromScratch() {
    Await<KestrelServerPtr> described;
    KestrelServer::CreateTideLinkServer(described.Callback());
    auto kestrel = described.Get();
    if (!kestrel) return nullptr;
    Await<ServerPtr> linked;
    kestrel->CreateLink(linked.Callback());
    auto server = linked.Get();
    if (!server) return nullptr;
    Await<ProjectPtr> opened;
    server->OpenProject(opened.Callback(), kProject);
    return opened.Get();
}

// Stops the link manager and waits until it and its peers are gone.
void StopEverything() {
    const Value info = ManagerInfo();
    std::vector<uint32_t> pids = PeerPids();
    const uint32_t manager = info.value("pid", 0u);
    if (manager != 0) ::kill(static_cast<pid_t>(manager), SIGTERM);
    if (manager != 0) WaitGone(manager, 10);
    for (auto pid : pids) WaitGone(pid, 10);
}

double Median(std::vector<double> v) {
    if (v.empty()) return NAN;
    std::sort(v.begin(), v.end());
    return v[v.size() / 2];
}

double ProcessStartMs() {
    const double t0 = NowSeconds();
    const pid_t pid = ::fork();
    if (pid == 0) {
        ::execl("/bin/true", "true", static_cast<char*>(nullptr));
        ::_exit(127);
    }
    ::waitpid(pid, nullptr, 0);
    return (NowSeconds() - t0) * 1000;
}

double Round(double v) { return std::round(v * 100) / 100; }

}  // namespace

int main(int argc, char** argv) {
    bool json = false;
    int runs = 9;
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg == "--json") {
            json = true;
        } else if (arg == "--runs" && i + 1 < argc) {
            runs = std::max(1, std::atoi(argv[++i]));
        } else {
            std::fprintf(stderr, "usage: bench_links [--json] [--runs N]\n");
            return 2;
        }
    }
    const bool privateManager = std::getenv("TIDELINK_SUITE_VERSION") == nullptr;
    if (privateManager) {
        const std::string version = "8" + std::to_string(10000 + GetCurrentProcessID() % 90000);
        ::setenv("TIDELINK_SUITE_VERSION", version.c_str(), 1);
    }
    SetClientInfo(u"bench_links", u"1.0");
    int failures = 0;

    std::vector<double> spawn;
    for (int i = 0; i < runs; ++i) spawn.push_back(ProcessStartMs());

    // Cold: neither process runs.
    std::vector<double> cold;
    for (int i = 0; i < runs; ++i) {
        const double t0 = NowSeconds();
        auto project = OpenFromScratch();
        const double t1 = NowSeconds();
        if (project) {
            cold.push_back((t1 - t0) * 1000);
        } else {
            ++failures;
        }
        project.reset();
        if (i + 1 < runs) StopEverything();
    }

    // Warm: both run.
    std::vector<double> warm;
    for (int i = 0; i < runs + 1; ++i) {
        const double t0 = NowSeconds();
        auto project = OpenFromScratch();
        const double t1 = NowSeconds();
        if (!project) {
            ++failures;
            continue;
        }
        if (i > 0) warm.push_back((t1 - t0) * 1000);
    }

    // Reconnection after the peer is killed.
    std::vector<double> reconnect;
    auto project = OpenFromScratch();
    for (int i = 0; project && i < runs; ++i) {
        auto gate = std::make_shared<Gate>();
        auto link = project->GetReconnect();
        const Guid id = link->AddStatusCallback([gate](ConnectionStatus s, const WString&, const File&) {
            if (s != ConnectionStatus::Reconnecting) gate->Open();
        });
        // The link manager forgets the previous peer once its session has closed.
        std::vector<uint32_t> pids;
        for (int tries = 0; tries < 500; ++tries) {
            pids = PeerPids();
            if (pids.size() == 1) break;
            SleepMilliseconds(2);
        }
        if (pids.size() != 1) {
            std::fprintf(stderr, "bench_links: %zu peers instead of one (reconnection %d)\n", pids.size(), i);
            ++failures;
            break;
        }
        const double t0 = NowSeconds();
        ::kill(static_cast<pid_t>(pids[0]), SIGKILL);
        const bool done = gate->Wait(60000);
        const double t1 = NowSeconds();
        link->RemoveStatusCallback(id);
        // The held requests go out just after the Connected report.
        for (int tries = 0; tries < 500 && link->IsReconnecting(); ++tries) SleepMilliseconds(2);
        if (!done || link->IsReconnecting()) {
            std::fprintf(stderr, "bench_links: no reconnection (%s)\n", done ? "still reconnecting" : "timed out");
            ++failures;
            continue;
        }
        reconnect.push_back((t1 - t0) * 1000);
        WaitGone(pids[0], 5);
    }
    project.reset();

    if (privateManager) StopEverything();

    Value out = Value::object();
    out["warm_open_ms"] = Round(Median(warm));
    out["cold_open_ms"] = Round(Median(cold));
    out["reconnect_ms"] = Round(Median(reconnect));
    out["process_start_ms"] = Round(Median(spawn));
    out["cold_vs_process_start"] = Round(Median(cold) / Median(spawn));
    out["warm_vs_process_start"] = Round(Median(warm) / Median(spawn));
    out["runs"] = runs;
    if (json) {
        std::printf("%s\n", ToJSONText(out).c_str());
    } else {
        std::printf("warm open    %8.2f ms (median of %zu)\n", Median(warm), warm.size());
        std::printf("cold open    %8.2f ms (median of %zu; %.1fx a bare process start)\n", Median(cold), cold.size(),
                    Median(cold) / Median(spawn));
        std::printf("reconnect    %8.2f ms (median of %zu)\n", Median(reconnect), reconnect.size());
        std::printf("process start %7.2f ms (baseline: fork, exec and wait of /bin/true)\n", Median(spawn));
    }
    if (failures > 0) std::fprintf(stderr, "bench_links: %d runs failed\n", failures);
    return failures > 0 ? 1 : 0;
}
