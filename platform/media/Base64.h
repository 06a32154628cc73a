// Binary-to-text encoding of opaque bytes inside records (colour-profile data): standard base64
// alphabet with '=' padding, no line breaks.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Export.h"

namespace tidelink::platform {

TIDELINK_EXPORT std::string EncodeBase64(const std::vector<uint8_t>& bytes);

// Strict: the length must be a multiple of four, padding only at the end, no other characters.
// Returns nullopt on anything else.
TIDELINK_EXPORT std::optional<std::vector<uint8_t>> DecodeBase64(std::string_view text);

}  // namespace tidelink::platform
