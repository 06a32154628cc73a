// Processes: launching detached programs, finding processes by executable name.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>
#include <vector>

#include "platform/Export.h"

namespace tidelink::platform {

// Executable names carry no suffix on this platform; a "shortcut" to a program is a symbolic link
// under the program's own name.
inline constexpr const char* kExecutableSuffix = "";
inline constexpr const char* kShortcutSuffix = "";

// Full path of the running executable.
TIDELINK_EXPORT std::string GetCurrentExecutablePath();
// Folder of the loaded module (the shared library, or the executable it is linked into).
TIDELINK_EXPORT std::string GetCurrentModuleDir();

// Starts |path| with |args| in a new session, detached: standard input and output go to
// /dev/null, standard error too unless TIDELINK_MANAGER_LOG names a file to append to (the launched
// servers trace there). No descriptor of the caller is inherited. The child is reaped by a
// dedicated waiter so no zombie remains. Returns the child's pid, or -1 (errno set).
TIDELINK_EXPORT pid_t LaunchProcess(const std::string& path, const std::vector<std::string>& args);

// Process ids (ascending) of the processes of this user whose executable file name is |name|.
TIDELINK_EXPORT std::vector<uint32_t> GetProcessIDsForName(const std::string& name);

TIDELINK_EXPORT uint32_t GetCurrentProcessID();
TIDELINK_EXPORT bool IsProcessAlive(uint32_t pid);

// High-precision monotonic clock, in seconds.
TIDELINK_EXPORT double NowSeconds();
// One processor pause instruction (spin-wait hint).
TIDELINK_EXPORT void CpuPause();
TIDELINK_EXPORT void SleepMilliseconds(int ms);

}  // namespace tidelink::platform
