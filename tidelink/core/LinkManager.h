// Finding, launching and reaching the link manager, and the process-wide transport objects every
// link is built on.
//
// The shared objects are held weakly here: each lives while some caller holds it, and the next
// request after the last holder let go creates a new one. Lock order: the manager lock, then the
// shared-objects lock. LaunchTidelinkManager holds the manager lock while it polls (up to 60 s);
// other callers wait and then get the session it found.
#pragma once

#include <cstdint>
#include <string>
#include <tuple>

#include "platform/Export.h"
#include "platform/Rpc.h"
#include "platform/Strings.h"
#include "platform/Transport.h"
#include "tidelink/core/LinkError.h"

namespace tidelink {

using platform::WString;

// Executable name of the link manager, without the platform's executable suffix.
inline constexpr const char* kTideLinkManagerName = "tidelinkmanager";
// Seconds LaunchTidelinkManager keeps trying.
inline constexpr double kManagerHuntSeconds = 60.0;

TIDELINK_EXPORT WString GetTideLinkProtocolVersion();
TIDELINK_EXPORT std::tuple<int32_t, int32_t, int32_t> GetTideLinkVersionInfo();
// The protocol version as UTF-8, followed by "(Beta)" in beta builds.
TIDELINK_EXPORT std::string CSVersionPortNumberString();
TIDELINK_EXPORT std::string GetTideLinkManagerPortFileName(uint32_t processId);
TIDELINK_EXPORT std::string GetKeyFileName();
TIDELINK_EXPORT std::string GetAddressForTideLinkManager();
// Finds or launches the link manager; returns its port. Throws LinkError.
TIDELINK_EXPORT uint16_t GetPortForTideLinkManager();

// Locates a suite executable: a symbolic link of that name in the package folder is followed;
// otherwise the package folder, the application folder, then |folder| (when not empty) are
// searched. Throws LinkError "Cannot find TideLink Server" when none has it. |feature| and
// |version| are not used.
TIDELINK_EXPORT WString GetSharedServerPath(const WString& name, const WString& feature,
                                            const WString& version, const WString& folder);
TIDELINK_EXPORT void SetTideLinkManagerFolderPath(const WString& folder);

// The port published by the link manager process |processId| (0 when none can be read).
TIDELINK_EXPORT uint16_t ReadManagerPort(uint32_t processId);

TIDELINK_EXPORT platform::SessionPtr LaunchTidelinkManager(const platform::SocketTransportPtr& transport);
TIDELINK_EXPORT platform::RPCClientPtr LaunchTidelinkManagerRPC();

TIDELINK_EXPORT platform::ExecutorPtr GetSharedExecutor();
TIDELINK_EXPORT platform::SocketTransportPtr GetSharedTransport();
TIDELINK_EXPORT platform::ListeningServerPtr GetSharedServer();
TIDELINK_EXPORT platform::RPCServerPtr GetSharedRPCServer();

// Probe message: answered by every link manager; its success tells that the manager is serving.
inline constexpr const char* kManagerProbeMessage = "com.quenlo.processcoordination.CancelPollForAvailableData";
// Status query of the link manager: {"value": {"pid", "port", "protocol_version", "sessions",
// "uptime_s"}}.
inline constexpr const char* kManagerInfoMessage = "com.quenlo.tidelink.GetLinkManagerInfo";

}  // namespace tidelink
