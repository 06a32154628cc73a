// The road of a frame with real processes: this test process opens a project of the reference
// peer through the link manager, reads its items and sources, and receives rendered frames and
// audio as shared memory, checked pixel- and sample-exact against the peer's own generators.
#include <gtest/gtest.h>
#include <signal.h>

#include <atomic>
#include <cstring>
#include <filesystem>
#include <map>
#include <mutex>

#include "Generators.h"
#include "Harness.h"
#include "ProjectModel.h"
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
using namespace tidelink::test;
namespace pc = processcoordination;

namespace {

constexpr int kWaitMs = 30000;

std::string Example(const std::string& name) {
    return std::string(TIDELINK_SOURCE_DIR) + "/examples/projects/" + name;
}

// One callback's result; counts the calls to catch a second completion.
template <class... T>
struct Outcome {
    struct State {
        std::mutex mutex;
        Gate gate;
        int calls = 0;
        std::tuple<T...> values;
    };
    std::shared_ptr<State> state = std::make_shared<State>();
    Outcome() = default;
    Outcome(const Outcome&) = delete;
    // The callback may live on inside the object it delivered (a source keeps its creation
    // callback): drop what it delivered so that nothing keeps itself alive.
    ~Outcome() {
        std::lock_guard lock(state->mutex);
        state->values = {};
    }
    auto Callback() {
        auto s = state;
        return [s](T... v) {
            std::lock_guard lock(s->mutex);
            if (++s->calls == 1) s->values = std::make_tuple(std::move(v)...);
            s->gate.Open();
        };
    }
    bool Wait(int ms = kWaitMs) { return state->gate.Wait(ms); }
    template <size_t I>
    auto Take() {
        std::lock_guard lock(state->mutex);
        return std::move(std::get<I>(state->values));
    }
    int Calls() {
        std::lock_guard lock(state->mutex);
        return state->calls;
    }
};

ProjectPtr OpenDemo(const std::string& file = Example("demo.kstproj")) {
    Outcome<ConnectionStatus, KestrelServerPtr> described;
    KestrelServer::CreateTideLinkServer(described.Callback());
    EXPECT_TRUE(described.Wait());
    auto kestrel = described.Take<1>();
    if (!kestrel) return nullptr;
    Outcome<ConnectionStatus, ServerPtr> linked;
    kestrel->CreateLink(linked.Callback());
    EXPECT_TRUE(linked.Wait());
    auto server = linked.Take<1>();
    if (!server) return nullptr;
    Outcome<ConnectionStatus, ProjectPtr> opened;
    server->OpenProject(opened.Callback(), file);
    EXPECT_TRUE(opened.Wait());
    return opened.Take<1>();
}

ContainerPtr GetContainer(const ProjectPtr& project, const Guid& id) {
    Outcome<ConnectionStatus, ContainerPtr> got;
    project->GetContainer(got.Callback(), id);
    EXPECT_TRUE(got.Wait());
    return got.Take<1>();
}

// The first item of |type| anywhere in the project, depth first.
std::optional<ItemInfo> FindItem(const ProjectPtr& project, const std::u16string& name) {
    std::function<std::optional<ItemInfo>(const Guid&)> visit = [&](const Guid& id) -> std::optional<ItemInfo> {
        auto container = GetContainer(project, id);
        if (!container) return std::nullopt;
        for (const auto& item : container->GetContainedItems()) {
            if (item.mName == name) return item;
            if (item.mType == 1) {
                if (auto found = visit(item.mID)) return found;
            }
        }
        return std::nullopt;
    };
    return visit(Guid());
}

SourcePtr GetSource(const ProjectPtr& project, const std::u16string& name) {
    auto item = FindItem(project, name);
    EXPECT_TRUE(item.has_value()) << ToUTF8(name);
    if (!item) return nullptr;
    Outcome<ConnectionStatus, SourcePtr> got;
    project->GetSource(got.Callback(), item->mID);
    EXPECT_TRUE(got.Wait());
    return got.Take<1>();
}

VideoRendererPtr GetRenderer(const SourcePtr& source, const VideoRenderOptions& options = {}) {
    Outcome<ConnectionStatus, VideoRendererPtr> got;
    source->GetVideoRenderer(got.Callback(), options);
    EXPECT_TRUE(got.Wait());
    return got.Take<1>();
}

// A source like |source| but with sessions turned on or off.
SourcePtr WithSessions(const SourcePtr& source, bool sessions) {
    SourceInfo info = source->GetSourceInfo();
    info.mSupportsVideoRenderingSessions = sessions;
    auto copy = Source::CreateSource(source->GetReconnect(), nullptr);
    copy->Init(info);
    return copy;
}

struct Frame {
    int result = -100;
    pc::BinaryReferencePtr reference;
};

// Renders one frame and waits for it.
Frame Render(const VideoRendererPtr& renderer, const RatioTime& time) {
    Outcome<Guid, pc::BinaryReferencePtr, int> got;
    auto cb = got.Callback();
    renderer->RenderVideo([cb](const Guid& id, pc::BinaryReferencePtr r, int result) { cb(id, std::move(r), result); },
                          Guid::New(), time);
    EXPECT_TRUE(got.Wait());
    return {got.Take<2>(), got.Take<1>()};
}

// What the peer must have drawn: its own generators over the composition of the project file.
std::vector<uint8_t> Expected(const std::string& file, const std::string& path, const RatioTime& time, int width,
                              int height) {
    const auto model = peer::ProjectModel::Load(file);
    const auto* item = model.FindByPath(path);
    EXPECT_NE(item, nullptr) << path;
    std::vector<uint8_t> pixels(static_cast<size_t>(width) * height * 4);
    if (!item || !item->composition) return pixels;
    peer::RenderCompositionFrame(*item->composition, peer::Rational(time.numerator(), time.denominator()),
                                 {pixels.data(), width, height, static_cast<size_t>(width) * 4});
    return pixels;
}

// Compares a delivered frame with the expected pixels, row by row.
void ExpectPixels(const Frame& frame, const std::vector<uint8_t>& expected, int width, int height) {
    ASSERT_EQ(frame.result, 0);
    ASSERT_TRUE(frame.reference);
    const void* data = frame.reference->MapIntoCurrentProcess();
    ASSERT_NE(data, nullptr);
    const auto header = ReadFrameHeader(data, frame.reference->GetSize());
    ASSERT_TRUE(header.has_value());
    EXPECT_EQ(header->mWidth, static_cast<uint32_t>(width));
    EXPECT_EQ(header->mHeight, static_cast<uint32_t>(height));
    EXPECT_EQ(header->mPixelFormat, kPixelFormatBGRA);
    int badRows = 0;
    if (header->mWidth == static_cast<uint32_t>(width) && header->mHeight == static_cast<uint32_t>(height)) {
        const auto* pixels = static_cast<const uint8_t*>(data) + kFrameHeaderBytes;
        for (int y = 0; y < height; ++y) {
            if (std::memcmp(pixels + static_cast<size_t>(y) * header->mRowBytes,
                            expected.data() + static_cast<size_t>(y) * width * 4, static_cast<size_t>(width) * 4) != 0) {
                ++badRows;
            }
        }
    }
    EXPECT_EQ(badRows, 0);
    frame.reference->UnmapFromCurrentProcess(data);
}

RatioTime FrameTime(const SourcePtr& source, int64_t frame) {
    return RatioTime(frame * source->GetFrameRate().TicksPerFrame(), kTicksPerSecond);
}

class RenderTest : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_TRUE(pc::InitializeClient()); }
    void TearDown() override { pc::UninitializeClient(); }
};

}  // namespace

