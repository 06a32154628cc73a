// tidelinkmanager: the per-user link manager daemon.
#include <signal.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>

#include "BrokerService.h"
#include "BufferService.h"
#include "ManagerService.h"
#include "platform/Trace.h"
#include "tidelink/core/LinkManager.h"

namespace {

void Usage(FILE* out) {
    std::fprintf(out,
                 "Usage: tidelinkmanager [--idle-exit SECONDS] [--version]\n"
                 "  --idle-exit SECONDS  exit after SECONDS without clients (default 300, 0 = never;\n"
                 "                       TIDELINK_MANAGER_IDLE_EXIT sets the default)\n"
                 "  --buffer-client-cap BYTES  bytes one client may hold allocated and unpublished\n"
                 "                       (default 1 GiB; TIDELINK_BUFFER_CLIENT_CAP sets the default)\n"
                 "Peer applications are found through their manifests: TIDELINK_PEERS_PATH, then\n"
                 "../share/tidelink/peers and ../../share/tidelink/peers beside this program.\n"
                 "Normally started by the tidelink library when a host needs it.\n");
}

}  // namespace

int main(int argc, char** argv) {
    using namespace tidelink;
    manager::ManagerOptions options;
    manager::BufferServiceOptions bufferOptions = manager::BufferServiceOptionsFromEnvironment();
    if (const char* env = std::getenv("TIDELINK_MANAGER_IDLE_EXIT")) options.idleExitSeconds = std::atof(env);
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg == "--idle-exit" && i + 1 < argc) {
            char* end = nullptr;
            options.idleExitSeconds = std::strtod(argv[++i], &end);
            if (*end != '\0' || options.idleExitSeconds < 0) {
                std::fprintf(stderr, "tidelinkmanager: bad --idle-exit value '%s'\n", argv[i]);
                return 2;
            }
        } else if (arg == "--buffer-client-cap" && i + 1 < argc) {
            char* end = nullptr;
            bufferOptions.clientCapBytes = std::strtoull(argv[++i], &end, 10);
            if (*end != '\0') {
                std::fprintf(stderr, "tidelinkmanager: bad --buffer-client-cap value '%s'\n", argv[i]);
                return 2;
            }
        } else if (arg == "--debug-publish-port" && i + 1 < argc) {
            // Test seam: publish a chosen value instead of the port, without the instance lock.
            options.publishedPortOverride = static_cast<uint32_t>(std::strtoul(argv[++i], nullptr, 0));
            options.singleInstance = false;
        } else if (arg == "--version") {
            std::printf("tidelinkmanager version %s (protocol %s)\n", TIDELINK_VERSION_STRING,
                        CSVersionPortNumberString().c_str());
            return 0;
        } else if (arg == "--help" || arg == "-h") {
            Usage(stdout);
            return 0;
        } else {
            std::fprintf(stderr, "tidelinkmanager: unknown option '%s'\n", arg.c_str());
            Usage(stderr);
            return 2;
        }
    }

    // Signals are taken synchronously by this thread; block them before any thread starts.
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGINT);
    sigaddset(&signals, SIGTERM);
    sigaddset(&signals, SIGHUP);
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);
    signal(SIGPIPE, SIG_IGN);

    auto service = std::make_shared<manager::ManagerService>(options);
    service->AddModule(manager::CreateCoreModule());
    service->AddModule(std::make_shared<manager::BufferService>(bufferOptions));
    service->AddModule(std::make_shared<manager::BrokerService>(manager::BrokerServiceOptionsFromEnvironment()));
    std::string error;
    switch (service->Start(error)) {
        case manager::StartResult::AlreadyRunning:
            TL_TRACE("TideLinkManager", 3) << "Not starting: " << error;
            return 0;
        case manager::StartResult::Failed:
            TL_TRACE("TideLinkManager", 0) << "Cannot start: " << error;
            return 1;
        case manager::StartResult::Started:
            break;
    }

    std::thread signalWaiter([&] {
        int sig = 0;
        sigwait(&signals, &sig);
        if (sig != 0) TL_TRACE("TideLinkManager", 3) << "Stopping on signal " << sig;
        service->RequestStop();
    });
    service->WaitForExit();
    service->Stop();
    // Wake the signal waiter if we ended by idling.
    pthread_kill(signalWaiter.native_handle(), SIGTERM);
    signalWaiter.join();
    return 0;
}
