// A stand-in peer application for the broker tests: listens, announces itself to the link manager
// with the token it was started with, answers the connect request on its own port, and exits when
// its session to the manager closes.
//   announce_peer [--role ROLE] [--tidelink-named-server NAME [INSTANCE]]
//                 [--announce-after SECONDS]  wait before announcing
//                 [--no-announce]             listen, never announce
//                 [--exit-at-once]            exit with status 1 before doing anything
//                 [--lifetime SECONDS]        leave after this long whatever happens (default 120)
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <memory>
#include <cstdlib>
#include <cstring>
#include <string>

#include "platform/Process.h"
#include "platform/Rpc.h"
#include "platform/Sync.h"
#include "tidelink/core/Brokering.h"
#include "tidelink/core/LinkError.h"
#include "tidelink/core/LinkManager.h"

using namespace tidelink;
using namespace tidelink::platform;

int main(int argc, char** argv) {
    std::string role = "Kestrel";
    std::string instance;
    double announceAfter = 0;
    double lifetime = 120;
    bool announce = true;
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg == "--role" && i + 1 < argc) {
            role = argv[++i];
        } else if (arg == kNamedServerArgument && i + 1 < argc) {
            role = argv[++i];
            if (i + 1 < argc && std::strncmp(argv[i + 1], "--", 2) != 0) instance = argv[++i];
        } else if (arg == "--announce-after" && i + 1 < argc) {
            announceAfter = std::atof(argv[++i]);
        } else if (arg == "--lifetime" && i + 1 < argc) {
            lifetime = std::atof(argv[++i]);
        } else if (arg == "--no-announce") {
            announce = false;
        } else if (arg == "--exit-at-once") {
            return 1;
        } else {
            std::fprintf(stderr, "announce_peer: unknown option '%s'\n", arg.c_str());
            return 2;
        }
    }
    const int lifetimeMs = static_cast<int>(lifetime * 1000);

    auto server = ServerStart(GetSharedTransport(), 0, true);
    if (!server) return 3;
    auto registrar = MessageRegistrar::Create();
    const Value description = {{"servername", role},
                               {"serverapiversion", 1},
                               {"serverappversion", "1.0"},
                               {"sourcetypes", Value::object()},
                               {"supportsremotelinking", false},
                               {"instance", instance},
                               {"pid", GetCurrentProcessID()}};
    const auto describe = std::make_shared<FunctionRequestHandler>(
        [description](const ResponderPtr& r, const Value&) { r->SendGeneralResult(description); });
    registrar->Register("com.quenlo.tidelink.ConnectToServerWithVersion", describe);
    registrar->Register("com.quenlo.tidelink.ConnectToServer", describe);
    RPCServer rpc(server, "AnnouncePeer", registrar);

    // Shared with handlers that may still run while the process exits.
    struct State {
        Gate done;
        std::atomic<int> status{0};
    };
    auto state = std::make_shared<State>();
    if (!announce) {
        state->done.Wait(lifetimeMs);
        return 0;
    }
    if (announceAfter > 0) SleepMilliseconds(static_cast<int>(announceAfter * 1000));

    RPCClientPtr manager;
    try {
        manager = LaunchTidelinkManagerRPC();
    } catch (const LinkError& e) {
        std::fprintf(stderr, "announce_peer: %s\n", e.what());
        return 4;
    }
    manager->GetSession()->AddCloseHandler([state](const SessionPtr&, TransportError) { state->done.Open(); });
    const char* token = std::getenv(kPeerTokenVariable);
    const Value announcement = {{"token", token ? token : ""},
                                {"role", role},
                                {"instance", instance},
                                {"address", server->GetAddress()},
                                {"port", server->GetPort()},
                                {"pid", GetCurrentProcessID()}};
    manager->SendRequest(
        BuildCall(kRegisterPeerServerMessage, Value::array({announcement})), [](const Value&, RequestId) {},
        [state](int32_t code, const WString& message, RequestId) {
            std::fprintf(stderr, "announce_peer: refused (%d): %s\n", code, ToUTF8(message).c_str());
            state->status = 5;
            state->done.Open();
        });
    state->done.Wait(lifetimeMs);
    return state->status;
}
