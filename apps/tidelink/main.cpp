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
#include "Commands.h"
#include "Host.h"
#include "tidelink/core/LinkManager.h"
#include "tidelink/peers/Project.h"

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

int RunOpen(const std::string& file, bool json, bool verbose) {
    try {
        cli::OpenOptions options;
        options.verbose = verbose;
        ProjectPtr project = cli::OpenProjectFile(file, options);
        projectprotocol::ProjectInfo info;
        info.mName = project->GetName();
        info.mFile = project->GetFile();
        info.mMissingAssets = project->GetMissingAssets();
        info.mFarlandProductionInfo = project->GetFarlandProductionRequestInfo().GetProductionInfo();
        if (json) {
            std::cout << platform::ToJSONText(Value(info), 4) << "\n";
            return 0;
        }
        std::cout << platform::ToUTF8(info.mName) << "\n  file: " << info.mFile.string() << "\n";
        const auto& missing = info.mMissingAssets;
        if (missing.IsEmpty()) std::cout << "  missing assets: none\n";
        for (const auto& f : missing.mMissingFootage) std::cout << "  missing footage: " << platform::ToUTF8(f.mPath) << "\n";
        for (const auto& f : missing.mMissingFonts) std::cout << "  missing font: " << f.mFullName << "\n";
        for (const auto& p : missing.mMissingPlugins) std::cout << "  missing plug-in: " << p.mMatchName << "\n";
        return 0;
    } catch (const cli::HostError& e) {
        PrintError(json ? "json" : "default", kExitFailure, e.message);
        return kExitFailure;
    }
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

    auto* open = app.add_subcommand("open", "Open a project in the application that serves it and describe it");
    std::string projectFile;
    open->add_option("project", projectFile, "Project file (.kstproj, .ospproj or .pufproj)")->required();
    bool openJson = false;
    open->add_flag("--json", openJson, "Print the project description as JSON");

    bool itemsJson = false, describeJson = false;
    auto* items = app.add_subcommand("items", "List the bins and items of a project");
    items->add_option("project", projectFile, "Project file")->required();
    items->add_flag("--json", itemsJson, "Print the items as JSON");

    std::string itemName;
    auto* describe = app.add_subcommand("describe", "Describe an item of a project as a source");
    describe->add_option("project", projectFile, "Project file")->required();
    describe->add_option("item", itemName, "Item name, path (Bin/Item) or id")->required();
    describe->add_flag("--json", describeJson, "Print the source description as JSON");

    cli::RenderArgs renderArgs;
    std::string frames, timeText, size;
    bool sessions = false, noSessions = false;
    auto* render = app.add_subcommand("render", "Render frames of an item to PNG files");
    render->add_option("project", renderArgs.project, "Project file")->required();
    render->add_option("item", renderArgs.item, "Item name, path (Bin/Item) or id")->required();
    auto* framesOpt = render->add_option("--frames", frames, "Frame numbers A-B (or one number)");
    auto* timeOpt = render->add_option("--time", timeText, "One frame at this time in seconds (1.5 or 1001/1000)");
    framesOpt->excludes(timeOpt);
    render->add_option("--size", size, "Output size WxH (default: the composition's)");
    render->add_flag("--sessions", sessions, "Render through a rendering session");
    render->add_flag("--no-sessions", noSessions, "Render without a rendering session")->excludes("--sessions");
    render->add_option("-o,--output", renderArgs.output, "Output files, e.g. out/frame_%05d.png")->required();
    render->add_option("-j,--jobs", renderArgs.depth, "Frames in flight (default 4)")->check(CLI::Range(1, 64));
    render->add_option("--png-compression", renderArgs.compression, "zlib level 0-9 (default 1)")
        ->check(CLI::Range(0, 9));

    cli::AudioArgs audioArgs;
    std::string startText = "0", durationText;
    std::string sampleFormat = "f32";
    auto* audio = app.add_subcommand("audio", "Render the audio of an item to a WAV file");
    audio->add_option("project", audioArgs.project, "Project file")->required();
    audio->add_option("item", audioArgs.item, "Item name, path (Bin/Item) or id")->required();
    audio->add_option("--start", startText, "Start time in seconds (default 0)");
    audio->add_option("--duration", durationText, "Duration in seconds")->required();
    audio->add_option("-o,--output", audioArgs.output, "Output WAV file")->required();
    audio->add_option("--sample-format", sampleFormat, "f32 (default) or s16")->check(CLI::IsMember({"f32", "s16"}));
    audio->add_option("--chunk", audioArgs.samplesPerChunk, "Samples per chunk (default 4800)")
        ->check(CLI::Range(1u, 1u << 20));

    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        const int rc = app.exit(e);
        return rc == 0 ? 0 : kExitUsage;
    }
    if (json) format = "json";
    const int level = LevelForName(loglevel);
    if (std::getenv("TIDELINK_TRACE") == nullptr) {
        platform::SetTraceSelection(level < 0 ? "*:-1" : "*:" + std::to_string(level));
    }
    cli::SetTraceLevel(level);
    platform::SetClientInfo(u"tidelink", platform::ToUTF16(TIDELINK_VERSION_STRING));

    if (status->parsed()) return RunStatus(format);
    if (open->parsed()) return RunOpen(projectFile, openJson, level >= 3);
    try {
        if (items->parsed()) return cli::RunItems(projectFile, itemsJson);
        if (describe->parsed()) return cli::RunDescribe(projectFile, itemName, describeJson);
        if (render->parsed()) {
            if (!frames.empty()) {
                const auto dash = frames.find('-', 1);
                try {
                    renderArgs.first = std::stoll(frames.substr(0, dash));
                    renderArgs.last = dash == std::string::npos ? renderArgs.first : std::stoll(frames.substr(dash + 1));
                } catch (const std::exception&) {
                    std::cerr << "tidelink: --frames takes A-B, e.g. 0-99\n";
                    return kExitUsage;
                }
                if (renderArgs.first < 0 || renderArgs.last < renderArgs.first) {
                    std::cerr << "tidelink: --frames A-B needs 0 <= A <= B\n";
                    return kExitUsage;
                }
            } else if (!timeText.empty()) {
                renderArgs.time = cli::ParseSeconds(timeText);
                if (!renderArgs.time) {
                    std::cerr << "tidelink: --time takes seconds, e.g. 1.5 or 1001/1000\n";
                    return kExitUsage;
                }
            } else {
                std::cerr << "tidelink: render needs --frames A-B or --time T\n";
                return kExitUsage;
            }
            if (!size.empty()) {
                const auto x = size.find('x');
                try {
                    renderArgs.width = std::stoi(size.substr(0, x));
                    renderArgs.height = x == std::string::npos ? 0 : std::stoi(size.substr(x + 1));
                } catch (const std::exception&) {
                    renderArgs.width = 0;
                }
                if (renderArgs.width <= 0 || renderArgs.height <= 0 || renderArgs.width > 16384 || renderArgs.height > 16384) {
                    std::cerr << "tidelink: --size takes WxH, e.g. 640x360\n";
                    return kExitUsage;
                }
            }
            if (sessions) renderArgs.sessions = true;
            if (noSessions) renderArgs.sessions = false;
            return cli::RunRender(renderArgs);
        }
        if (audio->parsed()) {
            const auto start = cli::ParseSeconds(startText);
            const auto duration = cli::ParseSeconds(durationText);
            if (!start || !duration || *start < 0 || *duration <= 0) {
                std::cerr << "tidelink: --start and --duration take seconds, e.g. 0 and 2.5\n";
                return kExitUsage;
            }
            audioArgs.start = *start;
            audioArgs.duration = *duration;
            audioArgs.format = sampleFormat == "s16" ? cli::WavWriter::Format::Int16 : cli::WavWriter::Format::Float32;
            return cli::RunAudio(audioArgs);
        }
    } catch (const cli::HostError& e) {
        std::cerr << "tidelink: " << e.message << "\n";
        return kExitFailure;
    }
    return kExitUsage;
}
