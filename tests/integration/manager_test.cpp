// Finding and launching the real link manager.
#include <gtest/gtest.h>
#include <signal.h>

#include <filesystem>

#include "Harness.h"
#include "platform/Process.h"
#include "platform/SharedMemory.h"
#include "platform/Sync.h"
#include "tidelink/core/LinkManager.h"

using namespace tidelink;
using namespace tidelink::platform;
using namespace tidelink::test;

namespace {

// Asks the manager on |session| who it is.
Value ManagerInfo(const SessionPtr& session) {
    Gate gate;
    Value info;
    session->SendRequest(
        BuildCall(kManagerInfoMessage),
        [&](const Value& reply, RequestId) {
            info = reply.value("value", Value());
            gate.Open();
        },
        [&](int32_t, const WString&, RequestId) { gate.Open(); });
    EXPECT_TRUE(gate.Wait(10000));
    return info;
}

class ManagerTest : public ::testing::Test {
protected:
    void TearDown() override { StopOurManagers(); }
};

TEST_F(ManagerTest, FirstCallLaunchesAndSecondReturnsTheHeldSession) {
    ASSERT_TRUE(OurManagers().empty());
    auto transport = GetSharedTransport();
    SessionPtr first = LaunchTidelinkManager(transport);
    ASSERT_TRUE(first && first->IsOpen());
    const auto managers = OurManagers();
    ASSERT_EQ(managers.size(), 1u);
    const Value info = ManagerInfo(first);
    EXPECT_EQ(info["pid"], managers[0]);
    EXPECT_EQ(info["port"], ReadManagerPort(managers[0]));
    EXPECT_EQ(info["port"], first->GetRemotePort());
    EXPECT_EQ(info["protocol_version"], SuiteVersion() + ".0");

    // While the session is held, a second call hands it back without looking for the manager:
    // even with the port mapping gone it finds nothing to do.
    ASSERT_TRUE(MemoryMappedFile::Remove(GetTideLinkManagerPortFileName(managers[0])));
    SessionPtr second = LaunchTidelinkManager(transport);
    EXPECT_EQ(second, first);
    EXPECT_EQ(OurManagers().size(), 1u) << "no second manager launched";
}

TEST_F(ManagerTest, ManagerRestartedElsewhereIsFoundAgain) {
    SessionPtr session = LaunchTidelinkManager(GetSharedTransport());
    ASSERT_TRUE(session);
    const auto before = OurManagers();
    ASSERT_EQ(before.size(), 1u);
    const uint32_t oldPid = before[0];
    const std::string oldMapping = GetTideLinkManagerPortFileName(oldPid);

    SendSignal(oldPid, SIGKILL);
    ASSERT_TRUE(WaitForExit(oldPid, 10));
    ASSERT_TRUE(WaitFor([&] { return !session->IsOpen(); }, 10));
    EXPECT_TRUE(MemoryMappedFile::Exists(oldMapping)) << "a killed manager cannot clean up";

    // The held session is dead, so the next call hunts again and launches a new manager.
    SessionPtr again = LaunchTidelinkManager(GetSharedTransport());
    ASSERT_TRUE(again && again->IsOpen());
    const Value info = ManagerInfo(again);
    EXPECT_NE(info["pid"], oldPid);
    EXPECT_EQ(info["port"], GetPortForTideLinkManager());
    // The new manager removed the mapping its dead predecessor left behind.
    EXPECT_TRUE(WaitFor([&] { return !MemoryMappedFile::Exists(oldMapping); }, 10));
}

TEST_F(ManagerTest, ManagerPublishingPortZeroCountsAsNotRunning) {
    const pid_t fake = LaunchProcess(BinDir() + "/tidelinkmanager", {"--debug-publish-port", "0"});
    ASSERT_GT(fake, 0);
    const std::string fakeMapping = GetTideLinkManagerPortFileName(static_cast<uint32_t>(fake));
    ASSERT_TRUE(WaitFor([&] { return MemoryMappedFile::Exists(fakeMapping); }, 10));
    EXPECT_EQ(ReadManagerPort(static_cast<uint32_t>(fake)), 0);

    SessionPtr session = LaunchTidelinkManager(GetSharedTransport());
    ASSERT_TRUE(session);
    const Value info = ManagerInfo(session);
    EXPECT_NE(info["pid"], static_cast<uint32_t>(fake)) << "a real manager was launched";
    EXPECT_EQ(OurManagers().size(), 2u);
}

TEST_F(ManagerTest, NoExecutableAnywhereFailsAtOnce) {
    const std::string empty = "/tmp/tidelink-test-empty-" + std::to_string(GetCurrentProcessID());
    std::filesystem::create_directories(empty);
    ::setenv("TIDELINK_PACKAGE_DIR", empty.c_str(), 1);
    ::setenv("TIDELINK_APP_DIR", empty.c_str(), 1);
    try {
        LaunchTidelinkManager(GetSharedTransport());
        ADD_FAILURE() << "expected LinkError";
    } catch (const LinkError& e) {
        EXPECT_STREQ(e.what(), "Cannot find TideLink Server");
    }
    EXPECT_THROW(LaunchTidelinkManagerRPC(), LinkError);

    // The host-set folder is searched last and is enough on its own.
    SetTideLinkManagerFolderPath(ToUTF16(BinDir()));
    EXPECT_TRUE(LaunchTidelinkManagerRPC()->GetSession()->IsOpen());
    SetTideLinkManagerFolderPath(u"");
    ::unsetenv("TIDELINK_PACKAGE_DIR");
    ::unsetenv("TIDELINK_APP_DIR");
    std::filesystem::remove_all(empty);
}

TEST_F(ManagerTest, ConnectionsWithoutTheSecretAreRefused) {
    auto client = LaunchTidelinkManagerRPC();
    const uint16_t port = GetPortForTideLinkManager();
    {
        RawClient stranger(port);
        auto hello = wire::MakeHello(wire::Secret{});
        wire::AppendRequest(hello, 1, kManagerInfoMessage, Value::array());
        stranger.Send(hello);
        EXPECT_TRUE(stranger.ClosedWithin(10));
    }
    {
        RawClient garbage(port);
        garbage.SendHello();
        garbage.Send({0xff, 0xff, 0xff, 0x7f});
        EXPECT_TRUE(garbage.ClosedWithin(10));
    }
    EXPECT_EQ(ManagerInfo(client->GetSession())["port"], port) << "the manager serves on";
}

TEST_F(ManagerTest, StopsCleanlyOnSignalsAndWhenIdle) {
    for (int sig : {SIGTERM, SIGINT}) {
        auto session = LaunchTidelinkManager(GetSharedTransport());
        const auto pids = OurManagers();
        ASSERT_EQ(pids.size(), 1u);
        const std::string mapping = GetTideLinkManagerPortFileName(pids[0]);
        ASSERT_TRUE(MemoryMappedFile::Exists(mapping));
        SendSignal(pids[0], sig);
        EXPECT_TRUE(WaitForExit(pids[0], 10)) << "signal " << sig;
        EXPECT_FALSE(MemoryMappedFile::Exists(mapping)) << "signal " << sig;
        EXPECT_TRUE(WaitFor([&] { return !session->IsOpen(); }, 10));
    }
    // Started by hand with a short idle limit and never used, it leaves by itself.
    const pid_t idle = LaunchProcess(BinDir() + "/tidelinkmanager", {"--idle-exit", "0.5"});
    ASSERT_GT(idle, 0);
    EXPECT_TRUE(WaitForExit(static_cast<uint32_t>(idle), 20));
    EXPECT_FALSE(MemoryMappedFile::Exists(GetTideLinkManagerPortFileName(static_cast<uint32_t>(idle))));
}

TEST_F(ManagerTest, OneManagerPerUserAndVersion) {
    const pid_t a = LaunchProcess(BinDir() + "/tidelinkmanager", {});
    const pid_t b = LaunchProcess(BinDir() + "/tidelinkmanager", {});
    ASSERT_GT(a, 0);
    ASSERT_GT(b, 0);
    EXPECT_TRUE(WaitFor([&] { return OurManagers().size() == 1; }, 10));
    EXPECT_TRUE(LaunchTidelinkManager(GetSharedTransport()));
}

}  // namespace
