// 128-bit identifiers, written as 36 characters (8-4-4-4-12 lower-case hexadecimal, no braces).
// New GUIDs are version 4 from the kernel's random source; they act as capabilities (whoever
// knows a frame's GUID may ask for its data), so they must not be guessable.
#pragma once

#include <array>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Export.h"
#include "platform/Strings.h"

namespace tidelink::platform {

class TIDELINK_EXPORT Guid {
public:
    Guid() = default;  // nil
    explicit Guid(const std::array<uint8_t, 16>& bytes) : mBytes(bytes) {}

    static Guid New();
    // Strict: exactly 36 characters, hyphens at 8, 13, 18, 23, hex digits elsewhere (either case).
    static std::optional<Guid> Parse(std::string_view text);
    static std::optional<Guid> Parse(std::u16string_view text);

    bool IsNil() const;
    std::string ToString() const;
    WString ToWString() const { return ToUTF16(ToString()); }
    const std::array<uint8_t, 16>& Bytes() const { return mBytes; }

    friend bool operator==(const Guid& a, const Guid& b) { return a.mBytes == b.mBytes; }
    friend bool operator!=(const Guid& a, const Guid& b) { return !(a == b); }
    friend bool operator<(const Guid& a, const Guid& b) { return a.mBytes < b.mBytes; }

private:
    std::array<uint8_t, 16> mBytes{};
};

// Fills |out| from the kernel's random source (getrandom); never from time or pid.
TIDELINK_EXPORT void FillRandom(void* out, size_t size);

}  // namespace tidelink::platform

template <>
struct std::hash<tidelink::platform::Guid> {
    size_t operator()(const tidelink::platform::Guid& g) const noexcept {
        uint64_t a = 0, b = 0;
        for (int i = 0; i < 8; ++i) a = (a << 8) | g.Bytes()[static_cast<size_t>(i)];
        for (int i = 8; i < 16; ++i) b = (b << 8) | g.Bytes()[static_cast<size_t>(i)];
        return static_cast<size_t>(a ^ (b * 0x9E3779B97F4A7C15ull));
    }
};
