// Edit records carried by template parameters: what was placed in a media slot, the per-run font
// edits of a text, and the table of a spreadsheet parameter.
//
// ConvertToObject writes a record's keys into an object that may hold other keys too (a parameter
// object); ExtractProperties reads them back, each key only when present. A present key holding a
// value of the wrong kind fails with the serializer's type_error and leaves the record unchanged.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include <boost/variant.hpp>

#include "platform/Export.h"
#include "platform/Serialization.h"
#include "platform/Strings.h"

namespace tidelink {

using platform::Value;
using platform::WString;

// ---- Media replacement ---------------------------------------------------------------------

// How replaced media is scaled into its slot; the template host gives the values their meaning.
enum EMediaReplacementDefaultScale : int32_t {
    kMediaReplacementDefaultScale_None = 0,
    kMediaReplacementDefaultScale_Fit = 1,
    kMediaReplacementDefaultScale_Fill = 2,
};

struct TIDELINK_EXPORT MediaReplacementProperties {
    uint32_t mWidth = 0;
    uint32_t mHeight = 0;
    int32_t mStartTime = 0;
    int32_t mEndTime = 0;
    uint32_t mTimescale = 1;
    WString mThumbnail;
    EMediaReplacementDefaultScale mScale = kMediaReplacementDefaultScale_Fill;

    void ConvertToObject(Value& object) const;
    void ExtractProperties(const Value& object);

    friend bool operator==(const MediaReplacementProperties& a,
                           const MediaReplacementProperties& b) {
        return a.mWidth == b.mWidth && a.mHeight == b.mHeight && a.mStartTime == b.mStartTime &&
               a.mEndTime == b.mEndTime && a.mTimescale == b.mTimescale &&
               a.mThumbnail == b.mThumbnail && a.mScale == b.mScale;
    }
    friend bool operator!=(const MediaReplacementProperties& a,
                           const MediaReplacementProperties& b) {
        return !(a == b);
    }
};

class TIDELINK_EXPORT MediaReplacementInfo {
public:
    MediaReplacementInfo() = default;
    // Parse JSON text of the object form. Empty text gives the default record; malformed text
    // throws the serializer's parse_error, a non-object its type_error.
    explicit MediaReplacementInfo(const WString& jsonText);
    explicit MediaReplacementInfo(const std::string& jsonText);

    WString AsString() const;
    std::string AsUTF8String() const;
    void ConvertToObject(Value& object) const;
    void ExtractProperties(const Value& object);

    uint32_t mVersion = 1;
    MediaReplacementProperties mProperties;

    friend bool operator==(const MediaReplacementInfo& a, const MediaReplacementInfo& b) {
        return a.mVersion == b.mVersion && a.mProperties == b.mProperties;
    }
    friend bool operator!=(const MediaReplacementInfo& a, const MediaReplacementInfo& b) {
        return !(a == b);
    }
};

// ---- Text edits ----------------------------------------------------------------------------

// One run of equally formatted characters.
struct TIDELINK_EXPORT TextRunFontEditInfo {
    TextRunFontEditInfo() = default;
    TextRunFontEditInfo(int32_t runLength, WString fontName, float fontSize, bool bold,
                        bool italic, bool allCaps, bool smallCaps)
        : mRunLength(runLength), mFontName(std::move(fontName)), mFontSize(fontSize),
          mBold(bold), mItalic(italic), mAllCaps(allCaps), mSmallCaps(smallCaps) {}

    // Everything but the length.
    bool SameFormatAs(const TextRunFontEditInfo& o) const {
        return mFontName == o.mFontName && mFontSize == o.mFontSize && mBold == o.mBold &&
               mItalic == o.mItalic && mAllCaps == o.mAllCaps && mSmallCaps == o.mSmallCaps;
    }
    friend bool operator==(const TextRunFontEditInfo& a, const TextRunFontEditInfo& b) {
        return a.mRunLength == b.mRunLength && a.SameFormatAs(b);
    }
    friend bool operator!=(const TextRunFontEditInfo& a, const TextRunFontEditInfo& b) {
        return !(a == b);
    }

