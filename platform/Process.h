// Processes: launching detached programs, finding processes by executable name.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
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
// The same, with |extraEnvironment| ("NAME=value" entries) added to the inherited environment;
// an entry replaces an inherited variable of the same name. An entry without '=' or with an empty
// name fails with EINVAL.
TIDELINK_EXPORT pid_t LaunchProcess(const std::string& path, const std::vector<std::string>& args,
                                    const std::vector<std::string>& extraEnvironment);

// Empty when |path| names a regular file (symbolic links followed) that this user may execute;
// otherwise why not, in the system's words ("No such file or directory", "Permission denied", ...).
TIDELINK_EXPORT std::string CheckExecutable(const std::string& path);

// Process ids (ascending) of the processes of this user whose executable file name is |name|.
TIDELINK_EXPORT std::vector<uint32_t> GetProcessIDsForName(const std::string& name);

TIDELINK_EXPORT uint32_t GetCurrentProcessID();
TIDELINK_EXPORT bool IsProcessAlive(uint32_t pid);
// True while |pid| runs: false once it has exited, even before its parent has reaped it.
TIDELINK_EXPORT bool IsProcessRunning(uint32_t pid);
// Sends |signal| to |pid|. Returns false (errno set) when it cannot be sent; pid 0 is refused.
TIDELINK_EXPORT bool SignalProcess(uint32_t pid, int signal);
// The value of |name| in the environment |pid| was started with (readable for this user's
// processes only); nullopt when the variable is absent or the environment cannot be read.
TIDELINK_EXPORT std::optional<std::string> GetProcessEnvironmentVariable(uint32_t pid,
                                                                         const std::string& name);

// High-precision monotonic clock, in seconds.
TIDELINK_EXPORT double NowSeconds();
// One processor pause instruction (spin-wait hint).
TIDELINK_EXPORT void CpuPause();
TIDELINK_EXPORT void SleepMilliseconds(int ms);

}  // namespace tidelink::platform
