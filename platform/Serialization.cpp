#include "platform/Serialization.h"

#include "platform/SerializationDetail.h"

namespace tidelink::platform {

Call BuildCall(std::string name, Value args) {
    Call c;
    c.name = std::move(name);
    if (args.is_array()) {
        c.args = std::move(args);
    } else if (!args.is_null()) {
        c.args = Value::array({std::move(args)});
    }
    return c;
}

std::string ToJSONText(const Value& v, int indent) {
    return v.dump(indent, ' ', false, Value::error_handler_t::replace);
}

Value ParseJSONText(std::string_view text) {
    Value result;
    detail::DepthLimitedSax sax(result, kMaxValueDepth);
    Value::sax_parse(text.begin(), text.end(), &sax, nlohmann::detail::input_format_t::json, true,
                     false);
    return result;
}

void to_json(Value& j, const Guid& g) { j = g.ToString(); }

void from_json(const Value& j, Guid& g) {
    const auto& s = j.get_ref<const std::string&>();
    auto parsed = Guid::Parse(std::string_view(s));
    if (!parsed) {
        throw nlohmann::json::type_error::create(302, "GUID text must be 36 characters 8-4-4-4-12",
                                                 &j);
    }
    g = *parsed;
}

}  // namespace tidelink::platform
