#include "tidelink/render/FrameLayout.h"

#include <cstdint>
#include <cstring>

namespace tidelink {

namespace {

template <class T>
void Put(uint8_t* p, T v) {
    using U = std::make_unsigned_t<T>;
    const U u = static_cast<U>(v);
    for (size_t i = 0; i < sizeof(T); ++i) p[i] = static_cast<uint8_t>(u >> (8 * i));
}

template <class T>
T Get(const uint8_t* p) {
    using U = std::make_unsigned_t<T>;
    U u = 0;
    for (size_t i = 0; i < sizeof(T); ++i) u |= static_cast<U>(static_cast<U>(p[i]) << (8 * i));
    return static_cast<T>(u);
}

}  // namespace

uint32_t BytesPerPixel(uint32_t pixelFormat) {
    return pixelFormat == kPixelFormatBGRA || pixelFormat == kPixelFormatRGBA ? 4 : 0;
}

void WriteFrameHeader(void* data, const FrameHeader& h) {
    auto* p = static_cast<uint8_t*>(data);
    std::memset(p, 0, kFrameHeaderBytes);
    Put<uint32_t>(p + 0, kFrameMagic);
    Put<uint32_t>(p + 4, static_cast<uint32_t>(kFrameHeaderBytes));
    Put<uint32_t>(p + 8, h.mWidth);
    Put<uint32_t>(p + 12, h.mHeight);
    Put<uint32_t>(p + 16, h.mRowBytes);
    Put<uint32_t>(p + 20, h.mPixelFormat);
    Put<int32_t>(p + 24, h.mFieldType);
    Put<int64_t>(p + 32, h.mTime.numerator());
    Put<int64_t>(p + 40, h.mTime.denominator());
    Put<uint32_t>(p + 48, h.mPixelAspectNumerator);
    Put<uint32_t>(p + 52, h.mPixelAspectDenominator);
}

std::optional<FrameHeader> ReadFrameHeader(const void* data, uint64_t size) {
    if (!data || size < kFrameHeaderBytes) return std::nullopt;
    const auto* p = static_cast<const uint8_t*>(data);
    if (Get<uint32_t>(p) != kFrameMagic || Get<uint32_t>(p + 4) != kFrameHeaderBytes) return std::nullopt;
    FrameHeader h;
    h.mWidth = Get<uint32_t>(p + 8);
    h.mHeight = Get<uint32_t>(p + 12);
    h.mRowBytes = Get<uint32_t>(p + 16);
    h.mPixelFormat = Get<uint32_t>(p + 20);
    h.mFieldType = Get<int32_t>(p + 24);
    const int64_t num = Get<int64_t>(p + 32);
    const int64_t den = Get<int64_t>(p + 40);
    h.mPixelAspectNumerator = Get<uint32_t>(p + 48);
    h.mPixelAspectDenominator = Get<uint32_t>(p + 52);
    const uint32_t bpp = BytesPerPixel(h.mPixelFormat);
    if (bpp == 0 || den <= 0 || num == INT64_MIN) return std::nullopt;
    if (uint64_t{h.mRowBytes} < uint64_t{h.mWidth} * bpp) return std::nullopt;
    if (h.FrameBytes() > size) return std::nullopt;
    h.mTime = platform::RatioTime(num, den);
    return h;
}

}  // namespace tidelink
