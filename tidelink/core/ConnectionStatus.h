// The outcome every completion and status callback of the library receives first, and the
// identity a host presents to peers.
#pragma once

#include <cstdint>

#include "platform/Export.h"
#include "platform/Serialization.h"
#include "platform/Strings.h"

namespace tidelink {

using platform::WString;

enum class ConnectionStatus : int32_t {
    // The operation succeeded; in a status callback: the link was re-established.
    Connected = 0,
    // The operation failed; in a status callback: the link is lost for good.
    Failed = 1,
    // Status callbacks only: the peer went away and the link is being re-established; a
    // callback with Connected or Failed follows.
    Reconnecting = 2,
};

TIDELINK_EXPORT const char* Describe(ConnectionStatus status);

// Who is asking: the host's client name and version and the library's protocol version. Sent as
// {"name", "appVersion", "protoVersion"} in versioned connect requests.
struct TIDELINK_EXPORT ClientIdentity {
    WString mName;
    WString mAppVersion;
    WString mProtoVersion;

    // This process's identity (platform configuration and protocol version).
    static ClientIdentity Current();
};

TIDELINK_EXPORT void to_json(platform::Value& j, const ClientIdentity& r);
TIDELINK_EXPORT void from_json(const platform::Value& j, ClientIdentity& r);

}  // namespace tidelink
