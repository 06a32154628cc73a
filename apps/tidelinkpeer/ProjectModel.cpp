#include "ProjectModel.h"

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstring>
#include <fstream>
#include <set>
#include <sstream>
#include <system_error>

#include <boost/uuid/name_generator_sha1.hpp>
#include <boost/uuid/uuid.hpp>

#include "platform/Strings.h"

namespace tidelink::peer {

using platform::Value;
namespace fs = std::filesystem;

namespace {

// Fixed namespace of derived item ids; changing it changes the id of every item without one.
constexpr boost::uuids::uuid kItemNamespace = {{0x5e, 0x0b, 0x8d, 0x21, 0x7a, 0x43, 0x4f, 0x6c,
                                                0xa1, 0x9e, 0x3d, 0x62, 0x0f, 0xc4, 0x88, 0x17}};

constexpr const char* kFormatName = "tidelink-project";
constexpr int64_t kFormatVersion = 1;
// Bounds that keep every product of two rational parts inside 128 bits.
constexpr int64_t kMaxRationalPart = int64_t{1} << 40;
constexpr size_t kMaxNameBytes = 1024;

[[noreturn]] void Fail(const std::string& where, const std::string& what) {
    throw ProjectError((where.empty() ? std::string("/") : where) + ": " + what);
}

std::string Join(const std::string& pointer, const std::string& key) {
    // JSON-pointer escaping of the key.
    std::string escaped;
    for (char c : key) {
        if (c == '~') escaped += "~0";
        else if (c == '/') escaped += "~1";
        else escaped += c;
    }
    return pointer + "/" + escaped;
}

std::string Join(const std::string& pointer, size_t index) { return pointer + "/" + std::to_string(index); }

const char* KindOf(const Value& v) {
    switch (v.type()) {
        case Value::value_t::null: return "null";
        case Value::value_t::boolean: return "a boolean";
        case Value::value_t::string: return "a string";
        case Value::value_t::array: return "an array";
        case Value::value_t::object: return "an object";
        case Value::value_t::discarded: return "nothing";
        default: return "a number";
    }
}

// Reads one object, remembering which members were looked at, so that unknown (misspelt)
// members are reported instead of silently ignored.
class ObjectReader {
public:
    ObjectReader(const Value& v, std::string pointer) : mValue(v), mPointer(std::move(pointer)) {
        if (!v.is_object()) Fail(mPointer, std::string("expected an object, found ") + KindOf(v));
    }

    const Value* Find(const char* key) {
        mSeen.insert(key);
        auto it = mValue.find(key);
        return it == mValue.end() || it->is_null() ? nullptr : &*it;
    }
    const Value& Require(const char* key) {
        const Value* v = Find(key);
        if (!v) Fail(mPointer, std::string("the member \"") + key + "\" is missing");
        return *v;
    }
    std::string At(const char* key) const { return Join(mPointer, key); }
    const std::string& Pointer() const { return mPointer; }

