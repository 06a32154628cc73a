#include "platform/Config.h"

#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <fstream>
#include <mutex>
#include <vector>

#include "platform/Process.h"
#include "platform/Trace.h"

#ifndef TIDELINK_DEFAULT_SUITE_MAJOR
#define TIDELINK_DEFAULT_SUITE_MAJOR 1
#endif

namespace tidelink::platform {
namespace {

SuiteVersionInfo ParseSuiteVersion(const char* text) {
    const SuiteVersionInfo fallback{TIDELINK_DEFAULT_SUITE_MAJOR, 0, 0};
    if (text == nullptr || *text == '\0') return fallback;
    SuiteVersionInfo v;
    int32_t* fields[] = {&v.major, &v.minor, &v.patch};
    const char* p = text;
    for (int i = 0; i < 3; ++i) {
        char* end = nullptr;
        errno = 0;
        const long n = std::strtol(p, &end, 10);
        if (end == p || errno != 0 || n < 0 || n > INT32_MAX || *p == '-' || *p == '+' || *p == ' ') {
            // An unreadable major number keeps the built-in version; later fields stay 0.
            if (i == 0) {
                TL_TRACE("platform", 0) << "Ignoring TIDELINK_SUITE_VERSION \"" << text << "\"";
                return fallback;
            }
            break;
        }
        *fields[i] = static_cast<int32_t>(n);
        p = end;
        if (*p != '.') break;
        ++p;
    }
    return v;
}

bool Truthy(const char* text) {
    if (text == nullptr) return false;
    const std::string s(text);
    return s == "1" || s == "true" || s == "yes" || s == "on";
}

struct ClientInfo {
    std::mutex mutex;
    WString name;
    WString version = u"0.0";
    bool nameSet = false;
};

ClientInfo& GetClientInfo() {
    static auto* info = new ClientInfo();  // immortal: read by work that may outlive main
    return *info;
}

std::string Trim(std::string s) {
    const auto first = s.find_first_not_of(" \t\r");
    if (first == std::string::npos) return {};
    const auto last = s.find_last_not_of(" \t\r");
    return s.substr(first, last - first + 1);
}

std::string DebugFilePath() {
    if (const char* f = std::getenv("TIDELINK_DEBUG_FILE")) return f;
    if (const char* x = std::getenv("XDG_CONFIG_HOME"); x && *x) {
        return std::string(x) + "/tidelink/debug.conf";
    }
    if (const char* h = std::getenv("HOME"); h && *h) return std::string(h) + "/.config/tidelink/debug.conf";
    return {};
}

bool EnsurePrivateDir(const std::string& path) {
    if (::mkdir(path.c_str(), 0700) != 0 && errno != EEXIST) return false;
    struct stat st {};
    if (::lstat(path.c_str(), &st) != 0) return false;
    if (!S_ISDIR(st.st_mode) || st.st_uid != ::getuid() || (st.st_mode & 077) != 0) {
        TL_TRACE("TideLink", 0) << "Refusing runtime folder " << path
                                << ": it must be a folder of this user with mode 0700";
        return false;
    }
    return true;
}

}  // namespace

SuiteVersionInfo GetSuiteVersionInfo() {
    static const SuiteVersionInfo info = ParseSuiteVersion(std::getenv("TIDELINK_SUITE_VERSION"));
    return info;
}

bool IsBetaPrime() {
    static const bool beta = Truthy(std::getenv("TIDELINK_BETA"));
    return beta;
}

void SetClientInfo(const WString& name, const WString& version) {
    auto& info = GetClientInfo();
    std::lock_guard lock(info.mutex);
    info.name = name;
    info.version = version;
    info.nameSet = true;
}

WString GetClientName() {
    auto& info = GetClientInfo();
    std::lock_guard lock(info.mutex);
    if (!info.nameSet) {
        const std::string exe = GetCurrentExecutablePath();
        info.name = ToUTF16(exe.substr(exe.find_last_of('/') + 1));
        info.nameSet = true;
    }
    return info.name;
}

WString GetClientVersion() {
    auto& info = GetClientInfo();
    std::lock_guard lock(info.mutex);
    return info.version;
}

std::optional<std::string> GetDebugEntry(std::string_view name) {
    const std::string key(name);
    if (const char* env = std::getenv(key.c_str())) return std::string(env);
    const std::string path = DebugFilePath();
    if (path.empty()) return std::nullopt;
    std::ifstream in(path);
    std::string line;
    while (std::getline(in, line)) {
        const auto hash = line.find('#');
        if (hash != std::string::npos) line.resize(hash);
        const auto eq = line.find('=');
        if (eq == std::string::npos) continue;
        if (Trim(line.substr(0, eq)) == key) return Trim(line.substr(eq + 1));
    }
    return std::nullopt;
}

int64_t GetDebugEntryInt(std::string_view name, int64_t defaultValue) {
    const auto entry = GetDebugEntry(name);
    if (!entry) return defaultValue;
    try {
        size_t used = 0;
        // Decimal, or hexadecimal with 0x; a leading zero does not mean octal.
        const bool hex = entry->size() > 2 && (*entry)[0] == '0' && ((*entry)[1] == 'x' || (*entry)[1] == 'X');
        const long long v = std::stoll(*entry, &used, hex ? 16 : 10);
        if (used != entry->size()) return defaultValue;
        return v;
    } catch (...) {
        return defaultValue;
    }
}

std::string GetRuntimeDir() {
    std::string dir;
    if (const char* t = std::getenv("TIDELINK_RUNTIME_DIR"); t && *t) {
        dir = t;
    } else if (const char* x = std::getenv("XDG_RUNTIME_DIR"); x && *x) {
        dir = std::string(x) + "/tidelink";
    } else {
        dir = "/tmp/tidelink-" + std::to_string(::getuid());
    }
    return EnsurePrivateDir(dir) ? dir : std::string();
}

WString Localize(std::string_view keyed, std::initializer_list<WString> args) {
    std::string_view text = keyed;
    if (text.substr(0, 4) == "$$$/") {
        const auto eq = text.find('=');
        text = eq == std::string_view::npos ? std::string_view() : text.substr(eq + 1);
    }
    const WString in = ToUTF16(text);
    const std::vector<WString> values(args);
    // One pass: text taken from an argument is never searched for markers again.
    WString out;
    out.reserve(in.size());
    for (size_t i = 0; i < in.size(); ++i) {
        if (in[i] == u'@' && i + 1 < in.size() && in[i + 1] >= u'0' && in[i + 1] <= u'9') {
            const size_t index = static_cast<size_t>(in[i + 1] - u'0');
            if (index < values.size()) {
                out += values[index];
                ++i;
                continue;
            }
        }
        out.push_back(in[i]);
    }
    return out;
}

WString Localize(std::string_view keyed) { return Localize(keyed, {}); }

WString Localize(std::string_view keyed, const WString& arg0) { return Localize(keyed, {arg0}); }

}  // namespace tidelink::platform
