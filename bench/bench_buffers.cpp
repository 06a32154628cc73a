// Frame hand-off between two processes through the link manager's buffers, against the floor of
// one process writing and then reading the same bytes in a reused buffer.
//
//   bench_buffers [--json] [--seconds S]
//
// The producer (a child process) renders on request: allocate, fill every byte, publish with
// hand-over. The consumer registers for a frame, asks the producer for it once the registration is
// acknowledged, then maps, reads every byte and drops it; 1 or 4 frames are in flight. Per frame
// size and depth it reports frames per second, latency from request to dropped reference (median
// and 99th percentile), and the shared-memory objects and mappings created per frame in steady
// state. Without TIDELINK_SUITE_VERSION it runs a private link manager and stops it at the end.
#include <signal.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <mutex>
#include <string>
#include <vector>

#include "platform/Process.h"
#include "platform/Rpc.h"
#include "platform/Sync.h"
#include "processcoordination/ProcessCoordination.h"
#include "tidelink/core/LinkManager.h"

using namespace tidelink;
using namespace tidelink::platform;
using namespace processcoordination;

namespace {

struct FrameSize {
    const char* name;
    uint64_t bytes;
};
constexpr FrameSize kSizes[] = {
    {"360p", 640ull * 360 * 4}, {"1080p", 1920ull * 1080 * 4}, {"2160p", 3840ull * 2160 * 4}};
constexpr int kDepths[] = {1, 4};
constexpr int kWarmupFrames = 8;

double Now() {
    return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch()).count();
}

// Writes every byte (as 64-bit words) the way a renderer fills a frame.
void Fill(void* data, uint64_t size, uint64_t seed) {
    auto* p = static_cast<uint64_t*>(data);
    for (uint64_t i = 0; i < size / 8; ++i) p[i] = seed + i;
}

// Reads every byte.
uint64_t Sum(const void* data, uint64_t size) {
    const auto* p = static_cast<const uint64_t*>(data);
    uint64_t s = 0;
    for (uint64_t i = 0; i < size / 8; ++i) s += p[i];
    return s;
}

// ---- producer process ----
int RunProducer(const std::string& portFile) {
    InitializeClient();
    auto transport = SocketTransport::Create(CreateCPUBoundExecutor());
    auto server = transport->ServerStart(0, true);
    auto registrar = MessageRegistrar::Create();
    RPCServer rpc(server, "bench", registrar);
    auto workers = CreateSubExecutor(CreateCPUBoundExecutor(), -1);
    Gate quit;
    std::atomic<uint64_t> seed{1};
    registrar->Register("bench.render", std::make_shared<FunctionNotificationHandler>([&](const Value& args) {
        const Guid id = args.at(0).get<Guid>();
        const uint64_t size = args.at(1).get<uint64_t>();
        // Allocation asks the link manager and waits: never on the transport thread.
        workers->Post([id, size, &seed] {
            WritableBinaryReferencePtr ref;
            if (GetWritableBinaryData(size, ref) != 0) {
                PutBinaryDataGenerationError(id, -1);
                return;
            }
            void* p = ref->MapIntoCurrentProcess();
            if (p != nullptr) {
                Fill(p, size, seed.fetch_add(1));
                ref->UnmapFromCurrentProcess(p);
            }
            PutCompletedBinaryData(id, ref, true);
        });
    }));
    registrar->Register("bench.quit", std::make_shared<FunctionNotificationHandler>([&](const Value&) { quit.Open(); }));
    {
        std::ofstream out(portFile + ".tmp");
        out << server->GetPort() << "\n";
    }
    std::rename((portFile + ".tmp").c_str(), portFile.c_str());
    quit.Wait(600000);
    workers->WaitUntilIdle();
    server->Stop();
    UninitializeClient();
    return 0;
}

// ---- consumer ----
struct Result {
    double fps = 0;
    double floorFps = 0;
    double p50 = 0;
    double p99 = 0;
    double objectsPerFrame = 0;
    double mappingsPerFrame = 0;
    int failures = 0;
};

double MeasureFloor(uint64_t size, double seconds) {
    std::vector<uint64_t> buffer(size / 8);
    uint64_t sink = 0;
    int frames = 0;
    const double start = Now();
    double now = start;
    while (now - start < seconds || frames < 10) {
        Fill(buffer.data(), size, static_cast<uint64_t>(frames));
        sink += Sum(buffer.data(), size);
        ++frames;
        now = Now();
    }
    if (sink == 42) std::printf(" ");
    return frames / (now - start);
}

