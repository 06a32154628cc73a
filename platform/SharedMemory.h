// Named shared memory (POSIX shm objects in /dev/shm), mapped into this process.
//
// Names are plain words without '/', at most 200 bytes. Objects are created exclusively with mode
// 0600; opening checks that the object belongs to this user and is at least the requested size,
// so a mapping never reaches past the object's end.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/Export.h"

namespace tidelink::platform {

// Open and create flags.
inline constexpr uint32_t kMMFWritable = 0x01;  // map for writing as well as reading
inline constexpr uint32_t kMMFReplaceStale = 0x02;  // Init: replace an object of ours left under the name
inline constexpr uint32_t kMMFReadOnly = 0x20;  // Open: map read-only

// Names of this user's shared-memory objects that start with |prefix|.
TIDELINK_EXPORT std::vector<std::string> ListSharedMemoryNames(const std::string& prefix);

class TIDELINK_EXPORT MemoryMappedFile {
public:
    MemoryMappedFile() = default;
    ~MemoryMappedFile();
    MemoryMappedFile(const MemoryMappedFile&) = delete;
    MemoryMappedFile& operator=(const MemoryMappedFile&) = delete;

    // Creates the object |name| of |size| bytes and maps it writable. Fails when the name exists,
    // unless kMMFReplaceStale is given and the existing object is ours. The object is removed
    // again when this MemoryMappedFile is destroyed (or Unlink is called).
    bool Init(const std::string& name, size_t size, uint32_t flags);
    // Maps the existing object |name|; |size| bytes are mapped (0 = the whole object).
    bool Open(const std::string& name, size_t size, uint32_t flags);
    void Close();
    // Removes the name; existing mappings stay valid.
    void Unlink();

    void* GetAddress() const { return mAddress; }
    size_t Size() const { return mSize; }
    bool MappedMemoryIsWritable() const { return mWritable; }
    bool IsOpen() const { return mAddress != nullptr; }
    const std::string& Name() const { return mName; }
    int LastError() const { return mError; }

    static bool IsValidName(const std::string& name);
    static bool Exists(const std::string& name);
    static bool Remove(const std::string& name);

private:
    bool Map(int fd, size_t size, bool writable);

    void* mAddress = nullptr;
    size_t mSize = 0;
    bool mWritable = false;
    bool mOwner = false;
    int mError = 0;
    std::string mName;
};

}  // namespace tidelink::platform
