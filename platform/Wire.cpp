#include "platform/Wire.h"

#include <algorithm>
#include <cstring>
#include <string_view>
#include <unordered_set>

#include "platform/Strings.h"

namespace tidelink::platform::wire {
namespace {

constexpr uint8_t kMagic[4] = {'T', 'L', 'N', 'K'};

void PutU16(Buffer& out, uint16_t v) {
    out.push_back(static_cast<uint8_t>(v));
    out.push_back(static_cast<uint8_t>(v >> 8));
}

uint16_t GetU16(const uint8_t* p) { return static_cast<uint16_t>(p[0] | (p[1] << 8)); }

void PutBigEndian(Buffer& out, uint64_t v, int bytes) {
    for (int i = bytes - 1; i >= 0; --i) out.push_back(static_cast<uint8_t>(v >> (8 * i)));
}

void PutUInt(Buffer& out, uint64_t v) {
    if (v < 0x80) {
        out.push_back(static_cast<uint8_t>(v));
    } else if (v <= 0xFFFFFFFFull) {
        out.push_back(0xce);
        PutBigEndian(out, v, 4);
    } else {
        out.push_back(0xcf);
        PutBigEndian(out, v, 8);
    }
}

void PutInt(Buffer& out, int64_t v) {
    if (v >= 0) return PutUInt(out, static_cast<uint64_t>(v));
    if (v >= -32) {
        out.push_back(static_cast<uint8_t>(v));
    } else {
        out.push_back(0xd3);
        PutBigEndian(out, static_cast<uint64_t>(v), 8);
    }
}

void PutString(Buffer& out, const std::string& s) {
    const size_t n = s.size();
    if (n < 32) {
        out.push_back(static_cast<uint8_t>(0xa0 | n));
    } else if (n <= 0xFF) {
        out.push_back(0xd9);
        out.push_back(static_cast<uint8_t>(n));
    } else if (n <= 0xFFFF) {
        out.push_back(0xda);
        PutBigEndian(out, n, 2);
    } else {
        out.push_back(0xdb);
        PutBigEndian(out, n, 4);
    }
    out.insert(out.end(), s.begin(), s.end());
}

void CheckName(const std::string& name) {
    if (name.empty() || name.size() > kMaxNameLength) throw WireError("message name empty or too long");
    if (!IsValidUTF8(name)) throw WireError("message name is not UTF-8");
}

// Reserves the length prefix, runs |body|, then patches the length (or rolls back).
template <class F>
void AppendFrame(Buffer& out, F&& body) {
    const size_t start = out.size();
    out.resize(start + kFrameHeaderSize);
    try {
        body();
    } catch (const nlohmann::json::exception& e) {
        out.resize(start);
        throw WireError(std::string("cannot encode message: ") + e.what());
    } catch (...) {
        out.resize(start);
        throw;
    }
    const size_t len = out.size() - start - kFrameHeaderSize;
    if (len > kMaxFrameSize) {
        out.resize(start);
        throw WireError("message of " + std::to_string(len) + " bytes exceeds the limit of " +
                        std::to_string(kMaxFrameSize));
    }
    for (int i = 0; i < 4; ++i) out[start + static_cast<size_t>(i)] = static_cast<uint8_t>(len >> (8 * i));
}

void PutArgs(Buffer& out, const Value& args) {
    if (args.is_array()) {
        Value::to_msgpack(args, out);
    } else if (args.is_null()) {
        out.push_back(0x90);  // empty array
    } else {
        out.push_back(0x91);
        Value::to_msgpack(args, out);
    }
}


// Reads MessagePack straight into the tree. Recursion is bounded by the depth limit.
class Reader {
public:
    Reader(const uint8_t* data, size_t size, size_t maxDepth)
        : mPos(data), mEnd(data + size), mMaxDepth(maxDepth) {}

    Value ReadTop() {
        Value v = Read(0);
        if (mPos != mEnd) throw WireError("undecodable message: trailing bytes");
        return v;
    }

private:
    [[noreturn]] static void Truncated() { throw WireError("undecodable message: truncated"); }
    [[noreturn]] static void RepeatedKey() { throw WireError("undecodable message: repeated map key"); }