    // Every member must have been looked at ("comment" is free text anywhere).
    void Finish() const {
        for (auto it = mValue.begin(); it != mValue.end(); ++it) {
            if (it.key() == "comment") continue;
            if (!mSeen.count(it.key())) Fail(Join(mPointer, it.key()), "unknown member");
        }
    }

private:
    const Value& mValue;
    std::string mPointer;
    std::set<std::string> mSeen;
};

std::string ReadText(const Value& v, const std::string& where) {
    if (!v.is_string()) Fail(where, std::string("expected a string, found ") + KindOf(v));
    return v.get<std::string>();
}

int64_t ReadWhole(const Value& v, const std::string& where, int64_t lo, int64_t hi) {
    const auto outOfRange = [&] { Fail(where, "must be between " + std::to_string(lo) + " and " + std::to_string(hi)); };
    int64_t x = 0;
    if (v.is_number_unsigned()) {
        const uint64_t u = v.get<uint64_t>();
        if (hi < 0 || u > static_cast<uint64_t>(hi)) outOfRange();
        x = static_cast<int64_t>(u);
    } else if (v.is_number_integer()) {
        x = v.get<int64_t>();
    } else if (v.is_number_float()) {
        const double d = v.get<double>();
        if (!std::isfinite(d) || d != std::floor(d) || d < -9.0e15 || d > 9.0e15) {
            Fail(where, "expected a whole number, found " + platform::ToJSONText(v));
        }
        x = static_cast<int64_t>(d);
    } else {
        Fail(where, std::string("expected a whole number, found ") + KindOf(v));
    }
    if (x < lo || x > hi) outOfRange();
    return x;
}

double ReadNumber(const Value& v, const std::string& where) {
    if (!v.is_number()) Fail(where, std::string("expected a number, found ") + KindOf(v));
    const double d = v.get<double>();
    if (!std::isfinite(d)) Fail(where, "expected a finite number");
    return d;
}

// A rational: 25, [30000, 1001] or {"value": 30000, "scale": 1001}.
Rational ReadRational(const Value& v, const std::string& where) {
    const char* expected = "expected a rational such as 25, [30000, 1001] or {\"value\": 30000, \"scale\": 1001}";
    int64_t num = 0;
    int64_t den = 1;
    if (v.is_number()) {
        if (!v.is_number_integer() && !(v.is_number_float() && std::isfinite(v.get<double>()) &&
                                        v.get<double>() == std::floor(v.get<double>()))) {
            Fail(where, std::string(expected) + " (fractions are written [numerator, denominator])");
        }
        num = ReadWhole(v, where, -kMaxRationalPart, kMaxRationalPart);
    } else if (v.is_array()) {
        if (v.size() != 2) Fail(where, expected);
        num = ReadWhole(v[0], Join(where, size_t{0}), -kMaxRationalPart, kMaxRationalPart);
        den = ReadWhole(v[1], Join(where, size_t{1}), 1, kMaxRationalPart);
    } else if (v.is_object()) {
        ObjectReader o(v, where);
        num = ReadWhole(o.Require("value"), o.At("value"), -kMaxRationalPart, kMaxRationalPart);
        den = ReadWhole(o.Require("scale"), o.At("scale"), 1, kMaxRationalPart);
        o.Finish();
    } else {
        Fail(where, expected);
    }
    return Rational(num, den);
}

// Exact comparison helpers on the bounded rationals.
bool Less(const Rational& a, const Rational& b) {
    return static_cast<Int128>(a.numerator()) * b.denominator() <
           static_cast<Int128>(b.numerator()) * a.denominator();
}

uint8_t UnitTo8(double c) { return static_cast<uint8_t>(std::lround(std::clamp(c, 0.0, 1.0) * 255.0)); }

// [r, g, b] or [r, g, b, a] in 0..1, or "#rrggbb" / "#rrggbbaa".
Color8 ReadColor(const Value& v, const std::string& where) {
    const char* expected = "expected a colour such as [1, 0.5, 0], [1, 0.5, 0, 1] or \"#ff8000\"";
    if (v.is_string()) {
        const std::string s = v.get<std::string>();
        if ((s.size() != 7 && s.size() != 9) || s[0] != '#' ||
            s.find_first_not_of("0123456789abcdefABCDEF", 1) != std::string::npos) {
            Fail(where, expected);
        }
        auto byte = [&](size_t at) { return static_cast<uint8_t>(std::stoul(s.substr(at, 2), nullptr, 16)); };
        return Color8{byte(1), byte(3), byte(5), s.size() == 9 ? byte(7) : uint8_t{255}};
    }
    if (!v.is_array() || (v.size() != 3 && v.size() != 4)) Fail(where, expected);
    double c[4] = {0, 0, 0, 1};
    for (size_t i = 0; i < v.size(); ++i) {
        c[i] = ReadNumber(v[i], Join(where, i));
        if (c[i] < 0.0 || c[i] > 1.0) Fail(Join(where, i), "colour components run from 0 to 1");
    }
    return Color8{UnitTo8(c[0]), UnitTo8(c[1]), UnitTo8(c[2]), UnitTo8(c[3])};
}

PixelRect ReadRect(const Value& v, const std::string& where) {
    if (!v.is_array() || v.size() != 4) Fail(where, "expected a rectangle [x, y, width, height]");
    PixelRect r;
    r.x = static_cast<int32_t>(ReadWhole(v[0], Join(where, size_t{0}), -ProjectModel::kMaxDimension, ProjectModel::kMaxDimension));
    r.y = static_cast<int32_t>(ReadWhole(v[1], Join(where, size_t{1}), -ProjectModel::kMaxDimension, ProjectModel::kMaxDimension));
    r.width = static_cast<int32_t>(ReadWhole(v[2], Join(where, size_t{2}), 0, ProjectModel::kMaxDimension));
    r.height = static_cast<int32_t>(ReadWhole(v[3], Join(where, size_t{3}), 0, ProjectModel::kMaxDimension));
    return r;
}

std::string ReadName(const Value& v, const std::string& where) {
    std::string name = ReadText(v, where);
    if (name.empty()) Fail(where, "a name must not be empty");
    if (name.size() > kMaxNameBytes) Fail(where, "a name must be at most 1024 bytes");
    if (name.find('/') != std::string::npos) Fail(where, "a name must not contain \"/\"");
    if (name.find('\0') != std::string::npos) Fail(where, "a name must not contain NUL");
    return name;
}

Guid ReadGuid(const Value& v, const std::string& where) {
    auto g = v.is_string() ? Guid::Parse(std::string_view(v.get_ref<const std::string&>())) : std::nullopt;
    if (!g) Fail(where, "expected a GUID such as \"6f1c2a3e-5b7d-4e21-9a0c-1d2e3f405162\"");
    if (g->IsNil()) Fail(where, "the nil GUID names the root; give the item another id");
    return *g;
}

// Paths of siblings: the first "Comp" is "Comp", the second "Comp#2", and so on.
class SiblingNames {
public:
    std::string Segment(const std::string& name) {
        const int n = ++mCount[name];
        return n == 1 ? name : name + "#" + std::to_string(n);
    }

private:
    std::map<std::string, int> mCount;
};

std::string ChildPath(const std::string& parent, const std::string& segment) {
    return parent.empty() ? segment : parent + "/" + segment;
}

fs::path ResolveFootage(const fs::path& projectDir, const std::string& path) {
    fs::path p(path);
    if (p.is_relative()) p = projectDir / p;
    return p.lexically_normal();
}

bool IsRegularFile(const fs::path& p) {
    std::error_code ec;
    return fs::is_regular_file(p, ec);
}

}  // namespace

Guid DeriveItemId(std::string_view itemPath) {
    boost::uuids::name_generator_sha1 gen(kItemNamespace);
    const boost::uuids::uuid u = gen(itemPath.data(), itemPath.size());
    std::array<uint8_t, 16> bytes;
    std::copy(u.begin(), u.end(), bytes.begin());
    return Guid(bytes);
}

int64_t Composition::FrameCount() const {
    // ceil(duration * frameRate)
    const Int128 num = static_cast<Int128>(duration.numerator()) * frameRate.numerator();
    const Int128 den = static_cast<Int128>(duration.denominator()) * frameRate.denominator();
    return static_cast<int64_t>((num + den - 1) / den);
}

bool Composition::HasAudio() const {
    return std::any_of(layers.begin(), layers.end(),
                       [](const Layer& l) { return std::holds_alternative<ToneLayer>(l.content); });
}

// ---- overrides ----

DocumentOverrides ParseOverrides(std::string_view json) {
    DocumentOverrides out;
    if (json.find_first_not_of(" \t\r\n") == std::string_view::npos) return out;
    Value v;
    try {
        v = platform::ParseJSONText(json);
    } catch (const nlohmann::json::exception& e) {
        throw ProjectError(std::string("the JSON text is not valid JSON: ") + e.what());
    }
    ObjectReader o(v, "");
    if (const Value* d = o.Find("document")) {
        if (!d->is_object()) Fail(o.At("document"), "expected an object (a merge patch over the document)");
        out.document = *d;
    }
    if (const Value* items = o.Find("items")) {
        if (!items->is_object()) Fail(o.At("items"), "expected an object from item id or path to a merge patch");
        for (auto it = items->begin(); it != items->end(); ++it) {
            if (!it->is_object()) Fail(Join(o.At("items"), it.key()), "expected an object (a merge patch over the item)");
            out.items.emplace_back(it.key(), *it);
        }
    }
    o.Finish();
    return out;
}

namespace {

// Applies the item patches of |overrides| to the raw document. Items are matched by their path,
// their "id" member or their derived id, computed as the reader computes them.
void ApplyItemPatches(Value& doc, const DocumentOverrides& overrides) {
    if (overrides.items.empty()) return;
    std::vector<bool> used(overrides.items.size(), false);
    auto matches = [](const std::string& key, const std::string& path, const Value& item) {
        if (key == path) return true;
        const auto keyId = Guid::Parse(std::string_view(key));
        if (!keyId) return false;
        if (auto it = item.find("id"); it != item.end() && it->is_string()) {
            const auto id = Guid::Parse(std::string_view(it->get_ref<const std::string&>()));
            return id && *id == *keyId;
        }
        return DeriveItemId(path) == *keyId;
    };
    auto walk = [&](auto& self, Value& items, const std::string& parentPath) -> void {
        if (!items.is_array()) return;
        SiblingNames siblings;
        for (auto& item : items) {
            if (!item.is_object()) continue;
            auto name = item.find("name");
            if (name == item.end() || !name->is_string()) continue;
            const std::string path = ChildPath(parentPath, siblings.Segment(name->get<std::string>()));
            for (size_t i = 0; i < overrides.items.size(); ++i) {
                if (!used[i] && matches(overrides.items[i].first, path, item)) {
                    used[i] = true;
                    item.merge_patch(overrides.items[i].second);
                }
            }
            if (auto children = item.find("items"); children != item.end()) self(self, *children, path);
        }
    };
    if (auto items = doc.find("items"); items != doc.end()) walk(walk, *items, "");
    for (size_t i = 0; i < used.size(); ++i) {
        if (!used[i]) throw ProjectError("no item \"" + overrides.items[i].first + "\" to override");
    }
}

}  // namespace

// ---- the reader ----

class DocumentReader {
public:
    DocumentReader(ProjectModel& model, const fs::path& file) : mModel(model), mDir(file.parent_path()) {}

