#include "platform/media/ValueAccess.h"

#include <cmath>

namespace tidelink::platform {

void ThrowTypeError(const Value& v, const char* expected) {
    throw nlohmann::json::type_error::create(
        302, std::string("type must be ") + expected + ", but is " + v.type_name(), &v);
}

void ThrowRangeError(const Value& v, const char* field) {
    throw nlohmann::json::type_error::create(
        302, std::string("number does not fit a ") + field + " field", &v);
}

int64_t ReadInt64(const Value& v) {
    switch (v.type()) {
    case Value::value_t::number_integer:
        return v.get_ref<const Value::number_integer_t&>();
    case Value::value_t::number_unsigned: {
        const uint64_t u = v.get_ref<const Value::number_unsigned_t&>();
        if (u > static_cast<uint64_t>(std::numeric_limits<int64_t>::max())) {
            ThrowRangeError(v, "signed 64-bit");
        }
        return static_cast<int64_t>(u);
    }
    case Value::value_t::number_float: {
        const double d = v.get_ref<const Value::number_float_t&>();
        // 2^63 is exact as a double; the range is [-2^63, 2^63).
        if (!(d >= -9223372036854775808.0 && d < 9223372036854775808.0) || std::trunc(d) != d) {
            ThrowRangeError(v, "signed 64-bit");
        }
        return static_cast<int64_t>(d);
    }
    default:
        ThrowTypeError(v, "integer");
    }
}

uint64_t ReadUInt64(const Value& v) {
    switch (v.type()) {
    case Value::value_t::number_unsigned:
        return v.get_ref<const Value::number_unsigned_t&>();
    case Value::value_t::number_integer: {
        const int64_t i = v.get_ref<const Value::number_integer_t&>();
        if (i < 0) ThrowRangeError(v, "unsigned");
        return static_cast<uint64_t>(i);
    }
    case Value::value_t::number_float: {
        const double d = v.get_ref<const Value::number_float_t&>();
        if (!(d >= 0.0 && d < 18446744073709551616.0) || std::trunc(d) != d) {
            ThrowRangeError(v, "unsigned 64-bit");
        }
        return static_cast<uint64_t>(d);
    }
    default:
        ThrowTypeError(v, "integer");
    }
}

double ReadDouble(const Value& v) {
    switch (v.type()) {
    case Value::value_t::number_float:
        return v.get_ref<const Value::number_float_t&>();
    case Value::value_t::number_integer:
        return static_cast<double>(v.get_ref<const Value::number_integer_t&>());
    case Value::value_t::number_unsigned:
        return static_cast<double>(v.get_ref<const Value::number_unsigned_t&>());
    default:
        ThrowTypeError(v, "number");
    }
}

float ReadFloat(const Value& v) {
    const double d = ReadDouble(v);
    constexpr double kMax = std::numeric_limits<float>::max();
    if (d > kMax) return std::numeric_limits<float>::infinity();
    if (d < -kMax) return -std::numeric_limits<float>::infinity();
    return static_cast<float>(d);
}

bool ReadBool(const Value& v) {
    if (!v.is_boolean()) ThrowTypeError(v, "boolean");
    return v.get_ref<const Value::boolean_t&>();
}

const std::string& ReadString(const Value& v) {
    if (!v.is_string()) ThrowTypeError(v, "string");
    return v.get_ref<const std::string&>();
}

WString ReadWString(const Value& v) { return ToUTF16(ReadString(v)); }

std::vector<double> ReadDoubleArray(const Value& v) {
    RequireArray(v);
    std::vector<double> out;
    out.reserve(v.size());
    for (const auto& e : v) out.push_back(ReadDouble(e));
    return out;
}

std::vector<WString> ReadWStringArray(const Value& v) {
    RequireArray(v);
    std::vector<WString> out;
    out.reserve(v.size());
    for (const auto& e : v) out.push_back(ReadWString(e));
    return out;
}

}  // namespace tidelink::platform