    size_t Remaining() const { return static_cast<size_t>(mEnd - mPos); }

    uint64_t Big(int bytes) {
        if (Remaining() < static_cast<size_t>(bytes)) Truncated();
        uint64_t v = 0;
        for (int i = 0; i < bytes; ++i) v = (v << 8) | *mPos++;
        return v;
    }

    std::string_view Bytes(size_t n) {
        if (Remaining() < n) Truncated();
        std::string_view view(reinterpret_cast<const char*>(mPos), n);
        mPos += n;
        return view;
    }

    Value Binary(size_t n, bool ext) {
        const int64_t subtype = ext ? static_cast<int8_t>(Big(1)) : -1;
        const auto bytes = Bytes(n);
        Value::binary_t::container_type data(bytes.begin(), bytes.end());
        return ext ? Value::binary(std::move(data), static_cast<std::uint8_t>(subtype)) : Value::binary(std::move(data));
    }

    Value Read(size_t depth) {
        if (mPos == mEnd) Truncated();
        const uint8_t b = *mPos++;
        if (b <= 0x7f) return Value(static_cast<uint64_t>(b));
        if (b >= 0xe0) return Value(static_cast<int64_t>(static_cast<int8_t>(b)));
        if (b >= 0xa0 && b <= 0xbf) return Value(std::string(Bytes(b & 0x1f)));
        if (b >= 0x90 && b <= 0x9f) return Array(b & 0x0f, depth);
        if (b >= 0x80 && b <= 0x8f) return Map(b & 0x0f, depth);
        switch (b) {
            case 0xc0: return Value(nullptr);
            case 0xc2: return Value(false);
            case 0xc3: return Value(true);
            case 0xcc: return Value(Big(1));
            case 0xcd: return Value(Big(2));
            case 0xce: return Value(Big(4));
            case 0xcf: return Value(Big(8));
            case 0xd0: return Value(static_cast<int64_t>(static_cast<int8_t>(Big(1))));
            case 0xd1: return Value(static_cast<int64_t>(static_cast<int16_t>(Big(2))));
            case 0xd2: return Value(static_cast<int64_t>(static_cast<int32_t>(Big(4))));
            case 0xd3: return Value(static_cast<int64_t>(Big(8)));
            case 0xca: {
                const auto bits = static_cast<uint32_t>(Big(4));
                float f;
                std::memcpy(&f, &bits, sizeof(f));
                return Value(static_cast<double>(f));
            }
            case 0xcb: {
                const uint64_t bits = Big(8);
                double d;
                std::memcpy(&d, &bits, sizeof(d));
                return Value(d);
            }
            case 0xd9: return Value(std::string(Bytes(Big(1))));
            case 0xda: return Value(std::string(Bytes(Big(2))));
            case 0xdb: return Value(std::string(Bytes(Big(4))));
            case 0xc4: return Binary(Big(1), false);
            case 0xc5: return Binary(Big(2), false);
            case 0xc6: return Binary(Big(4), false);
            case 0xd4: return Binary(1, true);
            case 0xd5: return Binary(2, true);
            case 0xd6: return Binary(4, true);
            case 0xd7: return Binary(8, true);
            case 0xd8: return Binary(16, true);
            case 0xc7: return Binary(Big(1), true);
            case 0xc8: return Binary(Big(2), true);
            case 0xc9: return Binary(Big(4), true);
            case 0xdc: return Array(Big(2), depth);
            case 0xdd: return Array(Big(4), depth);
            case 0xde: return Map(Big(2), depth);
            case 0xdf: return Map(Big(4), depth);
            default: throw WireError("undecodable message: reserved byte 0xc1");
        }
    }

    void Enter(size_t depth) const {
        if (depth + 1 > mMaxDepth) throw WireError("undecodable message: nested too deeply");
    }

