// The tests below replace the global allocator; gcc cannot see that new and free match here.
#pragma GCC diagnostic ignored "-Wmismatched-new-delete"
#include <gtest/gtest.h>

#include <cstdint>
#include <cstdlib>
#include <limits>
#include <new>
#include <string>

#include "platform/Wire.h"

using namespace tidelink::platform;
using namespace tidelink::platform::wire;

// Records the largest single allocation made by the current thread while armed, so a decode test
// can prove that an announced size was not trusted before the bytes were there.
namespace {
thread_local bool tTrackAllocations = false;
thread_local size_t tLargestAllocation = 0;
}  // namespace

void* operator new(size_t n) {
    if (tTrackAllocations && n > tLargestAllocation) tLargestAllocation = n;
    if (void* p = std::malloc(n == 0 ? 1 : n)) return p;
    throw std::bad_alloc();
}
void operator delete(void* p) noexcept { std::free(p); }
void operator delete(void* p, size_t) noexcept { std::free(p); }

namespace {

Buffer Msgpack(const Value& v) {
    Buffer out;
    Value::to_msgpack(v, out);
    return out;
}

Message Decode(const Buffer& body) { return DecodeBody(body.data(), body.size()); }

// Splits a buffer of frames back into messages, checking every length prefix.
std::vector<Message> DecodeStream(const Buffer& stream) {
    std::vector<Message> out;
    size_t pos = 0;
    while (pos < stream.size()) {
        EXPECT_GE(stream.size() - pos, kFrameHeaderSize);
        const uint32_t len = ReadFrameLength(stream.data() + pos);
        pos += kFrameHeaderSize;
        EXPECT_LE(len, stream.size() - pos);
        out.push_back(DecodeBody(stream.data() + pos, len));
        pos += len;
    }
    return out;
}

Value Nested(size_t depth) {
    Value v = Value::array();
    for (size_t i = 1; i < depth; ++i) v = Value::array({v});
    return v;
}

Secret MakeSecret(uint8_t seed) {
    Secret s{};
    for (size_t i = 0; i < s.size(); ++i) s[i] = static_cast<uint8_t>(seed + i * 7);
    return s;
}

}  // namespace

TEST(Wire, FramesOfEveryKindRoundTripInOneStream) {
    const Value args = Value::array(
        {1, -2, -100000, 3.5, true, nullptr, "caf\xc3\xa9 \xf0\x9f\x98\x80",
         Value::array({Value::array({1, 2}), Value::object({{"z", 1}, {"a", Value::array()}})}),
         Value::object({{"id", std::numeric_limits<uint64_t>::max()},
                        {"min", std::numeric_limits<int64_t>::min()}})});
    const Value result = Value::object({{"value", Value::array({"x", 2})}});

    Buffer stream;
    AppendRequest(stream, 0, "com.quenlo.test.Call", args);
    AppendRequest(stream, std::numeric_limits<uint64_t>::max(), "n", Value::array());
    AppendReply(stream, 42, result);
    AppendReply(stream, 43, nullptr);
    AppendErrorReply(stream, 44, std::numeric_limits<int32_t>::min(), "it failed");
    AppendErrorReply(stream, 45, std::numeric_limits<int32_t>::max(), std::string(300, 'e'));
    AppendErrorReply(stream, 46, -5, "bad \xff byte");
    AppendNotification(stream, "com.quenlo.test.Changed", args);
    AppendNotification(stream, "Tick", nullptr);
    AppendNotification(stream, "One", "single");

    const auto m = DecodeStream(stream);
    ASSERT_EQ(m.size(), 10u);

    EXPECT_EQ(m[0].kind, Kind::Request);
    EXPECT_EQ(m[0].id, 0u);
    EXPECT_EQ(m[0].name, "com.quenlo.test.Call");
    EXPECT_EQ(m[0].args, args);
    EXPECT_EQ(m[1].id, std::numeric_limits<uint64_t>::max());
    EXPECT_EQ(m[1].args, Value::array());

    EXPECT_EQ(m[2].kind, Kind::Reply);
    EXPECT_EQ(m[2].id, 42u);
    EXPECT_FALSE(m[2].isError);
    EXPECT_EQ(m[2].result, result);
    EXPECT_TRUE(m[3].result.is_null());
    EXPECT_FALSE(m[3].isError);

    EXPECT_TRUE(m[4].isError);
    EXPECT_EQ(m[4].id, 44u);
    EXPECT_EQ(m[4].errorCode, std::numeric_limits<int32_t>::min());
    EXPECT_EQ(m[4].errorMessage, "it failed");
    EXPECT_EQ(m[5].errorCode, std::numeric_limits<int32_t>::max());
    EXPECT_EQ(m[5].errorMessage, std::string(300, 'e'));
    // Invalid UTF-8 in a message is repaired on the way out, never sent as is.
    EXPECT_EQ(m[6].errorCode, -5);
    EXPECT_EQ(m[6].errorMessage, "bad \xef\xbf\xbd byte");

    EXPECT_EQ(m[7].kind, Kind::Notification);
    EXPECT_EQ(m[7].name, "com.quenlo.test.Changed");
    EXPECT_EQ(m[7].args, args);
    // Null arguments travel as no arguments, a lone value as a one-element array.
    EXPECT_EQ(m[8].args, Value::array());
    EXPECT_EQ(m[9].args, Value::array({"single"}));
}

