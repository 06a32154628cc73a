#include "platform/FileSystem.h"

#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>

#include "platform/Process.h"

#ifndef TIDELINK_LIBEXEC_FROM_LIBDIR
#define TIDELINK_LIBEXEC_FROM_LIBDIR "../libexec/tidelink"
#endif

namespace tidelink::platform {

bool File::Exists() const {
    struct stat st {};
    return !mPath.empty() && ::stat(mPath.c_str(), &st) == 0 && S_ISREG(st.st_mode);
}

bool File::IsSymlink() const {
    struct stat st {};
    return !mPath.empty() && ::lstat(mPath.c_str(), &st) == 0 && S_ISLNK(st.st_mode);
}

std::string File::ResolveLink() const {
    if (!IsSymlink()) return {};
    char resolved[PATH_MAX];
    if (::realpath(mPath.c_str(), resolved) == nullptr) return {};
    return resolved;
}

std::string File::Name() const { return mPath.substr(mPath.find_last_of('/') + 1); }

Dir Dir::PackageDir() {
    if (const char* env = std::getenv("TIDELINK_PACKAGE_DIR"); env && *env) return Dir(env);
    const std::string moduleDir = GetCurrentModuleDir();
    Dir installed(moduleDir + "/" + TIDELINK_LIBEXEC_FROM_LIBDIR);
    if (installed.Exists()) return installed;
    return Dir(moduleDir);
}

Dir Dir::AppDir() {
    if (const char* env = std::getenv("TIDELINK_APP_DIR"); env && *env) return Dir(env);
    const std::string exe = GetCurrentExecutablePath();
    return Dir(exe.substr(0, exe.find_last_of('/')));
}

bool Dir::Exists() const {
    struct stat st {};
    return !mPath.empty() && ::stat(mPath.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

File Dir::GetFile(const std::string& name) const {
    if (mPath.empty()) return File(name);
    return File(mPath.back() == '/' ? mPath + name : mPath + "/" + name);
}

}  // namespace tidelink::platform
