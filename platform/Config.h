// Process configuration: who the host is, which suite it belongs to, and the debug database.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Export.h"
#include "platform/Strings.h"

namespace tidelink::platform {

struct SuiteVersionInfo {
    int32_t major = 0;
    int32_t minor = 0;
    int32_t patch = 0;
};

// The suite version this build belongs to. TIDELINK_SUITE_VERSION ("MAJOR[.MINOR[.PATCH]]")
// overrides it, so that tests and developers run link managers isolated from each other.
// Read once per process.
TIDELINK_EXPORT SuiteVersionInfo GetSuiteVersionInfo();
// Beta builds announce themselves with "(Beta)" in their port and key names. TIDELINK_BETA=1
// (or true/yes) sets the flag; read once per process.
TIDELINK_EXPORT bool IsBetaPrime();

// The host's identity as sent to peers. Defaults: the executable's file name and "0.0".
TIDELINK_EXPORT void SetClientInfo(const WString& name, const WString& version);
TIDELINK_EXPORT WString GetClientName();
TIDELINK_EXPORT WString GetClientVersion();

// Debug database: an entry comes from the environment variable of the same name, otherwise from
// the file named by TIDELINK_DEBUG_FILE, otherwise from $XDG_CONFIG_HOME/tidelink/debug.conf
// (default ~/.config/tidelink/debug.conf). The file holds "Name=value" lines; '#' starts a
// comment. The file is read on every lookup so edits apply without a restart.
TIDELINK_EXPORT std::optional<std::string> GetDebugEntry(std::string_view name);
TIDELINK_EXPORT int64_t GetDebugEntryInt(std::string_view name, int64_t defaultValue);

// Per-user folder for the session secret and the link manager's lock files: TIDELINK_RUNTIME_DIR,
// else $XDG_RUNTIME_DIR/tidelink, else /tmp/tidelink-<uid>. Created with mode 0700 on first use;
// refused (empty result) when it exists but belongs to another user or is open to others.
TIDELINK_EXPORT std::string GetRuntimeDir();

// Localised text. |keyed| is "$$$/key=Default text"; the result is the default text with "@0".."@9"
// replaced by the arguments. Text without the "$$$/" form passes through unchanged.
TIDELINK_EXPORT WString Localize(std::string_view keyed);
TIDELINK_EXPORT WString Localize(std::string_view keyed, const WString& arg0);
TIDELINK_EXPORT WString Localize(std::string_view keyed, std::initializer_list<WString> args);

}  // namespace tidelink::platform