    int32_t mRunLength = 0;
    WString mFontName;
    float mFontSize = 0.0f;
    bool mBold = false;
    bool mItalic = false;
    bool mAllCaps = false;
    bool mSmallCaps = false;
};

// The older single-font form of a text edit.
struct TIDELINK_EXPORT SourceTextFontEditInfo {
    void ConvertToObject(Value& object) const;
    void ExtractProperties(const Value& object);

    friend bool operator==(const SourceTextFontEditInfo& a, const SourceTextFontEditInfo& b) {
        return a.mFontEdit == b.mFontEdit && a.mFontName == b.mFontName &&
               a.mFontSizeEdit == b.mFontSizeEdit && a.mFontSize == b.mFontSize &&
               a.mFauxStyleEdit == b.mFauxStyleEdit && a.mBold == b.mBold &&
               a.mItalic == b.mItalic && a.mAllCaps == b.mAllCaps && a.mSmallCaps == b.mSmallCaps;
    }
    friend bool operator!=(const SourceTextFontEditInfo& a, const SourceTextFontEditInfo& b) {
        return !(a == b);
    }

    bool mFontEdit = false;
    WString mFontName;
    bool mFontSizeEdit = false;
    float mFontSize = 0.0f;
    bool mFauxStyleEdit = false;
    bool mBold = false;
    bool mItalic = false;
    bool mAllCaps = false;
    bool mSmallCaps = false;
};

// A text with its formatting as consecutive runs. The record is consistent (Verify) when the run
// count is non-zero, equals the number of runs, and the run lengths add up to the text length.
// Indices and lengths count UTF-16 code units.
class TIDELINK_EXPORT TextEditInfo {
public:
    enum TextRunChangeType : int32_t {
        kChangeFontName = 0,
        kChangeFontSize = 1,
        kChangeBold = 2,
        kChangeItalic = 3,
        kChangeSmallCaps = 4,
        kChangeAllCaps = 5,
    };

    TextEditInfo() = default;
    // Parse JSON text of the object form; empty text gives the empty record. Malformed text
    // throws the serializer's parse_error, a non-object its type_error.
    explicit TextEditInfo(const WString& jsonText);
    explicit TextEditInfo(const std::string& jsonText);
    // Empty text, one zero-length run in the given font.
    explicit TextEditInfo(const SourceTextFontEditInfo& source);

    WString AsString() const;
    std::string AsUTF8String() const;
    void ConvertToObject(Value& object) const;
    void ExtractProperties(const Value& object);

    bool Verify() const;
    // One run covering the whole text; |text| replaces the text unless empty.
    void ConvertIntoSingleTextRun(const WString& text);
    // Makes an inconsistent record consistent, keeping the runs when only the count was off.
    void FixMismatchedTextRuns();
    // Copies of the runs overlapping [start, end); for start == end, the run holding the
    // position (at a boundary the run before it). Both negative means the whole text.
    std::vector<TextRunFontEditInfo> GetTextRunInfoAt(int32_t start, int32_t end) const;
    // Applies |run|'s attribute named by |changeType| to [start, end), splitting runs at the
    // selection edges and merging neighbours that end up formatted alike.
    void InsertTextRun(const TextRunFontEditInfo& run, int32_t start, int32_t end,
                       TextRunChangeType changeType);
    static void CopyChangeTypeSpecificValue(const TextRunFontEditInfo& from,
                                            TextRunFontEditInfo& to, TextRunChangeType changeType);
    static void VerifySelectionIndices(int32_t& start, int32_t& end);

    friend bool operator==(const TextEditInfo& a, const TextEditInfo& b) {
        return a.mText == b.mText && a.mRunCount == b.mRunCount &&
               a.mFontSizeEdit == b.mFontSizeEdit && a.mFontEdit == b.mFontEdit &&
               a.mFauxStyleEdit == b.mFauxStyleEdit && a.mRuns == b.mRuns;
    }
    friend bool operator!=(const TextEditInfo& a, const TextEditInfo& b) { return !(a == b); }

