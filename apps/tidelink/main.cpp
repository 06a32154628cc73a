// tidelink: the command-line host. Data goes to stdout, messages and progress to stderr.
// Exit codes: 0 success, 1 runtime failure, 2 usage error.
#include <CLI/CLI.hpp>
#include <cstdio>
#include <iostream>
#include <string>

#include "platform/Config.h"
#include "platform/Rpc.h"
#include "platform/Sync.h"
#include "platform/Trace.h"
#include "tidelink/core/LinkManager.h"

namespace {

using namespace tidelink;
using platform::Value;

constexpr int kExitFailure = 1;
constexpr int kExitUsage = 2;
constexpr int kRequestTimeoutMs = 30000;

int LevelForName(const std::string& name) {
    static const char* names[] = {"quiet", "panic", "fatal", "error", "warning", "info", "verbose", "debug", "trace"};
    static const int levels[] = {-1, 0, 0, 0, 1, 3, 5, 6, 7};
    for (size_t i = 0; i < std::size(names); ++i) {
        if (name == names[i]) return levels[i];
    }
    return -2;
}

void PrintError(const std::string& format, int code, const std::string& message) {
    if (format == "json") {
        Value err = {{"error", {{"code", code}, {"string", message}}}};
        std::cout << platform::ToJSONText(err, 4) << "\n";
    }
    std::cerr << "tidelink: " << message << "\n";
}

// Sends one request to the link manager and waits for its answer.
bool AskManager(const platform::RPCClientPtr& client, const std::string& name, Value& reply,
                std::string& error) {
    auto gate = std::make_shared<platform::Gate>();
    auto result = std::make_shared<std::pair<bool, Value>>();
    auto message = std::make_shared<std::string>();
    client->SendRequest(
        platform::BuildCall(name),
        [gate, result](const Value& r, platform::RequestId) {
            *result = {true, r};
            gate->Open();
        },
        [gate, message](int32_t code, const platform::WString& m, platform::RequestId) {
            *message = platform::ToUTF8(m) + " (" + std::to_string(code) + ")";
            gate->Open();
        });
    if (!gate->Wait(kRequestTimeoutMs)) {
        error = "The link manager did not answer";
        return false;
    }
    if (!result->first) {
        error = *message;
        return false;
    }
    reply = result->second;
    return true;
}

int RunStatus(const std::string& format) {
    Value info;
    try {
        auto client = LaunchTidelinkManagerRPC();
        std::string error;
        if (!AskManager(client, kManagerInfoMessage, info, error)) {
            PrintError(format, kExitFailure, error);
            return kExitFailure;
        }
    } catch (const LinkError& e) {
        PrintError(format, kExitFailure, e.what());
        return kExitFailure;
    }
    const Value v = info.value("value", Value::object());
    const std::string version = v.value("protocol_version", platform::ToUTF8(GetTideLinkProtocolVersion()));
    const auto port = v.value("port", 0u);
    const auto pid = v.value("pid", 0u);
    const Value b = v.value("buffers", Value::object());
    const std::pair<const char*, uint64_t> buffers[] = {
        {"buffers_live", b.value("buffers_live", uint64_t{0})},
        {"bytes_live", b.value("bytes_live", uint64_t{0})},
        {"bytes_pooled", b.value("bytes_pooled", uint64_t{0})},
        {"clients", b.value("clients", uint64_t{0})}};
    // The broker: its full record in JSON, the number of peers and starts elsewhere.
    const Value broker = v.value("broker", Value::object());
    const std::pair<const char*, uint64_t> brokerFigures[] = {
        {"peers", broker.value("peers", Value::array()).size()}, {"starts", broker.value("starts", uint64_t{0})}};
    if (format == "json") {
        Value out = Value::object();
        out["protocol_version"] = version;
        out["port"] = port;
        out["manager_pid"] = pid;
        Value section = Value::object();
        for (const auto& [key, value] : buffers) section[key] = value;
        out["buffers"] = section;
        out["broker"] = broker;
        std::cout << platform::ToJSONText(out, 4) << "\n";
    } else if (format == "compact") {
        std::cout << "status|protocol_version=" << version << "|port=" << port << "|manager_pid=" << pid << "\n";
        std::cout << "buffers";
        for (const auto& [key, value] : buffers) std::cout << "|" << key << "=" << value;
        std::cout << "\nbroker";
        for (const auto& [key, value] : brokerFigures) std::cout << "|" << key << "=" << value;
        std::cout << "\n";
    } else if (format == "flat") {
        std::cout << "status.protocol_version=\"" << version << "\"\nstatus.port=" << port
                  << "\nstatus.manager_pid=" << pid << "\n";
        for (const auto& [key, value] : buffers) std::cout << "status.buffers." << key << "=" << value << "\n";
        for (const auto& [key, value] : brokerFigures) std::cout << "status.broker." << key << "=" << value << "\n";
    } else {
        std::cout << "protocol_version=" << version << "\nport=" << port << "\nmanager_pid=" << pid << "\n";
        for (const auto& [key, value] : buffers) std::cout << "buffers." << key << "=" << value << "\n";
        for (const auto& [key, value] : brokerFigures) std::cout << "broker." << key << "=" << value << "\n";
    }
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    CLI::App app{"tidelink: use the compositions of linked media applications live"};
    app.require_subcommand(1);
    app.set_version_flag("--version", std::string("tidelink version ") + TIDELINK_VERSION_STRING +
                                          "\nprotocol " + CSVersionPortNumberString() + "\n");
    std::string loglevel = "error";
    app.add_option("-v,--loglevel", loglevel,
                   "quiet, panic, fatal, error, warning, info, verbose, debug or trace")
        ->check(CLI::IsMember({"quiet", "panic", "fatal", "error", "warning", "info", "verbose", "debug", "trace"}));
    std::string format = "default";

    auto* status = app.add_subcommand("status", "Reach the link manager (starting it if needed) and describe it");
    status->add_option("--of,--print-format", format, "default, compact, flat or json")
        ->check(CLI::IsMember({"default", "compact", "flat", "json"}));
    bool json = false;
    status->add_flag("--json", json, "Shorthand for --of json");

    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        const int rc = app.exit(e);
        return rc == 0 ? 0 : kExitUsage;
    }
    if (json) format = "json";
    if (std::getenv("TIDELINK_TRACE") == nullptr) {
        const int level = LevelForName(loglevel);
        platform::SetTraceSelection(level < 0 ? "*:-1" : "*:" + std::to_string(level));
    }
    platform::SetClientInfo(u"tidelink", platform::ToUTF16(TIDELINK_VERSION_STRING));

    if (status->parsed()) return RunStatus(format);
    return kExitUsage;
}
