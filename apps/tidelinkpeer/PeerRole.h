// Which application the reference peer plays, and its command line.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/Serialization.h"

namespace tidelink::peer {

struct PeerRole {
    // What the peer announces as "role": "Kestrel", "Osprey", "Puffin", or the server name of a
    // named server ("Plover").
    std::string announceName;
    // The description answered to the connect requests.
    std::string serverName;
    int64_t apiVersion = 1;
    std::string appVersion = "1.0";
    std::vector<std::pair<std::string, std::string>> sourceTypes;  // name -> extension
    bool supportsRemoteLinking = false;
    // Named servers only: the instance argument they were started with.
    std::string instance;
    bool named = false;

    // The extension of the project files this role opens and creates (".kstproj", ...).
    const std::string& ProjectExtension() const { return sourceTypes.front().second; }
    // {"servername", "serverapiversion", "serverappversion", "sourcetypes", "supportsremotelinking"}
    platform::Value Description() const;
};

// "kestrel", "osprey", "puffin" or "plover" (any case); nullopt for anything else.
std::optional<PeerRole> RoleByName(std::string_view name);
// The role of a named server called |serverName|; only "Plover" is served.
std::optional<PeerRole> NamedServerRole(std::string_view serverName, std::string instance);

struct PeerOptions {
    PeerRole role;
    bool announce = true;
    int traceLevel = 0;       // -1 quiet ... 7 trace
    bool help = false;
    bool version = false;
};

// Parses the arguments after the program name. On failure returns nullopt and sets |error|.
std::optional<PeerOptions> ParsePeerArguments(const std::vector<std::string>& args, std::string& error);

// The usage text.
std::string PeerUsage();

}  // namespace tidelink::peer