    Value Array(uint64_t count, size_t depth) {
        Enter(depth);
        if (count > Remaining()) Truncated();  // every element takes at least one byte
        Value v = Value::array();
        auto& items = v.get_ref<Value::array_t&>();
        items.reserve(static_cast<size_t>(count));
        for (uint64_t i = 0; i < count; ++i) items.push_back(Read(depth + 1));
        return v;
    }

    Value Map(uint64_t count, size_t depth) {
        Enter(depth);
        if (count > Remaining() / 2) Truncated();  // a key and a value, one byte each at least
        Value v = Value::object();
        auto& members = static_cast<std::vector<std::pair<const std::string, Value>>&>(
            v.get_ref<Value::object_t&>());
        members.reserve(static_cast<size_t>(count));
        // Repeated keys are refused. Small maps sort their keys once at the end; large ones use a
        // set, so a hostile map of millions of keys cannot make the check quadratic.
        constexpr size_t kSmall = 64;
        std::string_view small[kSmall];
        std::unordered_set<std::string_view> seen;
        const bool useSet = count > kSmall;
        if (useSet) seen.reserve(static_cast<size_t>(count));
        for (uint64_t i = 0; i < count; ++i) {
            if (mPos == mEnd) Truncated();
            const uint8_t b = *mPos++;
            std::string_view key;
            if (b >= 0xa0 && b <= 0xbf) key = Bytes(b & 0x1f);
            else if (b == 0xd9) key = Bytes(Big(1));
            else if (b == 0xda) key = Bytes(Big(2));
            else if (b == 0xdb) key = Bytes(Big(4));
            else throw WireError("undecodable message: map key is not a string");
            if (useSet) {
                if (!seen.insert(key).second) RepeatedKey();
            } else {
                small[i] = key;
            }
            members.emplace_back(std::string(key), Read(depth + 1));
        }
        if (!useSet && count > 1) {
            std::sort(small, small + count);
            if (std::adjacent_find(small, small + count) != small + count) RepeatedKey();
        }
        return v;
    }