TEST_F(RenderTest, ProjectRequestsReachThePeer) {
    ProjectPtr project = OpenDemo();
    ASSERT_TRUE(project);
    // The root and a bin below it.
    auto root = GetContainer(project, Guid());
    ASSERT_TRUE(root);
    const auto top = root->GetContainedItems();
    ASSERT_EQ(top.size(), 2u);
    EXPECT_EQ(top[0].mName, u"Compositions");
    EXPECT_EQ(top[0].mType, 1);
    auto bin = GetContainer(project, top[0].mID);
    ASSERT_TRUE(bin);
    EXPECT_EQ(bin->GetName(), u"Compositions");
    EXPECT_EQ(bin->GetID(), top[0].mID);
    ASSERT_FALSE(bin->GetContainedItems().empty());
    const ItemInfo comp = bin->GetContainedItems()[0];

    // An unknown container or source fails once.
    Outcome<ConnectionStatus, ContainerPtr> noBin;
    project->GetContainer(noBin.Callback(), Guid::New());
    ASSERT_TRUE(noBin.Wait());
    EXPECT_EQ(noBin.Take<0>(), ConnectionStatus::Failed);
    Outcome<ConnectionStatus, SourcePtr> noSource;
    project->GetSource(noSource.Callback(), Guid::New());
    ASSERT_TRUE(noSource.Wait());
    EXPECT_EQ(noSource.Take<0>(), ConnectionStatus::Failed);

    Outcome<ConnectionStatus, bool> linked;
    project->IsSourceLinked(linked.Callback(), comp.mID);
    ASSERT_TRUE(linked.Wait());
    EXPECT_EQ(linked.Take<0>(), ConnectionStatus::Connected);

    Outcome<ConnectionStatus, std::string> xml;
    project->GetItemsAsXML(xml.Callback(), {comp.mID});
    ASSERT_TRUE(xml.Wait());
    EXPECT_EQ(xml.Take<0>(), ConnectionStatus::Connected);
    EXPECT_NE(xml.Take<1>().find(comp.mID.ToString()), std::string::npos);

    Outcome<ConnectionStatus, projectprotocol::ProjectInfo, SourceInfo> snapshot;
    project->GetProjectSnapshot(snapshot.Callback(), comp.mID);
    ASSERT_TRUE(snapshot.Wait());
    EXPECT_EQ(snapshot.Take<0>(), ConnectionStatus::Connected);
    EXPECT_EQ(snapshot.Take<1>().mName, project->GetName());
    EXPECT_EQ(snapshot.Take<2>().mID, comp.mID);

    // A new source from a description, with and without XML.
    Outcome<ConnectionStatus, SourcePtr> created;
    const RectT<int> rect{{0, 0}, {640, 360}};
    project->CreateSource(created.Callback(), u"Made here", RatioTime(2), PixelAspectRatio(), rect,
                          FrameRate(kTicksPerSecond / 25), CreateStereoChannelLayout(), FrameRate(kTicksPerSecond / 48000),
                          false);
    ASSERT_TRUE(created.Wait());
    ASSERT_EQ(created.Take<0>(), ConnectionStatus::Connected);
    Outcome<ConnectionStatus, SourcePtr> fromXML;
    project->CreateSourceFromXML(fromXML.Callback(), std::u16string(u"<items/>"), u"From XML", RatioTime(1),
                                 PixelAspectRatio(), rect, FrameRate(kTicksPerSecond / 25), CreateStereoChannelLayout(),
                                 FrameRate(kTicksPerSecond / 48000), false);
    ASSERT_TRUE(fromXML.Wait());
    EXPECT_EQ(fromXML.Take<0>(), ConnectionStatus::Connected);

    // Notifications: nothing comes back, and the link stays usable.
    std::atomic<int> shown{0};
    project->ShowSource([&](ConnectionStatus, SourcePtr) { ++shown; }, comp.mID);
    project->SendFile(Example("demo.kstproj"));
    project->CreateItemsFromXML(std::string("<items/>"));
    Outcome<ConnectionStatus, uint32_t> font;
    project->RuntimeFontChange(font.Callback());
    ASSERT_TRUE(font.Wait());
    EXPECT_EQ(font.Take<0>(), ConnectionStatus::Connected);
    EXPECT_EQ(shown.load(), 0);
}

