// Checked readers for the serialization tree, shared by every record converter.
//
// They fail with the serializer's own type_error (id 302) when a value has the wrong kind or does
// not fit the field it is read into, so that a record is either read whole or not at all. Integer
// fields accept signed and unsigned integers, and doubles that hold an integral value in range.
#pragma once

#include <cstdint>
#include <limits>
#include <string>
#include <type_traits>
#include <vector>

#include "platform/Export.h"
#include "platform/Serialization.h"
#include "platform/Strings.h"

namespace tidelink::platform {

[[noreturn]] TIDELINK_EXPORT void ThrowTypeError(const Value& v, const char* expected);
[[noreturn]] TIDELINK_EXPORT void ThrowRangeError(const Value& v, const char* field);

// The member |key| of |object|, or nullptr when |object| lacks it. |object| must be an object.
inline const Value* FindMember(const Value& object, const char* key) {
    auto it = object.find(key);
    return it == object.end() ? nullptr : &*it;
}

inline const Value& RequireObject(const Value& v) {
    if (!v.is_object()) ThrowTypeError(v, "object");
    return v;
}

inline const Value& RequireArray(const Value& v) {
    if (!v.is_array()) ThrowTypeError(v, "array");
    return v;
}

// A required member: a missing one reads as null and so fails with the kind that was expected.
inline const Value& MemberOrNull(const Value& object, const char* key) {
    static const Value kNull;
    const Value* m = FindMember(object, key);
    return m ? *m : kNull;
}

TIDELINK_EXPORT int64_t ReadInt64(const Value& v);
TIDELINK_EXPORT uint64_t ReadUInt64(const Value& v);
TIDELINK_EXPORT double ReadDouble(const Value& v);
// Doubles beyond the float range become infinities of the same sign.
TIDELINK_EXPORT float ReadFloat(const Value& v);
TIDELINK_EXPORT bool ReadBool(const Value& v);
TIDELINK_EXPORT const std::string& ReadString(const Value& v);
TIDELINK_EXPORT WString ReadWString(const Value& v);

// A signed or unsigned integer of any width, range-checked.
template <class T>
T ReadInteger(const Value& v) {
    static_assert(std::is_integral_v<T> && !std::is_same_v<T, bool>);
    if constexpr (std::is_signed_v<T>) {
        const int64_t x = ReadInt64(v);
        if (x < std::numeric_limits<T>::min() || x > std::numeric_limits<T>::max()) {
            ThrowRangeError(v, sizeof(T) == 4 ? "32-bit signed" : "signed");
        }
        return static_cast<T>(x);
    } else {
        const uint64_t x = ReadUInt64(v);
        if (x > std::numeric_limits<T>::max()) {
            ThrowRangeError(v, sizeof(T) == 4 ? "32-bit unsigned" : "unsigned");
        }
        return static_cast<T>(x);
    }
}

// A 32-bit enumeration that travels as an integer; every value of the underlying type is kept.
template <class E>
E ReadEnum(const Value& v) {
    return static_cast<E>(ReadInteger<std::underlying_type_t<E>>(v));
}

template <class E>
int64_t EnumToWire(E e) {
    return static_cast<int64_t>(static_cast<std::underlying_type_t<E>>(e));
}

TIDELINK_EXPORT std::vector<double> ReadDoubleArray(const Value& v);
TIDELINK_EXPORT std::vector<WString> ReadWStringArray(const Value& v);

}  // namespace tidelink::platform
