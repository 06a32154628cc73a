#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <fstream>
#include <mutex>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "platform/Config.h"
#include "platform/Executor.h"
#include "platform/Sync.h"
#include "platform/Trace.h"

using namespace tidelink::platform;

namespace {

// Sets an environment variable for the life of the object, then puts back what was there.
class ScopedEnv {
public:
    ScopedEnv(const char* name, const std::string& value) : mName(name) {
        if (const char* old = std::getenv(name)) mOld = old;
        ::setenv(name, value.c_str(), 1);
    }
    ~ScopedEnv() {
        if (mOld) {
            ::setenv(mName, mOld->c_str(), 1);
        } else {
            ::unsetenv(mName);
        }
    }
    ScopedEnv(const ScopedEnv&) = delete;
    ScopedEnv& operator=(const ScopedEnv&) = delete;

private:
    const char* mName;
    std::optional<std::string> mOld;
};

struct TraceRecord {
    std::string category;
    int level;
    std::string line;
};

// Collects trace lines; the default sink and the selection from the environment come back at
// the end of each test.
class TraceCapture : public ::testing::Test {
protected:
    void SetUp() override {
        SetTraceSink([this](std::string_view category, int level, std::string_view line) {
            std::lock_guard lock(mMutex);
            mLines.push_back({std::string(category), level, std::string(line)});
        });
    }
    void TearDown() override {
        SetTraceSink({});
        const char* env = std::getenv("TIDELINK_TRACE");
        SetTraceSelection(env ? env : "");
    }
    std::vector<TraceRecord> Lines() {
        std::lock_guard lock(mMutex);
        return mLines;
    }

    std::mutex mMutex;
    std::vector<TraceRecord> mLines;
};

class ExecutorTest : public TraceCapture {};
class SyncTest : public TraceCapture {};
class TraceTest : public TraceCapture {};

constexpr int kLongWaitMs = 10000;  // only reached when the code under test is broken

}  // namespace

// ---- executors ----

TEST_F(ExecutorTest, SerialSubExecutorKeepsOrderAndRunsOneAtATime) {
    auto serial = CreateSubExecutor(CreateCPUBoundExecutor(), 1);
    std::atomic<int> running{0};
    std::atomic<int> maxRunning{0};
    std::mutex mutex;
    std::vector<int> order;
    constexpr int kTasks = 300;
    for (int i = 0; i < kTasks; ++i) {
        serial->Post([&, i] {
            const int now = ++running;
            int seen = maxRunning.load();
            while (now > seen && !maxRunning.compare_exchange_weak(seen, now)) {
            }
            if (i % 16 == 0) std::this_thread::yield();
            {
                std::lock_guard lock(mutex);
                order.push_back(i);
            }
            --running;
        });
    }
    serial->WaitUntilIdle();
    EXPECT_EQ(maxRunning.load(), 1);
    ASSERT_EQ(order.size(), size_t{kTasks});
    for (int i = 0; i < kTasks; ++i) ASSERT_EQ(order[static_cast<size_t>(i)], i);
}

TEST_F(ExecutorTest, UnlimitedSubExecutorRunsTasksConcurrently) {
    auto unlimited = CreateSubExecutor(CreateCPUBoundExecutor(), -1);
    SyncPoint both(2);
    std::atomic<int> met{0};
    for (int i = 0; i < 2; ++i) {
        unlimited->Post([&] {
            if (both.Arrive(kLongWaitMs)) ++met;
        });
    }
    unlimited->WaitUntilIdle();
    EXPECT_EQ(met.load(), 2);
}

TEST_F(ExecutorTest, WaitUntilIdleCoversTasksPostedMeanwhile) {
    for (int limit : {1, -1}) {
        auto executor = CreateSubExecutor(CreateCPUBoundExecutor(), limit);
        Gate release;
        std::atomic<int> done{0};
        executor->Post([&] {
            release.Wait(kLongWaitMs);
            // Posted by a running task, most likely while the waiter below is blocked.
            executor->Post([&] {
                executor->Post([&] { ++done; });
                ++done;
            });
            ++done;
        });
        std::thread opener([&] {
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
            release.Open();
        });
        executor->WaitUntilIdle();
        EXPECT_EQ(done.load(), 3) << "limit " << limit;
        opener.join();
    }
}