    void Read(const Value& doc) {
        ObjectReader o(doc, "");
        const std::string format = ReadText(o.Require("format"), o.At("format"));
        if (format != kFormatName) Fail(o.At("format"), std::string("expected \"") + kFormatName + "\"");
        const int64_t version = ReadWhole(o.Require("version"), o.At("version"), 0, INT32_MAX);
        if (version != kFormatVersion) {
            Fail(o.At("version"), "version " + std::to_string(version) + " is not supported (this peer reads version 1)");
        }
        if (const Value* name = o.Find("name")) {
            mModel.mName = ReadText(*name, o.At("name"));
            if (mModel.mName.size() > kMaxNameBytes) Fail(o.At("name"), "a name must be at most 1024 bytes");
        }
        if (mModel.mName.empty()) mModel.mName = mModel.mFile.stem().string();

        Item root;
        root.type = ItemType::Bin;
        root.name = mModel.mName;
        root.id = DeriveItemId("");
        if (const Value* id = o.Find("id")) root.id = ReadGuid(*id, o.At("id"));
        mModel.mItems.push_back(std::move(root));
        Register(0, "");
        if (const Value* items = o.Find("items")) ReadItems(*items, o.At("items"), 0);
        o.Finish();
    }

private:
    void Register(size_t index, const std::string& pointer) {
        const Guid id = mModel.mItems[index].id;
        auto [it, inserted] = mModel.mById.emplace(id, index);
        if (!inserted) {
            Fail(pointer, "the id " + id.ToString() + " is also the id of \"" + mModel.mItems[it->second].path +
                              "\"; give one of them another \"id\"");
        }
    }

