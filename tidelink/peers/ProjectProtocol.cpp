#include "tidelink/peers/ProjectProtocol.h"

#include "platform/media/ValueAccess.h"

namespace tidelink {

using namespace platform;

namespace {

std::string OptString(const Value& j, const char* key) {
    const Value* v = FindMember(j, key);
    return v && !v->is_null() ? ReadString(*v) : std::string();
}

template <class T, class F>
std::vector<T> ReadArrayOf(const Value& j, const char* key, F read) {
    std::vector<T> out;
    const Value* v = FindMember(j, key);
    if (!v || v->is_null()) return out;
    RequireArray(*v);
    out.reserve(v->size());
    for (const auto& e : *v) out.push_back(read(RequireObject(e)));
    return out;
}

}  // namespace

void to_json(Value& j, const MissingAssets& r) {
    Value fonts = Value::array();
    for (const auto& f : r.mMissingFonts) {
        fonts.push_back({{"missAssetPropFontFamily", f.mFamily},
                         {"missAssetPropFontStyle", f.mStyle},
                         {"missAssetPropFontPostScript", f.mPostScriptName},
                         {"missAssetPropFontFullName", f.mFullName},
                         {"missAssetPropFontType", f.mFontType}});
    }
    Value plugins = Value::array();
    for (const auto& p : r.mMissingPlugins) plugins.push_back({{"missAssetPropPluginMatchName", p.mMatchName}});
    Value footage = Value::array();
    for (const auto& f : r.mMissingFootage) footage.push_back({{"missAssetPropFootagePath", ToUTF8(f.mPath)}});
    j = Value::object();
    j["missAssetsPropMissingFonts"] = std::move(fonts);
    j["missAssetsPropMissingPlugins"] = std::move(plugins);
    j["missAssetsPropMissingFootage"] = std::move(footage);
}

void from_json(const Value& j, MissingAssets& r) {
    RequireObject(j);
    MissingAssets out;
    out.mMissingFonts = ReadArrayOf<MissingAssets::Font>(j, "missAssetsPropMissingFonts", [](const Value& e) {
        MissingAssets::Font f;
        f.mFamily = OptString(e, "missAssetPropFontFamily");
        f.mStyle = OptString(e, "missAssetPropFontStyle");
        f.mPostScriptName = OptString(e, "missAssetPropFontPostScript");
        f.mFullName = OptString(e, "missAssetPropFontFullName");
        // Peers write the type signed or unsigned; both read as the same number.
        if (const Value* t = FindMember(e, "missAssetPropFontType")) {
            f.mFontType = t->is_number_unsigned() ? static_cast<int64_t>(ReadUInt64(*t)) : ReadInt64(*t);
        }
        return f;
    });
    out.mMissingPlugins = ReadArrayOf<MissingAssets::Plugin>(j, "missAssetsPropMissingPlugins", [](const Value& e) {
        return MissingAssets::Plugin{OptString(e, "missAssetPropPluginMatchName")};
    });
    out.mMissingFootage = ReadArrayOf<MissingAssets::Footage>(j, "missAssetsPropMissingFootage", [](const Value& e) {
        return MissingAssets::Footage{ToUTF16(OptString(e, "missAssetPropFootagePath"))};
    });
    r = std::move(out);
}

void to_json(Value& j, const ItemInfo& r) {
    j = Value::object();
    j["name"] = ToUTF8(r.mName);
    j["id"] = r.mID.ToString();
    j["type"] = r.mType;
}

void from_json(const Value& j, ItemInfo& r) {
    RequireObject(j);
    ItemInfo out;
    out.mName = ToUTF16(OptString(j, "name"));
    if (const Value* v = FindMember(j, "id")) from_json(*v, out.mID);
    if (const Value* v = FindMember(j, "type")) out.mType = ReadInteger<int32_t>(*v);
    r = std::move(out);
}

namespace projectprotocol {

void to_json(Value& j, const ProjectInfo& r) {
    j = Value::object();
    j["name"] = ToUTF8(r.mName);
    j["file"] = r.mFile.string();
    j["missing"] = Value(r.mMissingAssets);
    j["farlandProductionInfo"] = Value(r.mFarlandProductionInfo);
}

void from_json(const Value& j, ProjectInfo& r) {
    RequireObject(j);
    ProjectInfo out;
    out.mName = ToUTF16(OptString(j, "name"));
    out.mFile = File(OptString(j, "file"));
    if (const Value* v = FindMember(j, "missing"); v && !v->is_null()) out.mMissingAssets = v->get<MissingAssets>();
    if (const Value* v = FindMember(j, "farlandProductionInfo"); v && !v->is_null()) {
        out.mFarlandProductionInfo = v->get<FarlandProductionInfo>();
    }
    r = std::move(out);
}

}  // namespace projectprotocol
}  // namespace tidelink
