// Parameters of a graphics template ("capsule") and the values chosen for them.
//
// A CapsuleParam is a property map; each kind of parameter sets its own properties through its
// initialiser and reads them back through its getter. Getters fail with std::out_of_range
// ("invalid map<K, T> key") for a property the map lacks and with boost::bad_get for a property
// held as another type. The JSON readers fail with the serializer's type_error for a missing
// object or a key holding a value of another kind, and never return a partial record.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <boost/variant.hpp>

#include "platform/Export.h"
#include "platform/Serialization.h"
#include "platform/media/MediaTypes.h"
#include "tidelink/templates/EditRecords.h"

namespace tidelink {

enum CapsuleParamType : int32_t {
    kCapsuleParamType_Text = 0,
    kCapsuleParamType_Float = 1,
    kCapsuleParamType_Boolean = 2,
    kCapsuleParamType_Color = 3,
    kCapsuleParamType_Comment = 4,
    kCapsuleParamType_Angle = 5,
    kCapsuleParamType_Point2D = 6,
    kCapsuleParamType_Scale = 7,
    kCapsuleParamType_Group = 8,
    kCapsuleParamType_Spreadsheet = 9,
    kCapsuleParamType_Menu = 10,
    kCapsuleParamType_Media = 11,
};

enum CapsuleParamPropertyID : int32_t {
    kCapsuleParamProperty_Type = 0,
    kCapsuleParamProperty_MatchName = 1,
    kCapsuleParamProperty_UIName = 2,
    kCapsuleParamProperty_Animatable = 3,
    kCapsuleParamProperty_DefaultValue = 4,
    kCapsuleParamProperty_Min = 5,  // Float: minimum value; Spreadsheet: minimum rows
    kCapsuleParamProperty_Max = 6,  // Float: maximum value; Spreadsheet: maximum rows
    kCapsuleParamProperty_Decimals = 7,
    kCapsuleParamProperty_Linked = 8,
    kCapsuleParamProperty_Dimensions = 9,
    kCapsuleParamProperty_FontEditInfo = 10,
    kCapsuleParamProperty_SpreadsheetColumnInfo = 11,
    kCapsuleParamProperty_Expanded = 12,
    kCapsuleParamProperty_MenuContent = 13,
    kCapsuleParamProperty_MediaReplacementInfo = 14,
};

// Interned names; UTF-8.
using ImmutableString = std::string;
using CapsulePoint = platform::PointT<double>;
using platform::ColorRGBA;

using CapsuleParamProperty =
    boost::variant<CapsuleParamType, ImmutableString, WString, bool, int, unsigned int, double,
                   ColorRGBA, CapsulePoint, std::vector<double>, std::vector<WString>,
                   SpreadsheetValue, std::vector<SpreadsheetColumnInfo>, SourceTextFontEditInfo,
                   TextEditInfo, MediaReplacementInfo>;
using CapsuleParamProperties = std::map<CapsuleParamPropertyID, CapsuleParamProperty>;

using CapsuleParamValueVariant =
    boost::variant<WString, bool, int, unsigned int, double, ColorRGBA, CapsulePoint,
                   std::vector<double>, std::vector<WString>, SpreadsheetValue>;

class CapsuleParamValues;

class TIDELINK_EXPORT CapsuleParam {
public:
    void InitSharedProperties(const ImmutableString& matchName, const WString& uiName,
                              bool animatable);
    void InitTextParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                       const WString& defaultText, const TextEditInfo& textEditInfo);
    void InitFloatParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                        double defaultValue, double minValue, double maxValue, int decimals);
    void InitBooleanParam(const ImmutableString& matchName, const WString& uiName,
                          bool animatable, bool defaultValue);
    void InitColorParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                        const ColorRGBA& defaultColor);
    void InitCommentParam(const ImmutableString& matchName, const WString& uiName,
                          bool animatable, const WString& text);
    void InitAngleParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                        double defaultAngle);
    void InitPoint2DParam(const ImmutableString& matchName, const WString& uiName,
                          bool animatable, const CapsulePoint& defaultPoint);
    void InitScaleParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                        const std::vector<double>& defaultScale, bool linked, int dimensions);
    void InitGroupParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                        const std::vector<WString>& defaultValue, bool expanded);
    void InitSpreadsheetParam(const ImmutableString& matchName, const WString& uiName,
                              bool animatable, const SpreadsheetValue& defaultValue,
                              unsigned int minRows, unsigned int maxRows,
                              const std::vector<SpreadsheetColumnInfo>& columnInfos);
    void InitMenuParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                       int defaultIndex, const std::vector<WString>& menuEntries);
    void InitMediaParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                        bool expanded, const WString& defaultText,
                        const MediaReplacementInfo& mediaReplacementInfo);

    CapsuleParamType GetType() const;
    void GetBasicProperties(ImmutableString& matchName, WString& uiName, bool& animatable) const;
    void GetTextProperties(ImmutableString& matchName, WString& uiName, bool& animatable,
                           WString& defaultText, TextEditInfo& textEditInfo) const;
    void GetFloatProperties(ImmutableString& matchName, WString& uiName, bool& animatable,
                            double& defaultValue, double& minValue, double& maxValue,
                            int& decimals) const;
    void GetBooleanProperties(ImmutableString& matchName, WString& uiName, bool& animatable,
                              bool& defaultValue) const;
    void GetColorProperties(ImmutableString& matchName, WString& uiName, bool& animatable,
                            ColorRGBA& defaultColor) const;
    void GetCommentProperties(ImmutableString& matchName, WString& uiName, bool& animatable,
                              WString& text) const;
    void GetAngleProperties(ImmutableString& matchName, WString& uiName, bool& animatable,
                            double& defaultAngle) const;
    void GetPoint2DProperties(ImmutableString& matchName, WString& uiName, bool& animatable,
                              CapsulePoint& defaultPoint) const;
    void GetScaleProperties(ImmutableString& matchName, WString& uiName, bool& animatable,
                            std::vector<double>& defaultScale, bool& linked,
                            int& dimensions) const;
    void GetGroupProperties(ImmutableString& matchName, WString& uiName, bool& animatable,
                            std::vector<WString>& defaultValue, bool& expanded) const;
    void GetGroupDropZoneProperties(ImmutableString& matchName, WString& uiName, bool& animatable,
                                    std::vector<WString>& defaultValue) const;
    void GetSpreadsheetProperties(ImmutableString& matchName, WString& uiName, bool& animatable,
                                  SpreadsheetValue& defaultValue, unsigned int& minRows,
                                  unsigned int& maxRows,
                                  std::vector<SpreadsheetColumnInfo>& columnInfos) const;
    void GetMenuProperties(ImmutableString& matchName, WString& uiName, bool& animatable,
                           int& defaultIndex, std::vector<WString>& menuEntries) const;
    void GetMediaProperties(ImmutableString& matchName, WString& uiName, bool& animatable,
                            bool& expanded, WString& defaultText,
                            MediaReplacementInfo& mediaReplacementInfo) const;

    const CapsuleParamProperties& GetProperties() const { return mProperties; }
    void SetProperties(const CapsuleParamProperties& properties) { mProperties = properties; }
    // Replaces the UI name and, for Text and Comment parameters, the default text.
    void SetLocalizedNamesAndValues(const WString& uiName, const WString& defaultText);

    // The match name and the default value.
    void GetParamValue(ImmutableString& name, CapsuleParamValueVariant& value) const;
    void AddParamValue(const std::shared_ptr<CapsuleParamValues>& values) const;

    friend bool operator==(const CapsuleParam& a, const CapsuleParam& b) {
        return a.mProperties == b.mProperties;
    }
    friend bool operator!=(const CapsuleParam& a, const CapsuleParam& b) { return !(a == b); }

