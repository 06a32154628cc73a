#include "processcoordination/MappedAudioData.h"

#include <cstring>

namespace processcoordination {

namespace {

void PutU32(uint8_t* p, uint32_t v) {
    for (int i = 0; i < 4; ++i) p[i] = static_cast<uint8_t>(v >> (8 * i));
}

uint32_t GetU32(const uint8_t* p) {
    return static_cast<uint32_t>(p[0]) | (static_cast<uint32_t>(p[1]) << 8) | (static_cast<uint32_t>(p[2]) << 16) |
           (static_cast<uint32_t>(p[3]) << 24);
}

}  // namespace

MappedAudioData::~MappedAudioData() {
    if (mReference && mData) mReference->UnmapFromCurrentProcess(mData);
    if (mWritable && mWritableData) mWritable->UnmapFromCurrentProcess(mWritableData);
}

int MappedAudioData::Init(uint32_t channels, uint32_t samples, const Guid&) {
    if (mData || mWritableData) throw ContractViolation();
    WritableBinaryReferencePtr writable;
    const uint64_t size = uint64_t{channels} * samples * 4 + kAudioChunkHeaderBytes;
    if (GetWritableBinaryData(size, writable) != 0 || !writable) return -1;
    void* data = writable->MapIntoCurrentProcess();
    if (!data) throw ContractViolation();
    mWritable = std::move(writable);
    mWritableData = data;
    auto* bytes = static_cast<uint8_t*>(data);
    PutU32(bytes, channels);
    PutU32(bytes + 4, samples);
    mChannelCount = channels;
    mSampleCount = samples;
    mChannels.resize(channels);
    for (uint32_t i = 0; i < channels; ++i) {
        mChannels[i] = reinterpret_cast<float*>(bytes + kAudioChunkHeaderBytes + uint64_t{4} * i * samples);
    }
    return 0;
}

int MappedAudioData::Init(BinaryReferencePtr reference) {
    if (!reference) throw ContractViolation();
    if (mData || mWritableData) throw ContractViolation();
    const void* data = reference->MapIntoCurrentProcess();
    if (!data) throw ContractViolation();
    mReference = std::move(reference);
    mData = data;
    const uint64_t size = mReference->GetSize();
    if (size < kAudioChunkHeaderBytes) return -1;
    const auto* bytes = static_cast<const uint8_t*>(data);
    const uint32_t channels = GetU32(bytes);
    const uint32_t samples = GetU32(bytes + 4);
    // A header that announces more samples than the chunk holds would send readers past its end.
    if (uint64_t{channels} * samples * 4 > size - kAudioChunkHeaderBytes) return -1;
    mChannelCount = channels;
    mSampleCount = samples;
    mChannels.resize(channels);
    for (uint32_t i = 0; i < channels; ++i) {
        // The consumer reads only; the pointer type is shared with the producer side.
        mChannels[i] = reinterpret_cast<float*>(const_cast<uint8_t*>(bytes) + kAudioChunkHeaderBytes +
                                                uint64_t{4} * i * samples);
    }
    return 0;
}

}  // namespace processcoordination
