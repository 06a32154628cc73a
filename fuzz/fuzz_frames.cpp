// Feeds arbitrary bytes to the frame-header reader: it must accept only headers whose rows fit in
// the bytes given, and what it accepts must be written back unchanged.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "tidelink/render/FrameLayout.h"

using namespace tidelink;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const auto header = ReadFrameHeader(data, size);
    if (!header) return 0;
    if (header->FrameBytes() > size) abort();
    if (uint64_t{header->mRowBytes} < uint64_t{header->mWidth} * BytesPerPixel(header->mPixelFormat)) abort();
    std::vector<uint8_t> copy(data, data + size);
    WriteFrameHeader(copy.data(), *header);
    const auto again = ReadFrameHeader(copy.data(), copy.size());
    if (!again || again->mWidth != header->mWidth || again->mHeight != header->mHeight ||
        again->mRowBytes != header->mRowBytes || again->mTime != header->mTime) {
        abort();
    }
    return 0;
}