private:
    friend TIDELINK_EXPORT void FromJSON(const Value& j, CapsuleParam& param);

    // The shared properties and the type; a kind's initialiser adds its own properties.
    void InitKind(CapsuleParamType type, const ImmutableString& matchName, const WString& uiName,
                  bool animatable);
    const CapsuleParamProperty& At(CapsuleParamPropertyID id) const;
    template <class T>
    const T& Get(CapsuleParamPropertyID id) const;

    CapsuleParamProperties mProperties;
};

class TIDELINK_EXPORT CapsuleParams {
public:
    void AddTextParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                      const WString& defaultText, const TextEditInfo& textEditInfo);
    void AddFloatParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                       double defaultValue, double minValue, double maxValue, int decimals);
    void AddBooleanParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                         bool defaultValue);
    void AddColorParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                       const ColorRGBA& defaultColor);
    void AddCommentParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                         const WString& text);
    void AddAngleParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                       double defaultAngle);
    void AddPoint2DParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                         const CapsulePoint& defaultPoint);
    void AddScaleParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                       const std::vector<double>& defaultScale, bool linked, int dimensions);
    void AddGroupParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                       const std::vector<WString>& defaultValue, bool expanded);
    void AddSpreadsheetParam(const ImmutableString& matchName, const WString& uiName,
                             bool animatable, const SpreadsheetValue& defaultValue,
                             unsigned int minRows, unsigned int maxRows,
                             const std::vector<SpreadsheetColumnInfo>& columnInfos);
    void AddMenuParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                      int defaultIndex, const std::vector<WString>& menuEntries);
    void AddMediaParam(const ImmutableString& matchName, const WString& uiName, bool animatable,
                       bool expanded, const WString& defaultText,
                       const MediaReplacementInfo& mediaReplacementInfo);

    const std::vector<CapsuleParam>& GetParams() const { return mParams; }
    void SetParams(const std::vector<CapsuleParam>& params) { mParams = params; }
    bool IsEmpty() const { return mParams.empty(); }

    // Every parameter's default value under its match name. A parameter of a kind this library
    // does not know has no default value and is left out.
    std::shared_ptr<CapsuleParamValues> GetParamValues() const;

    friend bool operator==(const CapsuleParams& a, const CapsuleParams& b) {
        return a.mParams == b.mParams;
    }
    friend bool operator!=(const CapsuleParams& a, const CapsuleParams& b) { return !(a == b); }

