// End to end: frames and audio chunks of a composition rendered by the reference peer, received
// by this host through the link manager as shared memory, mapped, read and dropped.
//
//   bench_frames [--json] [--seconds S]
//
// Per frame size (360p, 1080p, 2160p, BGRA, a fill-only composition) and frames in flight (1, 2,
// 8): frames per second, latency from request to dropped reference (median, 99th percentile),
// the overhead beyond the floor at the median, and new mappings per frame in steady state. The
// floor, measured in the same run, is one process filling and then reading the same bytes in a
// reused buffer (the shared-binary-data benchmark's floor). The same for audio chunks of 1024
// and 4800 samples (48 kHz stereo). Without TIDELINK_SUITE_VERSION it runs a private link manager
// and stops it at the end.
#include <signal.h>

#include <algorithm>
#include <atomic>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <string>
#include <vector>

#include "LinkBench.h"
#include "platform/Config.h"
#include "platform/Process.h"
#include "platform/Rpc.h"
#include "platform/Sync.h"
#include "processcoordination/MappedAudioData.h"
#include "processcoordination/ProcessCoordination.h"
#include "tidelink/core/LinkManager.h"
#include "tidelink/peers/PeerServers.h"
#include "tidelink/peers/Project.h"
#include "tidelink/peers/Source.h"
#include "tidelink/render/FrameLayout.h"

using namespace tidelink;
using namespace tidelink::platform;
using bench::Await;
using bench::ManagerInfo;
namespace pc = processcoordination;

namespace {

const std::string kProject = std::string(TIDELINK_SOURCE_DIR) + "/examples/projects/bench.kstproj";
constexpr int kWarmup = 8;

struct Size {
    const char* name;
    const char16_t* item;
    int width;
    int height;
};
constexpr Size kSizes[] = {{"360p", u"Fill 360p", 640, 360},
                           {"1080p", u"Fill 1080p", 1920, 1080},
                           {"2160p", u"Fill 2160p", 3840, 2160}};
constexpr int kDepths[] = {1, 2, 8};
constexpr uint32_t kChunks[] = {1024, 4800};

uint64_t Sum(const void* data, uint64_t size) {
    const auto* p = static_cast<const uint64_t*>(data);
    uint64_t s = 0;
    for (uint64_t i = 0; i < size / 8; ++i) s += p[i];
    return s;
}

// One process filling and then reading a reused buffer of |bytes|: frames per second.
double Floor(uint64_t bytes, double seconds) {
    std::vector<uint64_t> buffer(bytes / 8 + 1);
    uint64_t sink = 0;
    int frames = 0;
    const double start = NowSeconds();
    double now = start;
    while (now - start < seconds || frames < 10) {
        std::fill(buffer.begin(), buffer.end(), static_cast<uint64_t>(frames));
        sink += Sum(buffer.data(), bytes);
        ++frames;
        now = NowSeconds();
    }
    if (sink == 42) std::printf(" ");
    return frames / (now - start);
}

double Percentile(std::vector<double> v, double q) {
    if (v.empty()) return 0;
    std::sort(v.begin(), v.end());
    return v[std::min(v.size() - 1, static_cast<size_t>(q * static_cast<double>(v.size())))];
}

// Keeps |depth| requests in flight for |seconds|; |request| starts one and calls |done| once with
// whether it succeeded.
struct Pump {
    using Request = std::function<void(std::function<void(bool)> done)>;
    std::mutex mutex;
    std::vector<double> latencies;
    std::atomic<int> completed{0};
    std::atomic<int> failures{0};
    std::atomic<int> inFlight{0};
    double start = 0, steadyStart = 0, end = 0;
    uint64_t mappingsAtSteady = 0;
    Gate finished;

