// The command-line host as a user runs it.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "Harness.h"
#include "platform/Serialization.h"
#include "platform/SharedMemory.h"
#include "tidelink/core/LinkManager.h"

using namespace tidelink;
using namespace tidelink::test;

namespace {

class CliTest : public ::testing::Test {
protected:
    void TearDown() override { StopOurManagers(); }
    std::string Tool() const { return BinDir() + "/tidelink"; }
};

TEST_F(CliTest, StatusLaunchesTheManagerAndDescribesIt) {
    auto r = RunCommand(Tool() + " status --json");
    ASSERT_EQ(r.exitCode, 0) << r.err;
    const auto json = platform::ParseJSONText(r.out);
    const auto managers = OurManagers();
    ASSERT_EQ(managers.size(), 1u);
    EXPECT_EQ(json["protocol_version"], SuiteVersion() + ".0");
    EXPECT_EQ(json["manager_pid"], managers[0]);
    EXPECT_EQ(json["port"], ReadManagerPort(managers[0]));
    EXPECT_TRUE(r.err.empty()) << "nothing on stderr on success: " << r.err;

    // Plain form, same manager.
    auto plain = RunCommand(Tool() + " status");
    ASSERT_EQ(plain.exitCode, 0);
    EXPECT_NE(plain.out.find("manager_pid=" + std::to_string(managers[0])), std::string::npos);
    EXPECT_EQ(OurManagers().size(), 1u);
}

TEST_F(CliTest, FailuresAndUsageErrorsUseTheirExitCodes) {
    const std::string empty = "/tmp/tidelink-test-cli-" + std::to_string(::getpid());
    std::filesystem::create_directories(empty);
    // Copy the tool away from the manager so that nothing can find it.
    std::filesystem::copy_file(Tool(), empty + "/tidelink");
    auto r = RunCommand("env TIDELINK_PACKAGE_DIR=" + empty + " LD_LIBRARY_PATH=" + BinDir() + " " +
                        empty + "/tidelink status --json");
    EXPECT_EQ(r.exitCode, 1);
    EXPECT_NE(r.err.find("Cannot find TideLink Server"), std::string::npos) << r.err;
    EXPECT_EQ(platform::ParseJSONText(r.out)["error"]["string"], "Cannot find TideLink Server");
    std::filesystem::remove_all(empty);

    EXPECT_EQ(RunCommand(Tool() + " status --no-such-flag").exitCode, 2);
    EXPECT_EQ(RunCommand(Tool()).exitCode, 2);
    auto version = RunCommand(Tool() + " --version");
    EXPECT_EQ(version.exitCode, 0);
    EXPECT_EQ(version.out.rfind("tidelink version ", 0), 0u);
    EXPECT_TRUE(OurManagers().empty());
}

}  // namespace

namespace {

std::string ExampleProject(const std::string& name) {
    return std::string(TIDELINK_SOURCE_DIR) + "/examples/projects/" + name;
}

}  // namespace

TEST_F(CliTest, OpenDescribesAProjectOrSaysWhyNot) {
    auto r = RunCommand(Tool() + " open " + ExampleProject("missing-footage.kstproj") + " --json");
    ASSERT_EQ(r.exitCode, 0) << r.err;
    const auto json = platform::ParseJSONText(r.out);
    EXPECT_EQ(json["file"], ExampleProject("missing-footage.kstproj"));
    EXPECT_FALSE(json["missing"]["missAssetsPropMissingFootage"].empty());

    auto plain = RunCommand(Tool() + " open " + ExampleProject("titles.ospproj"));
    ASSERT_EQ(plain.exitCode, 0) << plain.err;
    EXPECT_NE(plain.out.find("missing assets: none"), std::string::npos);

    // Not a project type any application serves, a file that is not there, a file the peer
    // cannot read: exit 1 with the reason.
    const auto dir = std::filesystem::temp_directory_path() / ("tl-cli-" + std::to_string(::getpid()));
    std::filesystem::create_directories(dir);
    std::ofstream(dir / "notes.txt") << "hello";
    std::ofstream(dir / "broken.kstproj") << "{\"format\": \"tidelink-project\", \"version\": 1, \"items\": 7}";
    auto wrongType = RunCommand(Tool() + " open " + (dir / "notes.txt").string());
    EXPECT_EQ(wrongType.exitCode, 1);
    EXPECT_NE(wrongType.err.find("Unknown project type"), std::string::npos) << wrongType.err;
    auto absent = RunCommand(Tool() + " open " + (dir / "absent.kstproj").string());
    EXPECT_EQ(absent.exitCode, 1);
    EXPECT_NE(absent.err.find("No such project file"), std::string::npos) << absent.err;
    auto broken = RunCommand(Tool() + " open " + (dir / "broken.kstproj").string() + " --json");
    EXPECT_EQ(broken.exitCode, 1);
    EXPECT_NE(broken.err.find("could not be opened: "), std::string::npos) << broken.err;
    EXPECT_NE(broken.err.find("items"), std::string::npos) << "the peer's reason reaches the user: " << broken.err;
    EXPECT_TRUE(platform::ParseJSONText(broken.out).contains("error"));
    auto usage = RunCommand(Tool() + " open");
    EXPECT_EQ(usage.exitCode, 2);
    std::filesystem::remove_all(dir);
}
