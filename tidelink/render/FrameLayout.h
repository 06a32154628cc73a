// How a rendered video frame lies in shared memory: a 128-byte header, then the rows of pixels
// from top to bottom, each |rowBytes| long (docs/frames.md).
//
//   offset  size  content (little-endian)
//   0       4     magic "TLFR"
//   4       4     header size (128)
//   8       4     width in pixels
//   12      4     height in pixels
//   16      4     row bytes (at least width x bytes per pixel)
//   20      4     pixel format four-character code ('BGRA' or 'RGBA', 8 bits per component)
//   24      4     field type
//   28      4     reserved (0)
//   32      8     frame time numerator (seconds)
//   40      8     frame time denominator
//   48      4     pixel aspect ratio numerator
//   52      4     pixel aspect ratio denominator
//   56      72    reserved (0)
#pragma once

#include <cstdint>
#include <optional>

#include "platform/Export.h"
#include "platform/media/MediaTypes.h"

namespace tidelink {

inline constexpr uint32_t kFrameMagic = 0x52464C54;  // "TLFR" in memory order
inline constexpr uint64_t kFrameHeaderBytes = 128;
inline constexpr uint32_t kPixelFormatBGRA = platform::MakeFourCC('B', 'G', 'R', 'A');
inline constexpr uint32_t kPixelFormatRGBA = platform::MakeFourCC('R', 'G', 'B', 'A');

struct TIDELINK_EXPORT FrameHeader {
    uint32_t mWidth = 0;
    uint32_t mHeight = 0;
    uint32_t mRowBytes = 0;
    uint32_t mPixelFormat = kPixelFormatBGRA;
    int32_t mFieldType = 0;
    platform::RatioTime mTime{0, 1};
    uint32_t mPixelAspectNumerator = 1;
    uint32_t mPixelAspectDenominator = 1;

    // Bytes the whole frame takes: header and rows.
    uint64_t FrameBytes() const { return kFrameHeaderBytes + uint64_t{mRowBytes} * mHeight; }
};

// Bytes per pixel of a pixel format the frames use (0 for an unknown one).
TIDELINK_EXPORT uint32_t BytesPerPixel(uint32_t pixelFormat);

// Writes |header| into the first kFrameHeaderBytes of |data|.
TIDELINK_EXPORT void WriteFrameHeader(void* data, const FrameHeader& header);

// Reads the header of a frame of |size| bytes. Nothing when the magic is wrong, the pixel format
// unknown, the rows shorter than a line of pixels, the time's denominator not positive, or the
// rows run past |size|.
TIDELINK_EXPORT std::optional<FrameHeader> ReadFrameHeader(const void* data, uint64_t size);

}  // namespace tidelink
