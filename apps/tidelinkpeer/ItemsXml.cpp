#include "ItemsXml.h"

#include <charconv>
#include <cmath>
#include <set>

#include "SourceDescription.h"

namespace tidelink::peer {

namespace {

constexpr const char* kRootElement = "tidelink-items";
constexpr const char* kVersion = "1";
constexpr size_t kMaxAttributes = 64;

// ---- reading XML ----

class XmlReader {
public:
    explicit XmlReader(std::string_view text) : mText(text) {}

    XmlElement Read() {
        if (mText.size() > kMaxXmlBytes) throw ItemsXmlError("the text is larger than 16 MiB");
        if (mText.substr(0, 3) == "\xEF\xBB\xBF") mPos = 3;
        SkipMisc();
        if (AtEnd() || Peek() != '<') Fail("expected an element");
        XmlElement root = ReadElementTree();
        SkipMisc();
        if (!AtEnd()) Fail("unexpected content after the root element");
        return root;
    }

private:
    [[noreturn]] void Fail(const std::string& what) const {
        throw ItemsXmlError("line " + std::to_string(mLine) + ": " + what);
    }

    bool AtEnd() const { return mPos >= mText.size(); }
    char Peek() const { return mText[mPos]; }
    bool StartsWith(std::string_view s) const { return mText.substr(mPos, s.size()) == s; }

    void Advance(size_t n = 1) {
        for (size_t i = 0; i < n && mPos < mText.size(); ++i, ++mPos) {
            if (mText[mPos] == '\n') ++mLine;
        }
    }

    static bool IsSpace(char c) { return c == ' ' || c == '\t' || c == '\r' || c == '\n'; }
    static bool IsNameStart(char c) {
        return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || c == '_' || c == ':' ||
               static_cast<unsigned char>(c) >= 0x80;
    }
    static bool IsNameChar(char c) { return IsNameStart(c) || (c >= '0' && c <= '9') || c == '-' || c == '.'; }

    void SkipSpace() {
        while (!AtEnd() && IsSpace(Peek())) Advance();
    }

    // Skips |open| ... |close|.
    void SkipPast(std::string_view open, std::string_view close, const char* what) {
        Advance(open.size());
        const size_t end = mText.find(close, mPos);
        if (end == std::string_view::npos) Fail(std::string("unterminated ") + what);
        Advance(end + close.size() - mPos);
    }

    // White space, comments and processing instructions.
    void SkipMisc() {
        for (;;) {
            SkipSpace();
            if (StartsWith("<!--")) {
                SkipPast("<!--", "-->", "comment");
            } else if (StartsWith("<?")) {
                SkipPast("<?", "?>", "processing instruction");
            } else if (StartsWith("<!DOCTYPE") || StartsWith("<!doctype")) {
                Fail("document type declarations are not accepted");
            } else {
                return;
            }
        }
    }

    std::string ReadName() {
        if (AtEnd() || !IsNameStart(Peek())) Fail("expected a name");
        const size_t start = mPos;
        while (!AtEnd() && IsNameChar(Peek())) Advance();
        return std::string(mText.substr(start, mPos - start));
    }

    static void AppendUtf8(std::string& out, uint32_t cp) {
        if (cp < 0x80) {
            out += static_cast<char>(cp);
        } else if (cp < 0x800) {
            out += static_cast<char>(0xC0 | (cp >> 6));
            out += static_cast<char>(0x80 | (cp & 0x3F));
        } else if (cp < 0x10000) {
            out += static_cast<char>(0xE0 | (cp >> 12));
            out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
            out += static_cast<char>(0x80 | (cp & 0x3F));
        } else {
            out += static_cast<char>(0xF0 | (cp >> 18));
            out += static_cast<char>(0x80 | ((cp >> 12) & 0x3F));
            out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
            out += static_cast<char>(0x80 | (cp & 0x3F));
        }
    }