TEST_F(ExecutorTest, WorkerPoolRunsWaitingTasksBesideTheCPUPoolAndDrainsWhenLetGo) {
    // Tasks that wait for a CPU-pool task must not starve it: a worker pool has threads of its own.
    auto workers = CreateWorkerPool(3);
    Gate cpuRan;
    std::atomic<int> saw{0};
    for (int i = 0; i < 3; ++i) {
        workers->Post([&] {
            if (cpuRan.Wait(kLongWaitMs)) ++saw;
        });
    }
    CreateCPUBoundExecutor()->Post([&] { cpuRan.Open(); });
    workers->WaitUntilIdle();
    EXPECT_EQ(saw.load(), 3);

    // Letting it go runs what is queued, also when the last reference goes on one of its threads.
    std::atomic<int> ran{0};
    {
        auto pool = CreateWorkerPool(1);
        for (int i = 0; i < 50; ++i) pool->Post([&] { ++ran; });
    }
    EXPECT_EQ(ran.load(), 50);
    Gate last;
    {
        auto pool = CreateWorkerPool(2);
        pool->Post([pool, &last]() mutable {
            pool.reset();
            last.Open();
        });
    }
    EXPECT_TRUE(last.Wait(kLongWaitMs));
    EXPECT_GE(HardwareThreadCount(), 1u);
}

TEST_F(ExecutorTest, ThrowingTaskDoesNotStopTheExecutor) {
    auto pool = CreateCPUBoundExecutor();
    auto serial = CreateSubExecutor(pool, 1);
    std::atomic<int> ran{0};
    serial->Post([] { throw std::runtime_error("task failure"); });
    serial->Post([] { throw 7; });
    serial->Post([&] { ++ran; });
    pool->Post([] { throw std::logic_error("pool failure"); });
    pool->Post([&] { ++ran; });
    serial->WaitUntilIdle();
    pool->WaitUntilIdle();
    EXPECT_EQ(ran.load(), 2);

    int reported = 0;
    for (const auto& l : Lines()) {
        if (l.line.find("task failure") != std::string::npos ||
            l.line.find("pool failure") != std::string::npos) {
            EXPECT_EQ(l.level, 0);
            ++reported;
        }
    }
    EXPECT_EQ(reported, 2);
}

// ---- sync ----

TEST_F(SyncTest, GateOpensClosesAndTimesOut) {
    Gate gate;
    EXPECT_FALSE(gate.IsOpen());
    EXPECT_FALSE(gate.Wait(20));
    gate.Open();
    EXPECT_TRUE(gate.IsOpen());
    EXPECT_TRUE(gate.Wait(0));
    EXPECT_TRUE(gate.Wait(-1));
    gate.Close();
    EXPECT_FALSE(gate.Wait(20));
    EXPECT_TRUE(Gate(true).Wait(0));

    std::atomic<int> passed{0};
    std::vector<std::thread> waiters;
    for (int i = 0; i < 3; ++i) {
        waiters.emplace_back([&] {
            if (gate.Wait(-1)) ++passed;
        });
    }
    gate.Open();
    for (auto& t : waiters) t.join();
    EXPECT_EQ(passed.load(), 3);
}

TEST_F(SyncTest, SyncPointMeetsAndTimesOut) {
    SyncPoint meet(3);
    std::atomic<int> met{0};
    std::vector<std::thread> parties;
    for (int i = 0; i < 2; ++i) {
        parties.emplace_back([&] {
            if (meet.Arrive(-1)) ++met;
        });
    }
    EXPECT_TRUE(meet.Arrive(kLongWaitMs));
    for (auto& t : parties) t.join();
    EXPECT_EQ(met.load(), 2);

    SyncPoint alone(2);
    EXPECT_FALSE(alone.Arrive(30));
    // The party that gave up still counts: the late one is not held up.
    EXPECT_TRUE(alone.Arrive(0));
}

