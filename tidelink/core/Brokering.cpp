#include "tidelink/core/Brokering.h"

#include "platform/media/ValueAccess.h"

namespace tidelink {

using namespace platform;

void to_json(Value& j, const ServerConnection& r) {
    j = Value::object();
    j["address"] = r.mAddress;
    j["port"] = r.mPort;
}

void from_json(const Value& j, ServerConnection& r) {
    RequireObject(j);
    ServerConnection out;
    if (const Value* v = FindMember(j, "address")) out.mAddress = ReadString(*v);
    if (const Value* v = FindMember(j, "port")) out.mPort = ReadInteger<uint16_t>(*v);
    r = std::move(out);
}

}  // namespace tidelink
