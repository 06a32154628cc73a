// Shared buffers between real processes through the coordination client: this test process and
// buffer_peer processes, with the real link manager between them.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstring>
#include <mutex>

#include "Harness.h"
#include "platform/Rpc.h"
#include "platform/Sync.h"
#include "processcoordination/MappedAudioData.h"
#include "processcoordination/ProcessCoordination.h"
#include "tidelink/core/LinkManager.h"
#include "tidelink/peers/Source.h"

using namespace tidelink;
using namespace tidelink::platform;
using namespace tidelink::test;
using namespace processcoordination;

namespace {

// A peer process with its standard output on a pipe.
struct Peer {
    pid_t pid = -1;
    int out = -1;
    std::string buffered;

    explicit Peer(const std::vector<std::string>& args) {
        int fds[2];
        if (::pipe(fds) != 0) return;
        pid = ::fork();
        if (pid == 0) {
            ::dup2(fds[1], 1);
            ::close(fds[0]);
            std::vector<char*> argv;
            const std::string exe = BinDir() + "/buffer_peer";
            argv.push_back(const_cast<char*>(exe.c_str()));
            for (const auto& a : args) argv.push_back(const_cast<char*>(a.c_str()));
            argv.push_back(nullptr);
            ::execv(exe.c_str(), argv.data());
            ::_exit(127);
        }
        ::close(fds[1]);
        out = fds[0];
    }
    ~Peer() {
        if (pid > 0) {
            ::kill(pid, SIGKILL);
            ::waitpid(pid, nullptr, 0);
        }
        if (out >= 0) ::close(out);
    }
    // The next line, or "" after |seconds| or at the end.
    std::string Line(double seconds = 20) {
        const auto end = NowMs() + seconds * 1000;
        for (;;) {
            auto nl = buffered.find('\n');
            if (nl != std::string::npos) {
                std::string line = buffered.substr(0, nl);
                buffered.erase(0, nl + 1);
                return line;
            }
            const double left = end - NowMs();
            if (left <= 0) return {};
            fd_set set;
            FD_ZERO(&set);
            FD_SET(out, &set);
            timeval tv{0, 20000};
            if (::select(out + 1, &set, nullptr, nullptr, &tv) > 0) {
                char buf[256];
                const ssize_t n = ::read(out, buf, sizeof(buf));
                if (n <= 0) return {};
                buffered.append(buf, static_cast<size_t>(n));
            }
        }
    }
    int Wait() {
        int status = 0;
        ::waitpid(pid, &status, 0);
        pid = -1;
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    }
    void Kill() {
        ::kill(pid, SIGKILL);
        ::waitpid(pid, nullptr, 0);
        pid = -1;
    }
    static double NowMs() {
        return std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now().time_since_epoch()).count();
    }
};

Value Buffers() {
    auto session = GetSharedTransport()->ClientStart("127.0.0.1", GetPortForTideLinkManager());
    auto state = std::make_shared<std::pair<Gate, Value>>();
    session->SendRequest(
        BuildCall(kManagerInfoMessage),
        [state](const Value& reply, RequestId) {
            state->second = reply.value("value", Value()).value("buffers", Value::object());
            state->first.Open();
        },
        [state](int32_t, const WString&, RequestId) { state->first.Open(); });
    state->first.Wait(10000);
    session->Close();
    return state->second;
}

uint64_t Live() { return Buffers().value("buffers_live", uint64_t{99}); }

// Waits for one delivery of |id|.
struct Waiter {
    Gate gate;
    std::mutex mutex;
    BinaryReferencePtr reference;
    int result = 1;
    int calls = 0;
    AvailabilityCallback Callback() {
        return [this](const Guid&, BinaryReferencePtr ref, int r) {
            {
                std::lock_guard lock(mutex);
                reference = ref;
                result = r;
                ++calls;
            }
            gate.Open();
        };
    }
};

uint64_t Sum(uint64_t size, int seed) {
    uint64_t sum = 0;
    for (uint64_t i = 0; i < size; ++i) sum += static_cast<uint8_t>(seed + i);
    return sum;
}

