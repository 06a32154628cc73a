#include "platform/SharedMemory.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

namespace tidelink::platform {
namespace {

std::string ShmPath(const std::string& name) { return "/" + name; }

}  // namespace

std::vector<std::string> ListSharedMemoryNames(const std::string& prefix) {
    std::vector<std::string> names;
    DIR* dir = ::opendir("/dev/shm");
    if (dir == nullptr) return names;
    const uid_t me = ::getuid();
    while (dirent* e = ::readdir(dir)) {
        const std::string name = e->d_name;
        if (name.compare(0, prefix.size(), prefix) != 0) continue;
        struct stat st {};
        if (::fstatat(::dirfd(dir), e->d_name, &st, AT_SYMLINK_NOFOLLOW) == 0 && st.st_uid == me &&
            S_ISREG(st.st_mode)) {
            names.push_back(name);
        }
    }
    ::closedir(dir);
    return names;
}

MemoryMappedFile::~MemoryMappedFile() { Close(); }

bool MemoryMappedFile::IsValidName(const std::string& name) {
    if (name.empty() || name.size() > 200 || name == "." || name == "..") return false;
    for (char c : name) {
        if (c == '/' || c == '\0') return false;
    }
    return true;
}

bool MemoryMappedFile::Exists(const std::string& name) {
    if (!IsValidName(name)) return false;
    struct stat st {};
    return ::stat(("/dev/shm/" + name).c_str(), &st) == 0;
}

bool MemoryMappedFile::Remove(const std::string& name) {
    return IsValidName(name) && ::shm_unlink(ShmPath(name).c_str()) == 0;
}

bool MemoryMappedFile::Map(int fd, size_t size, bool writable) {
    // Populated at once: faulting the pages in one by one costs more than the copy it avoids.
    void* p = ::mmap(nullptr, size, writable ? PROT_READ | PROT_WRITE : PROT_READ, MAP_SHARED | MAP_POPULATE, fd, 0);
    if (p == MAP_FAILED) {
        mError = errno;
        return false;
    }
    mAddress = p;
    mSize = size;
    mWritable = writable;
    return true;
}

bool MemoryMappedFile::Init(const std::string& name, size_t size, uint32_t flags) {
    Close();
    if (!IsValidName(name) || size == 0) {
        mError = EINVAL;
        return false;
    }
    const std::string path = ShmPath(name);
    int fd = ::shm_open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
    if (fd < 0 && errno == EEXIST && (flags & kMMFReplaceStale)) {
        struct stat st {};
        if (::stat(("/dev/shm/" + name).c_str(), &st) == 0 && st.st_uid == ::getuid()) {
            ::shm_unlink(path.c_str());
            fd = ::shm_open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
        }
    }
    if (fd < 0) {
        mError = errno;
        return false;
    }
    // Reserve the pages now, so a full shm filesystem fails here instead of faulting a writer.
    const int rc = ::posix_fallocate(fd, 0, static_cast<off_t>(size));
    if (rc != 0) {
        mError = rc;
        ::close(fd);
        ::shm_unlink(path.c_str());
        return false;
    }
    const bool ok = Map(fd, size, true);
    ::close(fd);
    if (!ok) {
        ::shm_unlink(path.c_str());
        return false;
    }
    mName = name;
    mOwner = true;
    return true;
}

bool MemoryMappedFile::Open(const std::string& name, size_t size, uint32_t flags) {
    Close();
    if (!IsValidName(name)) {
        mError = EINVAL;
        return false;
    }
    const bool writable = (flags & kMMFWritable) != 0 && (flags & kMMFReadOnly) == 0;
    const int fd = ::shm_open(ShmPath(name).c_str(),
                              (writable ? O_RDWR : O_RDONLY) | O_CLOEXEC | O_NOFOLLOW, 0);
    if (fd < 0) {
        mError = errno;
        return false;
    }
    struct stat st {};
    if (::fstat(fd, &st) != 0 || st.st_uid != ::getuid() || !S_ISREG(st.st_mode)) {
        mError = EACCES;
        ::close(fd);
        return false;
    }
    const auto actual = static_cast<size_t>(st.st_size);
    if (size == 0) size = actual;
    if (size == 0 || actual < size) {
        mError = EINVAL;  // smaller than announced: mapping it would fault on access
        ::close(fd);
        return false;
    }
    const bool ok = Map(fd, size, writable);
    ::close(fd);
    if (ok) mName = name;
    return ok;
}

void MemoryMappedFile::Unlink() {
    if (mOwner && !mName.empty()) ::shm_unlink(ShmPath(mName).c_str());
    mOwner = false;
}

void MemoryMappedFile::Close() {
    if (mAddress != nullptr) ::munmap(mAddress, mSize);
    Unlink();
    mAddress = nullptr;
    mSize = 0;
    mWritable = false;
    mName.clear();
}

}  // namespace tidelink::platform
