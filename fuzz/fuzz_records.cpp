// Feeds arbitrary JSON text to every record reader. A reader must either return a whole record
// or throw the documented errors (the serializer's exceptions, boost::bad_rational) and leave
// its target alone; a record it returns must come back unchanged from a write and a read,
// through the tree and the wire.
// Project, item, address, render-option and caption records take the same path.
// Text-edit records read from the input also go through the run-editing operations.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "platform/Serialization.h"
#include "tidelink/core/Brokering.h"
#include "tidelink/peers/LinkRecords.h"
#include "tidelink/peers/ProjectProtocol.h"
#include "tidelink/peers/Source.h"
#include "tidelink/render/RenderOptions.h"
#include "tidelink/templates/CapsuleParams.h"
#include "tidelink/templates/EditRecords.h"

using namespace tidelink;
using tidelink::platform::Value;

namespace {

template <class T>
void Check(const Value& v) {
    // A reader that fails must leave its target untouched: no partial record.
    T record;
    try {
        from_json(v, record);
    } catch (const nlohmann::json::exception&) {
        if (!(record == T())) abort();
        return;
    } catch (const boost::bad_rational&) {
        if (!(record == T())) abort();
        return;
    }
    const Value written = record;
    if (!(written.get<T>() == record)) abort();
    if (!(Value::from_msgpack(Value::to_msgpack(written)).get<T>() == record)) abort();
}

void EditRuns(TextEditInfo t, const uint8_t* data, size_t size) {
    t.FixMismatchedTextRuns();
    if (t.mText.size() <= INT32_MAX && !t.Verify()) abort();
    const int32_t a = size > 1 ? static_cast<int8_t>(data[size - 1]) : 0;
    const int32_t b = size > 2 ? static_cast<int8_t>(data[size - 2]) : 0;
    (void)t.GetTextRunInfoAt(a, b);
    (void)t.GetTextRunInfoAt(a, a);
    TextRunFontEditInfo run(1, u"F", 9.0f, true, true, true, true);
    for (int type = 0; type <= 6; ++type) {
        t.InsertTextRun(run, a, b, static_cast<TextEditInfo::TextRunChangeType>(type));
        if (t.mText.size() <= INT32_MAX && !t.Verify()) abort();
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    Value v;
    try {
        v = platform::ParseJSONText(std::string_view(reinterpret_cast<const char*>(data), size));
    } catch (const nlohmann::json::exception&) {
        return 0;
    }
    Check<SourceInfo>(v);
    Check<FarlandServerConnectInfo>(v);
    Check<FarlandAssetInfo>(v);
    Check<FarlandAssetRequestInfo>(v);
    Check<FarlandProductionInfo>(v);
    Check<FarlandProductionRequestInfo>(v);
    Check<GenericAssetInfo>(v);
    Check<GenericAssetRequestInfo>(v);
    Check<CapsuleParams>(v);
    Check<CapsuleParamValues>(v);
    Check<MediaReplacementInfo>(v);
    Check<TextEditInfo>(v);
    Check<SourceTextFontEditInfo>(v);
    Check<SpreadsheetValue>(v);
    Check<SpreadsheetColumnInfo>(v);
    Check<platform::ColorSpace>(v);
    Check<projectprotocol::ProjectInfo>(v);
    Check<MissingAssets>(v);
    Check<ItemInfo>(v);
    Check<ServerConnection>(v);
    Check<VideoRenderOptions>(v);
    Check<CaptionData>(v);
    Check<CaptionSelectionData>(v);
    try {
        EditRuns(v.get<TextEditInfo>(), data, size);
    } catch (const nlohmann::json::exception&) {
    }
    return 0;
}
