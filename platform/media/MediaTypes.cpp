#include "platform/media/MediaTypes.h"

#include <boost/uuid/name_generator_sha1.hpp>
#include <boost/uuid/uuid.hpp>

#include "platform/media/Base64.h"
#include "platform/media/ValueAccess.h"

namespace tidelink::platform {
namespace {

// Fixed namespaces of the name-based GUIDs; changing them changes every profile's identity.
constexpr boost::uuids::uuid kProfileNamespace = {{0x3b, 0x4c, 0x9c, 0x3e, 0x15, 0x1e, 0x41, 0xb8,
                                                   0x9d, 0x05, 0x0e, 0x50, 0x7b, 0xd5, 0xd8, 0xa7}};
constexpr boost::uuids::uuid kColorSpaceNamespace = {{0x70, 0x1c, 0x09, 0xd6, 0xc4, 0xe5, 0x41,
                                                      0x99, 0xba, 0x6e, 0x73, 0x57, 0x84, 0x79,
                                                      0x4a, 0x9f}};

void AppendU64(std::string& out, uint64_t v) {
    for (int shift = 56; shift >= 0; shift -= 8) out.push_back(static_cast<char>(v >> shift));
}

Guid NameBasedGuid(const boost::uuids::uuid& ns, const std::string& name) {
    boost::uuids::name_generator_sha1 gen(ns);
    const boost::uuids::uuid u = gen(name.data(), name.size());
    std::array<uint8_t, 16> bytes;
    std::copy(u.begin(), u.end(), bytes.begin());
    return Guid(bytes);
}

}  // namespace

RatioTime TimeToRatioTime(TickTime ticks) { return RatioTime(ticks, kTicksPerSecond); }

Value RatioTimeToValue(const RatioTime& t) {
    Value v = Value::object();
    v["value"] = t.numerator();
    v["scale"] = t.denominator();
    return v;
}

RatioTime RatioTimeFromValue(const Value& v) {
    RequireObject(v);
    const int64_t value = ReadInt64(MemberOrNull(v, "value"));
    const int64_t scale = ReadInt64(MemberOrNull(v, "scale"));
    if (scale == 0) throw boost::bad_rational();
    if (scale < 0) throw boost::bad_rational("bad rational: negative scale");
    return RatioTime(value, scale);
}

void to_json(Value& j, const FrameRate& r) {
    j = Value::object();
    j["ticksperframe"] = r.TicksPerFrame();
}

void from_json(const Value& j, FrameRate& r) {
    RequireObject(j);
    const Value* ticks = FindMember(j, "ticksperframe");
    const int64_t t = ticks ? ReadInt64(*ticks) : 0;
    r = FrameRate(t == 0 ? FrameRate::kUnset : t);
}

void to_json(Value& j, const RectT<int>& r) {
    j = Value::object();
    j["topleft"] = {{"x", r.mTopLeft.mX}, {"y", r.mTopLeft.mY}};
    j["size"] = {{"x", r.mSize.mX}, {"y", r.mSize.mY}};
}

namespace {
PointT<int> ReadIntPoint(const Value& v) {
    RequireObject(v);
    return {ReadInteger<int>(MemberOrNull(v, "x")), ReadInteger<int>(MemberOrNull(v, "y"))};
}
}  // namespace

void from_json(const Value& j, RectT<int>& r) {
    RequireObject(j);
    RectT<int> out;
    out.mTopLeft = ReadIntPoint(MemberOrNull(j, "topleft"));
    out.mSize = ReadIntPoint(MemberOrNull(j, "size"));
    r = out;
}

void to_json(Value& j, const PixelAspectRatio& r) {
    j = Value::object();
    j["numerator"] = r.Numerator();
    j["denominator"] = r.Denominator();
}

void from_json(const Value& j, PixelAspectRatio& r) {
    RequireObject(j);
    const Value* n = FindMember(j, "numerator");
    const Value* d = FindMember(j, "denominator");
    r = PixelAspectRatio(n ? ReadUInt64(*n) : 0, d ? ReadUInt64(*d) : 0);
}

void to_json(Value& j, const PixelFormat& f) {
    j = Value::object();
    j["fourcc"] = static_cast<uint64_t>(f.mFourCC);
    j["properties"] = static_cast<uint64_t>(f.mProperties);
}

void from_json(const Value& j, PixelFormat& f) {
    RequireObject(j);
    const Value* fourcc = FindMember(j, "fourcc");
    const Value* properties = FindMember(j, "properties");
    PixelFormat out;
    out.mFourCC = fourcc ? ReadInteger<uint32_t>(*fourcc) : 0;
    out.mProperties = properties ? ReadInteger<uint32_t>(*properties)
                                 : PixelFormat::kDefaultProperties;
    f = out;
}

AudioChannelLayout CreateStereoChannelLayout() {
    return {AudioChannelDescription{AudioChannelDescription::kLabelLeft},
            AudioChannelDescription{AudioChannelDescription::kLabelRight}};
}

void to_json(Value& j, const AudioChannelDescription& d) {
    j = Value::object();
    j["channellabel"] = static_cast<int64_t>(d.mChannelLabel);
}

void from_json(const Value& j, AudioChannelDescription& d) {
    RequireObject(j);
    d.mChannelLabel = ReadInteger<int32_t>(MemberOrNull(j, "channellabel"));
}

Guid ColorProfile::GetGuid() const {
    const std::string name = ToUTF8(mName);
    std::string key;
    key.reserve(8 + name.size() + mData.size());
    AppendU64(key, name.size());
    key += name;
    key.append(reinterpret_cast<const char*>(mData.data()), mData.size());
    return NameBasedGuid(kProfileNamespace, key);
}

void to_json(Value& j, const ColorProfile& p) {
    j = Value::object();
    j["colorProfileName"] = ToUTF8(p.GetName());
    j["colorProfileData"] = EncodeBase64(p.GetData());
}

void from_json(const Value& j, ColorProfile& p) {
    RequireObject(j);
    ColorProfile out;
    if (const Value* name = FindMember(j, "colorProfileName")) out.SetName(ReadWString(*name));
    if (const Value* data = FindMember(j, "colorProfileData")) {
        auto bytes = DecodeBase64(ReadString(*data));
        if (!bytes) {
            throw nlohmann::json::type_error::create(302, "colour profile data is not base64",
                                                     data);
        }
        out.SetData(std::move(*bytes));
    }
    p = std::move(out);
}

Guid ColorSpace::ToGuid() const {
    std::string key;
    const Guid profile = mBaseProfile.GetGuid();
    key.append(reinterpret_cast<const char*>(profile.Bytes().data()), profile.Bytes().size());
    AppendU64(key, mBaseProfileType);
    key.push_back(mLinearized ? 1 : 0);
    return NameBasedGuid(kColorSpaceNamespace, key);
}

void to_json(Value& j, const ColorSpace& c) {
    j = Value::object();
    if (!c.GetBaseProfile().IsDefault()) j["baseColorProfile"] = c.GetBaseProfile();
    if (c.GetBaseProfileType() != 0) j["baseProfileType"] = uint64_t{c.GetBaseProfileType()};
    if (c.IsLinearized()) j["colorSpaceLinearized"] = true;
}

void from_json(const Value& j, ColorSpace& c) {
    RequireObject(j);
    ColorProfile profile;
    uint32_t type = 0;
    bool linear = false;
    if (const Value* p = FindMember(j, "baseColorProfile")) profile = p->get<ColorProfile>();
    if (const Value* t = FindMember(j, "baseProfileType")) type = ReadInteger<uint32_t>(*t);
    if (const Value* l = FindMember(j, "colorSpaceLinearized")) linear = ReadBool(*l);
    c = ColorSpace(std::move(profile), type, linear);
}

}  // namespace tidelink::platform
