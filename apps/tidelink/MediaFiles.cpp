#include "MediaFiles.h"

#include <png.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstring>
#include <regex>

#include "platform/Process.h"

namespace tidelink::cli {

std::string WritePNG(const std::string& path, const uint8_t* pixels, uint32_t width, uint32_t height, size_t rowBytes,
                     bool bgra, int compression) {
    std::FILE* file = std::fopen(path.c_str(), "wb");
    if (!file) return "cannot write " + path + ": " + std::strerror(errno);
    png_structp png = png_create_write_struct(PNG_LIBPNG_VER_STRING, nullptr, nullptr, nullptr);
    png_infop info = png ? png_create_info_struct(png) : nullptr;
    if (!png || !info) {
        png_destroy_write_struct(&png, &info);
        std::fclose(file);
        return "cannot set up the PNG encoder";
    }
    std::vector<uint8_t> row(static_cast<size_t>(width) * 4);
    if (setjmp(png_jmpbuf(png))) {
        png_destroy_write_struct(&png, &info);
        std::fclose(file);
        return "cannot encode " + path;
    }
    png_init_io(png, file);
    png_set_compression_level(png, std::clamp(compression, 0, 9));
    png_set_filter(png, 0, compression <= 1 ? PNG_FILTER_NONE : PNG_ALL_FILTERS);
    png_set_IHDR(png, info, width, height, 8, PNG_COLOR_TYPE_RGB_ALPHA, PNG_INTERLACE_NONE,
                 PNG_COMPRESSION_TYPE_DEFAULT, PNG_FILTER_TYPE_DEFAULT);
    png_write_info(png, info);
    for (uint32_t y = 0; y < height; ++y) {
        const uint8_t* src = pixels + y * rowBytes;
        if (bgra) {
            for (uint32_t x = 0; x < width; ++x) {
                row[4 * x + 0] = src[4 * x + 2];
                row[4 * x + 1] = src[4 * x + 1];
                row[4 * x + 2] = src[4 * x + 0];
                row[4 * x + 3] = src[4 * x + 3];
            }
            png_write_row(png, row.data());
        } else {
            png_write_row(png, const_cast<uint8_t*>(src));
        }
    }
    png_write_end(png, nullptr);
    png_destroy_write_struct(&png, &info);
    if (std::fclose(file) != 0) return "cannot write " + path + ": " + std::strerror(errno);
    return {};
}

namespace {

void Put16(uint8_t* p, uint16_t v) {
    p[0] = static_cast<uint8_t>(v);
    p[1] = static_cast<uint8_t>(v >> 8);
}

void Put32(uint8_t* p, uint32_t v) {
    for (int i = 0; i < 4; ++i) p[i] = static_cast<uint8_t>(v >> (8 * i));
}

}  // namespace

WavWriter::~WavWriter() {
    if (mFile) std::fclose(mFile);
}

std::string WavWriter::Open(const std::string& path, uint32_t channels, uint32_t sampleRate, Format format) {
    mFile = std::fopen(path.c_str(), "wb");
    if (!mFile) return "cannot write " + path + ": " + std::strerror(errno);
    mChannels = channels;
    mFormat = format;
    const uint16_t bytes = format == Format::Float32 ? 4 : 2;
    uint8_t header[44] = {};
    std::memcpy(header, "RIFF", 4);
    std::memcpy(header + 8, "WAVEfmt ", 8);
    Put32(header + 16, 16);
    Put16(header + 20, format == Format::Float32 ? 3 : 1);
    Put16(header + 22, static_cast<uint16_t>(channels));
    Put32(header + 24, sampleRate);
    Put32(header + 28, sampleRate * channels * bytes);
    Put16(header + 32, static_cast<uint16_t>(channels * bytes));
    Put16(header + 34, static_cast<uint16_t>(bytes * 8));
    std::memcpy(header + 36, "data", 4);
    if (std::fwrite(header, 1, sizeof(header), mFile) != sizeof(header)) return "cannot write " + path;
    return {};
}

bool WavWriter::Write(const float* const* planar, uint32_t frames) {
    const size_t bytes = mFormat == Format::Float32 ? 4 : 2;
    mScratch.resize(static_cast<size_t>(frames) * mChannels * bytes);
    uint8_t* out = mScratch.data();
    for (uint32_t i = 0; i < frames; ++i) {
        for (uint32_t c = 0; c < mChannels; ++c) {
            const float v = planar[c][i];
            if (mFormat == Format::Float32) {
                std::memcpy(out, &v, 4);  // little-endian host
                out += 4;
            } else {
                const float clamped = std::clamp(v, -1.0f, 1.0f);
                const auto s = static_cast<int16_t>(std::lrint(clamped * 32767.0f));
                Put16(out, static_cast<uint16_t>(s));
                out += 2;
            }
        }
    }
    mDataBytes += mScratch.size();
    return std::fwrite(mScratch.data(), 1, mScratch.size(), mFile) == mScratch.size();
}

std::string WavWriter::Close() {
    if (!mFile) return {};
    uint8_t size[4];
    Put32(size, static_cast<uint32_t>(std::min<uint64_t>(mDataBytes + 36, UINT32_MAX)));
    bool ok = std::fseek(mFile, 4, SEEK_SET) == 0 && std::fwrite(size, 1, 4, mFile) == 4;
    Put32(size, static_cast<uint32_t>(std::min<uint64_t>(mDataBytes, UINT32_MAX)));
    ok = ok && std::fseek(mFile, 40, SEEK_SET) == 0 && std::fwrite(size, 1, 4, mFile) == 4;
    ok = std::fclose(mFile) == 0 && ok;
    mFile = nullptr;
    return ok ? std::string() : std::string("cannot finish the WAV file");
}

Progress::Progress(std::string unit, uint64_t total)
    : mUnit(std::move(unit)), mTotal(total), mTerminal(::isatty(2) != 0), mStart(platform::NowSeconds()) {}

void Progress::Update(uint64_t done) {
    if (!mTerminal) return;
    const double now = platform::NowSeconds();
    if (done < mTotal && now - mLastDraw < 0.1) return;
    mLastDraw = now;
    constexpr int kWidth = 30;
    const int filled = mTotal ? static_cast<int>(kWidth * done / mTotal) : kWidth;
    const double rate = now > mStart ? static_cast<double>(done) / (now - mStart) : 0.0;
    std::fprintf(stderr, "\r[%s%s] %llu/%llu %s  %.1f/s ", std::string(static_cast<size_t>(filled), '#').c_str(),
                 std::string(static_cast<size_t>(kWidth - filled), ' ').c_str(), static_cast<unsigned long long>(done),
                 static_cast<unsigned long long>(mTotal), mUnit.c_str(), rate);
    std::fflush(stderr);
}

void Progress::Finish() {
    if (mTerminal) std::fprintf(stderr, "\r%*s\r", 72, "");
}

std::string FormatFrameName(const std::string& pattern, int64_t number) {
    static const std::regex field("%(0?)([0-9]*)d");
    std::smatch m;
    if (!std::regex_search(pattern, m, field)) return pattern;
    std::string digits = std::to_string(number);
    const size_t width = m[2].length() ? static_cast<size_t>(std::stoul(m[2].str())) : 0;
    if (digits.size() < width) digits.insert(0, width - digits.size(), m[1].length() ? '0' : ' ');
    return m.prefix().str() + digits + m.suffix().str();
}

}  // namespace tidelink::cli