    // Decodes the character or entity reference at '&'.
    void ReadReference(std::string& out) {
        const size_t semi = mText.find(';', mPos);
        if (semi == std::string_view::npos || semi - mPos > 12) Fail("malformed character reference");
        const std::string_view ref = mText.substr(mPos + 1, semi - mPos - 1);
        if (ref == "lt") out += '<';
        else if (ref == "gt") out += '>';
        else if (ref == "amp") out += '&';
        else if (ref == "quot") out += '"';
        else if (ref == "apos") out += '\'';
        else if (ref.size() > 1 && ref[0] == '#') {
            const bool hex = ref[1] == 'x';
            const std::string_view digits = ref.substr(hex ? 2 : 1);
            uint32_t cp = 0;
            const auto r = std::from_chars(digits.data(), digits.data() + digits.size(), cp, hex ? 16 : 10);
            if (digits.empty() || r.ec != std::errc() || r.ptr != digits.data() + digits.size() || cp == 0 ||
                cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF)) {
                Fail("malformed character reference &" + std::string(ref) + ";");
            }
            AppendUtf8(out, cp);
        } else {
            Fail("unknown entity &" + std::string(ref) + "; (only the five predefined ones and character references)");
        }
        Advance(semi + 1 - mPos);
    }

    std::string ReadAttributeValue() {
        if (AtEnd() || (Peek() != '"' && Peek() != '\'')) Fail("expected a quoted attribute value");
        const char quote = Peek();
        Advance();
        std::string value;
        for (;;) {
            if (AtEnd()) Fail("unterminated attribute value");
            const char c = Peek();
            if (c == quote) {
                Advance();
                return value;
            }
            if (c == '<') Fail("'<' in an attribute value");
            if (c == '&') {
                ReadReference(value);
            } else {
                value += c;
                Advance();
            }
        }
    }

    // Reads the start tag at '<' into |e|; returns true when it closed itself ("/>").
    bool ReadStartTag(XmlElement& e) {
        Advance();  // '<'
        e.line = mLine;
        e.name = ReadName();
        for (;;) {
            const bool spaced = !AtEnd() && IsSpace(Peek());
            SkipSpace();
            if (AtEnd()) Fail("unterminated tag <" + e.name + ">");
            if (StartsWith("/>")) {
                Advance(2);
                return true;
            }
            if (Peek() == '>') {
                Advance();
                return false;
            }
            if (!spaced) Fail("expected white space between attributes of <" + e.name + ">");
            std::string key = ReadName();
            SkipSpace();
            if (AtEnd() || Peek() != '=') Fail("expected '=' after attribute " + key);
            Advance();
            SkipSpace();
            std::string value = ReadAttributeValue();
            if (e.Attribute(key)) Fail("<" + e.name + "> has two attributes \"" + key + "\"");
            if (e.attributes.size() >= kMaxAttributes) Fail("<" + e.name + "> has too many attributes");
            e.attributes.emplace_back(std::move(key), std::move(value));
        }
    }

    // The element at '<' with everything in it, without recursion.
    XmlElement ReadElementTree() {
        XmlElement root;
        if (ReadStartTag(root)) return root;
        std::vector<XmlElement*> open{&root};
        size_t elements = 1;
        while (!open.empty()) {
            // Content: white space, comments, processing instructions, child elements, end tag.
            const size_t textStart = mPos;
            while (!AtEnd() && Peek() != '<') {
                if (!IsSpace(Peek())) {
                    mPos = textStart;
                    Fail("text is not accepted inside <" + open.back()->name + "> (only elements)");
                }
                Advance();
            }
            if (AtEnd()) Fail("<" + open.back()->name + "> is not closed");
            if (StartsWith("<!--")) {
                SkipPast("<!--", "-->", "comment");
            } else if (StartsWith("<?")) {
                SkipPast("<?", "?>", "processing instruction");
            } else if (StartsWith("<![CDATA[")) {
                Fail("CDATA sections are not accepted");
            } else if (StartsWith("<!")) {
                Fail("declarations are not accepted inside elements");
            } else if (StartsWith("</")) {
                Advance(2);
                const std::string name = ReadName();
                SkipSpace();
                if (AtEnd() || Peek() != '>') Fail("malformed end tag </" + name);
                Advance();
                if (name != open.back()->name) {
                    Fail("</" + name + "> closes <" + open.back()->name + ">");
                }
                open.pop_back();
            } else {
                if (++elements > kMaxXmlElements) Fail("more than 200000 elements");
                XmlElement& child = open.back()->children.emplace_back();
                const bool closed = ReadStartTag(child);
                if (!closed) {
                    if (static_cast<int>(open.size()) >= kMaxXmlDepth) Fail("elements nested deeper than 64 levels");
                    open.push_back(&child);
                }
            }
        }
        return root;
    }