class CoordinationTest : public ::testing::Test {
protected:
    void SetUp() override { InitializeClient(); }
    void TearDown() override {
        UninitializeClient();
        StopOurManagers();
    }
};

TEST_F(CoordinationTest, FramesFromAnotherProcessArriveMapAndReuseTheirMapping) {
    const uint64_t size = 640 * 360 * 4;
    uint64_t mappingsAfterFirst = 0;
    std::string firstName;
    for (int frame = 0; frame < 3; ++frame) {
        const Guid id = Guid::New();
        Waiter w;
        std::atomic<bool> registered{false};
        ASSERT_EQ(GetBinaryDataWithAsyncNotification(id, w.Callback(), [&] { registered = true; }), 0);
        EXPECT_TRUE(WaitFor([&] { return registered.load(); }, 10)) << "acknowledged";
        EXPECT_EQ(IsBinaryDataCurrentlyWanted(id), 0);
        Peer producer({"produce", id.ToString(), std::to_string(size), std::to_string(frame), "1"});
        ASSERT_EQ(producer.Line(), "published");
        ASSERT_TRUE(w.gate.Wait(10000));
        ASSERT_EQ(w.result, 0);
        ASSERT_EQ(w.reference->GetSize(), size);
        const auto* p = static_cast<const uint8_t*>(w.reference->MapIntoCurrentProcess());
        ASSERT_NE(p, nullptr);
        EXPECT_EQ(w.reference->MapIntoCurrentProcess(), p) << "nested maps share one mapping";
        uint64_t sum = 0;
        for (uint64_t i = 0; i < size; ++i) sum += p[i];
        EXPECT_EQ(sum, Sum(size, frame));
        w.reference->UnmapFromCurrentProcess(p);
        EXPECT_THROW(w.reference->UnmapFromCurrentProcess(p + 1), ContractViolation);
        w.reference->UnmapFromCurrentProcess(p);
        // The data are ours until we let go.
        BinaryReferencePtr again;
        EXPECT_EQ(GetBinaryDataIfAvailable(id, again), 0);
        EXPECT_EQ(again, w.reference);
        again.reset();
        w.reference.reset();
        EXPECT_EQ(producer.Wait(), 0);
        ASSERT_TRUE(WaitFor([] { return Live() == 0; }, 10)) << "the last drop frees the frame";
        if (frame == 0) mappingsAfterFirst = GetMappedFileCacheStats().mappingsCreated;
    }
    // Equal frames come back under one name: the consumer maps once.
    EXPECT_EQ(GetMappedFileCacheStats().mappingsCreated, mappingsAfterFirst);
    EXPECT_EQ(Buffers()["objects_created"], 1);
}

TEST_F(CoordinationTest, LocalDataAliasesAndTheSingleDrop) {
    const Guid id = Guid::New(), alias = Guid::New(), other = Guid::New();
    EXPECT_EQ(PutCompletedBinaryData(id, nullptr, false), -3);
    EXPECT_EQ(MakeBinaryDataAlias(id, nullptr, alias), -3);
    EXPECT_EQ(GetBinaryDataWithAsyncNotification(id, {}), -3);
    EXPECT_EQ(BeginBinaryDataGeneration(id, true), -2);

    WritableBinaryReferencePtr w;
    ASSERT_EQ(GetWritableBinaryData(100000, w), 0);
    auto* bytes = static_cast<uint8_t*>(w->MapIntoCurrentProcess());
    ASSERT_NE(bytes, nullptr);
    for (int i = 0; i < 100000; ++i) bytes[i] = static_cast<uint8_t>(i);
    w->UnmapFromCurrentProcess(bytes);
    ASSERT_EQ(PutCompletedBinaryData(id, w, false), 0);
    // Known locally through the writable reference: a read-only one, without asking.
    BinaryReferencePtr r;
    ASSERT_EQ(GetBinaryDataIfAvailable(id, r), 0);
    EXPECT_EQ(r->GetSize(), 100000u);
    ASSERT_EQ(MakeBinaryDataAlias(id, r, alias), 0);

    // A consumer elsewhere waiting for the alias gets the same data.
    Peer consumer({"consume", alias.ToString()});
    EXPECT_EQ(IsBinaryDataCurrentlyWanted(other), -1);
    EXPECT_EQ(consumer.Line(), "result 0 size 100000 sum " + std::to_string(Sum(100000, 0)));
    EXPECT_EQ(consumer.Wait(), 0);

    // Our last reference goes: one drop lists both identifiers, and the manager frees the data.
    EXPECT_EQ(IsBinaryDataCurrentlyAvailable(alias), 0);
    w.reset();
    r.reset();
    ASSERT_TRUE(WaitFor([] { return Live() == 0; }, 10));
    BinaryReferencePtr gone;
    EXPECT_EQ(GetBinaryDataIfAvailable(alias, gone), -1);
    EXPECT_EQ(IsBinaryDataCurrentlyAvailable(id), -1);
}