private:
    CapsuleParam& Append() { return mParams.emplace_back(); }
    std::vector<CapsuleParam> mParams;
};

class TIDELINK_EXPORT CapsuleParamValue {
public:
    CapsuleParamValue() = default;
    explicit CapsuleParamValue(CapsuleParamType type) : mType(type) {}
    CapsuleParamValue(CapsuleParamType type, CapsuleParamValueVariant value)
        : mType(type), mValue(std::move(value)) {}

    CapsuleParamType GetType() const { return mType; }
    void SetType(CapsuleParamType type) { mType = type; }
    const CapsuleParamValueVariant& GetValue() const { return mValue; }
    void SetValue(const CapsuleParamValueVariant& value) { mValue = value; }

    // Empty unless the type is Text or Comment.
    WString GetTextValue() const;
    double GetFloatValue() const;
    bool GetBooleanValue() const;
    ColorRGBA GetColorValue() const;
    double GetAngleValue() const;
    CapsulePoint GetPoint2DValue() const;
    std::vector<double> GetScaleValue() const;
    std::vector<WString> GetGroupValue() const;
    SpreadsheetValue GetSpreadsheetValue() const;
    int GetMenuValue() const;
    WString GetMediaValue() const;

    friend bool operator==(const CapsuleParamValue& a, const CapsuleParamValue& b) {
        return a.mType == b.mType && a.mValue == b.mValue;
    }
    friend bool operator!=(const CapsuleParamValue& a, const CapsuleParamValue& b) {
        return !(a == b);
    }

private:
    CapsuleParamType mType = kCapsuleParamType_Text;
    CapsuleParamValueVariant mValue;
};

class TIDELINK_EXPORT CapsuleParamValues {
public:
    using Map = std::map<ImmutableString, CapsuleParamValue>;

    // Inserts when |name| is absent; an existing value stays.
    void AddValue(const ImmutableString& name, CapsuleParamType type,
                  const CapsuleParamValueVariant& value);
    // Inserts or replaces.
    void UpdateValue(const ImmutableString& name, CapsuleParamType type,
                     const CapsuleParamValueVariant& value);
    void SetParamValues(const Map& values) { mValues = values; }
    const Map& GetParamValues() const { return mValues; }
    void Clear() { mValues.clear(); }
    bool IsEmpty() const { return mValues.empty(); }

    friend bool operator==(const CapsuleParamValues& a, const CapsuleParamValues& b) {
        return a.mValues == b.mValues;
    }
    friend bool operator!=(const CapsuleParamValues& a, const CapsuleParamValues& b) {
        return !(a == b);
    }

private:
    Map mValues;
};

// JSON forms.
TIDELINK_EXPORT Value ToJSON(const CapsuleParam& param);
TIDELINK_EXPORT Value ToJSON(const CapsuleParams& params);
TIDELINK_EXPORT Value ToJSON(const CapsuleParamValue& value);
TIDELINK_EXPORT Value ToJSON(const CapsuleParamValues& values);
TIDELINK_EXPORT void FromJSON(const Value& j, CapsuleParam& param);
TIDELINK_EXPORT void FromJSON(const Value& j, CapsuleParams& params);
TIDELINK_EXPORT void FromJSON(const Value& j, CapsuleParamValue& value);
TIDELINK_EXPORT void FromJSON(const Value& j, CapsuleParamValues& values);

inline void to_json(Value& j, const CapsuleParam& x) { j = ToJSON(x); }
inline void to_json(Value& j, const CapsuleParams& x) { j = ToJSON(x); }
inline void to_json(Value& j, const CapsuleParamValue& x) { j = ToJSON(x); }
inline void to_json(Value& j, const CapsuleParamValues& x) { j = ToJSON(x); }
inline void from_json(const Value& j, CapsuleParam& x) { FromJSON(j, x); }
inline void from_json(const Value& j, CapsuleParams& x) { FromJSON(j, x); }
inline void from_json(const Value& j, CapsuleParamValue& x) { FromJSON(j, x); }
inline void from_json(const Value& j, CapsuleParamValues& x) { FromJSON(j, x); }

}  // namespace tidelink