    WString mText;
    int32_t mRunCount = 0;
    bool mFontSizeEdit = false;
    bool mFontEdit = false;
    bool mFauxStyleEdit = false;
    std::vector<TextRunFontEditInfo> mRuns;
};

// ---- Spreadsheets --------------------------------------------------------------------------

enum SpreadsheetColumnDataType : uint32_t {
    kSpreadsheetColumnDataType_Number = 1,
    kSpreadsheetColumnDataType_Text = 2,
};

using SpreadsheetCell = boost::variant<WString, double>;

// One column. Number columns hold doubles, text columns strings; a column of another type
// carries no values on the wire.
class TIDELINK_EXPORT SpreadsheetData {
public:
    SpreadsheetData() = default;
    SpreadsheetData(uint32_t dataType, std::vector<SpreadsheetCell> values)
        : mDataType(dataType), mValues(std::move(values)) {}

    uint32_t GetDataType() const { return mDataType; }
    void SetDataType(uint32_t dataType) { mDataType = dataType; }
    const std::vector<SpreadsheetCell>& GetValues() const { return mValues; }
    void SetValues(std::vector<SpreadsheetCell> values) { mValues = std::move(values); }

    friend bool operator==(const SpreadsheetData& a, const SpreadsheetData& b) {
        return a.mDataType == b.mDataType && a.mValues == b.mValues;
    }
    friend bool operator!=(const SpreadsheetData& a, const SpreadsheetData& b) {
        return !(a == b);
    }

private:
    uint32_t mDataType = 0;
    std::vector<SpreadsheetCell> mValues;
};

struct TIDELINK_EXPORT SpreadsheetValue {
    uint32_t mActiveRows = 0;
    std::vector<SpreadsheetData> mColumns;

    friend bool operator==(const SpreadsheetValue& a, const SpreadsheetValue& b) {
        return a.mActiveRows == b.mActiveRows && a.mColumns == b.mColumns;
    }
    friend bool operator!=(const SpreadsheetValue& a, const SpreadsheetValue& b) {
        return !(a == b);
    }
};

struct TIDELINK_EXPORT SpreadsheetColumnInfo {
    uint32_t mDataType = 0;
    WString mName;
    double mMinValue = 0.0;  // number columns only
    double mMaxValue = 0.0;  // number columns only

    friend bool operator==(const SpreadsheetColumnInfo& a, const SpreadsheetColumnInfo& b) {
        return a.mDataType == b.mDataType && a.mName == b.mName && a.mMinValue == b.mMinValue &&
               a.mMaxValue == b.mMaxValue;
    }
    friend bool operator!=(const SpreadsheetColumnInfo& a, const SpreadsheetColumnInfo& b) {
        return !(a == b);
    }
};

// Tree forms. The readers read each key only when present.
TIDELINK_EXPORT void to_json(Value& j, const MediaReplacementInfo& m);
TIDELINK_EXPORT void from_json(const Value& j, MediaReplacementInfo& m);
TIDELINK_EXPORT void to_json(Value& j, const TextEditInfo& t);
TIDELINK_EXPORT void from_json(const Value& j, TextEditInfo& t);
TIDELINK_EXPORT void to_json(Value& j, const SourceTextFontEditInfo& s);
TIDELINK_EXPORT void from_json(const Value& j, SourceTextFontEditInfo& s);
TIDELINK_EXPORT void to_json(Value& j, const SpreadsheetData& d);
TIDELINK_EXPORT void from_json(const Value& j, SpreadsheetData& d);
TIDELINK_EXPORT void to_json(Value& j, const SpreadsheetValue& v);
TIDELINK_EXPORT void from_json(const Value& j, SpreadsheetValue& v);
TIDELINK_EXPORT void to_json(Value& j, const SpreadsheetColumnInfo& c);
TIDELINK_EXPORT void from_json(const Value& j, SpreadsheetColumnInfo& c);

}  // namespace tidelink