TEST_F(RenderTest, SourceRequestsReachThePeer) {
    ProjectPtr project = OpenDemo();
    ASSERT_TRUE(project);
    SourcePtr source = GetSource(project, u"Demo 1080p25");
    ASSERT_TRUE(source);
    EXPECT_EQ(source->GetFrameSize().mSize.mX, 1920);
    EXPECT_EQ(source->GetFrameSize().mSize.mY, 1080);
    EXPECT_EQ(source->GetFrameRate().TicksPerFrame(), kTicksPerSecond / 25);
    EXPECT_EQ(source->GetDuration(), RatioTime(10));
    EXPECT_TRUE(source->HasVideo());
    EXPECT_TRUE(source->HasAudio());
    EXPECT_EQ(source->GetParentProjectFile(), File(Example("demo.kstproj")));

    Outcome<ConnectionStatus, std::u16string> xml;
    source->GetXMLDescription(xml.Callback());
    ASSERT_TRUE(xml.Wait());
    EXPECT_EQ(xml.Take<0>(), ConnectionStatus::Connected);
    Outcome<ConnectionStatus, std::string> xml8;
    source->GetUTF8XMLDescription(xml8.Callback());
    ASSERT_TRUE(xml8.Wait());
    EXPECT_EQ(xml8.Take<0>(), ConnectionStatus::Connected);
    Outcome<ConnectionStatus, Guid> runtime;
    source->GetRuntimeGuid(runtime.Callback());
    ASSERT_TRUE(runtime.Wait());
    EXPECT_EQ(runtime.Take<0>(), ConnectionStatus::Connected);
    Outcome<ConnectionStatus, bool> containsLink;
    source->DoesSourceContainLink(containsLink.Callback());
    ASSERT_TRUE(containsLink.Wait());
    EXPECT_EQ(containsLink.Take<0>(), ConnectionStatus::Connected);
    Outcome<ConnectionStatus, std::string> xmp;
    source->RenderXMP(RatioTime(0), RatioTime(1), xmp.Callback());
    ASSERT_TRUE(xmp.Wait());
    EXPECT_EQ(xmp.Take<0>(), ConnectionStatus::Connected);
    Outcome<int> setXmp;
    source->SetXMP(setXmp.Callback(), "<x:xmpmeta/>");
    ASSERT_TRUE(setXmp.Wait());
    EXPECT_EQ(setXmp.Take<0>(), 0);
    Outcome<ConnectionStatus, CaptionData> captions;
    source->GetCaptionData(captions.Callback());
    ASSERT_TRUE(captions.Wait());
    EXPECT_EQ(captions.Take<0>(), ConnectionStatus::Connected);
    Outcome<ConnectionStatus, bool> selection;
    source->SetCaptionSelectionData(CaptionSelectionData{1, 0, {}}, selection.Callback());
    ASSERT_TRUE(selection.Wait());
    EXPECT_EQ(selection.Take<0>(), ConnectionStatus::Connected);
}

