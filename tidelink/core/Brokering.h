// What the link manager's broker and the peer applications agree on: the address record of a
// running peer, and the messages a peer process uses to announce itself (see docs/brokering.md).
#pragma once

#include <cstdint>
#include <string>

#include "platform/Export.h"
#include "platform/Serialization.h"

namespace tidelink {

// Where a peer listens: {"address": UTF-8 string, "port": integer}. A port of 0 means that no
// server could be reached.
struct TIDELINK_EXPORT ServerConnection {
    std::string mAddress;
    uint16_t mPort = 0;

    friend bool operator==(const ServerConnection& a, const ServerConnection& b) {
        return a.mAddress == b.mAddress && a.mPort == b.mPort;
    }
};

TIDELINK_EXPORT void to_json(platform::Value& j, const ServerConnection& r);
TIDELINK_EXPORT void from_json(const platform::Value& j, ServerConnection& r);

// Request a peer process sends to the link manager once it listens, on a session it keeps open
// for its whole life (its closing tells the manager that the peer is gone). One argument:
// {"token": the value of kPeerTokenVariable it was started with (empty when started by hand),
//  "role": "Kestrel", "Osprey", "Puffin" or the name of a named server,
//  "instance": the instance argument of a named server (empty otherwise),
//  "address", "port": where it listens, "pid": its process id}.
// Reply {"value": true}.
inline constexpr const char* kRegisterPeerServerMessage = "com.quenlo.tidelink.RegisterPeerServer";

// Environment variable the link manager sets for every process it starts.
inline constexpr const char* kPeerTokenVariable = "TIDELINK_PEER_TOKEN";
// First argument the link manager passes to a named server it starts, followed by the server
// name and, when not empty, the instance argument.
inline constexpr const char* kNamedServerArgument = "--tidelink-named-server";

}  // namespace tidelink
