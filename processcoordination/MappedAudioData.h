// An audio chunk in shared memory: a 128-byte header (channel count, samples per channel, both
// unsigned 32-bit little-endian; the rest reserved) followed by planar 32-bit float samples,
// channel after channel.
#pragma once

#include <cstdint>
#include <vector>

#include "platform/Export.h"
#include "processcoordination/ProcessCoordination.h"

namespace processcoordination {

inline constexpr uint64_t kAudioChunkHeaderBytes = 128;

class TIDELINK_EXPORT MappedAudioData {
public:
    MappedAudioData() = default;
    ~MappedAudioData();
    MappedAudioData(const MappedAudioData&) = delete;
    MappedAudioData& operator=(const MappedAudioData&) = delete;

    // Producer: allocates a chunk for |channels| x |samples| and maps it writable. -1 when no
    // buffer could be had. Throws ContractViolation when the object already holds data.
    int Init(uint32_t channels, uint32_t samples, const Guid& identifier);
    // Consumer: maps |reference| read-only. -1 when it is shorter than its header, or than the
    // samples its header announces. Throws ContractViolation for an empty reference or when the
    // object already holds data.
    int Init(BinaryReferencePtr reference);

    // One pointer per channel (null when there are no channels).
    float** GetAudioDataBuffer() { return mChannels.empty() ? nullptr : mChannels.data(); }
    // The writable reference to publish with PutCompletedBinaryData (producer side).
    WritableBinaryReferencePtr GetWritablePtr() const { return mWritable; }

    uint32_t GetChannelCount() const { return mChannelCount; }
    uint32_t GetSampleCount() const { return mSampleCount; }

private:
    uint32_t mChannelCount = 0;
    BinaryReferencePtr mReference;
    const void* mData = nullptr;
    uint32_t mSampleCount = 0;
    WritableBinaryReferencePtr mWritable;
    void* mWritableData = nullptr;
    std::vector<float*> mChannels;
};

}  // namespace processcoordination
