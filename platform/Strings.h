// UTF-8 / UTF-16 conversion. Wide strings are UTF-16 code units (std::u16string), the same
// width on every platform, so that names and messages compare and hash identically on both
// ends of a link.
#pragma once

#include <string>
#include <string_view>

#include "platform/Export.h"

namespace tidelink::platform {

using WString = std::u16string;

// Invalid input sequences become U+FFFD; conversion never throws.
TIDELINK_EXPORT std::string ToUTF8(std::u16string_view in);
TIDELINK_EXPORT WString ToUTF16(std::string_view in);

// True when |in| is well-formed UTF-8 (no overlongs, surrogates or code points past U+10FFFF).
TIDELINK_EXPORT bool IsValidUTF8(std::string_view in);

}  // namespace tidelink::platform