    void ReadItems(const Value& items, const std::string& pointer, size_t parent) {
        if (!items.is_array()) Fail(pointer, std::string("expected an array of items, found ") + KindOf(items));
        SiblingNames siblings;
        for (size_t i = 0; i < items.size(); ++i) {
            if (mModel.mItems.size() >= ProjectModel::kMaxItems) {
                Fail(Join(pointer, i), "a project holds at most " + std::to_string(ProjectModel::kMaxItems) + " items");
            }
            ReadItem(items[i], Join(pointer, i), parent, siblings);
        }
    }

    void ReadItem(const Value& v, const std::string& pointer, size_t parent, SiblingNames& siblings) {
        ObjectReader o(v, pointer);
        Item item;
        const std::string type = ReadText(o.Require("type"), o.At("type"));
        if (type == "bin") item.type = ItemType::Bin;
        else if (type == "composition") item.type = ItemType::Composition;
        else if (type == "footage") item.type = ItemType::Footage;
        else Fail(o.At("type"), "unknown item type \"" + type + "\" (bin, composition or footage)");
        item.name = ReadName(o.Require("name"), o.At("name"));
        item.path = ChildPath(mModel.mItems[parent].path, siblings.Segment(item.name));
        item.id = DeriveItemId(item.path);
        if (const Value* id = o.Find("id")) item.id = ReadGuid(*id, o.At("id"));
        item.parent = mModel.mItems[parent].id;

        const Value* children = nullptr;
        switch (item.type) {
            case ItemType::Bin:
                children = o.Find("items");
                break;
            case ItemType::Composition:
                item.composition = ReadComposition(o);
                break;
            case ItemType::Footage:
                item.footage = ReadFootage(o.Require("path"), o.At("path"));
                break;
        }
        o.Finish();

        const size_t index = mModel.mItems.size();
        mModel.mItems.push_back(std::move(item));
        mModel.mItems[parent].children.push_back(index);
        Register(index, pointer);
        if (children) ReadItems(*children, Join(pointer, "items"), index);
    }