    void Run(int depth, double seconds, const Request& request) {
        start = NowSeconds();
        std::function<void()> next = [&] {
            const double started = NowSeconds();
            ++inFlight;
            request([&, started](bool ok) {
                const double now = NowSeconds();
                if (!ok) ++failures;
                const int n = ++completed;
                if (n == kWarmup) {
                    steadyStart = now;
                    mappingsAtSteady = pc::GetMappedFileCacheStats().mappingsCreated;
                } else if (n > kWarmup) {
                    std::lock_guard lock(mutex);
                    latencies.push_back((now - started) * 1e6);
                }
                const bool more = now - start < seconds || n < kWarmup + 20;
                if (more) next();
                if (--inFlight == 0) {
                    end = now;
                    finished.Open();
                }
            });
        };
        for (int i = 0; i < depth; ++i) next();
        finished.Wait();
    }
};

Value Figures(Pump& pump, double floorFps) {
    const auto steadyFrames = static_cast<double>(pump.latencies.size());
    const double fps = steadyFrames / std::max(1e-9, pump.end - pump.steadyStart);
    const double p50 = Percentile(pump.latencies, 0.5);
    const double floorUs = 1e6 / floorFps;
    Value v = Value::object();
    v["fps"] = std::round(fps * 10) / 10;
    v["floor_fps"] = std::round(floorFps * 10) / 10;
    v["ratio"] = std::round(fps / floorFps * 1000) / 1000;
    v["p50_us"] = std::round(p50);
    v["p99_us"] = std::round(Percentile(pump.latencies, 0.99));
    v["overhead_p50_us"] = std::round(p50 - floorUs);
    v["new_mappings_per_frame"] =
        std::round(static_cast<double>(pc::GetMappedFileCacheStats().mappingsCreated - pump.mappingsAtSteady) /
                   std::max(1.0, steadyFrames) * 1000) /
        1000;
    v["frames"] = pump.latencies.size();
    if (pump.failures > 0) v["failures"] = pump.failures.load();
    return v;
}

}  // namespace

