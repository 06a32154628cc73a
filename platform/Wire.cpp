#include "platform/Wire.h"

#include <cstring>

#include "platform/SerializationDetail.h"
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

}  // namespace

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
    Value root;
    try {
        detail::DepthLimitedSax sax(root, kMaxValueDepth + 1);  // +1 for the envelope
        Value::sax_parse(data, data + size, &sax, nlohmann::detail::input_format_t::msgpack, true);
    } catch (const nlohmann::json::exception& e) {
        throw WireError(std::string("undecodable message: ") + e.what());
    }
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
