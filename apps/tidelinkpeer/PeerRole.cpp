#include "PeerRole.h"

#include <algorithm>
#include <cctype>

#include "tidelink/core/Brokering.h"

namespace tidelink::peer {

namespace {

std::string Lower(std::string_view s) {
    std::string out(s);
    std::transform(out.begin(), out.end(), out.begin(), [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return out;
}

PeerRole MakeRole(std::string name, int64_t api, std::string typeName, std::string extension) {
    PeerRole r;
    r.announceName = name;
    r.serverName = std::move(name);
    r.apiVersion = api;
    r.sourceTypes = {{std::move(typeName), std::move(extension)}};
    return r;
}

// "quiet" ... "trace" as trace levels, as the command-line host reads them.
std::optional<int> LevelForName(const std::string& name) {
    static const std::pair<const char*, int> levels[] = {
        {"quiet", -1}, {"panic", 0}, {"fatal", 0}, {"error", 0}, {"warning", 1},
        {"info", 3},   {"verbose", 5}, {"debug", 6}, {"trace", 7}};
    for (const auto& [n, level] : levels) {
        if (name == n) return level;
    }
    return std::nullopt;
}

}  // namespace

platform::Value PeerRole::Description() const {
    platform::Value types = platform::Value::object();
    for (const auto& [name, extension] : sourceTypes) types[name] = extension;
    platform::Value d = platform::Value::object();
    d["servername"] = serverName;
    d["serverapiversion"] = apiVersion;
    d["serverappversion"] = appVersion;
    d["sourcetypes"] = std::move(types);
    d["supportsremotelinking"] = supportsRemoteLinking;
    return d;
}

std::optional<PeerRole> RoleByName(std::string_view name) {
    const std::string n = Lower(name);
    if (n == "kestrel") return MakeRole("Kestrel", 1, "Kestrel Project", ".kstproj");
    if (n == "osprey") return MakeRole("Osprey", 1, "Osprey Project", ".ospproj");
    if (n == "puffin") return MakeRole("Puffin", 10, "Puffin Project", ".pufproj");
    if (n == "plover") {
        PeerRole r = MakeRole("Plover", 1, "Plover Catalog", ".plvcat");
        r.named = true;
        return r;
    }
    return std::nullopt;
}

std::optional<PeerRole> NamedServerRole(std::string_view serverName, std::string instance) {
    if (serverName != "Plover") return std::nullopt;
    auto role = RoleByName("plover");
    role->instance = std::move(instance);
    return role;
}

std::optional<PeerOptions> ParsePeerArguments(const std::vector<std::string>& args, std::string& error) {
    PeerOptions options;
    bool haveRole = false;
    for (size_t i = 0; i < args.size(); ++i) {
        const std::string& arg = args[i];
        if (arg == "--role") {
            if (i + 1 >= args.size()) {
                error = "--role needs a value (kestrel, osprey, puffin or plover)";
                return std::nullopt;
            }
            auto role = RoleByName(args[++i]);
            if (!role) {
                error = "unknown role '" + args[i] + "' (kestrel, osprey, puffin or plover)";
                return std::nullopt;
            }
            options.role = *role;
            haveRole = true;
        } else if (arg == kNamedServerArgument) {
            // <name> [<instance>]: the instance is the next argument unless it is an option.
            if (i + 1 >= args.size()) {
                error = std::string(kNamedServerArgument) + " needs a server name";
                return std::nullopt;
            }
            const std::string name = args[++i];
            std::string instance;
            if (i + 1 < args.size() && args[i + 1].rfind("-", 0) != 0) instance = args[++i];
            auto role = NamedServerRole(name, instance);
            if (!role) {
                error = "this program serves no named server '" + name + "' (only Plover)";
                return std::nullopt;
            }
            options.role = *role;
            haveRole = true;
        } else if (arg == "--no-announce") {
            options.announce = false;
        } else if (arg == "-v" || arg == "--loglevel") {
            if (i + 1 >= args.size()) {
                error = arg + " needs a level (quiet, error, warning, info, verbose, debug or trace)";
                return std::nullopt;
            }
            auto level = LevelForName(args[++i]);
            if (!level) {
                error = "unknown log level '" + args[i] + "'";
                return std::nullopt;
            }
            options.traceLevel = *level;
        } else if (arg == "--help" || arg == "-h") {
            options.help = true;
            return options;
        } else if (arg == "--version") {
            options.version = true;
            return options;
        } else {
            error = "unknown argument '" + arg + "'";
            return std::nullopt;
        }
    }
    if (!haveRole) {
        error = "give --role kestrel|osprey|puffin|plover or --tidelink-named-server Plover";
        return std::nullopt;
    }
    return options;
}

std::string PeerUsage() {
    return "Usage: tidelinkpeer --role kestrel|osprey|puffin|plover [--no-announce] [-v LEVEL]\n"
           "       tidelinkpeer --tidelink-named-server Plover [INSTANCE] [-v LEVEL]\n"
           "  --role ROLE        the application to play\n"
           "  --no-announce      listen, but never announce to the link manager (tests)\n"
           "  -v, --loglevel L   quiet, error, warning, info, verbose, debug or trace\n"
           "                     (TIDELINK_TRACE overrides it)\n"
           "TIDELINK_RENDER_THREADS sets the threads that draw frames (default: cores + 2).\n"
           "Normally started by the link manager. Prints \"listening on ADDRESS:PORT\" once it serves.\n";
}

}  // namespace tidelink::peer
