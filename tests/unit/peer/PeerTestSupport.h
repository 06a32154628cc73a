// Helpers shared by the reference peer's unit tests.
#pragma once

#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "FrameComposer.h"
#include "Generators.h"
#include "RenderRules.h"
#include "platform/Guid.h"

namespace tidelink::peer::test {

// A fresh folder under the temporary folder, removed with everything in it at the end.
class TempDir {
public:
    TempDir() {
        mPath = std::filesystem::temp_directory_path() /
                ("tidelinkpeer-unit-" + std::to_string(::getpid()) + "-" + platform::Guid::New().ToString());
        std::filesystem::create_directories(mPath);
    }
    ~TempDir() {
        std::error_code ec;
        std::filesystem::remove_all(mPath, ec);
    }
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;

    const std::filesystem::path& Path() const { return mPath; }

    std::filesystem::path Write(const std::string& name, const std::string& text) const {
        const auto file = mPath / name;
        std::filesystem::create_directories(file.parent_path());
        std::ofstream(file, std::ios::binary) << text;
        return file;
    }

private:
    std::filesystem::path mPath;
};

inline std::filesystem::path ExamplesDir() { return TIDELINK_PEER_EXAMPLES_DIR; }

// What a frame of |g| must hold, from the reference generators: the whole drawn frame through
// RenderCompositionFrame, cropped to the window, in the geometry's byte order; interlaced frames
// take the second field's rows from a frame half a frame later. Rows are g.RowBytes() apart.
inline std::vector<uint8_t> ExpectedFrame(const Composition& comp, const Rational& time, const FrameGeometry& g) {
    const size_t fullRow = static_cast<size_t>(g.frameWidth) * 4;
    auto draw = [&](const Rational& t) {
        std::vector<uint8_t> full(fullRow * static_cast<size_t>(g.frameHeight));
        RenderCompositionFrame(comp, t, FrameView{full.data(), g.frameWidth, g.frameHeight, fullRow});
        return full;
    };
    const auto first = draw(time);
    std::vector<uint8_t> second;
    const bool interlaced =
        g.fieldType == platform::FieldType::UpperFirst || g.fieldType == platform::FieldType::LowerFirst;
    if (interlaced) second = draw(SecondFieldTime(comp.frameRate, time));
    const int firstParity = g.fieldType == platform::FieldType::UpperFirst ? 0 : 1;
    std::vector<uint8_t> out(g.RowBytes() * static_cast<size_t>(g.height));
    for (int32_t j = 0; j < g.height; ++j) {
        const int32_t y = g.y + j;
        const auto& src = interlaced && (y % 2) != firstParity ? second : first;
        for (int32_t i = 0; i < g.width; ++i) {
            const uint8_t* p = src.data() + static_cast<size_t>(y) * fullRow + static_cast<size_t>(g.x + i) * 4;
            uint8_t* q = out.data() + static_cast<size_t>(j) * g.RowBytes() + static_cast<size_t>(i) * 4;
            const bool rgba = g.pixelFormat == kPixelFormatRGBA;
            q[0] = rgba ? p[2] : p[0];
            q[1] = p[1];
            q[2] = rgba ? p[0] : p[2];
            q[3] = p[3];
        }
    }
    return out;
}

}  // namespace tidelink::peer::test
