// The peer's renders without sockets or a link manager: rendering sessions, direct renders into
// shared memory, and what happens to frames that are queued, cancelled, refused or repeated. The
// drawing executor is run by hand, so that the order of events is the test's.
#include <gtest/gtest.h>

#include <chrono>
#include <deque>
#include <future>
#include <mutex>

#include "PeerRole.h"
#include "PeerService.h"
#include "PeerTestSupport.h"
#include "RenderService.h"
#include "platform/SharedMemory.h"
#include "tidelink/render/FrameLayout.h"

using namespace tidelink;
using namespace tidelink::peer;
using platform::Value;
using tidelink::peer::test::ExamplesDir;
namespace fs = std::filesystem;

namespace {

const std::string kPrefix = "com.quenlo.tidelink.";

// Runs what is posted when told to (and when waited for).
class ManualExecutor final : public platform::Executor {
public:
    void Post(Task task) override {
        std::lock_guard lock(mMutex);
        mTasks.push_back(std::move(task));
    }
    void WaitUntilIdle() override { RunAll(); }
    size_t RunAll() {
        size_t ran = 0;
        for (;;) {
            Task task;
            {
                std::lock_guard lock(mMutex);
                if (mTasks.empty()) return ran;
                task = std::move(mTasks.front());
                mTasks.pop_front();
            }
            task();
            ++ran;
        }
    }
    size_t Queued() {
        std::lock_guard lock(mMutex);
        return mTasks.size();
    }

private:
    std::mutex mMutex;
    std::deque<Task> mTasks;
};

// A reply that can be looked at once it came, and that counts its calls.
struct Answer {
    struct State {
        std::mutex mutex;
        std::promise<Outcome> promise;
        int calls = 0;
    };
    std::shared_ptr<State> state = std::make_shared<State>();
    std::shared_future<Outcome> future = state->promise.get_future().share();
    ReplyFn Fn() {
        auto s = state;
        return [s](Outcome o) {
            std::lock_guard lock(s->mutex);
            if (++s->calls == 1) s->promise.set_value(std::move(o));
        };
    }
    bool Came() const { return future.wait_for(std::chrono::seconds(0)) == std::future_status::ready; }
    Outcome Get() const {
        if (future.wait_for(std::chrono::seconds(20)) != std::future_status::ready) return Outcome::Error("not answered");
        return future.get();
    }
    std::string Text() const { return platform::ToUTF8(Get().message); }
    int Calls() const {
        std::lock_guard lock(state->mutex);
        return state->calls;
    }
};

// A buffer of the buffer service's kind, made here.
struct Buffer {
    explicit Buffer(uint64_t bytes, const std::string& prefix = "tlmbuf-") {
        name = prefix + "unit-" + platform::Guid::New().ToString();
        EXPECT_TRUE(file.Init(name, bytes, 0)) << name;
        size = bytes;
    }
    Value Destination(int64_t result = 0) const { return {{"result", result}, {"filename", name}, {"size", size}}; }
    const uint8_t* Data() const { return static_cast<const uint8_t*>(file.GetAddress()); }
    bool Untouched() const {
        for (uint64_t i = 0; i < size; ++i) {
            if (Data()[i] != 0) return false;
        }
        return true;
    }
    platform::MemoryMappedFile file;
    std::string name;
    uint64_t size = 0;
};

Value Time(int64_t n, int64_t d) { return {{"value", n}, {"scale", d}}; }

class RenderServiceTest : public ::testing::Test {
protected:
    void SetUp() override { Make(RenderService::Limits{}); }
    void TearDown() override {
        renders->Shutdown();
        service->Shutdown(100);
    }

    void Make(RenderService::Limits limits) {
        if (renders) renders->Shutdown();
        if (!service) {
            service = PeerService::Create(*RoleByName("kestrel"), platform::CreateCPUBoundExecutor(), nullptr);
            Answer opened;
            service->Handle(kPrefix + "OpenProject", Value::array({(ExamplesDir() / "demo.kstproj").string()}),
                            opened.Fn());
            ASSERT_TRUE(opened.Get().ok) << opened.Text();
            demo = service->OpenProjectFiles().back();
        }
        drawer = std::make_shared<ManualExecutor>();
        renders = RenderService::Create(service, drawer, limits);
    }

    Answer Send(const std::string& name, Value args) {
        Answer a;
        renders->Handle(nullptr, kPrefix + name, args, a.Fn());
        return a;
    }
    // A request answered from the project queue (session creation), waited for.
    Outcome Ask(const std::string& name, Value args) { return Send(name, std::move(args)).Get(); }

