#include "platform/Guid.h"

#include <sys/random.h>

#include <cerrno>
#include <stdexcept>

namespace tidelink::platform {
namespace {

int HexValue(char c) {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
}

// Per-thread pool of random bytes: one getrandom() call serves 256 GUIDs.
struct RandomPool {
    uint8_t bytes[4096];
    size_t used = sizeof(bytes);
};

}  // namespace

void FillRandom(void* out, size_t size) {
    auto* p = static_cast<uint8_t*>(out);
    while (size > 0) {
        const ssize_t n = getrandom(p, size, 0);
        if (n < 0) {
            if (errno == EINTR) continue;
            throw std::runtime_error("getrandom failed");
        }
        p += n;
        size -= static_cast<size_t>(n);
    }
}

Guid Guid::New() {
    thread_local RandomPool pool;
    if (pool.used + 16 > sizeof(pool.bytes)) {
        FillRandom(pool.bytes, sizeof(pool.bytes));
        pool.used = 0;
    }
    std::array<uint8_t, 16> b;
    for (size_t i = 0; i < 16; ++i) b[i] = pool.bytes[pool.used + i];
    // Scrub what was handed out so a later core dump does not reveal issued GUIDs.
    for (size_t i = 0; i < 16; ++i) pool.bytes[pool.used + i] = 0;
    pool.used += 16;
    b[6] = static_cast<uint8_t>((b[6] & 0x0F) | 0x40);  // version 4
    b[8] = static_cast<uint8_t>((b[8] & 0x3F) | 0x80);  // RFC 4122 variant
    return Guid(b);
}

std::optional<Guid> Guid::Parse(std::string_view text) {
    if (text.size() != 36) return std::nullopt;
    std::array<uint8_t, 16> b{};
    size_t out = 0;
    for (size_t i = 0; i < 36;) {
        if (i == 8 || i == 13 || i == 18 || i == 23) {
            if (text[i] != '-') return std::nullopt;
            ++i;
            continue;
        }
        const int hi = HexValue(text[i]);
        const int lo = HexValue(text[i + 1]);
        if (hi < 0 || lo < 0) return std::nullopt;
        b[out++] = static_cast<uint8_t>(hi * 16 + lo);
        i += 2;
    }
    return Guid(b);
}

std::optional<Guid> Guid::Parse(std::u16string_view text) {
    if (text.size() != 36) return std::nullopt;
    std::string narrow(36, ' ');
    for (size_t i = 0; i < 36; ++i) {
        if (text[i] > 0x7F) return std::nullopt;
        narrow[i] = static_cast<char>(text[i]);
    }
    return Parse(std::string_view(narrow));
}

bool Guid::IsNil() const {
    for (auto v : mBytes)
        if (v != 0) return false;
    return true;
}

std::string Guid::ToString() const {
    static constexpr char kHex[] = "0123456789abcdef";
    std::string s;
    s.reserve(36);
    for (size_t i = 0; i < 16; ++i) {
        if (i == 4 || i == 6 || i == 8 || i == 10) s.push_back('-');
        s.push_back(kHex[mBytes[i] >> 4]);
        s.push_back(kHex[mBytes[i] & 0xF]);
    }
    return s;
}

}  // namespace tidelink::platform
