#include <deque>
#include <mutex>

#include "processcoordination/ProcessCoordination.h"

namespace processcoordination {

using tidelink::platform::kMMFWritable;
using tidelink::platform::MemoryMappedFile;

namespace {

struct Cache {
    std::mutex mutex;
    std::deque<std::pair<std::string, std::unique_ptr<MemoryMappedFile>>> entries;  // newest first
    uint64_t total = 0;
    uint64_t hits = 0;
    uint64_t created = 0;
};

// Never destroyed: references may give back mappings while the process exits.
Cache& TheCache() {
    static auto* cache = new Cache();
    return *cache;
}

}  // namespace

BinaryReference::~BinaryReference() = default;
WritableBinaryReference::~WritableBinaryReference() = default;

ContractViolation::ContractViolation()
    : std::logic_error(
          "$$$/mavcore/utility/Error/Contract/InputContractViolation=An input contract violation has occurred!") {}

std::unique_ptr<MemoryMappedFile> GetCachedMemoryMappedFile(const std::string& name, uint64_t size, bool writable) {
    Cache& c = TheCache();
    std::unique_ptr<MemoryMappedFile> unfit;  // unmapped outside the lock
    {
        std::lock_guard lock(c.mutex);
        for (auto it = c.entries.begin(); it != c.entries.end(); ++it) {
            if (it->first != name) continue;
            auto file = std::move(it->second);
            c.entries.erase(it);
            c.total -= file->Size();
            if (file->Size() == size && (!writable || file->MappedMemoryIsWritable())) {
                ++c.hits;
                return file;
            }
            unfit = std::move(file);
            break;
        }
    }
    unfit.reset();
    // Open checks the object against |size| first, so a short object is refused rather than
    // mapped past its end.
    auto file = std::make_unique<MemoryMappedFile>();
    if (size == 0 || !file->Open(name, size, writable ? kMMFWritable : 0)) return nullptr;
    std::lock_guard lock(c.mutex);
    ++c.created;
    return file;
}

void ReturnCachedMemoryMappedFile(const std::string& name, std::unique_ptr<MemoryMappedFile> file) {
    if (!file) return;
    Cache& c = TheCache();
    std::vector<std::unique_ptr<MemoryMappedFile>> evicted;
    {
        std::lock_guard lock(c.mutex);
        const uint64_t size = file->Size();
        if (size >= kCacheMinBytes && size <= kCacheMaxBytes) {
            c.entries.emplace_front(name, std::move(file));
            c.total += size;
        } else {
            evicted.push_back(std::move(file));
        }
        while (c.entries.size() > kCacheMaxEntries || c.total > kCacheTotalBytes) {
            c.total -= c.entries.back().second->Size();
            evicted.push_back(std::move(c.entries.back().second));
            c.entries.pop_back();
        }
    }
}

MappedFileCacheStats GetMappedFileCacheStats() {
    Cache& c = TheCache();
    std::lock_guard lock(c.mutex);
    return {c.entries.size(), c.total, c.hits, c.created};
}

void ClearMappedFileCache() {
    Cache& c = TheCache();
    std::deque<std::pair<std::string, std::unique_ptr<MemoryMappedFile>>> gone;
    std::lock_guard lock(c.mutex);
    gone.swap(c.entries);
    c.total = 0;
}

}  // namespace processcoordination