    const Item& ItemAt(const char* path) { return *service->OpenProject(demo.string())->FindByPath(path); }
    Value Direct(const char* path, const Guid& frame, Value time, const VideoRenderOptions& options, const Buffer& b) {
        return Value::array({demo.string(), ItemAt(path).id.ToString(), frame.ToString(), std::move(time),
                             Value(options), b.Destination()});
    }

    std::shared_ptr<PeerService> service;
    std::shared_ptr<ManualExecutor> drawer;
    std::shared_ptr<RenderService> renders;
    fs::path demo;
};

}  // namespace

TEST_F(RenderServiceTest, DirectRendersWriteTheFrameTheGeneratorsDraw) {
    const Composition& comp = *ItemAt("Compositions/Demo 1080p29.97").composition;
    VideoRenderOptions options;
    options.SetBounds(480, 270);
    options.SetPixelFormats({platform::PixelFormat{kPixelFormatRGBA}});
    platform::RectT<int> roi;
    roi.mTopLeft = {800, 400};
    roi.mSize = {400, 300};
    options.SetRegionOfInterest(roi);
    const FrameGeometry g = ResolveFrameGeometry(comp, options);
    const Rational time(1001 * 45, 30000);

    // Through a session, and with the options on the request: the same frame.
    const Outcome session = Ask("CreateVideoRenderingSession",
                                Value::array({demo.string(), ItemAt("Compositions/Demo 1080p29.97").id.ToString(),
                                              Value(options)}));
    ASSERT_TRUE(session.ok) << platform::ToUTF8(session.message);
    EXPECT_EQ(renders->VideoSessionCount(), 1u);
    Buffer viaSession(g.FrameBytes() + 64), plain(g.FrameBytes());
    Answer a = Send("RenderSessionVideoDirect",
                    Value::array({demo.string(), Guid().ToString(), Guid::New().ToString(), Time(1001 * 45, 30000),
                                  viaSession.Destination(), session.value}));
    Answer b = Send("RenderVideoDirect", Direct("Compositions/Demo 1080p29.97", Guid::New(), Time(1001 * 45, 30000),
                                                options, plain));
    EXPECT_EQ(drawer->RunAll(), 2u);
    ASSERT_TRUE(a.Get().ok) << a.Text();
    ASSERT_TRUE(b.Get().ok) << b.Text();

    const auto expected = test::ExpectedFrame(comp, time, g);
    for (const Buffer* buffer : {&viaSession, &plain}) {
        const auto header = ReadFrameHeader(buffer->Data(), buffer->size);
        ASSERT_TRUE(header.has_value());
        EXPECT_EQ(header->mWidth, 100u);  // 400 of 1920 at 480
        EXPECT_EQ(header->mHeight, 75u);
        EXPECT_EQ(header->mRowBytes, 400u);
        EXPECT_EQ(header->mPixelFormat, kPixelFormatRGBA);
        EXPECT_EQ(header->mFieldType, 0);
        EXPECT_EQ(header->mTime, time);
        EXPECT_EQ(header->mPixelAspectNumerator, 1u);
        EXPECT_EQ(std::memcmp(buffer->Data() + kFrameHeaderBytes, expected.data(), expected.size()), 0);
    }
    EXPECT_EQ(renders->FramesInFlight(), 0u);
    EXPECT_TRUE(Send("DisposeVideoRenderingSession", Value::array({session.value})).Get().ok);
    EXPECT_EQ(renders->VideoSessionCount(), 0u);
}