    std::string_view mText;
    size_t mPos = 0;
    int mLine = 1;
};

// ---- values ----

[[noreturn]] void Bad(const XmlElement& e, const std::string& what) {
    throw ItemsXmlError("line " + std::to_string(e.line) + ": <" + e.name + "> " + what);
}

// Attributes of one element, each looked at once; Finish refuses the others.
class Attributes {
public:
    explicit Attributes(const XmlElement& e) : mElement(e) {}

    const std::string* Find(const char* key) {
        mSeen.insert(key);
        return mElement.Attribute(key);
    }
    const std::string& Require(const char* key) {
        const std::string* v = Find(key);
        if (!v) Bad(mElement, std::string("needs a \"") + key + "\"");
        return *v;
    }
    void Finish() const {
        for (const auto& [key, value] : mElement.attributes) {
            if (!mSeen.count(key)) Bad(mElement, "has an unknown attribute \"" + key + "\"");
        }
    }
    const XmlElement& Element() const { return mElement; }

private:
    const XmlElement& mElement;
    std::set<std::string> mSeen;
};

constexpr int64_t kMaxRationalPart = int64_t{1} << 40;

template <class T>
bool ParseNumber(std::string_view s, T& out) {
    if (s.empty()) return false;
    if (s.front() == '+') return false;
    const auto r = std::from_chars(s.data(), s.data() + s.size(), out);
    return r.ec == std::errc() && r.ptr == s.data() + s.size();
}

int64_t WholeAttr(const XmlElement& e, const char* key, const std::string& v, int64_t lo, int64_t hi) {
    int64_t x = 0;
    if (!ParseNumber(v, x)) Bad(e, std::string("\"") + key + "\" must be a whole number, not \"" + v + "\"");
    if (x < lo || x > hi) {
        Bad(e, std::string("\"") + key + "\" must be between " + std::to_string(lo) + " and " + std::to_string(hi));
    }
    return x;
}

double NumberAttr(const XmlElement& e, const char* key, const std::string& v) {
    double x = 0;
    if (!ParseNumber(v, x) || !std::isfinite(x)) Bad(e, std::string("\"") + key + "\" must be a number, not \"" + v + "\"");
    return x;
}

// "25", "30000/1001".
Rational RationalAttr(const XmlElement& e, const char* key, const std::string& v) {
    const size_t slash = v.find('/');
    int64_t num = 0, den = 1;
    const bool ok = slash == std::string::npos
                        ? ParseNumber(std::string_view(v), num)
                        : ParseNumber(std::string_view(v).substr(0, slash), num) &&
                              ParseNumber(std::string_view(v).substr(slash + 1), den);
    if (!ok || den <= 0 || num > kMaxRationalPart || num < -kMaxRationalPart || den > kMaxRationalPart) {
        Bad(e, std::string("\"") + key + "\" must be a rational such as 25 or 30000/1001, not \"" + v + "\"");
    }
    return Rational(num, den);
}

Color8 ColorAttr(const XmlElement& e, const char* key, const std::string& v) {
    if ((v.size() != 7 && v.size() != 9) || v[0] != '#' ||
        v.find_first_not_of("0123456789abcdefABCDEF", 1) != std::string::npos) {
        Bad(e, std::string("\"") + key + "\" must be a colour such as #ff8000 or #ff800080, not \"" + v + "\"");
    }
    auto byte = [&](size_t at) {
        unsigned x = 0;
        std::from_chars(v.data() + at, v.data() + at + 2, x, 16);
        return static_cast<uint8_t>(x);
    };
    return Color8{byte(1), byte(3), byte(5), v.size() == 9 ? byte(7) : uint8_t{255}};
}

std::vector<std::string> Words(const std::string& v) {
    std::vector<std::string> out;
    size_t i = 0;
    while (i < v.size()) {
        while (i < v.size() && (v[i] == ' ' || v[i] == '\t' || v[i] == '\n' || v[i] == '\r')) ++i;
        const size_t start = i;
        while (i < v.size() && !(v[i] == ' ' || v[i] == '\t' || v[i] == '\n' || v[i] == '\r')) ++i;
        if (i > start) out.push_back(v.substr(start, i - start));
    }
    return out;
}

PixelRect RectAttr(const XmlElement& e, const std::string& v) {
    const auto words = Words(v);
    if (words.size() != 4) Bad(e, "\"rect\" must be four whole numbers \"x y width height\", not \"" + v + "\"");
    const int64_t m = ProjectModel::kMaxDimension;
    PixelRect r;
    r.x = static_cast<int32_t>(WholeAttr(e, "rect", words[0], -m, m));
    r.y = static_cast<int32_t>(WholeAttr(e, "rect", words[1], -m, m));
    r.width = static_cast<int32_t>(WholeAttr(e, "rect", words[2], 0, m));
    r.height = static_cast<int32_t>(WholeAttr(e, "rect", words[3], 0, m));
    return r;
}

platform::AudioChannelLayout ChannelsAttr(const XmlElement& e, const std::string& v) {
    platform::AudioChannelLayout out;
    for (const auto& w : Words(v)) {
        platform::AudioChannelDescription d;
        if (w == "left") d.mChannelLabel = platform::AudioChannelDescription::kLabelLeft;
        else if (w == "right") d.mChannelLabel = platform::AudioChannelDescription::kLabelRight;
        else d.mChannelLabel = static_cast<int32_t>(WholeAttr(e, "channels", w, 0, INT32_MAX));
        out.push_back(d);
    }
    if (out.empty() || out.size() > 32) Bad(e, "\"channels\" must list 1 to 32 channels such as \"left right\"");
    return out;
}

std::optional<Guid> IdAttr(Attributes& a) {
    const std::string* v = a.Find("id");
    if (!v) return std::nullopt;
    auto id = Guid::Parse(std::string_view(*v));
    if (!id) Bad(a.Element(), "\"id\" must be a GUID, not \"" + *v + "\"");
    return id;
}

// ---- writing values ----

std::string Text(const Rational& r) {
    return r.denominator() == 1 ? std::to_string(r.numerator())
                                : std::to_string(r.numerator()) + "/" + std::to_string(r.denominator());
}

std::string Text(double d) {
    char buf[64];
    const auto r = std::to_chars(buf, buf + sizeof(buf), d);
    return std::string(buf, r.ptr);
}

std::string Text(Color8 c) {
    static const char* hex = "0123456789abcdef";
    std::string s = "#";
    for (uint8_t b : {c.r, c.g, c.b, c.a}) {
        s += hex[b >> 4];
        s += hex[b & 15];
    }
    return s;
}

std::string Text(const PixelRect& r) {
    return std::to_string(r.x) + " " + std::to_string(r.y) + " " + std::to_string(r.width) + " " +
           std::to_string(r.height);
}

std::string Text(const platform::AudioChannelLayout& channels) {
    std::string s;
    for (const auto& c : channels) {
        if (!s.empty()) s += ' ';
        if (c.mChannelLabel == platform::AudioChannelDescription::kLabelLeft) s += "left";
        else if (c.mChannelLabel == platform::AudioChannelDescription::kLabelRight) s += "right";
        else s += std::to_string(c.mChannelLabel);
    }
    return s;
}

class XmlWriter {
public:
    void Open(const std::string& name) {
        Indent();
        mOut += "<" + name;
        mStack.push_back(name);
        mHasChildren.push_back(false);
    }
    void Attr(const char* key, const std::string& value) { mOut += std::string(" ") + key + "=\"" + EscapeXml(value) + "\""; }
    // Ends the start tag of an element that will have children.
    void BeginChildren() {
        mOut += ">\n";
        mHasChildren.back() = true;
    }
    void Close() {
        const std::string name = mStack.back();
        const bool children = mHasChildren.back();
        mStack.pop_back();
        mHasChildren.pop_back();
        if (!children) {
            mOut += "/>\n";
            return;
        }
        Indent();
        mOut += "</" + name + ">\n";
    }
    std::string Take() { return std::move(mOut); }
    std::string& Out() { return mOut; }

private:
    void Indent() { mOut.append(mStack.size() * 2, ' '); }
    std::string mOut;
    std::vector<std::string> mStack;
    std::vector<bool> mHasChildren;
};

void WriteLayer(XmlWriter& w, const Layer& layer) {
    const char* type = std::visit(
        [](const auto& c) -> const char* {
            using T = std::decay_t<decltype(c)>;
            if constexpr (std::is_same_v<T, PatternLayer>) return "pattern";
            else if constexpr (std::is_same_v<T, SolidLayer>) return "solid";
            else if constexpr (std::is_same_v<T, GradientLayer>) return "gradient";
            else if constexpr (std::is_same_v<T, ToneLayer>) return "tone";
            else return "footage";
        },
        layer.content);
    w.Open(type);
    w.Attr("name", layer.name);
    if (layer.start.numerator() != 0) w.Attr("start", Text(layer.start));
    if (layer.end) w.Attr("end", Text(*layer.end));
    if (const auto* s = std::get_if<SolidLayer>(&layer.content)) {
        w.Attr("color", Text(s->color));
        if (s->rect) w.Attr("rect", Text(*s->rect));
    } else if (const auto* g = std::get_if<GradientLayer>(&layer.content)) {
        w.Attr("from", Text(g->from));
        w.Attr("to", Text(g->to));
        w.Attr("direction", g->direction == GradientLayer::Direction::Vertical ? "vertical" : "horizontal");
        if (g->rect) w.Attr("rect", Text(*g->rect));
    } else if (const auto* t = std::get_if<ToneLayer>(&layer.content)) {
        w.Attr("frequency", Text(t->frequency));
        w.Attr("amplitude", Text(t->amplitude));
        if (!t->channels.empty()) {
            std::string list;
            for (int32_t c : t->channels) list += (list.empty() ? "" : " ") + std::to_string(c);
            w.Attr("channels", list);
        }
    } else if (const auto* f = std::get_if<FootageRef>(&layer.content)) {
        w.Attr("path", f->path);
    }
    w.Close();
}

void WriteItem(XmlWriter& w, const ProjectModel& model, const Item& item) {
    switch (item.type) {
        case ItemType::Bin:
            w.Open("bin");
            w.Attr("name", item.name);
            w.Attr("id", item.id.ToString());
            if (!item.children.empty()) {
                w.BeginChildren();
                for (size_t child : item.children) WriteItem(w, model, model.Items()[child]);
            }
            w.Close();
            return;
        case ItemType::Composition: {
            const Composition& c = *item.composition;
            w.Open("composition");
            w.Attr("name", item.name);
            w.Attr("id", item.id.ToString());
            w.Attr("width", std::to_string(c.width));
            w.Attr("height", std::to_string(c.height));
            w.Attr("frameRate", Text(c.frameRate));
            w.Attr("duration", Text(c.duration));
            w.Attr("pixelAspectRatio", std::to_string(c.pixelAspectRatio.Numerator()) + "/" +
                                           std::to_string(c.pixelAspectRatio.Denominator()));
            w.Attr("sampleRate", std::to_string(c.sampleRate));
            w.Attr("channels", Text(c.channels));
            w.Attr("background", Text(c.background));
            if (!c.layers.empty()) {
                w.BeginChildren();
                for (const Layer& layer : c.layers) WriteLayer(w, layer);
            }
            w.Close();
            return;
        }
        case ItemType::Footage:
            w.Open("footage");
            w.Attr("name", item.name);
            w.Attr("id", item.id.ToString());
            w.Attr("path", item.footage->path);
            w.Attr("missing", item.footage->missing ? "true" : "false");
            w.Close();
            return;
    }
}

// ---- reading the dialect ----

Layer ReadLayer(const XmlElement& e) {
    Attributes a(e);
    Layer layer;
    layer.name = e.name;
    if (const std::string* name = a.Find("name")) layer.name = *name;
    if (const std::string* start = a.Find("start")) layer.start = RationalAttr(e, "start", *start);
    if (const std::string* end = a.Find("end")) layer.end = RationalAttr(e, "end", *end);
    if (!e.children.empty()) Bad(e, "holds elements; layers hold none");
    if (e.name == "pattern") {
        layer.content = PatternLayer{};
    } else if (e.name == "solid") {
        SolidLayer s;
        s.color = ColorAttr(e, "color", a.Require("color"));
        if (const std::string* r = a.Find("rect")) s.rect = RectAttr(e, *r);
        layer.content = s;
    } else if (e.name == "gradient") {
        GradientLayer g;
        if (const std::string* v = a.Find("from")) g.from = ColorAttr(e, "from", *v);
        if (const std::string* v = a.Find("to")) g.to = ColorAttr(e, "to", *v);
        if (const std::string* d = a.Find("direction")) {
            if (*d == "horizontal") g.direction = GradientLayer::Direction::Horizontal;
            else if (*d == "vertical") g.direction = GradientLayer::Direction::Vertical;
            else Bad(e, "\"direction\" must be \"horizontal\" or \"vertical\"");
        }
        if (const std::string* r = a.Find("rect")) g.rect = RectAttr(e, *r);
        layer.content = g;
    } else if (e.name == "tone") {
        ToneLayer t;
        t.frequency = NumberAttr(e, "frequency", a.Require("frequency"));
        const std::string* amplitude = a.Find("amplitude");
        const std::string* level = a.Find("level");
        if (amplitude && level) Bad(e, "gives both \"amplitude\" and \"level\"");
        if (amplitude) t.amplitude = NumberAttr(e, "amplitude", *amplitude);
        if (level) {
            const double dB = NumberAttr(e, "level", *level);
            if (dB > 0 || dB < -200) Bad(e, "\"level\" is in dBFS, from -200 to 0");
            t.amplitude = std::pow(10.0, dB / 20.0);
        }
        if (const std::string* ch = a.Find("channels")) {
            for (const auto& w : Words(*ch)) t.channels.push_back(static_cast<int32_t>(WholeAttr(e, "channels", w, 0, 31)));
        }
        layer.content = t;
    } else if (e.name == "footage") {
        FootageRef f;
        f.path = a.Require("path");
        layer.content = f;
    } else {
        Bad(e, "is not a layer (pattern, solid, gradient, tone or footage)");
    }
    a.Finish();
    return layer;
}

// The attributes of a <composition> over |c|; its layers replace c's when it has any.
void ReadCompositionInto(Attributes& a, Composition& c) {
    const XmlElement& e = a.Element();
    const int64_t m = ProjectModel::kMaxDimension;
    if (const std::string* v = a.Find("width")) c.width = static_cast<int32_t>(WholeAttr(e, "width", *v, 1, m));
    if (const std::string* v = a.Find("height")) c.height = static_cast<int32_t>(WholeAttr(e, "height", *v, 1, m));
    if (const std::string* v = a.Find("frameRate")) c.frameRate = RationalAttr(e, "frameRate", *v);
    if (const std::string* v = a.Find("duration")) c.duration = RationalAttr(e, "duration", *v);
    if (const std::string* v = a.Find("pixelAspectRatio")) {
        const Rational r = RationalAttr(e, "pixelAspectRatio", *v);
        if (r <= 0) Bad(e, "\"pixelAspectRatio\" must be positive");
        c.pixelAspectRatio = platform::PixelAspectRatio(static_cast<uint64_t>(r.numerator()),
                                                        static_cast<uint64_t>(r.denominator()));
    }
    if (const std::string* v = a.Find("sampleRate")) {
        c.sampleRate = static_cast<int32_t>(WholeAttr(e, "sampleRate", *v, 8000, 384000));
    }
    if (const std::string* v = a.Find("channels")) c.channels = ChannelsAttr(e, *v);
    if (const std::string* v = a.Find("background")) c.background = ColorAttr(e, "background", *v);
    if (!e.children.empty()) {
        if (e.children.size() > ProjectModel::kMaxLayers) Bad(e, "holds more than 1000 layers");
        c.layers.clear();
        for (const XmlElement& child : e.children) c.layers.push_back(ReadLayer(child));
    }
}

void CheckComposition(const XmlElement& e, const Composition& c) {
    try {
        ValidateComposition(c);
    } catch (const ProjectError& error) {
        Bad(e, error.what());
    }
}

NewItem ReadItem(const XmlElement& e) {
    Attributes a(e);
    NewItem item;
    item.name = a.Require("name");
    item.id = IdAttr(a);
    if (e.name == "bin") {
        item.type = ItemType::Bin;
        for (const XmlElement& child : e.children) item.children.push_back(ReadItem(child));
    } else if (e.name == "composition") {
        item.type = ItemType::Composition;
        Composition c;
        c.channels = platform::CreateStereoChannelLayout();
        a.Require("width");
        a.Require("height");
        a.Require("frameRate");
        a.Require("duration");
        ReadCompositionInto(a, c);
        CheckComposition(e, c);
        item.composition = std::move(c);
    } else if (e.name == "footage") {
        item.type = ItemType::Footage;
        item.footagePath = a.Require("path");
        a.Find("missing");  // written for people; found out again when added
        if (!e.children.empty()) Bad(e, "holds elements; footage holds none");
    } else {
        Bad(e, "is not an item (bin, composition or footage)");
    }
    a.Finish();
    return item;
}

const XmlElement* FirstComposition(const XmlElement& e) {
    if (e.name == "composition") return &e;
    for (const XmlElement& child : e.children) {
        if (const XmlElement* found = FirstComposition(child)) return found;
    }
    return nullptr;
}

}  // namespace