TEST_F(CoordinationTest, AnAudioChunkHandedOverWhileMappedIsLetGoAfterwards) {
    // A producer publishes its chunk with hand-over while the MappedAudioData still maps it, then
    // lets the object go: the unmap of a handed-over reference has nothing to undo.
    const Guid id = Guid::New();
    Peer consumer({"consume", id.ToString()});
    uint64_t sum = 0;
    {
        MappedAudioData chunk;
        ASSERT_EQ(chunk.Init(2, 1024, id), 0);
        float** planes = chunk.GetAudioDataBuffer();
        for (uint32_t c = 0; c < 2; ++c) {
            for (uint32_t i = 0; i < 1024; ++i) planes[c][i] = static_cast<float>(c * 1024 + i) / 2048.0f;
        }
        const auto* bytes = reinterpret_cast<const uint8_t*>(planes[0]) - kAudioChunkHeaderBytes;
        for (uint64_t i = 0; i < kAudioChunkHeaderBytes + 2 * 1024 * 4; ++i) sum += bytes[i];
        ASSERT_EQ(PutCompletedBinaryData(id, chunk.GetWritablePtr(), true), 0);
    }
    EXPECT_EQ(consumer.Line(), "result 0 size 8320 sum " + std::to_string(sum));
    EXPECT_EQ(consumer.Wait(), 0);
}

TEST_F(CoordinationTest, FramesOfAProcessWithoutTheClientFailWithNoClient) {
    // Once the last user has let the client go, this process has none (it is started once); a
    // renderer's frames and chunks then fail with -5, on an executor, and send nothing.
    UninitializeClient();
    auto reconnect = ServerReconnect::Create(nullptr, false);
    SourceInfo info;
    info.mID = Guid::New();
    info.mParentProjectFile = "/nowhere/p.kstproj";
    auto source = Source::CreateSource(reconnect, nullptr);
    source->Init(info);
    Gate started;
    VideoRendererPtr renderer;
    source->GetVideoRenderer(
        [&](ConnectionStatus, VideoRendererPtr r) {
            renderer = std::move(r);
            started.Open();
        },
        VideoRenderOptions());
    ASSERT_TRUE(started.Wait(10000));
    ASSERT_TRUE(renderer);
    Gate failed;
    std::atomic<int> result{0};
    renderer->RenderVideo(
        [&](const Guid&, BinaryReferencePtr ref, int code) {
            result = ref ? 99 : code;
            failed.Open();
        },
        Guid::New(), RatioTime(0));
    ASSERT_TRUE(failed.Wait(10000));
    EXPECT_EQ(result.load(), -5);
    renderer.reset();
    InitializeClient();  // balances the fixture's teardown
}