TEST_F(RenderTest, FramesArrivePixelExactWithAndWithoutSessions) {
    ProjectPtr project = OpenDemo();
    ASSERT_TRUE(project);
    SourcePtr source = GetSource(project, u"Demo 1080p25");
    ASSERT_TRUE(source);
    for (bool sessions : {true, false}) {
        SCOPED_TRACE(sessions ? "with a session" : "without a session");
        auto renderer = GetRenderer(WithSessions(source, sessions));
        ASSERT_TRUE(renderer);
        EXPECT_EQ(renderer->GetSessionID().IsNil(), !sessions);
        for (int64_t frame : {0, 1, 37, 249}) {
            const RatioTime time = FrameTime(source, frame);
            ExpectPixels(Render(renderer, time), Expected(Example("demo.kstproj"), "Compositions/Demo 1080p25", time,
                                                          1920, 1080),
                         1920, 1080);
        }
    }
    // Scaled to a bounding size: the pattern is laid out for that size.
    VideoRenderOptions small;
    small.SetBounds(640, 360);
    auto renderer = GetRenderer(source, small);
    ASSERT_TRUE(renderer);
    const RatioTime time = FrameTime(source, 12);
    const Frame frame = Render(renderer, time);
    ExpectPixels(frame, Expected(Example("demo.kstproj"), "Compositions/Demo 1080p25", time, 640, 360), 640, 360);
    // The frame number reads back from the pixels.
    const void* data = frame.reference->MapIntoCurrentProcess();
    ASSERT_NE(data, nullptr);
    const auto header = ReadFrameHeader(data, frame.reference->GetSize());
    ASSERT_TRUE(header);
    EXPECT_EQ(peer::DecodePatternFrame(static_cast<const uint8_t*>(data) + kFrameHeaderBytes, 640, 360,
                                       header->mRowBytes),
              12);
    frame.reference->UnmapFromCurrentProcess(data);
}

