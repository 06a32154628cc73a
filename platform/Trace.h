// Trace lines by category and level. A line is built only when its category is enabled at that
// level: TL_TRACE("TideLink", 6) << "costly " << Describe(x);  evaluates nothing when disabled.
//
// Levels run from 0 (errors) to 7 (most verbose). TIDELINK_TRACE selects what is enabled:
//   TIDELINK_TRACE="7"                      every category up to level 7
//   TIDELINK_TRACE="TideLink:7,*:3"         one category verbose, the others up to 3
// Without it, level 0 of every category is enabled. Category names compare exactly.
#pragma once

#include <functional>
#include <sstream>
#include <string>
#include <string_view>

#include "platform/Export.h"

namespace tidelink::platform {

using TraceSink = std::function<void(std::string_view category, int level, std::string_view line)>;

TIDELINK_EXPORT bool TraceEnabled(std::string_view category, int level);
TIDELINK_EXPORT void TraceWrite(std::string_view category, int level, std::string_view line);
// Replaces the sink (default: one line to stderr with time, pid, category and level).
// An empty function restores the default.
TIDELINK_EXPORT void SetTraceSink(TraceSink sink);
// Re-reads the selection from |spec| (same syntax as TIDELINK_TRACE).
TIDELINK_EXPORT void SetTraceSelection(std::string_view spec);

class TIDELINK_EXPORT TraceLine {
public:
    TraceLine(std::string_view category, int level) : mCategory(category), mLevel(level) {}
    TraceLine(const TraceLine&) = delete;
    TraceLine& operator=(const TraceLine&) = delete;
    ~TraceLine() { TraceWrite(mCategory, mLevel, mStream.str()); }
    std::ostringstream& Stream() { return mStream; }

private:
    std::string_view mCategory;
    int mLevel;
    std::ostringstream mStream;
};

}  // namespace tidelink::platform

#define TL_TRACE(category, level)                                                          \
    for (bool tlTraceOn_ = ::tidelink::platform::TraceEnabled((category), (level)); tlTraceOn_; \
         tlTraceOn_ = false)                                                               \
    ::tidelink::platform::TraceLine((category), (level)).Stream()
