#include "platform/Process.h"

#include <dirent.h>
#include <dlfcn.h>
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string_view>
#include <thread>

extern char** environ;

namespace tidelink::platform {

std::string GetCurrentExecutablePath() {
    char buf[PATH_MAX];
    const ssize_t n = ::readlink("/proc/self/exe", buf, sizeof(buf) - 1);
    if (n <= 0) return {};
    return std::string(buf, static_cast<size_t>(n));
}

std::string GetCurrentModuleDir() {
    Dl_info info{};
    if (::dladdr(reinterpret_cast<void*>(&GetCurrentModuleDir), &info) != 0 && info.dli_fname) {
        char resolved[PATH_MAX];
        if (::realpath(info.dli_fname, resolved) != nullptr) {
            std::string p(resolved);
            return p.substr(0, p.find_last_of('/'));
        }
    }
    const std::string exe = GetCurrentExecutablePath();
    return exe.substr(0, exe.find_last_of('/'));
}

pid_t LaunchProcess(const std::string& path, const std::vector<std::string>& args) {
    return LaunchProcess(path, args, {});
}

pid_t LaunchProcess(const std::string& path, const std::vector<std::string>& args,
                    const std::vector<std::string>& extraEnvironment) {
    // The child's environment: the inherited one less the names |extraEnvironment| sets, then
    // those entries.
    std::vector<std::string> names;
    for (const auto& entry : extraEnvironment) {
        const size_t eq = entry.find('=');
        if (eq == std::string::npos || eq == 0) {
            errno = EINVAL;
            return -1;
        }
        names.push_back(entry.substr(0, eq + 1));
    }
    std::vector<char*> envp;
    for (char** e = environ; e != nullptr && *e != nullptr; ++e) {
        const std::string_view entry(*e);
        const bool replaced = std::any_of(names.begin(), names.end(), [&](const std::string& n) {
            return entry.compare(0, n.size(), n) == 0;
        });
        if (!replaced) envp.push_back(*e);
    }
    for (const auto& entry : extraEnvironment) envp.push_back(const_cast<char*>(entry.c_str()));
    envp.push_back(nullptr);

    posix_spawn_file_actions_t actions;
    posix_spawnattr_t attr;
    posix_spawn_file_actions_init(&actions);
    posix_spawnattr_init(&attr);
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&actions, 1, "/dev/null", O_WRONLY, 0);
    const char* log = std::getenv("TIDELINK_MANAGER_LOG");
    if (log != nullptr && *log != '\0') {
        posix_spawn_file_actions_addopen(&actions, 2, log, O_WRONLY | O_CREAT | O_APPEND, 0600);
    } else {
        posix_spawn_file_actions_addopen(&actions, 2, "/dev/null", O_WRONLY, 0);
    }
    posix_spawn_file_actions_addclosefrom_np(&actions, 3);
    sigset_t none;
    sigemptyset(&none);
    posix_spawnattr_setsigmask(&attr, &none);
    sigset_t defaults;
    sigemptyset(&defaults);
    sigaddset(&defaults, SIGPIPE);
    sigaddset(&defaults, SIGINT);
    sigaddset(&defaults, SIGTERM);
    posix_spawnattr_setsigdefault(&attr, &defaults);
    posix_spawnattr_setflags(&attr, POSIX_SPAWN_SETSID | POSIX_SPAWN_SETSIGMASK |
                                        POSIX_SPAWN_SETSIGDEF);

    std::vector<char*> argv;
    argv.push_back(const_cast<char*>(path.c_str()));
    for (const auto& a : args) argv.push_back(const_cast<char*>(a.c_str()));
    argv.push_back(nullptr);

    pid_t pid = -1;
    const int rc = ::posix_spawn(&pid, path.c_str(), &actions, &attr, argv.data(), envp.data());
    posix_spawn_file_actions_destroy(&actions);
    posix_spawnattr_destroy(&attr);
    if (rc != 0) {
        errno = rc;
        return -1;
    }
    // Reap the child when it exits so it never lingers as a zombie of the host.
    std::thread([pid] {
        int status = 0;
        while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
        }
    }).detach();
    return pid;
}

