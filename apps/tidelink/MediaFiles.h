// Writing what the host receives: PNG images from frames, WAV files from audio, and a progress
// line for long work.
#pragma once

#include <cstdint>
#include <cstdio>
#include <string>
#include <vector>

namespace tidelink::cli {

// Writes an 8-bit RGBA PNG from BGRA (or RGBA when |bgra| is false) rows. Returns an empty string
// on success, otherwise why not.
std::string WritePNG(const std::string& path, const uint8_t* pixels, uint32_t width, uint32_t height,
                     size_t rowBytes, bool bgra, int compression);

// A WAV file written as the samples arrive; the sizes in its header are fixed up by Close().
class WavWriter {
public:
    enum class Format { Float32, Int16 };
    ~WavWriter();
    // Returns an empty string on success, otherwise why not.
    std::string Open(const std::string& path, uint32_t channels, uint32_t sampleRate, Format format);
    // |planar| holds one pointer per channel; |frames| samples of each are written, interleaved.
    bool Write(const float* const* planar, uint32_t frames);
    std::string Close();

private:
    std::FILE* mFile = nullptr;
    uint32_t mChannels = 0;
    Format mFormat = Format::Float32;
    uint64_t mDataBytes = 0;
    std::vector<uint8_t> mScratch;
};

// "12/300 frames  48.2 fps" with a bar, redrawn in place on a terminal; silent otherwise.
class Progress {
public:
    Progress(std::string unit, uint64_t total);
    void Update(uint64_t done);
    void Finish();

private:
    std::string mUnit;
    uint64_t mTotal;
    bool mTerminal;
    double mStart;
    double mLastDraw = 0;
};

// Replaces a printf-style number field (%d, %05d, ...) in |pattern| with |number|.
std::string FormatFrameName(const std::string& pattern, int64_t number);

}  // namespace tidelink::cli