    Composition ReadComposition(ObjectReader& o) {
        Composition c;
        c.width = static_cast<int32_t>(ReadWhole(o.Require("width"), o.At("width"), 1, ProjectModel::kMaxDimension));
        c.height = static_cast<int32_t>(ReadWhole(o.Require("height"), o.At("height"), 1, ProjectModel::kMaxDimension));
        if (const Value* par = o.Find("pixelAspectRatio")) {
            const Rational r = ReadRational(*par, o.At("pixelAspectRatio"));
            if (r <= 0) Fail(o.At("pixelAspectRatio"), "must be positive");
            c.pixelAspectRatio = platform::PixelAspectRatio(static_cast<uint64_t>(r.numerator()),
                                                            static_cast<uint64_t>(r.denominator()));
        }
        c.frameRate = ReadRational(o.Require("frameRate"), o.At("frameRate"));
        if (c.frameRate <= 0 || Less(Rational(1000), c.frameRate)) {
            Fail(o.At("frameRate"), "the frame rate must be above 0 and at most 1000 frames per second");
        }
        const Value* duration = o.Find("duration");
        const Value* frames = o.Find("durationFrames");
        if ((duration != nullptr) == (frames != nullptr)) {
            Fail(o.Pointer(), "give exactly one of \"duration\" (seconds) and \"durationFrames\"");
        }
        if (duration) {
            c.duration = ReadRational(*duration, o.At("duration"));
        } else {
            const int64_t n = ReadWhole(*frames, o.At("durationFrames"), 1, int64_t{1} << 31);
            // n / frameRate, kept inside the rational bounds.
            const Int128 num = static_cast<Int128>(n) * c.frameRate.denominator();
            if (num > kMaxRationalPart) Fail(o.At("durationFrames"), "too long");
            c.duration = Rational(static_cast<int64_t>(num), c.frameRate.numerator());
        }
        if (c.duration <= 0 || Less(Rational(7 * 24 * 3600), c.duration)) {
            Fail(duration ? o.At("duration") : o.At("durationFrames"), "the duration must be above 0 and at most 7 days");
        }
        c.channels = platform::CreateStereoChannelLayout();
        if (const Value* audio = o.Find("audio")) ReadAudio(*audio, o.At("audio"), c);
        if (const Value* bg = o.Find("background")) c.background = ReadColor(*bg, o.At("background"));
        if (const Value* layers = o.Find("layers")) {
            const std::string at = o.At("layers");
            if (!layers->is_array()) Fail(at, std::string("expected an array of layers, found ") + KindOf(*layers));
            if (layers->size() > ProjectModel::kMaxLayers) Fail(at, "a composition holds at most 1000 layers");
            for (size_t i = 0; i < layers->size(); ++i) c.layers.push_back(ReadLayer((*layers)[i], Join(at, i), c));
        }
        return c;
    }