TEST_F(RenderServiceTest, DirectRendersRefuseWhatTheyCannotWriteAndWriteNothing) {
    VideoRenderOptions options;
    options.SetBounds(64, 36);
    const uint64_t bytes = kFrameHeaderBytes + 64 * 36 * 4;
    auto refused = [&](Answer a, const char* words) {
        drawer->RunAll();
        const Outcome o = a.Get();
        EXPECT_FALSE(o.ok);
        EXPECT_NE(platform::ToUTF8(o.message).find(words), std::string::npos) << platform::ToUTF8(o.message);
        EXPECT_EQ(a.Calls(), 1);
    };
    Buffer small(bytes - 1), stranger(bytes, "other-"), fine(bytes);
    refused(Send("RenderVideoDirect", Direct("Compositions/Demo 1080p25", Guid::New(), Time(0, 1), options, small)),
            "the frame needs 9344");
    refused(Send("RenderVideoDirect", Direct("Compositions/Demo 1080p25", Guid::New(), Time(0, 1), options, stranger)),
            "not a buffer of the link manager");
    Value args = Direct("Compositions/Demo 1080p25", Guid::New(), Time(0, 1), options, fine);
    args[5]["result"] = -1;
    refused(Send("RenderVideoDirect", args), "reports result -1");
    args = Direct("Compositions/Demo 1080p25", Guid::New(), Time(0, 1), options, fine);
    args[5] = Value::object({{"filename", fine.name}});
    refused(Send("RenderVideoDirect", args), "{\"result\", \"filename\", \"size\"}");
    refused(Send("RenderVideoDirect", Direct("Elements", Guid::New(), Time(0, 1), options, fine)), "is a bin");
    refused(Send("RenderSessionVideoDirect", Value::array({demo.string(), Guid().ToString(), Guid::New().ToString(),
                                                           Time(0, 1), fine.Destination(), Guid::New().ToString()})),
            "No video rendering session");
    args = Direct("Compositions/Demo 1080p25", Guid::New(), Time(0, 1), options, fine);
    args[0] = (ExamplesDir() / "titles.ospproj").string();
    refused(Send("RenderVideoDirect", args), "is not open");
    options.SetDownsampleFactor(0, 1);
    refused(Send("RenderVideoDirect", Direct("Compositions/Demo 1080p25", Guid::New(), Time(0, 1), options, fine)),
            "downsample");
    EXPECT_TRUE(small.Untouched());
    EXPECT_TRUE(stranger.Untouched());
    EXPECT_TRUE(fine.Untouched());

    // Arguments without a readable frame are answered at once, before anything is queued.
    Answer bad = Send("RenderVideoDirect", Value::array({demo.string(), Guid::New().ToString(), "frame"}));
    EXPECT_TRUE(bad.Came());
    EXPECT_NE(bad.Text().find("Bad arguments for RenderVideoDirect"), std::string::npos);
    EXPECT_NE(Send("RenderVideo", Value::object()).Text().find("not a list"), std::string::npos);
    EXPECT_NE(Send("NoSuchRender", Value::array()).Text().find("does not answer"), std::string::npos);
    EXPECT_NE(Send("RenderVideoForFarland", Value::array({Value::object()})).Text().find("argument 2"), std::string::npos);
}

TEST_F(RenderServiceTest, QueuedFramesAreCancelledOnceAndNeverRenderedTwice) {
    VideoRenderOptions options;
    options.SetBounds(64, 36);
    const uint64_t bytes = kFrameHeaderBytes + 64 * 36 * 4;
    Buffer first(bytes), second(bytes), third(bytes), fourth(bytes);
    const char* comp = "Compositions/Demo 1080p25";

    // The same frame asked for twice: the second is refused, the first still drawn.
    const Guid repeated = Guid::New();
    Answer a = Send("RenderVideoDirect", Direct(comp, repeated, Time(0, 1), options, first));
    Answer again = Send("RenderVideoDirect", Direct(comp, repeated, Time(0, 1), options, second));
    // Cancelled while queued: dropped.
    const Guid cancelled = Guid::New();
    Answer c = Send("RenderVideoDirect", Direct(comp, cancelled, Time(0, 1), options, third));
    EXPECT_TRUE(Send("CancelVideoRender", Value::array({cancelled.ToString()})).Get().ok);
    // Cancelled before its request came: dropped when it comes.
    const Guid early = Guid::New();
    renders->Handle(nullptr, kPrefix + "CancelVideoRender", Value::array({early.ToString()}), nullptr);
    Answer e = Send("RenderVideoDirect", Direct(comp, early, Time(0, 1), options, fourth));
    drawer->RunAll();

    EXPECT_TRUE(a.Get().ok) << a.Text();
    EXPECT_FALSE(first.Untouched());
    EXPECT_NE(again.Text().find("being rendered already"), std::string::npos);
    EXPECT_TRUE(second.Untouched());
    EXPECT_NE(c.Text().find("was cancelled"), std::string::npos);
    EXPECT_TRUE(third.Untouched());
    EXPECT_NE(e.Text().find("was cancelled"), std::string::npos);
    EXPECT_TRUE(fourth.Untouched());
    for (const Answer* x : {&a, &again, &c, &e}) EXPECT_EQ(x->Calls(), 1);
    // A cancel that finds nothing is remembered once: the frame can be asked for again.
    Answer later = Send("RenderVideoDirect", Direct(comp, early, Time(0, 1), options, fourth));
    drawer->RunAll();
    EXPECT_TRUE(later.Get().ok) << later.Text();
    EXPECT_EQ(renders->FramesInFlight(), 0u);
}

