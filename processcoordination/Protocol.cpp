#include "processcoordination/Protocol.h"

#include <limits>

namespace tidelinkmanager::processcoordinationprotocol {

using tidelink::platform::Guid;
using tidelink::platform::Value;

void to_json(Value& j, const BinaryReferenceDescription& d) {
    j = Value::object();
    j["result"] = static_cast<int64_t>(d.result);
    j["filename"] = d.filename;
    j["size"] = d.size;
}

void from_json(const Value& j, BinaryReferenceDescription& d) {
    BinaryReferenceDescription out;
    const int64_t result = j.at("result").get<int64_t>();
    out.result = result < std::numeric_limits<int32_t>::min() || result > std::numeric_limits<int32_t>::max()
                     ? -1
                     : static_cast<int32_t>(result);
    if (auto it = j.find("filename"); it != j.end() && !it->is_null()) out.filename = it->get<std::string>();
    if (auto it = j.find("size"); it != j.end() && !it->is_null()) out.size = it->get<uint64_t>();
    d = std::move(out);
}

void to_json(Value& j, const BinaryReferenceAvailable& a) {
    j = Value::object();
    j["identifier"] = a.identifier.ToString();
    j["reference"] = a.reference;
}

void from_json(const Value& j, BinaryReferenceAvailable& a) {
    auto id = Guid::Parse(j.at("identifier").get_ref<const std::string&>());
    if (!id) throw Value::type_error::create(302, "identifier is not a GUID", &j);
    a.identifier = *id;
    a.reference = j.at("reference").get<BinaryReferenceDescription>();
}

bool ReadBoolean(const Value& v) {
    if (v.is_boolean()) return v.get<bool>();
    if (v.is_number_integer() || v.is_number_unsigned()) return v.get<int64_t>() != 0;
    if (v.is_string()) return v.get_ref<const std::string&>() == "true";
    return false;
}

}  // namespace tidelinkmanager::processcoordinationprotocol