const std::string* XmlElement::Attribute(std::string_view key) const {
    for (const auto& [k, v] : attributes) {
        if (k == key) return &v;
    }
    return nullptr;
}

XmlElement ParseXml(std::string_view text) { return XmlReader(text).Read(); }

std::string WriteItemsXml(const ProjectModel& model, const std::vector<const Item*>& items) {
    XmlWriter w;
    w.Out() = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n";
    w.Open(kRootElement);
    w.Attr("version", kVersion);
    w.Attr("project", model.File().string());
    if (!items.empty()) {
        w.BeginChildren();
        for (const Item* item : items) WriteItem(w, model, *item);
    }
    w.Close();
    return w.Take();
}

ItemsDocument ReadItemsXml(std::string_view text) {
    const XmlElement root = ParseXml(text);
    if (root.name != kRootElement) {
        throw ItemsXmlError("line " + std::to_string(root.line) + ": expected <" + kRootElement + ">, found <" +
                            root.name + ">");
    }
    Attributes a(root);
    const std::string* version = a.Find("version");
    if (version && *version != kVersion) Bad(root, "version " + *version + " is not read by this peer (version 1)");
    ItemsDocument doc;
    if (const std::string* p = a.Find("project")) doc.project = *p;
    if (const std::string* p = a.Find("parent")) doc.parent = *p;
    a.Finish();
    for (const XmlElement& child : root.children) doc.items.push_back(ReadItem(child));
    return doc;
}

std::optional<Composition> ReadCompositionXml(std::string_view text, const Composition& base, std::string* name) {
    const XmlElement root = ParseXml(text);
    const XmlElement* e = FirstComposition(root);
    if (!e) return std::nullopt;
    Attributes a(*e);
    Composition c = base;
    if (const std::string* n = a.Find("name"); n && name) *name = *n;
    IdAttr(a);  // a new source gets an id of its own
    ReadCompositionInto(a, c);
    a.Finish();
    return c;
}

}  // namespace tidelink::peer