    static void ReadAudio(const Value& v, const std::string& pointer, Composition& c) {
        ObjectReader o(v, pointer);
        if (const Value* rate = o.Find("sampleRate")) {
            c.sampleRate = static_cast<int32_t>(ReadWhole(*rate, o.At("sampleRate"), 8000, 384000));
        }
        if (const Value* channels = o.Find("channels")) {
            const std::string at = o.At("channels");
            if (!channels->is_array() || channels->empty() || channels->size() > 32) {
                Fail(at, "expected an array of 1 to 32 channels such as [\"left\", \"right\"]");
            }
            c.channels.clear();
            for (size_t i = 0; i < channels->size(); ++i) {
                const Value& ch = (*channels)[i];
                platform::AudioChannelDescription d;
                if (ch.is_string()) {
                    const std::string name = ch.get<std::string>();
                    if (name == "left") d.mChannelLabel = platform::AudioChannelDescription::kLabelLeft;
                    else if (name == "right") d.mChannelLabel = platform::AudioChannelDescription::kLabelRight;
                    else Fail(Join(at, i), "unknown channel \"" + name + "\" (\"left\", \"right\" or a label number)");
                } else {
                    d.mChannelLabel = static_cast<int32_t>(ReadWhole(ch, Join(at, i), 0, INT32_MAX));
                }
                c.channels.push_back(d);
            }
        }
        o.Finish();
    }

    Layer ReadLayer(const Value& v, const std::string& pointer, const Composition& c) {
        ObjectReader o(v, pointer);
        Layer layer;
        const std::string type = ReadText(o.Require("type"), o.At("type"));
        layer.name = type;
        if (const Value* name = o.Find("name")) layer.name = ReadName(*name, o.At("name"));
        if (const Value* start = o.Find("start")) layer.start = ReadRational(*start, o.At("start"));
        if (const Value* end = o.Find("end")) layer.end = ReadRational(*end, o.At("end"));
        if (layer.start < 0) Fail(o.At("start"), "must not be negative");
        if (layer.end && !Less(layer.start, *layer.end)) Fail(o.At("end"), "must be after \"start\"");

        if (type == "pattern") {
            layer.content = PatternLayer{};
        } else if (type == "solid") {
            SolidLayer s;
            s.color = ReadColor(o.Require("color"), o.At("color"));
            if (const Value* rect = o.Find("rect")) s.rect = ReadRect(*rect, o.At("rect"));
            layer.content = s;
        } else if (type == "gradient") {
            GradientLayer g;
            if (const Value* from = o.Find("from")) g.from = ReadColor(*from, o.At("from"));
            if (const Value* to = o.Find("to")) g.to = ReadColor(*to, o.At("to"));
            if (const Value* dir = o.Find("direction")) {
                const std::string d = ReadText(*dir, o.At("direction"));
                if (d == "horizontal") g.direction = GradientLayer::Direction::Horizontal;
                else if (d == "vertical") g.direction = GradientLayer::Direction::Vertical;
                else Fail(o.At("direction"), "expected \"horizontal\" or \"vertical\"");
            }
            if (const Value* rect = o.Find("rect")) g.rect = ReadRect(*rect, o.At("rect"));
            layer.content = g;
        } else if (type == "tone") {
            ToneLayer t;
            t.frequency = ReadNumber(o.Require("frequency"), o.At("frequency"));
            if (t.frequency <= 0.0 || t.frequency > c.sampleRate / 2.0) {
                Fail(o.At("frequency"), "must be above 0 and at most half the sample rate (" +
                                            std::to_string(c.sampleRate / 2) + " Hz)");
            }
            double level = -20.0;
            if (const Value* l = o.Find("level")) level = ReadNumber(*l, o.At("level"));
            if (level > 0.0 || level < -200.0) Fail(o.At("level"), "the level is in dBFS, from -200 to 0");
            t.amplitude = std::pow(10.0, level / 20.0);
            if (const Value* chans = o.Find("channels")) {
                const std::string at = o.At("channels");
                if (!chans->is_array()) Fail(at, "expected an array of channel indices such as [0]");
                for (size_t i = 0; i < chans->size(); ++i) {
                    t.channels.push_back(static_cast<int32_t>(
                        ReadWhole((*chans)[i], Join(at, i), 0, static_cast<int64_t>(c.channels.size()) - 1)));
                }
            }
            layer.content = t;
        } else if (type == "footage") {
            layer.content = ReadFootage(o.Require("path"), o.At("path"));
        } else {
            Fail(o.At("type"), "unknown layer type \"" + type + "\" (pattern, solid, gradient, tone or footage)");
        }
        o.Finish();
        return layer;
    }