TEST(Wire, FrameLengthIsChecked) {
    auto le = [](uint32_t v) {
        return Buffer{static_cast<uint8_t>(v), static_cast<uint8_t>(v >> 8),
                      static_cast<uint8_t>(v >> 16), static_cast<uint8_t>(v >> 24)};
    };
    EXPECT_EQ(ReadFrameLength(le(1).data()), 1u);
    EXPECT_EQ(ReadFrameLength(le(0x00A0B0C0).data()), 0x00A0B0C0u);
    EXPECT_EQ(ReadFrameLength(le(kMaxFrameSize).data()), kMaxFrameSize);
    EXPECT_THROW(ReadFrameLength(le(0).data()), WireError);
    EXPECT_THROW(ReadFrameLength(le(kMaxFrameSize + 1).data()), WireError);
    EXPECT_THROW(ReadFrameLength(le(0xFFFFFFFFu).data()), WireError);
}

TEST(Wire, FailingAppendLeavesTheBufferAsItWas) {
    Buffer out;
    AppendNotification(out, "First", Value::array({1}));
    const Buffer before = out;

    EXPECT_THROW(AppendRequest(out, 1, "", Value::array()), WireError);
    EXPECT_THROW(AppendRequest(out, 1, std::string(kMaxNameLength + 1, 'n'), nullptr), WireError);
    EXPECT_THROW(AppendNotification(out, "bad\xc0\xafname", nullptr), WireError);
    const Value huge = Value::array({std::string(kMaxFrameSize, 'x')});
    EXPECT_THROW(AppendRequest(out, 1, "Big", huge), WireError);
    EXPECT_THROW(AppendNotification(out, "Big", huge), WireError);
    EXPECT_THROW(AppendReply(out, 1, huge), WireError);
    EXPECT_THROW(AppendErrorReply(out, 1, 1, std::string(kMaxFrameSize, 'x')), WireError);
    EXPECT_EQ(out, before);

    // The longest acceptable name still goes through.
    AppendRequest(out, 2, std::string(kMaxNameLength, 'n'), nullptr);
    const auto m = DecodeStream(out);
    ASSERT_EQ(m.size(), 2u);
    EXPECT_EQ(m[1].name.size(), kMaxNameLength);
}

TEST(Wire, TruncatedOrPaddedBodiesAreRefused) {
    Buffer frame;
    AppendRequest(frame, 300, "com.quenlo.test.Call",
                  Value::array({"text", Value::object({{"k", 1.25}}), -70000}));
    const Buffer body(frame.begin() + kFrameHeaderSize, frame.end());
    ASSERT_NO_THROW(Decode(body));
    EXPECT_THROW(DecodeBody(body.data(), 0), WireError);
    for (size_t n = 1; n < body.size(); ++n) {
        EXPECT_THROW(DecodeBody(body.data(), n), WireError) << "prefix of " << n << " bytes";
    }
    Buffer padded = body;
    padded.push_back(0xc0);
    EXPECT_THROW(Decode(padded), WireError);
}

