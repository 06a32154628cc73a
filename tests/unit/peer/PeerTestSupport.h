// Helpers shared by the reference peer's unit tests.
#pragma once

#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>

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

}  // namespace tidelink::peer::test
