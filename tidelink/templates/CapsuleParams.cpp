#include "tidelink/templates/CapsuleParams.h"

#include <stdexcept>

#include "platform/media/ValueAccess.h"

namespace tidelink {

using namespace platform;

// ---- CapsuleParam --------------------------------------------------------------------------

namespace {
using P = CapsuleParamProperty;
}

void CapsuleParam::InitSharedProperties(const ImmutableString& matchName, const WString& uiName,
                                        bool animatable) {
    mProperties[kCapsuleParamProperty_MatchName] = P(matchName);
    mProperties[kCapsuleParamProperty_UIName] = P(uiName);
    mProperties[kCapsuleParamProperty_Animatable] = P(animatable);
}

void CapsuleParam::InitKind(CapsuleParamType type, const ImmutableString& matchName,
                            const WString& uiName, bool animatable) {
    InitSharedProperties(matchName, uiName, animatable);
    mProperties[kCapsuleParamProperty_Type] = P(type);
}

void CapsuleParam::InitTextParam(const ImmutableString& matchName, const WString& uiName,
                                 bool animatable, const WString& defaultText,
                                 const TextEditInfo& textEditInfo) {
    InitKind(kCapsuleParamType_Text, matchName, uiName, animatable);
    mProperties[kCapsuleParamProperty_DefaultValue] = P(defaultText);
    mProperties[kCapsuleParamProperty_FontEditInfo] = P(textEditInfo);
}

void CapsuleParam::InitFloatParam(const ImmutableString& matchName, const WString& uiName,
                                  bool animatable, double defaultValue, double minValue,
                                  double maxValue, int decimals) {
    InitKind(kCapsuleParamType_Float, matchName, uiName, animatable);
    mProperties[kCapsuleParamProperty_DefaultValue] = P(defaultValue);
    mProperties[kCapsuleParamProperty_Min] = P(minValue);
    mProperties[kCapsuleParamProperty_Max] = P(maxValue);
    mProperties[kCapsuleParamProperty_Decimals] = P(decimals);
}

void CapsuleParam::InitBooleanParam(const ImmutableString& matchName, const WString& uiName,
                                    bool animatable, bool defaultValue) {
    InitKind(kCapsuleParamType_Boolean, matchName, uiName, animatable);
    mProperties[kCapsuleParamProperty_DefaultValue] = P(defaultValue);
}

void CapsuleParam::InitColorParam(const ImmutableString& matchName, const WString& uiName,
                                  bool animatable, const ColorRGBA& defaultColor) {
    InitKind(kCapsuleParamType_Color, matchName, uiName, animatable);
    mProperties[kCapsuleParamProperty_DefaultValue] = P(defaultColor);
}

void CapsuleParam::InitCommentParam(const ImmutableString& matchName, const WString& uiName,
                                    bool animatable, const WString& text) {
    InitKind(kCapsuleParamType_Comment, matchName, uiName, animatable);
    mProperties[kCapsuleParamProperty_DefaultValue] = P(text);
}

void CapsuleParam::InitAngleParam(const ImmutableString& matchName, const WString& uiName,
                                  bool animatable, double defaultAngle) {
    InitKind(kCapsuleParamType_Angle, matchName, uiName, animatable);
    mProperties[kCapsuleParamProperty_DefaultValue] = P(defaultAngle);
}

void CapsuleParam::InitPoint2DParam(const ImmutableString& matchName, const WString& uiName,
                                    bool animatable, const CapsulePoint& defaultPoint) {
    InitKind(kCapsuleParamType_Point2D, matchName, uiName, animatable);
    mProperties[kCapsuleParamProperty_DefaultValue] = P(defaultPoint);
}

void CapsuleParam::InitScaleParam(const ImmutableString& matchName, const WString& uiName,
                                  bool animatable, const std::vector<double>& defaultScale,
                                  bool linked, int dimensions) {
    InitKind(kCapsuleParamType_Scale, matchName, uiName, animatable);
    mProperties[kCapsuleParamProperty_DefaultValue] = P(defaultScale);
    mProperties[kCapsuleParamProperty_Linked] = P(linked);
    mProperties[kCapsuleParamProperty_Dimensions] = P(dimensions);
}

void CapsuleParam::InitGroupParam(const ImmutableString& matchName, const WString& uiName,
                                  bool animatable, const std::vector<WString>& defaultValue,
                                  bool expanded) {
    InitKind(kCapsuleParamType_Group, matchName, uiName, animatable);
    mProperties[kCapsuleParamProperty_DefaultValue] = P(defaultValue);
    mProperties[kCapsuleParamProperty_Expanded] = P(expanded);
}

void CapsuleParam::InitSpreadsheetParam(const ImmutableString& matchName, const WString& uiName,
                                        bool animatable, const SpreadsheetValue& defaultValue,
                                        unsigned int minRows, unsigned int maxRows,
                                        const std::vector<SpreadsheetColumnInfo>& columnInfos) {
    InitKind(kCapsuleParamType_Spreadsheet, matchName, uiName, animatable);
    mProperties[kCapsuleParamProperty_DefaultValue] = P(defaultValue);
    mProperties[kCapsuleParamProperty_Min] = P(minRows);
    mProperties[kCapsuleParamProperty_Max] = P(maxRows);
    mProperties[kCapsuleParamProperty_SpreadsheetColumnInfo] = P(columnInfos);
}

void CapsuleParam::InitMenuParam(const ImmutableString& matchName, const WString& uiName,
                                 bool animatable, int defaultIndex,
                                 const std::vector<WString>& menuEntries) {
    InitKind(kCapsuleParamType_Menu, matchName, uiName, animatable);
    mProperties[kCapsuleParamProperty_DefaultValue] = P(defaultIndex);
    mProperties[kCapsuleParamProperty_MenuContent] = P(menuEntries);
}

void CapsuleParam::InitMediaParam(const ImmutableString& matchName, const WString& uiName,
                                  bool animatable, bool expanded, const WString& defaultText,
                                  const MediaReplacementInfo& mediaReplacementInfo) {
    InitKind(kCapsuleParamType_Media, matchName, uiName, animatable);
    mProperties[kCapsuleParamProperty_Expanded] = P(expanded);
    mProperties[kCapsuleParamProperty_DefaultValue] = P(defaultText);
    mProperties[kCapsuleParamProperty_MediaReplacementInfo] = P(mediaReplacementInfo);
}

const CapsuleParamProperty& CapsuleParam::At(CapsuleParamPropertyID id) const {
    auto it = mProperties.find(id);
    if (it == mProperties.end()) throw std::out_of_range("invalid map<K, T> key");
    return it->second;
}

template <class T>
const T& CapsuleParam::Get(CapsuleParamPropertyID id) const {
    return boost::get<T>(At(id));
}

CapsuleParamType CapsuleParam::GetType() const {
    return Get<CapsuleParamType>(kCapsuleParamProperty_Type);
}

void CapsuleParam::GetBasicProperties(ImmutableString& matchName, WString& uiName,
                                      bool& animatable) const {
    matchName = Get<ImmutableString>(kCapsuleParamProperty_MatchName);
    uiName = Get<WString>(kCapsuleParamProperty_UIName);
    animatable = Get<bool>(kCapsuleParamProperty_Animatable);
}

void CapsuleParam::GetTextProperties(ImmutableString& matchName, WString& uiName,
                                     bool& animatable, WString& defaultText,
                                     TextEditInfo& textEditInfo) const {
    GetBasicProperties(matchName, uiName, animatable);
    defaultText = Get<WString>(kCapsuleParamProperty_DefaultValue);
    textEditInfo = Get<TextEditInfo>(kCapsuleParamProperty_FontEditInfo);
}

void CapsuleParam::GetFloatProperties(ImmutableString& matchName, WString& uiName,
                                      bool& animatable, double& defaultValue, double& minValue,
                                      double& maxValue, int& decimals) const {
    GetBasicProperties(matchName, uiName, animatable);
    defaultValue = Get<double>(kCapsuleParamProperty_DefaultValue);
    minValue = Get<double>(kCapsuleParamProperty_Min);
    maxValue = Get<double>(kCapsuleParamProperty_Max);
    decimals = Get<int>(kCapsuleParamProperty_Decimals);
}

void CapsuleParam::GetBooleanProperties(ImmutableString& matchName, WString& uiName,
                                        bool& animatable, bool& defaultValue) const {
    GetBasicProperties(matchName, uiName, animatable);
    defaultValue = Get<bool>(kCapsuleParamProperty_DefaultValue);
}

void CapsuleParam::GetColorProperties(ImmutableString& matchName, WString& uiName,
                                      bool& animatable, ColorRGBA& defaultColor) const {
    GetBasicProperties(matchName, uiName, animatable);
    defaultColor = Get<ColorRGBA>(kCapsuleParamProperty_DefaultValue);
}

void CapsuleParam::GetCommentProperties(ImmutableString& matchName, WString& uiName,
                                        bool& animatable, WString& text) const {
    GetBasicProperties(matchName, uiName, animatable);
    text = Get<WString>(kCapsuleParamProperty_DefaultValue);
}

void CapsuleParam::GetAngleProperties(ImmutableString& matchName, WString& uiName,
                                      bool& animatable, double& defaultAngle) const {
    GetBasicProperties(matchName, uiName, animatable);
    defaultAngle = Get<double>(kCapsuleParamProperty_DefaultValue);
}

void CapsuleParam::GetPoint2DProperties(ImmutableString& matchName, WString& uiName,
                                        bool& animatable, CapsulePoint& defaultPoint) const {
    GetBasicProperties(matchName, uiName, animatable);
    defaultPoint = Get<CapsulePoint>(kCapsuleParamProperty_DefaultValue);
}

void CapsuleParam::GetScaleProperties(ImmutableString& matchName, WString& uiName,
                                      bool& animatable, std::vector<double>& defaultScale,
                                      bool& linked, int& dimensions) const {
    GetBasicProperties(matchName, uiName, animatable);
    defaultScale = Get<std::vector<double>>(kCapsuleParamProperty_DefaultValue);
    linked = Get<bool>(kCapsuleParamProperty_Linked);
    dimensions = Get<int>(kCapsuleParamProperty_Dimensions);
}

void CapsuleParam::GetGroupProperties(ImmutableString& matchName, WString& uiName,
                                      bool& animatable, std::vector<WString>& defaultValue,
                                      bool& expanded) const {
    GetBasicProperties(matchName, uiName, animatable);
    defaultValue = Get<std::vector<WString>>(kCapsuleParamProperty_DefaultValue);
    expanded = Get<bool>(kCapsuleParamProperty_Expanded);
}

void CapsuleParam::GetGroupDropZoneProperties(ImmutableString& matchName, WString& uiName,
                                              bool& animatable,
                                              std::vector<WString>& defaultValue) const {
    GetBasicProperties(matchName, uiName, animatable);
    defaultValue = Get<std::vector<WString>>(kCapsuleParamProperty_DefaultValue);
}

void CapsuleParam::GetSpreadsheetProperties(
    ImmutableString& matchName, WString& uiName, bool& animatable, SpreadsheetValue& defaultValue,
    unsigned int& minRows, unsigned int& maxRows,
    std::vector<SpreadsheetColumnInfo>& columnInfos) const {
    GetBasicProperties(matchName, uiName, animatable);
    defaultValue = Get<SpreadsheetValue>(kCapsuleParamProperty_DefaultValue);
    minRows = Get<unsigned int>(kCapsuleParamProperty_Min);
    maxRows = Get<unsigned int>(kCapsuleParamProperty_Max);
    columnInfos = Get<std::vector<SpreadsheetColumnInfo>>(
        kCapsuleParamProperty_SpreadsheetColumnInfo);
}

void CapsuleParam::GetMenuProperties(ImmutableString& matchName, WString& uiName,
                                     bool& animatable, int& defaultIndex,
                                     std::vector<WString>& menuEntries) const {
    GetBasicProperties(matchName, uiName, animatable);
    defaultIndex = Get<int>(kCapsuleParamProperty_DefaultValue);
    menuEntries = Get<std::vector<WString>>(kCapsuleParamProperty_MenuContent);
}

void CapsuleParam::GetMediaProperties(ImmutableString& matchName, WString& uiName,
                                      bool& animatable, bool& expanded, WString& defaultText,
                                      MediaReplacementInfo& mediaReplacementInfo) const {
    GetBasicProperties(matchName, uiName, animatable);
    expanded = Get<bool>(kCapsuleParamProperty_Expanded);
    defaultText = Get<WString>(kCapsuleParamProperty_DefaultValue);
    mediaReplacementInfo = Get<MediaReplacementInfo>(kCapsuleParamProperty_MediaReplacementInfo);
}

void CapsuleParam::SetLocalizedNamesAndValues(const WString& uiName, const WString& defaultText) {
    mProperties[kCapsuleParamProperty_UIName] = P(uiName);
    const CapsuleParamType type = GetType();
    if (type == kCapsuleParamType_Text || type == kCapsuleParamType_Comment) {
        mProperties[kCapsuleParamProperty_DefaultValue] = P(defaultText);
    }
}

namespace {

// The default value of a parameter as a value variant; properties that no kind uses as its
// default (type, match name, column infos, edit records) have no value form.
struct ToValueVariant : boost::static_visitor<CapsuleParamValueVariant> {
    template <class T>
    CapsuleParamValueVariant operator()(const T& x) const {
        if constexpr (std::is_constructible_v<CapsuleParamValueVariant, const T&> &&
                      !std::is_same_v<T, CapsuleParamType> &&
                      !std::is_same_v<T, ImmutableString>) {
            return CapsuleParamValueVariant(x);
        } else {
            throw boost::bad_get();
        }
    }
};

}  // namespace

void CapsuleParam::GetParamValue(ImmutableString& name, CapsuleParamValueVariant& value) const {
    name = Get<ImmutableString>(kCapsuleParamProperty_MatchName);
    value = boost::apply_visitor(ToValueVariant(), At(kCapsuleParamProperty_DefaultValue));
}

void CapsuleParam::AddParamValue(const std::shared_ptr<CapsuleParamValues>& values) const {
    ImmutableString name;
    CapsuleParamValueVariant value;
    GetParamValue(name, value);
    values->AddValue(name, GetType(), value);
}

// ---- CapsuleParams -------------------------------------------------------------------------

void CapsuleParams::AddTextParam(const ImmutableString& matchName, const WString& uiName,
                                 bool animatable, const WString& defaultText,
                                 const TextEditInfo& textEditInfo) {
    Append().InitTextParam(matchName, uiName, animatable, defaultText, textEditInfo);
}

void CapsuleParams::AddFloatParam(const ImmutableString& matchName, const WString& uiName,
                                  bool animatable, double defaultValue, double minValue,
                                  double maxValue, int decimals) {
    Append().InitFloatParam(matchName, uiName, animatable, defaultValue, minValue, maxValue,
                            decimals);
}

void CapsuleParams::AddBooleanParam(const ImmutableString& matchName, const WString& uiName,
                                    bool animatable, bool defaultValue) {
    Append().InitBooleanParam(matchName, uiName, animatable, defaultValue);
}

void CapsuleParams::AddColorParam(const ImmutableString& matchName, const WString& uiName,
                                  bool animatable, const ColorRGBA& defaultColor) {
    Append().InitColorParam(matchName, uiName, animatable, defaultColor);
}

void CapsuleParams::AddCommentParam(const ImmutableString& matchName, const WString& uiName,
                                    bool animatable, const WString& text) {
    Append().InitCommentParam(matchName, uiName, animatable, text);
}

void CapsuleParams::AddAngleParam(const ImmutableString& matchName, const WString& uiName,
                                  bool animatable, double defaultAngle) {
    Append().InitAngleParam(matchName, uiName, animatable, defaultAngle);
}

void CapsuleParams::AddPoint2DParam(const ImmutableString& matchName, const WString& uiName,
                                    bool animatable, const CapsulePoint& defaultPoint) {
    Append().InitPoint2DParam(matchName, uiName, animatable, defaultPoint);
}

void CapsuleParams::AddScaleParam(const ImmutableString& matchName, const WString& uiName,
                                  bool animatable, const std::vector<double>& defaultScale,
                                  bool linked, int dimensions) {
    Append().InitScaleParam(matchName, uiName, animatable, defaultScale, linked, dimensions);
}

void CapsuleParams::AddGroupParam(const ImmutableString& matchName, const WString& uiName,
                                  bool animatable, const std::vector<WString>& defaultValue,
                                  bool expanded) {
    Append().InitGroupParam(matchName, uiName, animatable, defaultValue, expanded);
}

void CapsuleParams::AddSpreadsheetParam(const ImmutableString& matchName, const WString& uiName,
                                        bool animatable, const SpreadsheetValue& defaultValue,
                                        unsigned int minRows, unsigned int maxRows,
                                        const std::vector<SpreadsheetColumnInfo>& columnInfos) {
    Append().InitSpreadsheetParam(matchName, uiName, animatable, defaultValue, minRows, maxRows,
                                  columnInfos);
}

void CapsuleParams::AddMenuParam(const ImmutableString& matchName, const WString& uiName,
                                 bool animatable, int defaultIndex,
                                 const std::vector<WString>& menuEntries) {
    Append().InitMenuParam(matchName, uiName, animatable, defaultIndex, menuEntries);
}

void CapsuleParams::AddMediaParam(const ImmutableString& matchName, const WString& uiName,
                                  bool animatable, bool expanded, const WString& defaultText,
                                  const MediaReplacementInfo& mediaReplacementInfo) {
    Append().InitMediaParam(matchName, uiName, animatable, expanded, defaultText,
                            mediaReplacementInfo);
}

std::shared_ptr<CapsuleParamValues> CapsuleParams::GetParamValues() const {
    auto values = std::make_shared<CapsuleParamValues>();
    for (const auto& p : mParams) {
        const auto& props = p.GetProperties();
        if (props.count(kCapsuleParamProperty_DefaultValue) == 0) continue;
        p.AddParamValue(values);
    }
    return values;
}

// ---- CapsuleParamValue(s) ------------------------------------------------------------------

WString CapsuleParamValue::GetTextValue() const {
    if (mType != kCapsuleParamType_Text && mType != kCapsuleParamType_Comment) return WString();
    return boost::get<WString>(mValue);
}
double CapsuleParamValue::GetFloatValue() const { return boost::get<double>(mValue); }
bool CapsuleParamValue::GetBooleanValue() const { return boost::get<bool>(mValue); }
ColorRGBA CapsuleParamValue::GetColorValue() const { return boost::get<ColorRGBA>(mValue); }
double CapsuleParamValue::GetAngleValue() const { return boost::get<double>(mValue); }
CapsulePoint CapsuleParamValue::GetPoint2DValue() const {
    return boost::get<CapsulePoint>(mValue);
}
std::vector<double> CapsuleParamValue::GetScaleValue() const {
    return boost::get<std::vector<double>>(mValue);
}
std::vector<WString> CapsuleParamValue::GetGroupValue() const {
    return boost::get<std::vector<WString>>(mValue);
}
SpreadsheetValue CapsuleParamValue::GetSpreadsheetValue() const {
    return boost::get<SpreadsheetValue>(mValue);
}
int CapsuleParamValue::GetMenuValue() const { return boost::get<int>(mValue); }
WString CapsuleParamValue::GetMediaValue() const { return boost::get<WString>(mValue); }

void CapsuleParamValues::AddValue(const ImmutableString& name, CapsuleParamType type,
                                  const CapsuleParamValueVariant& value) {
    mValues.try_emplace(name, type, value);
}

void CapsuleParamValues::UpdateValue(const ImmutableString& name, CapsuleParamType type,
                                     const CapsuleParamValueVariant& value) {
    mValues.insert_or_assign(name, CapsuleParamValue(type, value));
}

// ---- JSON ----------------------------------------------------------------------------------

namespace {

Value ColorToJSON(const ColorRGBA& c) {
    return Value::array({double{c.mRed}, double{c.mGreen}, double{c.mBlue}, double{c.mAlpha}});
}

ColorRGBA ColorFromJSON(const Value& v) {
    RequireArray(v);
    if (v.size() != 4) ThrowTypeError(v, "array of four numbers");
    return {ReadFloat(v[0]), ReadFloat(v[1]), ReadFloat(v[2]), ReadFloat(v[3])};
}

Value PointToJSON(const CapsulePoint& p) { return Value::array({p.mX, p.mY}); }

CapsulePoint PointFromJSON(const Value& v) {
    RequireArray(v);
    if (v.size() != 2) ThrowTypeError(v, "array of two numbers");
    return {ReadDouble(v[0]), ReadDouble(v[1])};
}

Value WStringsToJSON(const std::vector<WString>& strings) {
    Value out = Value::array();
    for (const auto& s : strings) out.push_back(ToUTF8(s));
    return out;
}

bool IsKnownType(int64_t type) {
    return type >= kCapsuleParamType_Text && type <= kCapsuleParamType_Media;
}

}  // namespace

Value ToJSON(const CapsuleParam& param) {
    ImmutableString matchName;
    WString uiName;
    bool animatable = false;
    param.GetBasicProperties(matchName, uiName, animatable);
    const CapsuleParamType type = param.GetType();
    Value j = Value::object();
    j["capPropMatchName"] = matchName;
    j["capPropUIName"] = ToUTF8(uiName);
    j["capPropAnimatable"] = animatable;
    j["capPropType"] = int64_t{type};
    switch (type) {
    case kCapsuleParamType_Text: {
        WString text;
        TextEditInfo edit;
        param.GetTextProperties(matchName, uiName, animatable, text, edit);
        j["capPropDefault"] = ToUTF8(text);
        edit.ConvertToObject(j);
        break;
    }
    case kCapsuleParamType_Float: {
        double def = 0, min = 0, max = 0;
        int decimals = 0;
        param.GetFloatProperties(matchName, uiName, animatable, def, min, max, decimals);
        j["capPropDefault"] = def;
        j["capPropMin"] = min;
        j["capPropMax"] = max;
        j["capPropDecimals"] = int64_t{decimals};
        break;
    }
    case kCapsuleParamType_Boolean: {
        bool def = false;
        param.GetBooleanProperties(matchName, uiName, animatable, def);
        j["capPropDefault"] = def;
        break;
    }
    case kCapsuleParamType_Color: {
        ColorRGBA def;
        param.GetColorProperties(matchName, uiName, animatable, def);
        j["capPropDefault"] = ColorToJSON(def);
        break;
    }
    case kCapsuleParamType_Comment: {
        WString text;
        param.GetCommentProperties(matchName, uiName, animatable, text);
        j["capPropDefault"] = ToUTF8(text);
        break;
    }
    case kCapsuleParamType_Angle: {
        double def = 0;
        param.GetAngleProperties(matchName, uiName, animatable, def);
        j["capPropDefault"] = def;
        break;
    }
    case kCapsuleParamType_Point2D: {
        CapsulePoint def;
        param.GetPoint2DProperties(matchName, uiName, animatable, def);
        j["capPropDefault"] = PointToJSON(def);
        break;
    }
    case kCapsuleParamType_Scale: {
        std::vector<double> def;
        bool linked = false;
        int dimensions = 0;
        param.GetScaleProperties(matchName, uiName, animatable, def, linked, dimensions);
        j["capPropDefault"] = def;
        j["capPropLinked"] = linked;
        j["capPropDimensions"] = int64_t{dimensions};
        break;
    }
    case kCapsuleParamType_Group: {
        std::vector<WString> def;
        bool expanded = false;
        param.GetGroupProperties(matchName, uiName, animatable, def, expanded);
        j["capPropDefault"] = WStringsToJSON(def);
        j["capPropGroupExpanded"] = expanded;
        break;
    }
    case kCapsuleParamType_Spreadsheet: {
        SpreadsheetValue def;
        unsigned int minRows = 0, maxRows = 0;
        std::vector<SpreadsheetColumnInfo> columns;
        param.GetSpreadsheetProperties(matchName, uiName, animatable, def, minRows, maxRows,
                                       columns);
        j["capPropDefault"] = def;
        j["capPropSpreadsheetMinRows"] = uint64_t{minRows};
        j["capPropSpreadsheetMaxRows"] = uint64_t{maxRows};
        j["capPropSpreadsheetColumnInfo"] = columns;
        break;
    }
    case kCapsuleParamType_Menu: {
        int def = 0;
        std::vector<WString> entries;
        param.GetMenuProperties(matchName, uiName, animatable, def, entries);
        j["capPropDefault"] = int64_t{def};
        j["menuContent"] = WStringsToJSON(entries);
        break;
    }
    case kCapsuleParamType_Media: {
        bool expanded = false;
        WString text;
        MediaReplacementInfo media;
        param.GetMediaProperties(matchName, uiName, animatable, expanded, text, media);
        j["capPropExpanded"] = expanded;
        j["capPropDefault"] = ToUTF8(text);
        media.ConvertToObject(j);
        break;
    }
    default:
        break;  // a kind this library does not know: only the shared keys
    }
    return j;
}

void FromJSON(const Value& j, CapsuleParam& param) {
    RequireObject(j);
    const ImmutableString matchName = ReadString(MemberOrNull(j, "capPropMatchName"));
    const WString uiName = ReadWString(MemberOrNull(j, "capPropUIName"));
    const bool animatable = ReadBool(MemberOrNull(j, "capPropAnimatable"));
    const auto type = ReadEnum<CapsuleParamType>(MemberOrNull(j, "capPropType"));
    const Value& def = MemberOrNull(j, "capPropDefault");
    CapsuleParam out;
    switch (type) {
    case kCapsuleParamType_Text: {
        TextEditInfo edit;
        edit.ExtractProperties(j);
        out.InitTextParam(matchName, uiName, animatable, ReadWString(def), edit);
        break;
    }
    case kCapsuleParamType_Float:
        out.InitFloatParam(matchName, uiName, animatable, ReadDouble(def),
                           ReadDouble(MemberOrNull(j, "capPropMin")),
                           ReadDouble(MemberOrNull(j, "capPropMax")),
                           ReadInteger<int>(MemberOrNull(j, "capPropDecimals")));
        break;
    case kCapsuleParamType_Boolean:
        out.InitBooleanParam(matchName, uiName, animatable, ReadBool(def));
        break;
    case kCapsuleParamType_Color:
        out.InitColorParam(matchName, uiName, animatable, ColorFromJSON(def));
        break;
    case kCapsuleParamType_Comment:
        out.InitCommentParam(matchName, uiName, animatable, ReadWString(def));
        break;
    case kCapsuleParamType_Angle:
        out.InitAngleParam(matchName, uiName, animatable, ReadDouble(def));
        break;
    case kCapsuleParamType_Point2D:
        out.InitPoint2DParam(matchName, uiName, animatable, PointFromJSON(def));
        break;
    case kCapsuleParamType_Scale:
        out.InitScaleParam(matchName, uiName, animatable, ReadDoubleArray(def),
                           ReadBool(MemberOrNull(j, "capPropLinked")),
                           ReadInteger<int>(MemberOrNull(j, "capPropDimensions")));
        break;
    case kCapsuleParamType_Group:
        out.InitGroupParam(matchName, uiName, animatable, ReadWStringArray(def),
                           ReadBool(MemberOrNull(j, "capPropGroupExpanded")));
        break;
    case kCapsuleParamType_Spreadsheet: {
        const Value& columns = RequireArray(MemberOrNull(j, "capPropSpreadsheetColumnInfo"));
        std::vector<SpreadsheetColumnInfo> infos;
        infos.reserve(columns.size());
        for (const auto& c : columns) infos.push_back(c.get<SpreadsheetColumnInfo>());
        out.InitSpreadsheetParam(
            matchName, uiName, animatable, RequireObject(def).get<SpreadsheetValue>(),
            ReadInteger<unsigned int>(MemberOrNull(j, "capPropSpreadsheetMinRows")),
            ReadInteger<unsigned int>(MemberOrNull(j, "capPropSpreadsheetMaxRows")), infos);
        break;
    }
    case kCapsuleParamType_Menu:
        out.InitMenuParam(matchName, uiName, animatable, ReadInteger<int>(def),
                          ReadWStringArray(MemberOrNull(j, "menuContent")));
        break;
    case kCapsuleParamType_Media: {
        MediaReplacementInfo media;
        media.ExtractProperties(j);
        out.InitMediaParam(matchName, uiName, animatable,
                           ReadBool(MemberOrNull(j, "capPropExpanded")), ReadWString(def), media);
        break;
    }
    default:
        out.InitKind(type, matchName, uiName, animatable);
        break;
    }
    param = std::move(out);
}

Value ToJSON(const CapsuleParams& params) {
    Value list = Value::array();
    for (const auto& p : params.GetParams()) list.push_back(ToJSON(p));
    Value j = Value::object();
    j["capParams"] = std::move(list);
    return j;
}

void FromJSON(const Value& j, CapsuleParams& params) {
    RequireObject(j);
    const Value& list = RequireArray(MemberOrNull(j, "capParams"));
    std::vector<CapsuleParam> out(list.size());
    for (size_t i = 0; i < list.size(); ++i) FromJSON(list[i], out[i]);
    params.SetParams(out);
}

Value ToJSON(const CapsuleParamValue& value) {
    Value j = Value::object();
    const CapsuleParamType type = value.GetType();
    j["capValueType"] = int64_t{type};
    switch (type) {
    case kCapsuleParamType_Text:
    case kCapsuleParamType_Comment:
    case kCapsuleParamType_Media:
        j["capValueValue"] = ToUTF8(boost::get<WString>(value.GetValue()));
        break;
    case kCapsuleParamType_Float:
    case kCapsuleParamType_Angle:
        j["capValueValue"] = value.GetFloatValue();
        break;
    case kCapsuleParamType_Boolean:
        j["capValueValue"] = value.GetBooleanValue();
        break;
    case kCapsuleParamType_Color:
        j["capValueValue"] = ColorToJSON(value.GetColorValue());
        break;
    case kCapsuleParamType_Point2D:
        j["capValueValue"] = PointToJSON(value.GetPoint2DValue());
        break;
    case kCapsuleParamType_Scale:
        j["capValueValue"] = value.GetScaleValue();
        break;
    case kCapsuleParamType_Group:
        j["capValueValue"] = WStringsToJSON(value.GetGroupValue());
        break;
    case kCapsuleParamType_Spreadsheet:
        j["capValueValue"] = value.GetSpreadsheetValue();
        break;
    case kCapsuleParamType_Menu:
        j["capValueValue"] = int64_t{value.GetMenuValue()};
        break;
    default:
        break;
    }
    return j;
}

void FromJSON(const Value& j, CapsuleParamValue& value) {
    RequireObject(j);
    const auto type = ReadEnum<CapsuleParamType>(MemberOrNull(j, "capValueType"));
    if (!IsKnownType(type)) {
        value = CapsuleParamValue(type);
        return;
    }
    const Value& v = MemberOrNull(j, "capValueValue");
    CapsuleParamValueVariant out;
    switch (type) {
    case kCapsuleParamType_Text:
    case kCapsuleParamType_Comment:
    case kCapsuleParamType_Media: out = ReadWString(v); break;
    case kCapsuleParamType_Float:
    case kCapsuleParamType_Angle: out = ReadDouble(v); break;
    case kCapsuleParamType_Boolean: out = ReadBool(v); break;
    case kCapsuleParamType_Color: out = ColorFromJSON(v); break;
    case kCapsuleParamType_Point2D: out = PointFromJSON(v); break;
    case kCapsuleParamType_Scale: out = ReadDoubleArray(v); break;
    case kCapsuleParamType_Group: out = ReadWStringArray(v); break;
    case kCapsuleParamType_Spreadsheet: out = RequireObject(v).get<SpreadsheetValue>(); break;
    case kCapsuleParamType_Menu: out = ReadInteger<int>(v); break;
    default: break;
    }
    value = CapsuleParamValue(type, std::move(out));
}

Value ToJSON(const CapsuleParamValues& values) {
    Value list = Value::array();
    for (const auto& [name, value] : values.GetParamValues()) {
        list.push_back(Value::array({Value(name), ToJSON(value)}));
    }
    Value j = Value::object();
    j["capParamValues"] = std::move(list);
    return j;
}

void FromJSON(const Value& j, CapsuleParamValues& values) {
    RequireObject(j);
    const Value& list = RequireArray(MemberOrNull(j, "capParamValues"));
    CapsuleParamValues::Map out;
    for (const auto& entry : list) {
        RequireArray(entry);
        if (entry.size() != 2) ThrowTypeError(entry, "[name, value] pair");
        CapsuleParamValue value;
        FromJSON(entry[1], value);
        out.try_emplace(ReadString(entry[0]), std::move(value));  // the first of a name wins
    }
    values.SetParamValues(out);
}

}  // namespace tidelink
