#include "tidelink/templates/EditRecords.h"

#include <algorithm>

#include "platform/media/ValueAccess.h"

namespace tidelink {

using namespace platform;

namespace {

Value ParseRecordText(const std::string& text) {
    Value v = ParseJSONText(text);
    RequireObject(v);
    return v;
}

int32_t ClampLength(size_t n) {
    return static_cast<int32_t>(std::min<size_t>(n, static_cast<size_t>(INT32_MAX)));
}

}  // namespace

// ---- Media replacement ---------------------------------------------------------------------

void MediaReplacementProperties::ConvertToObject(Value& object) const {
    object["width"] = uint64_t{mWidth};
    object["height"] = uint64_t{mHeight};
    object["starttime"] = int64_t{mStartTime};
    object["endtime"] = int64_t{mEndTime};
    object["timescale"] = uint64_t{mTimescale};
    object["thumbnail"] = ToUTF8(mThumbnail);
    object["scale"] = int64_t{mScale};
}

void MediaReplacementProperties::ExtractProperties(const Value& object) {
    RequireObject(object);
    MediaReplacementProperties out = *this;
    if (const Value* v = FindMember(object, "width")) out.mWidth = ReadInteger<uint32_t>(*v);
    if (const Value* v = FindMember(object, "height")) out.mHeight = ReadInteger<uint32_t>(*v);
    if (const Value* v = FindMember(object, "starttime")) out.mStartTime = ReadInteger<int32_t>(*v);
    if (const Value* v = FindMember(object, "endtime")) out.mEndTime = ReadInteger<int32_t>(*v);
    if (const Value* v = FindMember(object, "timescale")) {
        out.mTimescale = ReadInteger<uint32_t>(*v);
    }
    if (const Value* v = FindMember(object, "thumbnail")) out.mThumbnail = ReadWString(*v);
    if (const Value* v = FindMember(object, "scale")) {
        out.mScale = static_cast<EMediaReplacementDefaultScale>(ReadInteger<int32_t>(*v));
    }
    *this = std::move(out);
}

MediaReplacementInfo::MediaReplacementInfo(const WString& jsonText)
    : MediaReplacementInfo(ToUTF8(jsonText)) {}

MediaReplacementInfo::MediaReplacementInfo(const std::string& jsonText) {
    if (!jsonText.empty()) ExtractProperties(ParseRecordText(jsonText));
}

WString MediaReplacementInfo::AsString() const { return ToUTF16(AsUTF8String()); }

std::string MediaReplacementInfo::AsUTF8String() const {
    Value object = Value::object();
    ConvertToObject(object);
    return ToJSONText(object);
}

void MediaReplacementInfo::ConvertToObject(Value& object) const {
    object["mediareplacementversion"] = uint64_t{mVersion};
    mProperties.ConvertToObject(object);
}

void MediaReplacementInfo::ExtractProperties(const Value& object) {
    RequireObject(object);
    MediaReplacementInfo out = *this;
    if (const Value* v = FindMember(object, "mediareplacementversion")) {
        out.mVersion = ReadInteger<uint32_t>(*v);
    }
    out.mProperties.ExtractProperties(object);
    *this = std::move(out);
}

void to_json(Value& j, const MediaReplacementInfo& m) {
    j = Value::object();
    m.ConvertToObject(j);
}

void from_json(const Value& j, MediaReplacementInfo& m) {
    MediaReplacementInfo out;
    out.ExtractProperties(j);
    m = std::move(out);
}

// ---- Text edits ----------------------------------------------------------------------------

void SourceTextFontEditInfo::ConvertToObject(Value& object) const {
    object["capPropFontEdit"] = mFontEdit;
    object["fontEditValue"] = ToUTF8(mFontName);
    object["capPropFontSizeEdit"] = mFontSizeEdit;
    object["fontSizeEditValue"] = static_cast<double>(mFontSize);
    object["capPropFontFauxStyleEdit"] = mFauxStyleEdit;
    object["fontFSBoldValue"] = mBold;
    object["fontFSItalicValue"] = mItalic;
    object["fontFSAllCapsValue"] = mAllCaps;
    object["fontFSSmallCapsValue"] = mSmallCaps;
}

void SourceTextFontEditInfo::ExtractProperties(const Value& object) {
    RequireObject(object);
    SourceTextFontEditInfo out = *this;
    if (const Value* v = FindMember(object, "capPropFontEdit")) out.mFontEdit = ReadBool(*v);
    if (const Value* v = FindMember(object, "fontEditValue")) out.mFontName = ReadWString(*v);
    if (const Value* v = FindMember(object, "capPropFontSizeEdit")) {
        out.mFontSizeEdit = ReadBool(*v);
    }
    if (const Value* v = FindMember(object, "fontSizeEditValue")) out.mFontSize = ReadFloat(*v);
    if (const Value* v = FindMember(object, "capPropFontFauxStyleEdit")) {
        out.mFauxStyleEdit = ReadBool(*v);
    }
    if (const Value* v = FindMember(object, "fontFSBoldValue")) out.mBold = ReadBool(*v);
    if (const Value* v = FindMember(object, "fontFSItalicValue")) out.mItalic = ReadBool(*v);
    if (const Value* v = FindMember(object, "fontFSAllCapsValue")) out.mAllCaps = ReadBool(*v);
    if (const Value* v = FindMember(object, "fontFSSmallCapsValue")) out.mSmallCaps = ReadBool(*v);
    *this = std::move(out);
}

void to_json(Value& j, const SourceTextFontEditInfo& s) {
    j = Value::object();
    s.ConvertToObject(j);
}

void from_json(const Value& j, SourceTextFontEditInfo& s) {
    SourceTextFontEditInfo out;
    out.ExtractProperties(j);
    s = std::move(out);
}

TextEditInfo::TextEditInfo(const WString& jsonText) : TextEditInfo(ToUTF8(jsonText)) {}

TextEditInfo::TextEditInfo(const std::string& jsonText) {
    if (!jsonText.empty()) ExtractProperties(ParseRecordText(jsonText));
}

TextEditInfo::TextEditInfo(const SourceTextFontEditInfo& source)
    : mRunCount(1), mFontSizeEdit(source.mFontSizeEdit), mFontEdit(source.mFontEdit),
      mFauxStyleEdit(source.mFauxStyleEdit) {
    mRuns.emplace_back(0, source.mFontName, source.mFontSize, source.mBold, source.mItalic,
                       source.mAllCaps, source.mSmallCaps);
}

WString TextEditInfo::AsString() const { return ToUTF16(AsUTF8String()); }

std::string TextEditInfo::AsUTF8String() const {
    Value object = Value::object();
    ConvertToObject(object);
    return ToJSONText(object);
}

void TextEditInfo::ConvertToObject(Value& object) const {
    // A count beyond the runs that exist writes only the runs that exist.
    const size_t count = static_cast<size_t>(std::max(mRunCount, 0));
    const size_t n = std::min(count, mRuns.size());
    Value lengths = Value::array(), fonts = Value::array(), sizes = Value::array();
    Value bold = Value::array(), italic = Value::array(), allCaps = Value::array();
    Value smallCaps = Value::array();
    for (size_t i = 0; i < n; ++i) {
        const auto& r = mRuns[i];
        lengths.push_back(int64_t{r.mRunLength});
        fonts.push_back(ToUTF8(r.mFontName));
        sizes.push_back(static_cast<double>(r.mFontSize));
        bold.push_back(r.mBold);
        italic.push_back(r.mItalic);
        allCaps.push_back(r.mAllCaps);
        smallCaps.push_back(r.mSmallCaps);
    }
    object["textEditValue"] = ToUTF8(mText);
    object["capPropFontEdit"] = mFontEdit;
    object["capPropFontSizeEdit"] = mFontSizeEdit;
    object["capPropFontFauxStyleEdit"] = mFauxStyleEdit;
    object["capPropTextRunCount"] = uint64_t{count};
    object["fontTextRunLength"] = std::move(lengths);
    object["fontEditValue"] = std::move(fonts);
    object["fontSizeEditValue"] = std::move(sizes);
    object["fontFSBoldValue"] = std::move(bold);
    object["fontFSItalicValue"] = std::move(italic);
    object["fontFSAllCapsValue"] = std::move(allCaps);
    object["fontFSSmallCapsValue"] = std::move(smallCaps);
}

void TextEditInfo::ExtractProperties(const Value& object) {
    RequireObject(object);
    TextEditInfo out = *this;
    const Value* count = FindMember(object, "capPropTextRunCount");
    if (!count) {
        if (const Value* legacy = FindMember(object, "fonteditinfo")) {
            SourceTextFontEditInfo source;
            source.ExtractProperties(*legacy);
            const TextEditInfo converted(source);
            out.mRunCount = converted.mRunCount;
            out.mFontSizeEdit = converted.mFontSizeEdit;
            out.mFontEdit = converted.mFontEdit;
            out.mFauxStyleEdit = converted.mFauxStyleEdit;
            out.mRuns = converted.mRuns;
        }
    }
    if (const Value* v = FindMember(object, "textEditValue")) out.mText = ReadWString(*v);
    if (const Value* v = FindMember(object, "capPropFontEdit")) out.mFontEdit = ReadBool(*v);
    if (const Value* v = FindMember(object, "capPropFontSizeEdit")) {
        out.mFontSizeEdit = ReadBool(*v);
    }
    if (const Value* v = FindMember(object, "capPropFontFauxStyleEdit")) {
        out.mFauxStyleEdit = ReadBool(*v);
    }
    if (count) {
        const uint32_t c = ReadInteger<uint32_t>(*count);
        if (c > static_cast<uint32_t>(INT32_MAX)) ThrowRangeError(*count, "run count");
        out.mRunCount = static_cast<int32_t>(c);
    }

    // The columns: a run exists for each index below the count that some column covers.
    static constexpr const char* kColumns[] = {
        "fontTextRunLength", "fontEditValue",      "fontSizeEditValue",   "fontFSBoldValue",
        "fontFSItalicValue", "fontFSAllCapsValue", "fontFSSmallCapsValue"};
    const Value* columns[7];
    size_t longest = 0;
    bool anyColumn = false;
    for (size_t c = 0; c < 7; ++c) {
        columns[c] = FindMember(object, kColumns[c]);
        if (columns[c]) {
            RequireArray(*columns[c]);
            longest = std::max(longest, columns[c]->size());
            anyColumn = true;
        }
    }
    if (count || anyColumn) {
        const size_t n = count ? std::min(longest, static_cast<size_t>(out.mRunCount)) : longest;
        std::vector<TextRunFontEditInfo> runs(n);
        for (size_t i = 0; i < n; ++i) {
            auto at = [&](size_t c) -> const Value* {
                return columns[c] && i < columns[c]->size() ? &(*columns[c])[i] : nullptr;
            };
            auto& r = runs[i];
            if (const Value* v = at(0)) r.mRunLength = ReadInteger<int32_t>(*v);
            if (const Value* v = at(1)) r.mFontName = ReadWString(*v);
            if (const Value* v = at(2)) r.mFontSize = ReadFloat(*v);
            if (const Value* v = at(3)) r.mBold = ReadBool(*v);
            if (const Value* v = at(4)) r.mItalic = ReadBool(*v);
            if (const Value* v = at(5)) r.mAllCaps = ReadBool(*v);
            if (const Value* v = at(6)) r.mSmallCaps = ReadBool(*v);
        }
        out.mRuns = std::move(runs);
        if (!count) out.mRunCount = ClampLength(out.mRuns.size());
    }
    *this = std::move(out);
}

void to_json(Value& j, const TextEditInfo& t) {
    j = Value::object();
    t.ConvertToObject(j);
}

void from_json(const Value& j, TextEditInfo& t) {
    TextEditInfo out;
    out.ExtractProperties(j);
    t = std::move(out);
}

bool TextEditInfo::Verify() const {
    if (mRunCount == 0 || static_cast<size_t>(std::max(mRunCount, 0)) != mRuns.size()) {
        return false;
    }
    int64_t total = 0;
    for (const auto& r : mRuns) total += r.mRunLength;
    return total == static_cast<int64_t>(mText.size());
}

void TextEditInfo::ConvertIntoSingleTextRun(const WString& text) {
    mRunCount = 1;
    if (!text.empty()) mText = text;
    const int32_t length = ClampLength(mText.size());
    if (!mRuns.empty()) {
        mRuns.resize(1);
        mRuns.front().mRunLength = length;
    } else {
        TextRunFontEditInfo run;
        run.mRunLength = length;
        mRuns.push_back(std::move(run));
    }
}

void TextEditInfo::FixMismatchedTextRuns() {
    if (Verify()) return;
    mRunCount = ClampLength(mRuns.size());
    if (Verify()) return;
    ConvertIntoSingleTextRun(WString());
}

void TextEditInfo::VerifySelectionIndices(int32_t& start, int32_t& end) {
    if (start > end) std::swap(start, end);
}

std::vector<TextRunFontEditInfo> TextEditInfo::GetTextRunInfoAt(int32_t start,
                                                                int32_t end) const {
    VerifySelectionIndices(start, end);
    int64_t from = start, to = end;
    if (from < 0 && to < 0) {
        from = 0;
        to = static_cast<int64_t>(mText.size());
    }
    std::vector<TextRunFontEditInfo> result;
    if (mRuns.empty()) return result;
    if (from == to) {
        if (from <= 0) {
            result.push_back(mRuns.front());
            return result;
        }
        int64_t offset = 0;
        for (const auto& r : mRuns) {
            const int64_t runStart = offset;
            offset += r.mRunLength;
            if (offset >= from && runStart < from) {
                result.push_back(r);
                break;
            }
        }
        return result;
    }
    int64_t offset = 0;
    for (const auto& r : mRuns) {
        const int64_t runStart = offset;
        offset += r.mRunLength;
        if (offset > from && runStart < to) result.push_back(r);
        if (offset >= to) break;
    }
    return result;
}

void TextEditInfo::CopyChangeTypeSpecificValue(const TextRunFontEditInfo& from,
                                               TextRunFontEditInfo& to,
                                               TextRunChangeType changeType) {
    switch (changeType) {
    case kChangeFontName: to.mFontName = from.mFontName; break;
    case kChangeFontSize: to.mFontSize = from.mFontSize; break;
    case kChangeBold: to.mBold = from.mBold; break;
    case kChangeItalic: to.mItalic = from.mItalic; break;
    case kChangeSmallCaps: to.mSmallCaps = from.mSmallCaps; break;
    case kChangeAllCaps: to.mAllCaps = from.mAllCaps; break;
    default: break;
    }
}

void TextEditInfo::InsertTextRun(const TextRunFontEditInfo& run, int32_t start, int32_t end,
                                 TextRunChangeType changeType) {
    VerifySelectionIndices(start, end);
    std::vector<TextRunFontEditInfo> runs;
    runs.reserve(mRuns.size() + 2);
    int64_t offset = 0;
    for (const auto& r : mRuns) {
        const int64_t runStart = offset;
        const int64_t runEnd = offset + r.mRunLength;
        offset = runEnd;
        if (runStart >= start && runEnd <= end) {
            // Wholly inside, including an empty run at the caret (the format of an empty text).
            runs.push_back(r);
            CopyChangeTypeSpecificValue(run, runs.back(), changeType);
            continue;
        }
        const int64_t innerStart = std::max<int64_t>(runStart, start);
        const int64_t innerEnd = std::min<int64_t>(runEnd, end);
        if (innerStart >= innerEnd) {
            runs.push_back(r);  // outside the selection
            continue;
        }
        if (runStart < innerStart) {
            runs.push_back(r);
            runs.back().mRunLength = static_cast<int32_t>(innerStart - runStart);
        }
        runs.push_back(r);
        runs.back().mRunLength = static_cast<int32_t>(innerEnd - innerStart);
        CopyChangeTypeSpecificValue(run, runs.back(), changeType);
        if (innerEnd < runEnd) {
            runs.push_back(r);
            runs.back().mRunLength = static_cast<int32_t>(runEnd - innerEnd);
        }
    }
    // Fold each run into a predecessor formatted alike.
    std::vector<TextRunFontEditInfo> merged;
    merged.reserve(runs.size());
    for (auto& r : runs) {
        if (!merged.empty() && merged.back().SameFormatAs(r)) {
            const int64_t sum = int64_t{merged.back().mRunLength} + r.mRunLength;
            if (sum <= INT32_MAX && sum >= INT32_MIN) {
                merged.back().mRunLength = static_cast<int32_t>(sum);
                continue;
            }
        }
        merged.push_back(std::move(r));
    }
    mRuns = std::move(merged);
    mRunCount = ClampLength(mRuns.size());
}

// ---- Spreadsheets --------------------------------------------------------------------------

void to_json(Value& j, const SpreadsheetData& d) {
    j = Value::object();
    // A cell of the other kind is written as 0 or "" so that the rows stay aligned.
    if (d.GetDataType() == kSpreadsheetColumnDataType_Number) {
        Value values = Value::array();
        for (const auto& cell : d.GetValues()) {
            const double* x = boost::get<double>(&cell);
            values.push_back(x ? *x : 0.0);
        }
        j["numberValues"] = std::move(values);
    } else if (d.GetDataType() == kSpreadsheetColumnDataType_Text) {
        Value values = Value::array();
        for (const auto& cell : d.GetValues()) {
            const WString* s = boost::get<WString>(&cell);
            values.push_back(s ? ToUTF8(*s) : std::string());
        }
        j["textValues"] = std::move(values);
    }
}

void from_json(const Value& j, SpreadsheetData& d) {
    RequireObject(j);
    std::vector<SpreadsheetCell> values;
    uint32_t type = 0;
    if (const Value* numbers = FindMember(j, "numberValues")) {
        type = kSpreadsheetColumnDataType_Number;
        RequireArray(*numbers);
        values.reserve(numbers->size());
        for (const auto& e : *numbers) values.emplace_back(ReadDouble(e));
    } else if (const Value* texts = FindMember(j, "textValues")) {
        type = kSpreadsheetColumnDataType_Text;
        RequireArray(*texts);
        values.reserve(texts->size());
        for (const auto& e : *texts) values.emplace_back(ReadWString(e));
    }
    d = SpreadsheetData(type, std::move(values));
}

void to_json(Value& j, const SpreadsheetValue& v) {
    j = Value::object();
    j["activeRows"] = uint64_t{v.mActiveRows};
    j["columnValues"] = v.mColumns;
}

void from_json(const Value& j, SpreadsheetValue& v) {
    RequireObject(j);
    SpreadsheetValue out;
    if (const Value* rows = FindMember(j, "activeRows")) {
        out.mActiveRows = ReadInteger<uint32_t>(*rows);
    }
    if (const Value* columns = FindMember(j, "columnValues")) {
        RequireArray(*columns);
        out.mColumns.reserve(columns->size());
        for (const auto& c : *columns) out.mColumns.push_back(c.get<SpreadsheetData>());
    }
    v = std::move(out);
}

void to_json(Value& j, const SpreadsheetColumnInfo& c) {
    j = Value::object();
    j["capPropSpreadsheetColumnDataType"] = uint64_t{c.mDataType};
    j["capPropSpreadsheetColumnName"] = ToUTF8(c.mName);
    if (c.mDataType == kSpreadsheetColumnDataType_Number) {
        j["capPropSpreadsheetColumnMinValue"] = c.mMinValue;
        j["capPropSpreadsheetColumnMaxValue"] = c.mMaxValue;
    }
}

void from_json(const Value& j, SpreadsheetColumnInfo& c) {
    RequireObject(j);
    SpreadsheetColumnInfo out;
    if (const Value* v = FindMember(j, "capPropSpreadsheetColumnDataType")) {
        out.mDataType = ReadInteger<uint32_t>(*v);
    }
    if (const Value* v = FindMember(j, "capPropSpreadsheetColumnName")) out.mName = ReadWString(*v);
    if (out.mDataType == kSpreadsheetColumnDataType_Number) {
        if (const Value* v = FindMember(j, "capPropSpreadsheetColumnMinValue")) {
            out.mMinValue = ReadDouble(*v);
        }
        if (const Value* v = FindMember(j, "capPropSpreadsheetColumnMaxValue")) {
            out.mMaxValue = ReadDouble(*v);
        }
    }
    c = std::move(out);
}

}  // namespace tidelink
