#include "platform/Trace.h"

#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <map>
#include <mutex>
#include <shared_mutex>

namespace tidelink::platform {
namespace {

struct Selection {
    int defaultLevel = 0;
    std::map<std::string, int, std::less<>> levels;
};

Selection Parse(std::string_view spec) {
    Selection s;
    while (!spec.empty()) {
        const auto comma = spec.find(',');
        std::string_view item = spec.substr(0, comma);
        spec = comma == std::string_view::npos ? std::string_view() : spec.substr(comma + 1);
        const auto colon = item.rfind(':');
        std::string_view name = colon == std::string_view::npos ? "*" : item.substr(0, colon);
        std::string_view num = colon == std::string_view::npos ? item : item.substr(colon + 1);
        int level = 0;
        try {
            level = std::stoi(std::string(num));
        } catch (...) {
            continue;
        }
        if (name == "*") {
            s.defaultLevel = level;
        } else {
            s.levels[std::string(name)] = level;
        }
    }
    return s;
}

struct State {
    std::shared_mutex mutex;
    Selection selection;
    TraceSink sink;
    State() {
        if (const char* env = std::getenv("TIDELINK_TRACE")) selection = Parse(env);
    }
};

State& GetState() {
    static State* state = new State();  // immortal: trace may run during static destruction
    return *state;
}

void DefaultSink(std::string_view category, int level, std::string_view line) {
    using namespace std::chrono;
    const auto now = system_clock::now();
    const auto t = system_clock::to_time_t(now);
    const auto ms = duration_cast<milliseconds>(now.time_since_epoch()).count() % 1000;
    std::tm tm{};
    localtime_r(&t, &tm);
    char stamp[32];
    std::strftime(stamp, sizeof(stamp), "%H:%M:%S", &tm);
    std::fprintf(stderr, "%s.%03lld [%d] %.*s(%d): %.*s\n", stamp, static_cast<long long>(ms),
                 static_cast<int>(getpid()), static_cast<int>(category.size()), category.data(),
                 level, static_cast<int>(line.size()), line.data());
}

}  // namespace

bool TraceEnabled(std::string_view category, int level) {
    auto& s = GetState();
    std::shared_lock lock(s.mutex);
    auto it = s.selection.levels.find(category);
    const int enabled = it == s.selection.levels.end() ? s.selection.defaultLevel : it->second;
    return level <= enabled;
}

void TraceWrite(std::string_view category, int level, std::string_view line) {
    auto& s = GetState();
    TraceSink sink;
    {
        std::shared_lock lock(s.mutex);
        sink = s.sink;
    }
    if (sink) {
        sink(category, level, line);
    } else {
        DefaultSink(category, level, line);
    }
}

void SetTraceSink(TraceSink sink) {
    auto& s = GetState();
    std::unique_lock lock(s.mutex);
    s.sink = std::move(sink);
}

void SetTraceSelection(std::string_view spec) {
    auto& s = GetState();
    auto parsed = Parse(spec);
    std::unique_lock lock(s.mutex);
    s.selection = std::move(parsed);
}

}  // namespace tidelink::platform