int main(int argc, char** argv) {
    bool json = false;
    double seconds = 1.5;
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg == "--json") {
            json = true;
        } else if (arg == "--seconds" && i + 1 < argc) {
            seconds = std::max(0.2, std::atof(argv[++i]));
        } else {
            std::fprintf(stderr, "usage: bench_frames [--json] [--seconds S]\n");
            return 2;
        }
    }
    const bool privateManager = std::getenv("TIDELINK_SUITE_VERSION") == nullptr;
    if (privateManager) {
        const std::string version = "8" + std::to_string(10000 + GetCurrentProcessID() % 90000);
        ::setenv("TIDELINK_SUITE_VERSION", version.c_str(), 1);
    }
    SetClientInfo(u"bench_frames", u"1.0");
    pc::InitializeClient();

    Await<KestrelServerPtr> described;
    KestrelServer::CreateTideLinkServer(described.Callback());
    auto kestrel = described.Get();
    Await<ServerPtr> linked;
    if (kestrel) kestrel->CreateLink(linked.Callback());
    auto server = kestrel ? linked.Get() : nullptr;
    Await<ProjectPtr> opened;
    if (server) server->OpenProject(opened.Callback(), kProject);
    ProjectPtr project = server ? opened.Get() : nullptr;
    if (!project) {
        std::fprintf(stderr, "bench_frames: cannot open %s\n", kProject.c_str());
        return 1;
    }
    Await<ContainerPtr> root;
    project->GetContainer(root.Callback(), Guid());
    auto container = root.Get();
    auto find = [&](const std::u16string& name) -> SourcePtr {
        if (!container) return nullptr;
        for (const auto& item : container->GetContainedItems()) {
            if (item.mName != name) continue;
            Await<SourcePtr> got;
            project->GetSource(got.Callback(), item.mID);
            return got.Get();
        }
        return nullptr;
    };

    Value out = Value::object();
    int failures = 0;
    for (const auto& size : kSizes) {
        SourcePtr source = find(size.item);
        if (!source) {
            std::fprintf(stderr, "bench_frames: no item \"%s\" in %s\n", ToUTF8(size.item).c_str(), kProject.c_str());
            return 1;
        }
        const uint64_t bytes = static_cast<uint64_t>(size.width) * size.height * 4;
        const double floorFps = Floor(bytes, seconds);
        Await<VideoRendererPtr> started;
        source->GetVideoRenderer(started.Callback(), VideoRenderOptions());
        VideoRendererPtr renderer = started.Get();
        if (!renderer) {
            std::fprintf(stderr, "bench_frames: cannot render %s\n", size.name);
            return 1;
        }
        const int64_t tpf = source->GetFrameRate().TicksPerFrame();
        std::atomic<int64_t> frameNumber{0};
        std::atomic<uint64_t> sink{0};
        for (int depth : kDepths) {
            Pump pump;
            pump.Run(depth, seconds, [&](std::function<void(bool)> done) {
                const int64_t n = frameNumber++ % 250;
                renderer->RenderVideo(
                    [done, &sink](const Guid&, pc::BinaryReferencePtr ref, int result) {
                        bool ok = result == 0 && ref;
                        if (ok) {
                            const void* p = ref->MapIntoCurrentProcess();
                            ok = p != nullptr;
                            if (ok) {
                                sink += Sum(p, ref->GetSize());
                                ref->UnmapFromCurrentProcess(p);
                            }
                        }
                        ref.reset();
                        done(ok);
                    },
                    Guid::New(), RatioTime(n * tpf, kTicksPerSecond));
            });
            failures += pump.failures;
            Value v = Figures(pump, floorFps);
            if (!json) {
                std::printf("%-6s d%d  %8.1f fps (floor %8.1f, ratio %.2f)  p50 %7.0f us  p99 %7.0f us  "
                            "overhead p50 %6.0f us  mappings/frame %.3f\n",
                            size.name, depth, v["fps"].get<double>(), floorFps, v["ratio"].get<double>(),
                            v["p50_us"].get<double>(), v["p99_us"].get<double>(), v["overhead_p50_us"].get<double>(),
                            v["new_mappings_per_frame"].get<double>());
            }
            out[size.name]["d" + std::to_string(depth)] = std::move(v);
        }
    }

    // Audio chunks of the 1080p composition's tone, 48 kHz stereo.
    SourcePtr audioSource = find(u"Fill 1080p");
    for (uint32_t samples : kChunks) {
        if (!audioSource || !audioSource->HasAudio()) break;
        AudioRenderOptions options;
        options.SetSampleRate(FrameRate(kTicksPerSecond / 48000));
        options.SetAudioChannelLayout(CreateStereoChannelLayout());
        Await<AudioRendererPtr> started;
        audioSource->GetAudioRenderer(started.Callback(), options, RatioTime(0), samples);
        AudioRendererPtr renderer = started.Get();
        if (!renderer) break;
        const uint64_t bytes = pc::kAudioChunkHeaderBytes + uint64_t{8} * samples;
        const double floorFps = Floor(bytes, seconds / 2);
        for (int depth : {1, 8}) {
            Pump pump;
            pump.Run(depth, seconds, [&](std::function<void(bool)> done) {
                renderer->RenderAudio(
                    [done](const Guid&, pc::BinaryReferencePtr ref, int result) {
                        bool ok = result == 0 && ref;
                        if (ok) {
                            pc::MappedAudioData chunk;
                            ok = chunk.Init(ref) == 0 && chunk.GetChannelCount() == 2;
                        }
                        ref.reset();
                        done(ok);
                    },
                    Guid::New());
            });
            failures += pump.failures;
            Value v = Figures(pump, floorFps);
            if (!json) {
                std::printf("audio %5u d%d  %8.1f chunks/s (floor %9.1f)  p50 %6.0f us  p99 %6.0f us\n", samples,
                            depth, v["fps"].get<double>(), floorFps, v["p50_us"].get<double>(),
                            v["p99_us"].get<double>());
            }
            out["audio"][std::to_string(samples)]["d" + std::to_string(depth)] = std::move(v);
        }
    }

    project.reset();
    server.reset();
    kestrel.reset();
    if (privateManager) {
        const auto pid = bench::ManagerInfo(10).value("pid", 0u);
        if (pid != 0) ::kill(static_cast<pid_t>(pid), SIGTERM);
    }
    pc::UninitializeClient();
    if (json) std::printf("%s\n", ToJSONText(out).c_str());
    if (failures > 0) std::fprintf(stderr, "bench_frames: %d frames or chunks failed\n", failures);
    return failures > 0 ? 1 : 0;
}