// The link manager's own description of itself ("value" of its info message).
Value ManagerInfo(const RPCClientPtr& manager) {
    auto gate = std::make_shared<Gate>();
    auto info = std::make_shared<Value>(Value::object());
    manager->SendRequest(
        BuildCall(kManagerInfoMessage),
        [gate, info](const Value& reply, RequestId) {
            *info = reply.value("value", Value::object());
            gate->Open();
        },
        [gate](int32_t, const WString&, RequestId) { gate->Open(); });
    gate->Wait(10000);
    return *info;
}

uint64_t ObjectsCreated(const RPCClientPtr& manager) {
    return ManagerInfo(manager).value("buffers", Value::object()).value("objects_created", uint64_t{0});
}

class Consumer : public std::enable_shared_from_this<Consumer> {
public:
    Consumer(RPCClientPtr producer, uint64_t size, double seconds)
        : mProducer(std::move(producer)), mSize(size), mSeconds(seconds) {}

    void Run(int depth) {
        mStart = Now();
        for (int i = 0; i < depth; ++i) StartFrame();
        mDone.Wait();
    }
    std::vector<double> Latencies() {
        std::lock_guard lock(mMutex);
        return mLatencies;
    }
    int Frames() const { return mFrames.load(); }
    int Failures() const { return mFailures.load(); }
    double Elapsed() const { return mEnd - mMeasureStart; }
    void MarkSteady() { mMeasureStart = Now(); }

private:
    void StartFrame() {
        const Guid id = Guid::New();
        const double started = Now();
        ++mInFlight;
        std::weak_ptr<Consumer> weak = shared_from_this();
        const int rc = GetBinaryDataWithAsyncNotification(
            id,
            [weak, started](const Guid&, BinaryReferencePtr ref, int result) {
                if (auto self = weak.lock()) self->OnFrame(ref, result, started);
            },
            [weak, id] {
                if (auto self = weak.lock()) {
                    self->mProducer->SendNotification(BuildCall("bench.render", Value::array({id, self->mSize})));
                }
            });
        if (rc != 0) ++mFailures;  // the callback still completes the frame
    }

    void OnFrame(BinaryReferencePtr ref, int result, double started) {
        if (result == 0 && ref) {
            const void* p = ref->MapIntoCurrentProcess();
            if (p != nullptr) {
                mSink += Sum(p, ref->GetSize());
                ref->UnmapFromCurrentProcess(p);
            } else {
                ++mFailures;
            }
            ref.reset();
        } else {
            if (mFailures.fetch_add(1) == 0) std::fprintf(stderr, "bench_buffers: first failed frame: result %d\n", result);
        }
        const double now = Now();
        const int frame = ++mFrames;
        if (frame > kWarmupFrames) {
            std::lock_guard lock(mMutex);
            mLatencies.push_back((now - started) * 1e6);
        }
        if (frame == kWarmupFrames) mOnWarm();
        if (now - mStart < mSeconds || frame < kWarmupFrames + 20) {
            StartFrame();
        }
        if (--mInFlight == 0) {
            mEnd = now;
            mDone.Open();
        }
    }

public:
    std::function<void()> mOnWarm = [] {};

private:
    RPCClientPtr mProducer;
    uint64_t mSize;
    double mSeconds;
    double mStart = 0;
    double mMeasureStart = 0;
    double mEnd = 0;
    std::atomic<int> mInFlight{0};
    std::atomic<int> mFrames{0};
    std::atomic<int> mFailures{0};
    std::atomic<uint64_t> mSink{0};
    std::mutex mMutex;
    std::vector<double> mLatencies;
    Gate mDone;
};

double Percentile(std::vector<double> v, double q) {
    if (v.empty()) return 0;
    std::sort(v.begin(), v.end());
    return v[std::min(v.size() - 1, static_cast<size_t>(q * static_cast<double>(v.size())))];
}

}  // namespace

