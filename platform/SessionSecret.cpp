#include "platform/SessionSecret.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <mutex>

#include "platform/Config.h"
#include "platform/Guid.h"
#include "platform/Trace.h"

namespace tidelink::platform {
namespace {

bool ReadSecret(const std::string& path, wire::Secret& out) {
    const int fd = ::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0) return false;
    struct stat st {};
    bool ok = ::fstat(fd, &st) == 0 && S_ISREG(st.st_mode) && st.st_uid == ::getuid() &&
              (st.st_mode & 077) == 0 && st.st_size == static_cast<off_t>(out.size());
    if (!ok) {
        TL_TRACE("platform", 0) << "Ignoring session secret " << path
                                << ": it must be a 32-byte file of this user with mode 0600";
    }
    size_t got = 0;
    while (ok && got < out.size()) {
        const ssize_t n = ::read(fd, out.data() + got, out.size() - got);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) ok = false;
        else got += static_cast<size_t>(n);
    }
    ::close(fd);
    return ok;
}

std::optional<wire::Secret> LoadOrCreate() {
    const std::string dir = GetRuntimeDir();
    if (dir.empty()) return std::nullopt;
    const std::string path = dir + "/session-secret";
    wire::Secret secret{};
    if (ReadSecret(path, secret)) return secret;
    // Write a candidate under a private name, then link it into place: link() fails when another
    // process won the race, and everyone then reads the winner's file.
    const std::string temp = path + "." + Guid::New().ToString();
    const int fd = ::open(temp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
    if (fd < 0) {
        TL_TRACE("platform", 0) << "Cannot create session secret in " << dir << ": " << std::strerror(errno);
        return std::nullopt;
    }
    FillRandom(secret.data(), secret.size());
    const bool written = ::write(fd, secret.data(), secret.size()) == static_cast<ssize_t>(secret.size());
    ::close(fd);
    if (written) {
        if (::link(temp.c_str(), path.c_str()) != 0 && errno != EEXIST) {
            TL_TRACE("platform", 0) << "Cannot install session secret " << path << ": " << std::strerror(errno);
        }
    }
    ::unlink(temp.c_str());
    if (ReadSecret(path, secret)) return secret;
    return std::nullopt;
}

}  // namespace

std::optional<wire::Secret> GetSessionSecret() {
    static std::once_flag once;
    static std::optional<wire::Secret> secret;
    std::call_once(once, [] { secret = LoadOrCreate(); });
    return secret;
}

}  // namespace tidelink::platform