    FootageRef ReadFootage(const Value& v, const std::string& pointer) {
        FootageRef f;
        f.path = ReadText(v, pointer);
        if (f.path.empty() || f.path.find('\0') != std::string::npos) Fail(pointer, "expected a file path");
        f.resolved = ResolveFootage(mDir, f.path);
        f.missing = !IsRegularFile(f.resolved);
        if (f.missing && mReported.insert(f.resolved.string()).second) {
            mModel.mMissing.mMissingFootage.push_back({platform::ToUTF16(f.resolved.string())});
        }
        return f;
    }

    ProjectModel& mModel;
    fs::path mDir;
    std::set<std::string> mReported;
};

ProjectModel ProjectModel::Parse(std::string_view text, const fs::path& projectFile,
                                 const DocumentOverrides& overrides) {
    if (text.size() > kMaxFileBytes) throw ProjectError("the document is larger than 64 MiB");
    Value doc;
    try {
        doc = platform::ParseJSONText(text);
    } catch (const nlohmann::json::exception& e) {
        throw ProjectError(std::string("not a valid JSON document: ") + e.what());
    }
    if (!overrides.document.is_null()) doc.merge_patch(overrides.document);
    ApplyItemPatches(doc, overrides);
    ProjectModel model;
    model.mFile = projectFile;
    DocumentReader(model, projectFile).Read(doc);
    return model;
}

ProjectModel ProjectModel::Load(const fs::path& projectFile, const DocumentOverrides& overrides) {
    std::error_code ec;
    const auto status = fs::status(projectFile, ec);
    if (ec || !fs::exists(status)) throw ProjectError("no such file");
    if (fs::is_directory(status)) throw ProjectError("it is a folder, not a project file");
    if (!fs::is_regular_file(status)) throw ProjectError("not a regular file");
    const auto size = fs::file_size(projectFile, ec);
    if (!ec && size > kMaxFileBytes) throw ProjectError("the document is larger than 64 MiB");
    std::ifstream in(projectFile, std::ios::binary);
    if (!in) throw ProjectError(std::string("cannot read it: ") + std::strerror(errno));
    std::ostringstream text;
    text << in.rdbuf();
    if (in.bad()) throw ProjectError(std::string("cannot read it: ") + std::strerror(errno));
    return Parse(text.str(), projectFile, overrides);
}

std::string ProjectModel::EmptyDocument(const std::string& name) {
    Value doc = Value::object();
    doc["format"] = kFormatName;
    doc["version"] = kFormatVersion;
    doc["name"] = name;
    doc["items"] = Value::array();
    return platform::ToJSONText(doc, 2) + "\n";
}

const Item* ProjectModel::Find(const Guid& id) const {
    if (id.IsNil()) return &mItems.front();
    auto it = mById.find(id);
    return it == mById.end() ? nullptr : &mItems[it->second];
}

const Item* ProjectModel::FindByPath(std::string_view path) const {
    for (const auto& item : mItems) {
        if (item.path == path) return &item;
    }
    return nullptr;
}

ProjectModel ProjectModel::WithItems(const Guid& parent, std::vector<NewItem> items, std::vector<Guid>* added) const {
    const Item* target = Find(parent);
    if (!target) throw ProjectError("the project has no item " + parent.ToString());
    if (target->type != ItemType::Bin) throw ProjectError("\"" + target->path + "\" is not a bin");
    ProjectModel out = *this;
    const fs::path dir = mFile.parent_path();
    std::set<std::string> reported;
    for (const auto& f : out.mMissing.mMissingFootage) reported.insert(platform::ToUTF8(f.mPath));
    auto resolve = [&](FootageRef& f) {
        if (f.path.empty() || f.path.find('\0') != std::string::npos) throw ProjectError("a footage path is empty");
        f.resolved = ResolveFootage(dir, f.path);
        f.missing = !IsRegularFile(f.resolved);
        if (f.missing && reported.insert(f.resolved.string()).second) {
            out.mMissing.mMissingFootage.push_back({platform::ToUTF16(f.resolved.string())});
        }
    };
    auto add = [&](auto& self, size_t parentIndex, NewItem& n) -> Guid {
        if (out.mItems.size() >= kMaxItems) {
            throw ProjectError("a project holds at most " + std::to_string(kMaxItems) + " items");
        }
        ReadName(Value(n.name), "the name \"" + n.name.substr(0, 64) + "\"");
        Item item;
        item.type = n.type;
        item.name = n.name;
        int sameName = 1;
        for (size_t sibling : out.mItems[parentIndex].children) {
            if (out.mItems[sibling].name == n.name) ++sameName;
        }
        const std::string segment = sameName == 1 ? n.name : n.name + "#" + std::to_string(sameName);
        item.path = ChildPath(out.mItems[parentIndex].path, segment);
        item.id = n.id && !n.id->IsNil() && !out.mById.count(*n.id) ? *n.id : Guid::New();
        while (out.mById.count(item.id)) item.id = Guid::New();
        item.parent = out.mItems[parentIndex].id;
        if (n.type == ItemType::Composition) {
            if (!n.composition) throw ProjectError("the composition \"" + n.name + "\" has no format");
            item.composition = std::move(n.composition);
            for (Layer& layer : item.composition->layers) {
                if (auto* f = std::get_if<FootageRef>(&layer.content)) resolve(*f);
            }
        } else if (n.type == ItemType::Footage) {
            FootageRef f;
            f.path = n.footagePath;
            resolve(f);
            item.footage = std::move(f);
        }
        const size_t index = out.mItems.size();
        const Guid id = item.id;
        out.mItems.push_back(std::move(item));
        out.mItems[parentIndex].children.push_back(index);
        out.mById.emplace(id, index);
        for (NewItem& child : n.children) self(self, index, child);
        return id;
    };
    const size_t parentIndex = parent.IsNil() ? 0 : mById.at(target->id);
    for (NewItem& n : items) {
        const Guid id = add(add, parentIndex, n);
        if (added) added->push_back(id);
    }
    return out;
}

ItemInfo ProjectModel::InfoOf(const Item& item) const {
    return ItemInfo{platform::ToUTF16(item.name), item.id, static_cast<int32_t>(item.type)};
}

std::vector<ItemInfo> ProjectModel::ChildrenOf(const Item& item) const {
    std::vector<ItemInfo> out;
    out.reserve(item.children.size());
    for (size_t index : item.children) out.push_back(InfoOf(mItems[index]));
    return out;
}

projectprotocol::ProjectInfo ProjectModel::Info() const {
    projectprotocol::ProjectInfo info;
    info.mName = platform::ToUTF16(mName);
    info.mFile = mFile;
    info.mMissingAssets = mMissing;
    return info;
}

}  // namespace tidelink::peer
