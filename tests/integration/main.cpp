// Integration tests: each test process gets its own suite version and runtime folder, so its
// link managers never meet another run's, and it checks on exit that nothing of it survives.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "Harness.h"
#include "platform/SharedMemory.h"

namespace {

std::string gRuntimeDir;

class LeftoverCheck : public ::testing::Environment {
public:
    void TearDown() override {
        tidelink::test::StopOurManagers();
        const auto left = tidelink::test::OurSharedMemory();
        for (const auto& name : left) {
            ADD_FAILURE() << "shared-memory object left behind: /dev/shm/" << name;
            tidelink::platform::MemoryMappedFile::Remove(name);
        }
        std::error_code ec;
        std::filesystem::remove_all(gRuntimeDir, ec);
    }
};

}  // namespace

int main(int argc, char** argv) {
    char version[16];
    std::snprintf(version, sizeof(version), "9%05d", static_cast<int>(::getpid() % 100000));
    ::setenv("TIDELINK_SUITE_VERSION", version, 1);
    gRuntimeDir = "/tmp/tidelink-test-" + std::to_string(::getpid());
    ::setenv("TIDELINK_RUNTIME_DIR", gRuntimeDir.c_str(), 1);
    // A manager the test forgets still goes away by itself.
    ::setenv("TIDELINK_MANAGER_IDLE_EXIT", "20", 1);
    ::setenv("TIDELINK_TEST_SUITE", "1", 1);
    // Recorded for the suite's final leftover check, which looks at this run's versions only.
    if (const char* records = std::getenv("TIDELINK_TEST_RECORD_DIR")) {
        std::filesystem::create_directories(records);
        std::ofstream(std::string(records) + "/" + version);
    }
    ::testing::InitGoogleTest(&argc, argv);
    ::testing::AddGlobalTestEnvironment(new LeftoverCheck());
    return RUN_ALL_TESTS();
}
