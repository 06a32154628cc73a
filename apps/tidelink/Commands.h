// The project commands of the command-line host. Each throws HostError with a message for the
// user and returns the exit code.
#pragma once

#include <optional>
#include <string>

#include "Host.h"
#include "MediaFiles.h"
#include "platform/media/MediaTypes.h"
#include "tidelink/peers/Project.h"
#include "tidelink/peers/Source.h"

namespace tidelink::cli {

int RunItems(const std::string& file, bool json);
int RunDescribe(const std::string& file, const std::string& item, bool json);

struct RenderArgs {
    std::string project;
    std::string item;
    int64_t first = 0;
    int64_t last = 0;
    std::optional<platform::RatioTime> time;  // one frame at this time instead of frame numbers
    int width = 0;                            // 0: the composition's size
    int height = 0;
    std::optional<bool> sessions;             // unset: as the source prefers
    std::string output;
    int depth = 4;                            // frames in flight
    int compression = 1;
};
int RunRender(const RenderArgs& args);

struct AudioArgs {
    std::string project;
    std::string item;
    platform::RatioTime start{0};
    platform::RatioTime duration{1};
    std::string output;
    uint32_t samplesPerChunk = 4800;
    WavWriter::Format format = WavWriter::Format::Float32;
};
int RunAudio(const AudioArgs& args);

// "1.5", "3" or "1001/1000" as exact seconds.
std::optional<platform::RatioTime> ParseSeconds(const std::string& text);

}  // namespace tidelink::cli