    const uint8_t* mPos;
    const uint8_t* mEnd;
    size_t mMaxDepth;
};

}  // namespace

void EncodeValue(Buffer& out, const Value& value) { Value::to_msgpack(value, out); }

Value DecodeValue(const uint8_t* data, size_t size, size_t maxDepth) {
    return Reader(data, size, maxDepth).ReadTop();
}

void AppendRequest(Buffer& out, uint64_t id, const std::string& name, const Value& args) {
    CheckName(name);
    AppendFrame(out, [&] {
        out.push_back(0x94);
        out.push_back(static_cast<uint8_t>(Kind::Request));
        PutUInt(out, id);
        PutString(out, name);
        PutArgs(out, args);
    });
}

void AppendNotification(Buffer& out, const std::string& name, const Value& args) {
    CheckName(name);
    AppendFrame(out, [&] {
        out.push_back(0x93);
        out.push_back(static_cast<uint8_t>(Kind::Notification));
        PutString(out, name);
        PutArgs(out, args);
    });
}

void AppendReply(Buffer& out, uint64_t id, const Value& result) {
    AppendFrame(out, [&] {
        out.push_back(0x94);
        out.push_back(static_cast<uint8_t>(Kind::Reply));
        PutUInt(out, id);
        out.push_back(0xc0);  // no error
        Value::to_msgpack(result, out);
    });
}

void AppendErrorReply(Buffer& out, uint64_t id, int32_t code, const std::string& message) {
    AppendFrame(out, [&] {
        out.push_back(0x94);
        out.push_back(static_cast<uint8_t>(Kind::Reply));
        PutUInt(out, id);
        out.push_back(0x92);
        PutInt(out, code);
        PutString(out, IsValidUTF8(message) ? message : ToUTF8(ToUTF16(message)));
        out.push_back(0xc0);
    });
}

uint32_t ReadFrameLength(const uint8_t* p) {
    const uint32_t len = static_cast<uint32_t>(p[0]) | (static_cast<uint32_t>(p[1]) << 8) |
                         (static_cast<uint32_t>(p[2]) << 16) | (static_cast<uint32_t>(p[3]) << 24);
    if (len == 0) throw WireError("empty frame");
    if (len > kMaxFrameSize) {
        throw WireError("frame of " + std::to_string(len) + " bytes exceeds the limit of " +
                        std::to_string(kMaxFrameSize));
    }
    return len;
}

Message DecodeBody(const uint8_t* data, size_t size) {
    Value root = DecodeValue(data, size, kMaxValueDepth + 1);  // +1 for the envelope
    if (!root.is_array() || root.empty() || !root[0].is_number_unsigned()) {
        throw WireError("message is not an envelope array");
    }
    Message m;
    const auto kind = root[0].get<uint64_t>();
    auto requireArgs = [](Value& v) -> Value {
        if (!v.is_array()) throw WireError("arguments are not an array");
        return std::move(v);
    };
    auto requireName = [](const Value& v) -> std::string {
        if (!v.is_string()) throw WireError("message name is not a string");
        std::string name = v.get<std::string>();
        CheckName(name);
        return name;
    };
    if (kind == static_cast<uint64_t>(Kind::Request)) {
        if (root.size() != 4 || !root[1].is_number_unsigned()) throw WireError("malformed request");
        m.kind = Kind::Request;
        m.id = root[1].get<uint64_t>();
        m.name = requireName(root[2]);
        m.args = requireArgs(root[3]);
    } else if (kind == static_cast<uint64_t>(Kind::Reply)) {
        if (root.size() != 4 || !root[1].is_number_unsigned()) throw WireError("malformed reply");
        m.kind = Kind::Reply;
        m.id = root[1].get<uint64_t>();
        const Value& err = root[2];
        if (!err.is_null()) {
            if (!err.is_array() || err.size() != 2 || !err[0].is_number_integer() || !err[1].is_string()) {
                throw WireError("malformed error in reply");
            }
            // Unsigned values past INT64_MAX would wrap when read as signed.
            if (err[0].is_number_unsigned() && err[0].get<uint64_t>() > static_cast<uint64_t>(INT32_MAX)) {
                throw WireError("error code out of range");
            }
            const auto code = err[0].get<int64_t>();
            if (code < INT32_MIN || code > INT32_MAX) throw WireError("error code out of range");
            m.isError = true;
            m.errorCode = static_cast<int32_t>(code);
            m.errorMessage = err[1].get<std::string>();
        } else {
            m.result = std::move(root[3]);
        }
    } else if (kind == static_cast<uint64_t>(Kind::Notification)) {
        if (root.size() != 3) throw WireError("malformed notification");
        m.kind = Kind::Notification;
        m.name = requireName(root[1]);
        m.args = requireArgs(root[2]);
    } else {
        throw WireError("unknown message kind " + std::to_string(kind));
    }
    return m;
}

Buffer MakeHello(const Secret& secret) {
    Buffer out(kMagic, kMagic + 4);
    PutU16(out, kWireVersion);
    PutU16(out, 0);
    out.insert(out.end(), secret.begin(), secret.end());
    return out;
}

HelloStatus CheckHello(const uint8_t* data, const Secret& secret) {
    if (std::memcmp(data, kMagic, 4) != 0) throw WireError("not a session hello");
    // Compare the whole secret regardless of where the first difference is.
    uint8_t diff = 0;
    for (size_t i = 0; i < kSecretSize; ++i) diff = static_cast<uint8_t>(diff | (data[8 + i] ^ secret[i]));
    if (diff != 0) throw WireError("wrong session secret");
    return GetU16(data + 4) == kWireVersion ? HelloStatus::Ok : HelloStatus::VersionMismatch;
}

Buffer MakeAck(HelloStatus status) {
    Buffer out(kMagic, kMagic + 4);
    PutU16(out, kWireVersion);
    PutU16(out, static_cast<uint16_t>(status));
    return out;
}

HelloStatus ReadAck(const uint8_t* data) {
    if (std::memcmp(data, kMagic, 4) != 0) throw WireError("not a session acknowledgement");
    return static_cast<HelloStatus>(GetU16(data + 6));
}

}  // namespace tidelink::platform::wire