TEST_F(SyncTest, RecursiveMutexIsReentrantAndExclusive) {
    RecursiveMutex mutex;
    mutex.Lock("outer");
    {
        RecursiveMutex::Guard inner(mutex, "inner");
        mutex.Lock("innermost");
        mutex.Unlock();
    }
    std::atomic<bool> otherHasIt{false};
    Gate otherStarted;
    std::thread other([&] {
        otherStarted.Open();
        RecursiveMutex::Guard guard(mutex, "other");
        otherHasIt = true;
    });
    otherStarted.Wait(-1);
    EXPECT_FALSE(otherHasIt.load());
    mutex.Unlock();
    other.join();
    EXPECT_TRUE(otherHasIt.load());
}

TEST_F(SyncTest, RecursiveMutexNamesBothSidesOfALongWait) {
    RecursiveMutex mutex;
    Gate reported;
    SetTraceSink([&](std::string_view category, int level, std::string_view line) {
        {
            std::lock_guard lock(mMutex);
            mLines.push_back({std::string(category), level, std::string(line)});
        }
        reported.Open();
    });
    mutex.Lock("HolderOp");
    std::thread waiter([&] { RecursiveMutex::Guard guard(mutex, "WaiterOp", 10); });
    EXPECT_TRUE(reported.Wait(kLongWaitMs));
    mutex.Unlock();
    waiter.join();  // the wait goes on until the lock is free
    const auto lines = Lines();
    ASSERT_FALSE(lines.empty());
    EXPECT_EQ(lines[0].level, 0);
    EXPECT_NE(lines[0].line.find("WaiterOp"), std::string::npos) << lines[0].line;
    EXPECT_NE(lines[0].line.find("HolderOp"), std::string::npos) << lines[0].line;
}

// ---- trace ----

TEST_F(TraceTest, SelectionByCategoryAndDefault) {
    SetTraceSelection("Cat:7,*:3");
    EXPECT_TRUE(TraceEnabled("Cat", 7));
    EXPECT_FALSE(TraceEnabled("Cat", 8));
    EXPECT_TRUE(TraceEnabled("Other", 3));
    EXPECT_FALSE(TraceEnabled("Other", 4));
    EXPECT_FALSE(TraceEnabled("cat", 4));  // names compare exactly

    SetTraceSelection("5");
    EXPECT_TRUE(TraceEnabled("Anything", 5));
    EXPECT_FALSE(TraceEnabled("Anything", 6));

    SetTraceSelection("Cat:x,Dog:2");  // an unreadable item is skipped
    EXPECT_FALSE(TraceEnabled("Cat", 1));
    EXPECT_TRUE(TraceEnabled("Cat", 0));
    EXPECT_TRUE(TraceEnabled("Dog", 2));

    SetTraceSelection("");
    EXPECT_TRUE(TraceEnabled("Any", 0));
    EXPECT_FALSE(TraceEnabled("Any", 1));
}

TEST_F(TraceTest, DisabledLineEvaluatesNothingAndSinkGetsCategoryAndLevel) {
    SetTraceSelection("Cat:7,*:3");
    int evaluated = 0;
    auto costly = [&] {
        ++evaluated;
        return "costly";
    };
    TL_TRACE("Other", 4) << costly();
    TL_TRACE("Cat", 8) << costly();
    EXPECT_EQ(evaluated, 0);
    EXPECT_TRUE(Lines().empty());

    TL_TRACE("Cat", 7) << costly() << ' ' << 42;
    TL_TRACE("Other", 3) << "plain";
    EXPECT_EQ(evaluated, 1);
    const auto lines = Lines();
    ASSERT_EQ(lines.size(), 2u);
    EXPECT_EQ(lines[0].category, "Cat");
    EXPECT_EQ(lines[0].level, 7);
    EXPECT_EQ(lines[0].line, "costly 42");
    EXPECT_EQ(lines[1].category, "Other");
    EXPECT_EQ(lines[1].level, 3);

    // The macro is a single statement.
    if (evaluated == 0)
        TL_TRACE("Cat", 0) << costly();
    else
        ++evaluated;
    EXPECT_EQ(evaluated, 2);
}

