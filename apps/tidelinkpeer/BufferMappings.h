// Writable mappings of the buffers the peer draws frames into, kept between frames.
//
// The link manager hands a buffer that comes back from a host to the next allocation of its size
// (its pool), so a steady stream of frames goes round a few buffers. With several frames in
// flight more buffers go round than the library's mapping cache keeps (26 MiB, three 1080p
// frames), and each frame would be mapped anew; this cache is sized for the frames in flight.
//
// A kept mapping holds its pages even after the link manager let the buffer go, so the cache is
// bounded in entries and bytes (least recently used first out), and Clear empties it.
//
// Threading: any thread. A mapping taken out belongs to the taker until it gives it back.
#pragma once

#include <cstdint>
#include <list>
#include <memory>
#include <mutex>
#include <string>

#include "platform/SharedMemory.h"

namespace tidelink::peer {

class BufferMappings {
public:
    BufferMappings(size_t maxEntries, uint64_t maxBytes) : mMaxEntries(maxEntries), mMaxBytes(maxBytes) {}
    ~BufferMappings() { Clear(); }
    BufferMappings(const BufferMappings&) = delete;
    BufferMappings& operator=(const BufferMappings&) = delete;

    // A writable mapping of exactly |size| bytes of |name|: a kept one, or a new one. Null when the
    // object cannot be opened (or is shorter than |size|).
    std::unique_ptr<platform::MemoryMappedFile> Take(const std::string& name, uint64_t size);
    // Keeps |mapping| for the next Take of its name.
    void Give(std::unique_ptr<platform::MemoryMappedFile> mapping);
    void Clear();

    size_t Entries() const;
    uint64_t Bytes() const;
    uint64_t Hits() const;
    uint64_t Opened() const;

private:
    const size_t mMaxEntries;
    const uint64_t mMaxBytes;
    mutable std::mutex mMutex;  // guards what follows
    std::list<std::unique_ptr<platform::MemoryMappedFile>> mKept;  // most recently given first
    uint64_t mBytes = 0;
    uint64_t mHits = 0;
    uint64_t mOpened = 0;
};

}  // namespace tidelink::peer