TEST_F(CoordinationTest, TwoWaitersInOrderAndCancel) {
    const Guid id = Guid::New(), cancelled = Guid::New();
    std::vector<int> order;
    std::mutex mutex;
    Gate both;
    auto record = [&](int n) {
        return [&, n](const Guid&, BinaryReferencePtr ref, int result) {
            std::lock_guard lock(mutex);
            order.push_back(result == 0 && ref ? n : -n);
            if (order.size() == 2) both.Open();
        };
    };
    ASSERT_EQ(GetBinaryDataWithAsyncNotification(id, record(1)), 0);
    ASSERT_EQ(GetBinaryDataWithAsyncNotification(id, record(2)), 0);
    Peer producer({"produce", id.ToString(), "4096", "1", "0"});
    ASSERT_TRUE(both.Wait(10000));
    EXPECT_EQ(order, (std::vector<int>{1, 2}));
    EXPECT_EQ(producer.Wait(), 0);

    Waiter w;
    ASSERT_EQ(GetBinaryDataWithAsyncNotification(cancelled, w.Callback()), 0);
    CancelAllOutstandingNotifications(cancelled, -6);
    ASSERT_TRUE(w.gate.Wait(10000));
    EXPECT_EQ(w.result, -6);
    EXPECT_FALSE(w.reference);
    FlushAllNotifications();
}

TEST_F(CoordinationTest, KilledPeersLoseTheirBuffersAndTheOthersGoOn) {
    const Guid id = Guid::New();
    Peer consumer({"consume", id.ToString(), "hold"});
    ASSERT_TRUE(WaitFor([&] { return IsBinaryDataCurrentlyWanted(id) == 0; }, 10));
    WritableBinaryReferencePtr w;
    ASSERT_EQ(GetWritableBinaryData(300000, w), 0);
    ASSERT_EQ(PutCompletedBinaryData(id, w, true), 0);
    w.reset();
    ASSERT_EQ(consumer.Line(), "result 0 size 300000 sum 0");
    EXPECT_EQ(Live(), 1u);
    consumer.Kill();
    ASSERT_TRUE(WaitFor([] { return Live() == 0; }, 10)) << "the killed consumer's buffer is freed";

    Peer producer({"allocate", "1000000"});
    ASSERT_EQ(producer.Line(), "allocating");
    producer.Kill();
    ASSERT_TRUE(WaitFor([] { return Live() == 0; }, 10)) << "the killed producer's buffers are freed";

    // We go on.
    ASSERT_EQ(GetWritableBinaryData(1000, w), 0);
}

TEST_F(CoordinationTest, ALostManagerCompletesEveryWaitWithNoAnswer) {
    Waiter a, b;
    ASSERT_EQ(GetBinaryDataWithAsyncNotification(Guid::New(), a.Callback()), 0);
    ASSERT_EQ(GetBinaryDataWithAsyncNotification(Guid::New(), b.Callback()), 0);
    for (uint32_t pid : OurManagers()) SendSignal(pid, SIGKILL);
    ASSERT_TRUE(a.gate.Wait(10000));
    ASSERT_TRUE(b.gate.Wait(10000));
    EXPECT_EQ(a.result, -4);
    EXPECT_EQ(b.result, -4);
    // Later waits are completed too, not left hanging.
    Waiter c;
    GetBinaryDataWithAsyncNotification(Guid::New(), c.Callback());
    ASSERT_TRUE(c.gate.Wait(10000));
    EXPECT_NE(c.result, 0);
    WritableBinaryReferencePtr w;
    EXPECT_EQ(GetWritableBinaryData(1000, w), -4);
    // The killed manager could not remove its objects; the next one does, at start.
    for (uint32_t pid : OurManagers()) WaitForExit(pid, 10);
    GetPortForTideLinkManager();
    EXPECT_TRUE(WaitFor([] { return OurSharedMemory().size() <= 1; }, 10));
}

}  // namespace

namespace {

TEST_F(CoordinationTest, StatusReportsTheBufferService) {
    WritableBinaryReferencePtr w;
    ASSERT_EQ(GetWritableBinaryData(123456, w), 0);
    auto r = RunCommand(BinDir() + "/tidelink status --json");
    ASSERT_EQ(r.exitCode, 0) << r.err;
    const Value b = ParseJSONText(r.out).at("buffers");
    EXPECT_EQ(b["buffers_live"], 1);
    EXPECT_EQ(b["bytes_live"], 123456);
    EXPECT_EQ(b["bytes_pooled"], 0);
    EXPECT_EQ(b["clients"], 1) << "the status query itself holds nothing";
    w.reset();
    ASSERT_TRUE(WaitFor([] { return Buffers()["bytes_pooled"] == 123456; }, 10));
}

}  // namespace