TEST_F(RenderTest, ManyFramesInFlightEachCompleteOnce) {
    ProjectPtr project = OpenDemo();
    ASSERT_TRUE(project);
    SourcePtr source = GetSource(project, u"Demo 1080p25");
    ASSERT_TRUE(source);
    VideoRenderOptions options;
    options.SetBounds(320, 180);
    auto renderer = GetRenderer(source, options);
    ASSERT_TRUE(renderer);
    constexpr int kFrames = 40;
    std::mutex mutex;
    std::map<int64_t, int> calls;
    std::map<int64_t, std::optional<int64_t>> decoded;
    Gate all;
    for (int64_t f = 0; f < kFrames; ++f) {
        renderer->RenderVideo(
            [&, f](const Guid&, pc::BinaryReferencePtr ref, int result) {
                std::optional<int64_t> number;
                if (result == 0 && ref) {
                    const void* data = ref->MapIntoCurrentProcess();
                    if (auto h = ReadFrameHeader(data, ref->GetSize())) {
                        number = peer::DecodePatternFrame(static_cast<const uint8_t*>(data) + kFrameHeaderBytes,
                                                          static_cast<int32_t>(h->mWidth),
                                                          static_cast<int32_t>(h->mHeight), h->mRowBytes);
                    }
                    ref->UnmapFromCurrentProcess(data);
                }
                std::lock_guard lock(mutex);
                ++calls[f];
                decoded[f] = number;
                if (calls.size() == kFrames) all.Open();
            },
            Guid::New(), FrameTime(source, f));
    }
    ASSERT_TRUE(all.Wait(kWaitMs));
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    std::lock_guard lock(mutex);
    for (int64_t f = 0; f < kFrames; ++f) {
        EXPECT_EQ(calls[f], 1) << f;
        EXPECT_EQ(decoded[f], f) << "frame " << f << " came back with another frame's pixels";
    }
}