// ---- debug database ----

class DebugDatabase : public ::testing::Test {
protected:
    void SetUp() override {
        char path[] = "/tmp/tidelink-test-debug-XXXXXX";
        const int fd = ::mkstemp(path);
        ASSERT_GE(fd, 0);
        ::close(fd);
        mPath = path;
        mFile.emplace("TIDELINK_DEBUG_FILE", mPath);
    }
    void TearDown() override {
        mFile.reset();
        ::unlink(mPath.c_str());
    }
    void Write(const std::string& text) {
        std::ofstream(mPath, std::ios::trunc) << text;
    }

    std::string mPath;
    std::optional<ScopedEnv> mFile;
};

TEST_F(DebugDatabase, FileWithCommentsAndSpaces) {
    Write("# settings for the tests\n"
          "\n"
          "  TIDELINK_TEST_NUMBER =  42   # the answer\n"
          "TIDELINK_TEST_TEXT=two words\r\n"
          "TIDELINK_TEST_EMPTY=\n"
          "#TIDELINK_TEST_COMMENTED=1\n"
          "no equals sign here\n"
          "TIDELINK_TEST_HEX=0x10\n"
          "TIDELINK_TEST_LEADING_ZERO=010\n");
    EXPECT_EQ(GetDebugEntry("TIDELINK_TEST_NUMBER"), "42");
    EXPECT_EQ(GetDebugEntry("TIDELINK_TEST_TEXT"), "two words");
    EXPECT_EQ(GetDebugEntry("TIDELINK_TEST_EMPTY"), "");
    EXPECT_EQ(GetDebugEntry("TIDELINK_TEST_COMMENTED"), std::nullopt);
    EXPECT_EQ(GetDebugEntry("TIDELINK_TEST_MISSING"), std::nullopt);
    EXPECT_EQ(GetDebugEntryInt("TIDELINK_TEST_NUMBER", -1), 42);
    EXPECT_EQ(GetDebugEntryInt("TIDELINK_TEST_HEX", -1), 16);
    EXPECT_EQ(GetDebugEntryInt("TIDELINK_TEST_LEADING_ZERO", -1), 10);  // not octal
    EXPECT_EQ(GetDebugEntryInt("TIDELINK_TEST_MISSING", -1), -1);

    // The file is read on each lookup.
    Write("TIDELINK_TEST_NUMBER=7\n");
    EXPECT_EQ(GetDebugEntryInt("TIDELINK_TEST_NUMBER", -1), 7);
}

TEST_F(DebugDatabase, EnvironmentBeatsFile) {
    Write("TIDELINK_TEST_NUMBER=1\n");
    ScopedEnv env("TIDELINK_TEST_NUMBER", "2");
    EXPECT_EQ(GetDebugEntry("TIDELINK_TEST_NUMBER"), "2");
    EXPECT_EQ(GetDebugEntryInt("TIDELINK_TEST_NUMBER", 0), 2);
}

TEST_F(DebugDatabase, BadNumbersGiveTheDefault) {
    Write("TIDELINK_TEST_A=12abc\n"
          "TIDELINK_TEST_B=\n"
          "TIDELINK_TEST_C=many\n"
          "TIDELINK_TEST_D=99999999999999999999999\n"
          "TIDELINK_TEST_E=-5\n");
    EXPECT_EQ(GetDebugEntryInt("TIDELINK_TEST_A", 9), 9);
    EXPECT_EQ(GetDebugEntryInt("TIDELINK_TEST_B", 9), 9);
    EXPECT_EQ(GetDebugEntryInt("TIDELINK_TEST_C", 9), 9);
    EXPECT_EQ(GetDebugEntryInt("TIDELINK_TEST_D", 9), 9);
    EXPECT_EQ(GetDebugEntryInt("TIDELINK_TEST_E", 9), -5);
}

