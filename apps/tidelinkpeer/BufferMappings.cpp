#include "BufferMappings.h"

#include <vector>

namespace tidelink::peer {

using platform::MemoryMappedFile;

std::unique_ptr<MemoryMappedFile> BufferMappings::Take(const std::string& name, uint64_t size) {
    std::unique_ptr<MemoryMappedFile> unfit;  // unmapped outside the lock
    {
        std::lock_guard lock(mMutex);
        for (auto it = mKept.begin(); it != mKept.end(); ++it) {
            if ((*it)->Name() != name) continue;
            auto mapping = std::move(*it);
            mKept.erase(it);
            mBytes -= mapping->Size();
            if (mapping->Size() == size && mapping->MappedMemoryIsWritable()) {
                ++mHits;
                return mapping;
            }
            unfit = std::move(mapping);
            break;
        }
    }
    unfit.reset();
    auto mapping = std::make_unique<MemoryMappedFile>();
    if (size == 0 || !mapping->Open(name, size, platform::kMMFWritable)) return nullptr;
    std::lock_guard lock(mMutex);
    ++mOpened;
    return mapping;
}

void BufferMappings::Give(std::unique_ptr<MemoryMappedFile> mapping) {
    if (!mapping || !mapping->IsOpen()) return;
    std::vector<std::unique_ptr<MemoryMappedFile>> evicted;
    {
        std::lock_guard lock(mMutex);
        if (mapping->Size() > mMaxBytes || mMaxEntries == 0) {
            evicted.push_back(std::move(mapping));
        } else {
            mBytes += mapping->Size();
            mKept.push_front(std::move(mapping));
        }
        while (mKept.size() > mMaxEntries || mBytes > mMaxBytes) {
            mBytes -= mKept.back()->Size();
            evicted.push_back(std::move(mKept.back()));
            mKept.pop_back();
        }
    }
}

void BufferMappings::Clear() {
    std::list<std::unique_ptr<MemoryMappedFile>> gone;
    std::lock_guard lock(mMutex);
    gone.swap(mKept);
    mBytes = 0;
}

size_t BufferMappings::Entries() const {
    std::lock_guard lock(mMutex);
    return mKept.size();
}

uint64_t BufferMappings::Bytes() const {
    std::lock_guard lock(mMutex);
    return mBytes;
}

uint64_t BufferMappings::Hits() const {
    std::lock_guard lock(mMutex);
    return mHits;
}

uint64_t BufferMappings::Opened() const {
    std::lock_guard lock(mMutex);
    return mOpened;
}

}  // namespace tidelink::peer