TEST(Wire, MalformedEnvelopesAreRefused) {
    const Value args = Value::array();
    const Value cases[] = {
        Value::object({{"kind", 0}}),                        // not an array
        Value::array(),                                      // empty
        "request",                                           // not an array
        Value::array({-1, 1, "n", args}),                    // negative kind
        Value::array({"0", 1, "n", args}),                   // kind as text
        Value::array({3, 1, "n", args}),                     // unknown kind
        Value::array({0, 1, "n"}),                           // request of 3
        Value::array({0, 1, "n", args, 5}),                  // request of 5
        Value::array({0, -1, "n", args}),                    // negative id
        Value::array({0, 1.0, "n", args}),                   // fractional id
        Value::array({0, 1, 5, args}),                       // name not a string
        Value::array({0, 1, "", args}),                      // empty name
        Value::array({0, 1, std::string(kMaxNameLength + 1, 'n'), args}),
        Value::array({0, 1, "bad\xff", args}),               // name not UTF-8
        Value::array({0, 1, "n", Value::object()}),          // args not an array
        Value::array({0, 1, "n", "x"}),                      // args not an array
        Value::array({0, 1, "n", nullptr}),                  // args not an array
        Value::array({1, 1, nullptr}),                       // reply of 3
        Value::array({1, 1, nullptr, 1, 2}),                 // reply of 5
        Value::array({1, "1", nullptr, 1}),                  // id as text
        Value::array({1, 1, 7, nullptr}),                    // error not an array
        Value::array({1, 1, Value::array({7}), nullptr}),    // error of 1
        Value::array({1, 1, Value::array({7, "m", 1}), nullptr}),
        Value::array({1, 1, Value::array({"7", "m"}), nullptr}),
        Value::array({1, 1, Value::array({7, 8}), nullptr}),
        Value::array({1, 1, Value::array({int64_t{INT32_MAX} + 1, "m"}), nullptr}),
        Value::array({1, 1, Value::array({int64_t{INT32_MIN} - 1, "m"}), nullptr}),
        Value::array({1, 1, Value::array({std::numeric_limits<int64_t>::min(), "m"}), nullptr}),
        Value::array({2, "n"}),                              // notification of 2
        Value::array({2, "n", args, 1}),                     // notification of 4
        Value::array({2, 1, args}),                          // name not a string
        Value::array({2, "", args}),                         // empty name
        Value::array({2, "n", Value::object()}),             // args not an array
    };
    for (const auto& c : cases) {
        EXPECT_THROW(Decode(Msgpack(c)), WireError) << c.dump();
    }
}

// An error code sent as a huge unsigned number wraps to a small negative one when read as int64,
// so 0xFFFFFFFFFFFFFFFF is accepted as -1 instead of being refused as out of range.
TEST(Wire, UnsignedErrorCodePastInt64IsRefused) {
    for (uint64_t code : {std::numeric_limits<uint64_t>::max(), uint64_t{0xFFFFFFFF80000000ull},
                          uint64_t{0x8000000000000001ull}}) {
        const Value reply = Value::array({1, 1, Value::array({code, "m"}), nullptr});
        EXPECT_THROW(Decode(Msgpack(reply)), WireError) << code;
    }
}

TEST(Wire, NestingIsLimited) {
    // The envelope takes one level; arguments may use the rest.
    Buffer ok;
    AppendRequest(ok, 1, "Deep", Nested(kMaxValueDepth));
    EXPECT_EQ(DecodeStream(ok)[0].args, Nested(kMaxValueDepth));

    Buffer deep;
    AppendRequest(deep, 1, "Deep", Nested(kMaxValueDepth + 1));
    EXPECT_THROW(DecodeBody(deep.data() + kFrameHeaderSize, deep.size() - kFrameHeaderSize),
                 WireError);

    Buffer deepMap = Msgpack(Value::array({2, "n", Value::array({})}));
    deepMap.pop_back();  // drop the empty args array, put {"a": {"a": ... }} in its place
    deepMap.push_back(0x91);
    for (int i = 0; i < 200; ++i) {
        deepMap.push_back(0x81);
        deepMap.push_back(0xa1);
        deepMap.push_back('a');
    }
    deepMap.push_back(0xc0);
    EXPECT_THROW(Decode(deepMap), WireError);

    // A frame-sized run of one-element arrays must be refused, not recursed into.
    Buffer bomb(kMaxFrameSize, 0x91);
    EXPECT_THROW(Decode(bomb), WireError);
}