std::string CheckExecutable(const std::string& path) {
    struct stat st {};
    if (::stat(path.c_str(), &st) != 0) return std::strerror(errno);
    if (S_ISDIR(st.st_mode)) return std::strerror(EISDIR);
    if (!S_ISREG(st.st_mode)) return "not a regular file";
    if (::access(path.c_str(), X_OK) != 0) return std::strerror(errno);
    return {};
}

std::vector<uint32_t> GetProcessIDsForName(const std::string& name) {
    std::vector<uint32_t> pids;
    DIR* dir = ::opendir("/proc");
    if (dir == nullptr) return pids;
    const uid_t me = ::getuid();
    while (dirent* e = ::readdir(dir)) {
        char* end = nullptr;
        const unsigned long pid = std::strtoul(e->d_name, &end, 10);
        if (end == e->d_name || *end != '\0') continue;
        const std::string base = std::string("/proc/") + e->d_name;
        struct stat st {};
        if (::stat(base.c_str(), &st) != 0 || st.st_uid != me) continue;
        char buf[PATH_MAX];
        const ssize_t n = ::readlink((base + "/exe").c_str(), buf, sizeof(buf) - 1);
        if (n <= 0) continue;
        std::string exe(buf, static_cast<size_t>(n));
        // A rebuilt binary shows as "<path> (deleted)" in processes started before the rebuild.
        static const std::string kDeleted = " (deleted)";
        if (exe.size() > kDeleted.size() &&
            exe.compare(exe.size() - kDeleted.size(), kDeleted.size(), kDeleted) == 0) {
            exe.resize(exe.size() - kDeleted.size());
        }
        if (exe.substr(exe.find_last_of('/') + 1) == name) pids.push_back(static_cast<uint32_t>(pid));
    }
    ::closedir(dir);
    std::sort(pids.begin(), pids.end());
    return pids;
}

uint32_t GetCurrentProcessID() { return static_cast<uint32_t>(::getpid()); }

bool IsProcessAlive(uint32_t pid) {
    if (pid == 0) return false;
    return ::kill(static_cast<pid_t>(pid), 0) == 0 || errno == EPERM;
}

bool IsProcessRunning(uint32_t pid) {
    if (pid == 0) return false;
    // The state follows the last ')' of /proc/<pid>/stat (the command name may hold one).
    std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
    std::string line;
    if (!std::getline(in, line)) return false;
    const size_t close = line.rfind(')');
    if (close == std::string::npos || close + 2 >= line.size()) return false;
    const char state = line[close + 2];
    return state != 'Z' && state != 'X' && state != 'x';
}

bool SignalProcess(uint32_t pid, int signal) {
    if (pid == 0 || pid > static_cast<uint32_t>(INT_MAX)) {
        errno = EINVAL;
        return false;
    }
    return ::kill(static_cast<pid_t>(pid), signal) == 0;
}

std::optional<std::string> GetProcessEnvironmentVariable(uint32_t pid, const std::string& name) {
    if (pid == 0) return std::nullopt;
    std::ifstream in("/proc/" + std::to_string(pid) + "/environ", std::ios::binary);
    const std::string prefix = name + "=";
    std::string entry;
    while (std::getline(in, entry, '\0')) {
        if (entry.compare(0, prefix.size(), prefix) == 0) return entry.substr(prefix.size());
    }
    return std::nullopt;
}

double NowSeconds() {
    using namespace std::chrono;
    return duration<double>(steady_clock::now().time_since_epoch()).count();
}

void CpuPause() {
#if defined(__x86_64__) || defined(__i386__)
    __builtin_ia32_pause();
#elif defined(__aarch64__)
    asm volatile("yield");
#endif
}

void SleepMilliseconds(int ms) { std::this_thread::sleep_for(std::chrono::milliseconds(ms)); }

}  // namespace tidelink::platform