TEST_F(RenderTest, CancelAndFailuresCompleteFramesOnce) {
    ProjectPtr project = OpenDemo();
    ASSERT_TRUE(project);
    SourcePtr source = GetSource(project, u"Demo 1080p25");
    ASSERT_TRUE(source);
    auto renderer = GetRenderer(source);
    ASSERT_TRUE(renderer);

    // Cancelled at once: -6, once.
    Outcome<Guid, pc::BinaryReferencePtr, int> cancelled;
    auto cb = cancelled.Callback();
    const Guid frameID = Guid::New();
    renderer->RenderVideo([cb](const Guid& id, pc::BinaryReferencePtr r, int result) { cb(id, std::move(r), result); },
                          frameID, FrameTime(source, 3));
    renderer->CancelVideoRender(frameID);
    ASSERT_TRUE(cancelled.Wait());
    EXPECT_EQ(cancelled.Take<2>(), pc::kResultCancelled);
    EXPECT_FALSE(cancelled.Take<1>());

    // A source the peer does not know: the render fails with the peer's code.
    SourceInfo unknown = source->GetSourceInfo();
    unknown.mID = Guid::New();
    unknown.mSupportsVideoRenderingSessions = false;
    auto stranger = Source::CreateSource(source->GetReconnect(), nullptr);
    stranger->Init(unknown);
    auto strangeRenderer = GetRenderer(stranger);
    ASSERT_TRUE(strangeRenderer);
    const Frame failed = Render(strangeRenderer, RatioTime(0));
    EXPECT_NE(failed.result, 0);
    EXPECT_FALSE(failed.reference);
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    EXPECT_EQ(cancelled.Calls(), 1);

    // A session the peer refuses: the renderer is not started.
    unknown.mSupportsVideoRenderingSessions = true;
    auto refusing = Source::CreateSource(source->GetReconnect(), nullptr);
    refusing->Init(unknown);
    Outcome<ConnectionStatus, VideoRendererPtr> refused;
    refusing->GetVideoRenderer(refused.Callback(), {});
    ASSERT_TRUE(refused.Wait());
    EXPECT_EQ(refused.Take<0>(), ConnectionStatus::Failed);

    // Rendering into a buffer of our own.
    pc::WritableBinaryReferencePtr target;
    const uint64_t bytes = kFrameHeaderBytes + uint64_t{1920} * 1080 * 4;
    ASSERT_EQ(pc::GetWritableBinaryData(bytes, target), 0);
    RenderDestination destination;
    ASSERT_TRUE(pc::DescribeWritableBinaryData(target, destination.mFileName, destination.mSize));
    Outcome<Guid, int> direct;
    renderer->RenderVideoDirect(direct.Callback(), Guid::New(), FrameTime(source, 5), destination);
    ASSERT_TRUE(direct.Wait());
    EXPECT_EQ(direct.Take<1>(), 0);
    void* data = target->MapIntoCurrentProcess();
    ASSERT_NE(data, nullptr);
    const auto header = ReadFrameHeader(data, bytes);
    ASSERT_TRUE(header);
    EXPECT_EQ(peer::DecodePatternFrame(static_cast<const uint8_t*>(data) + kFrameHeaderBytes, 1920, 1080,
                                       header->mRowBytes),
              5);
    target->UnmapFromCurrentProcess(data);
}

TEST_F(RenderTest, AudioChunksAreSampleExactAndContinuous) {
    ProjectPtr project = OpenDemo();
    ASSERT_TRUE(project);
    SourcePtr source = GetSource(project, u"Demo 1080p25");
    ASSERT_TRUE(source);
    ASSERT_TRUE(source->HasAudio());
    AudioRenderOptions options;
    options.SetSampleRate(source->GetAudioSampleRate());
    options.SetAudioChannelLayout(source->GetAudioChannelLayout());
    constexpr uint32_t kChunk = 1024;
    const RatioTime start(1, 3);  // 16000 samples in
    Outcome<ConnectionStatus, AudioRendererPtr> got;
    source->GetAudioRenderer(got.Callback(), options, start, kChunk);
    ASSERT_TRUE(got.Wait());
    AudioRendererPtr renderer = got.Take<1>();
    ASSERT_TRUE(renderer);

    const auto model = peer::ProjectModel::Load(Example("demo.kstproj"));
    const auto* comp = model.FindByPath("Compositions/Demo 1080p25");
    ASSERT_TRUE(comp && comp->composition);
    const size_t channels = comp->composition->channels.size();
    constexpr int kChunks = 6;
    std::vector<float> expected(static_cast<size_t>(kChunk) * kChunks * channels);
    peer::RenderCompositionAudio(*comp->composition, 16000, kChunk * kChunks, expected.data());

    for (int c = 0; c < kChunks; ++c) {
        Outcome<Guid, pc::BinaryReferencePtr, int> chunk;
        auto cb = chunk.Callback();
        renderer->RenderAudio([cb](const Guid& id, pc::BinaryReferencePtr r, int result) { cb(id, std::move(r), result); },
                              Guid::New());
        ASSERT_TRUE(chunk.Wait());
        ASSERT_EQ(chunk.Take<2>(), 0) << "chunk " << c;
        pc::MappedAudioData audio;
        ASSERT_EQ(audio.Init(chunk.Take<1>()), 0);
        ASSERT_EQ(audio.GetChannelCount(), channels);
        ASSERT_EQ(audio.GetSampleCount(), kChunk);
        float** planes = audio.GetAudioDataBuffer();
        int mismatches = 0;
        for (uint32_t i = 0; i < kChunk; ++i) {
            for (size_t ch = 0; ch < channels; ++ch) {
                const float want = expected[(static_cast<size_t>(c) * kChunk + i) * channels + ch];
                if (std::memcmp(&planes[ch][i], &want, sizeof(float)) != 0) ++mismatches;
            }
        }
        EXPECT_EQ(mismatches, 0) << "chunk " << c;
    }

    // A chunk at a chosen time is the same as the same samples in sequence.
    Outcome<Guid, pc::BinaryReferencePtr, int> atTime;
    auto cb = atTime.Callback();
    renderer->RenderAudioAtTime([cb](const Guid& id, pc::BinaryReferencePtr r, int result) { cb(id, std::move(r), result); },
                                Guid::New(), RatioTime(16000 + 2 * kChunk, 48000));
    ASSERT_TRUE(atTime.Wait());
    ASSERT_EQ(atTime.Take<2>(), 0);
    pc::MappedAudioData audio;
    ASSERT_EQ(audio.Init(atTime.Take<1>()), 0);
    const float want = expected[static_cast<size_t>(2) * kChunk * channels];
    EXPECT_EQ(std::memcmp(&audio.GetAudioDataBuffer()[0][0], &want, sizeof(float)), 0);
}

