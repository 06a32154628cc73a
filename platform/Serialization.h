// The serialization tree: every request argument, reply and record travels as a Value.
//
// A Value holds null, bool, signed or unsigned 64-bit integers, doubles, UTF-8 strings, arrays
// and objects whose members keep their insertion order. A type T takes part by providing
// to_json(Value&, const T&) and from_json(const Value&, T&) in its own namespace; it then passes
// directly as a request argument (Value(record)) and comes back from a reply (value.get<T>()).
//
// Conversion errors throw nlohmann::json::exception (type_error, out_of_range, parse_error);
// its what() is the serializer's own message.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include <nlohmann/json.hpp>

#include "platform/Export.h"
#include "platform/Guid.h"
#include "platform/Strings.h"

namespace tidelink::platform {

using Value = nlohmann::ordered_json;

// Nesting limit for every tree read from outside (wire or JSON text).
inline constexpr size_t kMaxValueDepth = 64;

// A named call with its positional arguments (always an array).
struct Call {
    std::string name;
    Value args = Value::array();
};

// |args| must be an array (or null for "no arguments"); anything else becomes a one-element array.
TIDELINK_EXPORT Call BuildCall(std::string name, Value args = Value::array());

// Compact JSON text (indent < 0) or pretty-printed with |indent| spaces. Invalid UTF-8 in strings
// is replaced by U+FFFD rather than throwing.
TIDELINK_EXPORT std::string ToJSONText(const Value& v, int indent = -1);

// Strict JSON text parser. Throws nlohmann::json::parse_error on malformed text, and
// nlohmann::json::out_of_range (id 408) past kMaxValueDepth levels of nesting.
TIDELINK_EXPORT Value ParseJSONText(std::string_view text);

// Reads "value" of a reply object; an absent "value" (or a non-object reply) gives T{}.
template <class T>
T ReplyValue(const Value& reply) {
    if (reply.is_object()) {
        auto it = reply.find("value");
        if (it != reply.end() && !it->is_null()) return it->template get<T>();
    }
    return T{};
}

// GUIDs travel as their 36-character text.
TIDELINK_EXPORT void to_json(Value& j, const Guid& g);
TIDELINK_EXPORT void from_json(const Value& j, Guid& g);

}  // namespace tidelink::platform

// Wide strings travel as UTF-8.
namespace nlohmann {
template <>
struct adl_serializer<std::u16string> {
    static void to_json(tidelink::platform::Value& j, const std::u16string& s) {
        j = tidelink::platform::ToUTF8(s);
    }
    static void to_json(nlohmann::json& j, const std::u16string& s) {
        j = tidelink::platform::ToUTF8(s);
    }
    template <class J>
    static void from_json(const J& j, std::u16string& s) {
        s = tidelink::platform::ToUTF16(j.template get_ref<const std::string&>());
    }
};
}  // namespace nlohmann