TEST_F(RenderServiceTest, FramesInFlightAndSessionsAreLimited) {
    RenderService::Limits limits;
    limits.framesInFlight = 1;
    limits.sessions = 2;
    Make(limits);
    VideoRenderOptions options;
    options.SetBounds(16, 9);
    Buffer one(kFrameHeaderBytes + 16 * 9 * 4), two(kFrameHeaderBytes + 16 * 9 * 4);
    Answer a = Send("RenderVideoDirect", Direct("Compositions/Demo 1080p25", Guid::New(), Time(0, 1), options, one));
    Answer b = Send("RenderVideoDirect", Direct("Compositions/Demo 1080p25", Guid::New(), Time(0, 1), options, two));
    drawer->RunAll();
    EXPECT_TRUE(a.Get().ok);
    EXPECT_NE(b.Text().find("Too many frames in flight (1)"), std::string::npos);

    const Value create = Value::array({demo.string(), ItemAt("Elements/Colour bars").id.ToString(), Value(options)});
    const Outcome s1 = Ask("CreateVideoRenderingSession", create);
    ASSERT_TRUE(Ask("CreateVideoRenderingSession", create).ok);
    EXPECT_NE(platform::ToUTF8(Ask("CreateVideoRenderingSession", create).message).find("Too many"), std::string::npos);
    Send("DisposeVideoRenderingSession", Value::array({s1.value}));
    EXPECT_TRUE(Ask("CreateVideoRenderingSession", create).ok);

    // Sessions are checked when made.
    Value unknown = create;
    unknown[1] = Guid::New().ToString();
    EXPECT_NE(platform::ToUTF8(Ask("CreateVideoRenderingSession", unknown).message).find("has no item"), std::string::npos);
    VideoRenderOptions bad;
    bad.SetBounds(-5, 0);
    Value badOptions = create;
    badOptions[2] = Value(bad);
    EXPECT_NE(platform::ToUTF8(Ask("CreateVideoRenderingSession", badOptions).message).find("bounds"), std::string::npos);
    EXPECT_NE(platform::ToUTF8(Ask("CreateFarlandVideoRenderingSession", Value::array({Value::object()})).message)
                  .find("Farland"),
              std::string::npos);
}

TEST_F(RenderServiceTest, AudioSessionsAreCheckedWhenMade) {
    const std::string comp = ItemAt("Compositions/Demo 1080p25").id.ToString();
    AudioRenderOptions options;
    options.SetSampleRate(platform::FrameRate(platform::kTicksPerSecond / 48000));
    auto create = [&](const AudioRenderOptions& o, Value samples, const std::string& source) {
        return Ask("CreateAudioRenderingSession",
                   Value::array({demo.string(), source, Value(o), Time(1, 3), std::move(samples)}));
    };
    const Outcome ok = create(options, 1024, comp);
    ASSERT_TRUE(ok.ok) << platform::ToUTF8(ok.message);
    EXPECT_EQ(renders->AudioSessionCount(), 1u);
    EXPECT_NE(platform::ToUTF8(create(options, 0, comp).message).find("samples per buffer"), std::string::npos);
    EXPECT_NE(platform::ToUTF8(create(options, "many", comp).message).find("samples per buffer"), std::string::npos);
    EXPECT_NE(platform::ToUTF8(create(options, 1024, ItemAt("Elements").id.ToString()).message).find("is a bin"),
              std::string::npos);
    AudioRenderOptions odd;
    odd.SetSampleRate(platform::FrameRate(7));
    EXPECT_NE(platform::ToUTF8(create(odd, 1024, comp).message).find("whole number"), std::string::npos);
    EXPECT_NE(platform::ToUTF8(create(options, kMaxSamplesPerBuffer + 1, comp).message).find("samples per buffer"),
              std::string::npos);
    EXPECT_TRUE(Send("DisposeAudioRenderingSession", Value::array({ok.value})).Get().ok);
    EXPECT_EQ(renders->AudioSessionCount(), 0u);
}

TEST_F(RenderServiceTest, ShutdownAnswersWhatIsQueuedAndRefusesTheRest) {
    VideoRenderOptions options;
    options.SetBounds(16, 9);
    Buffer buffer(kFrameHeaderBytes + 16 * 9 * 4);
    Answer queued = Send("RenderVideoDirect", Direct("Compositions/Demo 1080p25", Guid::New(), Time(0, 1), options, buffer));
    EXPECT_FALSE(queued.Came());
    renders->Shutdown();  // runs the queue: the frame is dropped, and answered
    EXPECT_NE(queued.Text().find("was cancelled"), std::string::npos);
    EXPECT_TRUE(buffer.Untouched());
    EXPECT_NE(Send("RenderVideoDirect", Direct("Compositions/Demo 1080p25", Guid::New(), Time(0, 1), options, buffer))
                  .Text()
                  .find("shutting down"),
              std::string::npos);
}