TEST_F(RenderTest, APeerKilledMidRenderCompletesEveryFrame) {
    ProjectPtr project = OpenDemo();
    ASSERT_TRUE(project);
    SourcePtr source = GetSource(project, u"Demo 1080p25");
    ASSERT_TRUE(source);
    // The source keeps its description across the restart: no replacement is reported.
    std::atomic<int> replacements{0};
    auto watched = Source::CreateSource(source->GetReconnect(), [&](ConnectionStatus, SourcePtr) { ++replacements; });
    watched->Init(source->GetSourceInfo());
    auto renderer = GetRenderer(source);
    ASSERT_TRUE(renderer);

    constexpr int kFrames = 24;
    std::mutex mutex;
    std::map<int, std::vector<int>> results;
    Gate all;
    auto render = [&](int index) {
        renderer->RenderVideo(
            [&, index](const Guid&, pc::BinaryReferencePtr, int result) {
                std::lock_guard lock(mutex);
                results[index].push_back(result);
                if (results.size() == kFrames) all.Open();
            },
            Guid::New(), FrameTime(source, index));
    };
    for (int i = 0; i < kFrames / 2; ++i) render(i);
    auto pids = [] {
        std::vector<uint32_t> out;
        for (uint32_t pid : GetProcessIDsForName("tidelinkpeer")) {
            if (GetProcessEnvironmentVariable(pid, "TIDELINK_SUITE_VERSION") == SuiteVersion()) out.push_back(pid);
        }
        return out;
    }();
    ASSERT_EQ(pids.size(), 1u);
    SendSignal(pids[0], SIGKILL);
    for (int i = kFrames / 2; i < kFrames; ++i) render(i);
    ASSERT_TRUE(all.Wait(kWaitMs));
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    {
        std::lock_guard lock(mutex);
        for (int i = 0; i < kFrames; ++i) EXPECT_EQ(results[i].size(), 1u) << "frame " << i;
    }
    // After the reconnection frames render again, from the new peer.
    ASSERT_TRUE(WaitFor([&] { return !source->GetReconnect()->IsReconnecting(); }, 30));
    const RatioTime time = FrameTime(source, 7);
    ExpectPixels(Render(renderer, time), Expected(Example("demo.kstproj"), "Compositions/Demo 1080p25", time, 1920, 1080),
                 1920, 1080);
    EXPECT_EQ(replacements.load(), 0);

    // A renderer destroyed with frames on the way: each frame still completes once, and the late
    // answers find no renderer to call into.
    auto late = std::make_shared<std::atomic<int>>(0);
    for (int i = 0; i < 4; ++i) {
        renderer->RenderVideo([late](const Guid&, pc::BinaryReferencePtr, int) { ++*late; }, Guid::New(),
                              FrameTime(source, i));
    }
    renderer.reset();
    EXPECT_TRUE(WaitFor([&] { return late->load() == 4; }, 30));
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    EXPECT_EQ(late->load(), 4);
}