TEST(Wire, AnnouncedSizesAreNotTrustedBeforeTheBytesArrive) {
    const Buffer prefix = Msgpack(Value::array({0, 1, "n"}));
    auto request = [&](std::initializer_list<uint8_t> argsHeader) {
        Buffer b(prefix);
        b[0] = 0x94;  // four elements: the args follow
        b.insert(b.end(), argsHeader);
        b.insert(b.end(), {0x01, 0x02, 0x03});
        return b;
    };
    const Buffer cases[] = {
        request({0xdd, 0x80, 0x00, 0x00, 0x00}),        // array of 2^31 elements
        request({0xdd, 0xff, 0xff, 0xff, 0xff}),        // array of 2^32 - 1 elements
        request({0xdf, 0xff, 0xff, 0xff, 0xff}),        // map of 2^32 - 1 pairs
        request({0x91, 0xdb, 0x06, 0x40, 0x00, 0x00}),  // string of 100 MB
        request({0x91, 0xc6, 0x06, 0x40, 0x00, 0x00}),  // binary of 100 MB
        request({0x91, 0xc9, 0x06, 0x40, 0x00, 0x00, 0x01}),  // extension of 100 MB
        Buffer{0xdd, 0x80, 0x00, 0x00, 0x00, 0x00},     // envelope of 2^31 elements
    };
    auto largestWhileDecoding = [](const Buffer& body, bool& threw) {
        tLargestAllocation = 0;
        tTrackAllocations = true;
        threw = false;
        try {
            Decode(body);
        } catch (const WireError&) {
            threw = true;
        }
        tTrackAllocations = false;
        return tLargestAllocation;
    };
    bool threw = false;
    // The tracker sees a string that is really there.
    Buffer real;
    AppendNotification(real, "n", Value::array({std::string(1 << 20, 's')}));
    real.erase(real.begin(), real.begin() + kFrameHeaderSize);
    EXPECT_GE(largestWhileDecoding(real, threw), size_t{1} << 20);
    EXPECT_FALSE(threw);

    for (const auto& body : cases) {
        EXPECT_LT(largestWhileDecoding(body, threw), 64u * 1024u)
            << "body starting " << int(body[0]);
        EXPECT_TRUE(threw);
    }
}

TEST(Wire, HelloAndAcknowledgement) {
    const Secret secret = MakeSecret(3);
    Buffer hello = MakeHello(secret);
    ASSERT_EQ(hello.size(), kHelloSize);
    EXPECT_EQ(CheckHello(hello.data(), secret), HelloStatus::Ok);

    EXPECT_THROW(CheckHello(hello.data(), MakeSecret(4)), WireError);
    Secret lastByte = secret;
    lastByte[kSecretSize - 1] ^= 1;
    EXPECT_THROW(CheckHello(hello.data(), lastByte), WireError);

    Buffer otherVersion = hello;
    otherVersion[4] = static_cast<uint8_t>(kWireVersion + 1);
    EXPECT_EQ(CheckHello(otherVersion.data(), secret), HelloStatus::VersionMismatch);
    // A peer with another version but the wrong secret learns nothing about the version.
    EXPECT_THROW(CheckHello(otherVersion.data(), MakeSecret(9)), WireError);

    Buffer badMagic = hello;
    badMagic[0] = 'X';
    EXPECT_THROW(CheckHello(badMagic.data(), secret), WireError);

    const Buffer ok = MakeAck(HelloStatus::Ok);
    ASSERT_EQ(ok.size(), kAckSize);
    EXPECT_EQ(ReadAck(ok.data()), HelloStatus::Ok);
    EXPECT_EQ(ReadAck(MakeAck(HelloStatus::VersionMismatch).data()), HelloStatus::VersionMismatch);
    Buffer badAck = ok;
    badAck[3] = 0;
    EXPECT_THROW(ReadAck(badAck.data()), WireError);
}

// Maps with a repeated key are refused whatever their size, and a large hostile map is checked
// without quadratic work (the test would time out otherwise).
TEST(Wire, RepeatedMapKeysAreRefused) {
    auto mapOf = [](size_t n, bool repeatLast) {
        Buffer out;
        out.push_back(0xdf);
        for (int shift = 24; shift >= 0; shift -= 8) out.push_back(static_cast<uint8_t>(n >> shift));
        for (size_t i = 0; i < n; ++i) {
            const std::string key = "k" + std::to_string(repeatLast && i + 1 == n ? 0 : i);
            out.push_back(static_cast<uint8_t>(0xa0 | key.size()));
            out.insert(out.end(), key.begin(), key.end());
            out.push_back(static_cast<uint8_t>(i & 0x7f));
        }
        return out;
    };
    for (size_t n : {2u, 17u, 64u, 65u, 200000u}) {
        const Buffer ok = mapOf(n, false);
        EXPECT_EQ(DecodeValue(ok.data(), ok.size()).size(), n);
        const Buffer bad = mapOf(n, true);
        EXPECT_THROW(DecodeValue(bad.data(), bad.size()), WireError) << n << " keys";
    }
    // Member order is kept as sent.
    const Buffer ordered = mapOf(3, false);
    const Value v = DecodeValue(ordered.data(), ordered.size());
    EXPECT_EQ(v.begin().key(), "k0");
    EXPECT_EQ((--v.end()).key(), "k2");
}
