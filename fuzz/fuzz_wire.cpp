// Feeds arbitrary bytes to the session decoders. The input is read as a stream of frames, the way
// a session reads its socket, and also as a hello and an acknowledgement. WireError is the only
// accepted way to refuse input; any other exception, crash or sanitizer report is a finding.
//
// Every message that decodes is encoded again, and that encoding must decode and re-encode to
// the same bytes: what the decoder accepts, the encoder must be able to send.
#include <cstddef>
#include <cstdint>
#include <cstdlib>

#include "platform/Wire.h"

using namespace tidelink::platform::wire;

namespace {

void Encode(Buffer& out, const Message& m) {
    switch (m.kind) {
        case Kind::Request:
            AppendRequest(out, m.id, m.name, m.args);
            break;
        case Kind::Notification:
            AppendNotification(out, m.name, m.args);
            break;
        case Kind::Reply:
            if (m.isError) {
                AppendErrorReply(out, m.id, m.errorCode, m.errorMessage);
            } else {
                AppendReply(out, m.id, m.result);
            }
            break;
    }
}

void CheckReencoding(const Message& m) {
    Buffer first;
    Encode(first, m);
    const uint32_t len = ReadFrameLength(first.data());
    if (len != first.size() - kFrameHeaderSize) std::abort();
    const Message again = DecodeBody(first.data() + kFrameHeaderSize, len);
    if (again.kind != m.kind || again.id != m.id || again.name != m.name ||
        again.isError != m.isError || again.errorCode != m.errorCode) {
        std::abort();
    }
    Buffer second;
    Encode(second, again);
    if (second != first) std::abort();
}

void DecodeStream(const uint8_t* data, size_t size) {
    size_t pos = 0;
    while (size - pos >= kFrameHeaderSize) {
        uint32_t len = 0;
        try {
            len = ReadFrameLength(data + pos);
        } catch (const WireError&) {
            return;  // a session drops the connection here
        }
        pos += kFrameHeaderSize;
        if (len > size - pos) return;  // waits for more bytes
        bool decoded = false;
        Message m;
        try {
            m = DecodeBody(data + pos, len);
            decoded = true;
        } catch (const WireError&) {
        }
        if (decoded) CheckReencoding(m);
        pos += len;
    }
}

void DecodeHandshake(const uint8_t* data, size_t size) {
    if (size >= kAckSize) {
        try {
            const auto status = ReadAck(data);
            (void)status;
        } catch (const WireError&) {
        }
    }
    if (size >= kHelloSize) {
        Secret fixed{};
        for (size_t i = 0; i < fixed.size(); ++i) fixed[i] = static_cast<uint8_t>(i);
        Secret own{};
        for (size_t i = 0; i < own.size(); ++i) own[i] = data[8 + i];
        for (const Secret* secret : {&fixed, &own}) {
            try {
                const auto status = CheckHello(data, *secret);
                if (status != HelloStatus::Ok && status != HelloStatus::VersionMismatch) {
                    std::abort();
                }
            } catch (const WireError&) {
            }
        }
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    DecodeStream(data, size);
    DecodeHandshake(data, size);
    return 0;
}