int main(int argc, char** argv) {
    bool json = false;
    double seconds = 1.5;
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg == "--producer" && i + 1 < argc) return RunProducer(argv[i + 1]);
        if (arg == "--json") {
            json = true;
        } else if (arg == "--seconds" && i + 1 < argc) {
            seconds = std::max(0.2, std::atof(argv[++i]));
        } else {
            std::fprintf(stderr, "usage: bench_buffers [--json] [--seconds S]\n");
            return 2;
        }
    }
    const bool privateManager = std::getenv("TIDELINK_SUITE_VERSION") == nullptr;
    if (privateManager) {
        const std::string version = "8" + std::to_string(10000 + GetCurrentProcessID() % 90000);
        ::setenv("TIDELINK_SUITE_VERSION", version.c_str(), 1);
    }

    InitializeClient();
    RPCClientPtr manager;
    try {
        manager = LaunchTidelinkManagerRPC();
    } catch (const LinkError& e) {
        std::fprintf(stderr, "bench_buffers: %s\n", e.what());
        return 1;
    }
    const std::string portFile = "/tmp/tidelink-bench-buffers-" + std::to_string(GetCurrentProcessID());
    if (LaunchProcess(GetCurrentExecutablePath(), {"--producer", portFile}) < 0) {
        std::perror("bench_buffers: cannot start the producer");
        return 1;
    }
    unsigned port = 0;
    for (int i = 0; i < 10000 && port == 0; ++i) {
        std::ifstream in(portFile);
        if (!(in >> port)) {
            port = 0;
            SleepMilliseconds(1);
        }
    }
    std::remove(portFile.c_str());
    auto session = port ? GetSharedTransport()->ClientStart("127.0.0.1", static_cast<uint16_t>(port)) : nullptr;
    if (!session) {
        std::fprintf(stderr, "bench_buffers: the producer did not start\n");
        return 1;
    }
    auto producer = std::make_shared<RPCClient>(session, "DirectClient");

    Value out = Value::object();
    int failures = 0;
    for (const auto& size : kSizes) {
        const double floorFps = MeasureFloor(size.bytes, seconds);
        for (int depth : kDepths) {
            auto consumer = std::make_shared<Consumer>(producer, size.bytes, seconds);
            uint64_t objectsAtWarm = 0;
            uint64_t mappingsAtWarm = 0;
            std::atomic<bool> warm{false};
            consumer->mOnWarm = [&] {
                objectsAtWarm = ObjectsCreated(manager);
                mappingsAtWarm = GetMappedFileCacheStats().mappingsCreated;
                consumer->MarkSteady();
                warm = true;
            };
            consumer->Run(depth);
            const auto latencies = consumer->Latencies();
            Result r;
            r.floorFps = floorFps;
            r.fps = static_cast<double>(latencies.size()) / consumer->Elapsed();
            r.p50 = Percentile(latencies, 0.50);
            r.p99 = Percentile(latencies, 0.99);
            const double steadyFrames = std::max<double>(1, static_cast<double>(latencies.size()));
            r.objectsPerFrame = static_cast<double>(ObjectsCreated(manager) - objectsAtWarm) / steadyFrames;
            r.mappingsPerFrame =
                static_cast<double>(GetMappedFileCacheStats().mappingsCreated - mappingsAtWarm) / steadyFrames;
            failures += consumer->Failures();
            Value v = Value::object();
            v["fps"] = std::round(r.fps * 10) / 10;
            v["floor_fps"] = std::round(r.floorFps * 10) / 10;
            v["ratio"] = std::round(r.fps / r.floorFps * 1000) / 1000;
            v["p50_us"] = std::round(r.p50);
            v["p99_us"] = std::round(r.p99);
            v["new_objects_per_frame"] = std::round(r.objectsPerFrame * 1000) / 1000;
            v["new_mappings_per_frame"] = std::round(r.mappingsPerFrame * 1000) / 1000;
            v["frames"] = latencies.size();
            out[size.name]["d" + std::to_string(depth)] = v;
            if (!json) {
                std::printf("%-6s d%d  %8.1f fps (floor %8.1f, ratio %.2f)  p50 %7.0f us  p99 %7.0f us  "
                            "objects/frame %.3f  mappings/frame %.3f\n",
                            size.name, depth, r.fps, r.floorFps, r.fps / r.floorFps, r.p50, r.p99,
                            r.objectsPerFrame, r.mappingsPerFrame);
            }
        }
    }
    producer->SendNotification(BuildCall("bench.quit"));
    SleepMilliseconds(100);
    session->Close();
    if (privateManager) {
        const auto pid = ManagerInfo(manager).value("pid", 0u);
        if (pid != 0) ::kill(static_cast<pid_t>(pid), SIGTERM);
    }
    UninitializeClient();
    if (json) std::printf("%s\n", ToJSONText(out).c_str());
    if (failures > 0) std::fprintf(stderr, "bench_buffers: %d frames failed\n", failures);
    return failures > 0 ? 1 : 0;
}