// ---- localised text ----

TEST(Localize, KeyedTextAndArguments) {
    EXPECT_EQ(Localize("$$$/tidelink/Test/Plain=Default text"), u"Default text");
    EXPECT_EQ(Localize("$$$/tidelink/Test/One=Cannot open @0.", u"\u00e9t\u00e9"),
              u"Cannot open \u00e9t\u00e9.");
    EXPECT_EQ(Localize("$$$/tidelink/Test/Twice=@0 and @0 again", u"X"), u"X and X again");
    EXPECT_EQ(Localize("$$$/tidelink/Test/Two=@1 before @0", {u"a", u"b"}), u"b before a");
    // An argument that contains its own marker is not expanded again.
    EXPECT_EQ(Localize("$$$/tidelink/Test/Self=<@0>", u"@0@0"), u"<@0@0>");
    EXPECT_EQ(Localize("$$$/tidelink/Test/Cross=@0 @1", {u"@1", u"x"}), u"@1 x");
    EXPECT_EQ(Localize("$$$/tidelink/Test/Eq=a=b"), u"a=b");
    EXPECT_EQ(Localize("Not keyed at all"), u"Not keyed at all");
    EXPECT_EQ(Localize("$$/almost=keyed"), u"$$/almost=keyed");
    EXPECT_EQ(Localize(""), u"");
}

// ---- runtime folder ----

class RuntimeDir : public TraceCapture {
protected:
    void SetUp() override {
        TraceCapture::SetUp();
        char path[] = "/tmp/tidelink-test-runtime-XXXXXX";
        ASSERT_NE(::mkdtemp(path), nullptr);
        mBase = path;
    }
    void TearDown() override {
        for (const char* sub : {"/fresh", "/open", "/link", "/target"}) {
            const std::string p = mBase + sub;
            if (::unlink(p.c_str()) != 0) ::rmdir(p.c_str());
        }
        ::rmdir(mBase.c_str());
        TraceCapture::TearDown();
    }
    std::string mBase;
};

TEST_F(RuntimeDir, CreatedPrivate) {
    const std::string dir = mBase + "/fresh";
    ScopedEnv env("TIDELINK_RUNTIME_DIR", dir);
    EXPECT_EQ(GetRuntimeDir(), dir);
    struct stat st {};
    ASSERT_EQ(::stat(dir.c_str(), &st), 0);
    EXPECT_TRUE(S_ISDIR(st.st_mode));
    EXPECT_EQ(st.st_mode & 0777, 0700u);
    EXPECT_EQ(GetRuntimeDir(), dir);  // and accepted once it exists
}

TEST_F(RuntimeDir, FolderOpenToOthersOrALinkIsRefused) {
    const std::string open = mBase + "/open";
    ASSERT_EQ(::mkdir(open.c_str(), 0700), 0);
    ASSERT_EQ(::chmod(open.c_str(), 0755), 0);
    {
        ScopedEnv env("TIDELINK_RUNTIME_DIR", open);
        EXPECT_EQ(GetRuntimeDir(), "");
        const auto lines = Lines();
        ASSERT_EQ(lines.size(), 1u);
        EXPECT_EQ(lines[0].level, 0);
        EXPECT_NE(lines[0].line.find(open), std::string::npos) << lines[0].line;
    }
    const std::string target = mBase + "/target";
    const std::string link = mBase + "/link";
    ASSERT_EQ(::mkdir(target.c_str(), 0700), 0);
    ASSERT_EQ(::symlink(target.c_str(), link.c_str()), 0);
    {
        ScopedEnv env("TIDELINK_RUNTIME_DIR", link);
        EXPECT_EQ(GetRuntimeDir(), "");
    }
    ScopedEnv env("TIDELINK_RUNTIME_DIR", mBase + "/missing/deeper");
    EXPECT_EQ(GetRuntimeDir(), "");
}
