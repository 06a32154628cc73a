// Round trips of a fully populated SourceInfo (with template parameters) through the wire
// encoding: record -> tree -> MessagePack bytes -> tree -> record.
//
//   bench_records [--json] [--seconds S]
//
// The headline figure counts round trips per second of this thread's CPU time (one core);
// wall-clock throughput is printed beside it. The stage times are wall clock.
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <time.h>

#include "platform/Wire.h"
#include "tidelink/peers/LinkRecords.h"

using namespace tidelink;
using namespace tidelink::platform;
using Clock = std::chrono::steady_clock;

namespace {

// CPU time of this thread: the figure is per core, and stays meaningful on a shared machine.
double ThreadSeconds() {
    timespec ts{};
    clock_gettime(CLOCK_THREAD_CPUTIME_ID, &ts);
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) * 1e-9;
}

SourceInfo PopulatedSource() {
    SourceInfo s;
    s.mParentProjectFile = "/media/projects/Evening News/opener.proj";
    s.mFarlandAssetRequestInfo.mServerConnectInfo.mServerDiscoveryURL = "https://discovery.example";
    s.mFarlandAssetRequestInfo.mServerConnectInfo.mEARPort = "4433";
    s.mFarlandAssetRequestInfo.mServerConnectInfo.mUserName = "editor";
    s.mFarlandAssetRequestInfo.mServerConnectInfo.mAuthToken = std::string(64, 'k');
    s.mFarlandAssetRequestInfo.mServerConnectInfo.mAuthTokenType = "Bearer";
    s.mFarlandAssetRequestInfo.mServerConnectInfo.mHeaders = {{"X-Client", "tidelink"}};
    s.mFarlandAssetRequestInfo.mProductionIdentifier = "prod-0042";
    s.mFarlandAssetRequestInfo.mProductionRevision = "17";
    s.mFarlandAssetRequestInfo.mAssetIdentifier = "asset-9f3c";
    s.mFarlandProductionRequestInfo.mServerConnectInfo =
        s.mFarlandAssetRequestInfo.mServerConnectInfo;
    s.mFarlandProductionRequestInfo.mProductionIdentifier = "prod-0042";
    s.mFarlandProductionRequestInfo.mRevision = "17";
    s.mFarlandProductionRequestInfo.mDisplayName = u"Evening News";
    s.mName = u"Opener \u2013 lower third";
    s.mMediaProducerDescription = u"Composition";
    s.mID = Guid::New();
    s.mDuration = RatioTime(1001 * 300, 30000);
    s.mPixelAspectRatio = PixelAspectRatio(1, 1);
    s.mAlphaChannelType = AlphaChannel::Premultiplied;
    s.mFrameRect.mSize = {1920, 1080};
    s.mFrameRate = FrameRate(10594584000);
    s.mPixelFormatList = {{MakeFourCC('B', 'G', 'R', 'A'), 0x78000},
                          {MakeFourCC('V', 'U', 'Y', 'A'), 0x78001}};
    s.mFieldType = FieldType::Progressive;
    s.mNativeFieldType = FieldType::Progressive;
    s.mAudioChannelLayout = CreateStereoChannelLayout();
    s.mAudioSampleRate = FrameRate(5292000);
    s.mInitialContentState = Guid::New();
    s.mHasAudio = true;
    s.mHasVideo = true;
    s.mCurrentTime = RatioTime(12, 1);
    s.mWorkInPoint = RatioTime(0);
    s.mWorkOutPoint = RatioTime(10);
    s.mAlphaMatteColorR = 0.1f;
    s.mStartTime = RatioTime(3600);
    s.mInPoint = RatioTime(0);
    s.mOutPoint = RatioTime(10);
    s.mSupportsVideoRenderingSessions = true;
    s.mAppSpecificSourceInfo = R"({"comp":"opener","layer":3})";
    s.mColorSpace = ColorSpace(ColorProfile(u"Rec. 709", std::vector<uint8_t>(64, 0x5a)), 1, false);
    s.mCohortName = u"News team";

    TextEditInfo title;
    title.ConvertIntoSingleTextRun(u"Breaking story");
    title.mRuns[0].mFontName = u"Sans Bold";
    title.mRuns[0].mFontSize = 48.0f;
    s.mCapsuleParams.AddTextParam("title", u"Title", true, u"Breaking story", title);
    s.mCapsuleParams.AddColorParam("bar", u"Bar colour", true, {0.8f, 0.1f, 0.1f, 1.0f});
    s.mCapsuleParams.AddFloatParam("opacity", u"Opacity", true, 100.0, 0.0, 100.0, 0);
    s.mCapsuleParams.AddPoint2DParam("position", u"Position", true, {960.0, 900.0});
    s.mCapsuleParams.AddMenuParam("style", u"Style", false, 1, {u"Flat", u"Glass", u"Neon"});
    s.mCapsuleParams.AddMediaParam("logo", u"Logo", false, true, u"", MediaReplacementInfo());
    return s;
}

}  // namespace

int main(int argc, char** argv) {
    bool json = false;
    double seconds = 2.0;
    for (int i = 1; i < argc; ++i) {
        if (std::strcmp(argv[i], "--json") == 0) {
            json = true;
        } else if (std::strcmp(argv[i], "--seconds") == 0 && i + 1 < argc) {
            seconds = std::atof(argv[++i]);
        } else {
            std::fprintf(stderr, "usage: %s [--json] [--seconds S]\n", argv[0]);
            return 2;
        }
    }

    const SourceInfo source = PopulatedSource();
    // The wire's own value codec, as every request argument and reply goes.
    // Like the transport, encode into one buffer that is reused from call to call.
    wire::Buffer scratch;
    auto encodeValue = [&scratch](const Value& v) -> const wire::Buffer& {
        scratch.clear();
        wire::EncodeValue(scratch, v);
        return scratch;
    };
    auto decodeValue = [](const wire::Buffer& bytes) { return wire::DecodeValue(bytes.data(), bytes.size()); };
    const size_t wireBytes = encodeValue(Value(source)).size();
    {
        const auto back = decodeValue(encodeValue(Value(source))).get<SourceInfo>();
        if (!(back == source)) {
            std::fprintf(stderr, "round trip changed the record\n");
            return 1;
        }
    }

    uint64_t iterations = 0;
    size_t sink = 0;
    const double cpuStart = ThreadSeconds();
    const auto start = Clock::now();
    const auto deadline = start + std::chrono::duration<double>(seconds);
    auto now = start;
    while (now < deadline) {
        for (int k = 0; k < 256; ++k) {
            const wire::Buffer& bytes = encodeValue(Value(source));
            const SourceInfo back = decodeValue(bytes).get<SourceInfo>();
            sink += back.mCapsuleParams.GetParams().size() + bytes.size();
        }
        iterations += 256;
        now = Clock::now();
    }
    const double elapsed = std::chrono::duration<double>(now - start).count();
    const double cpu = ThreadSeconds() - cpuStart;
    const double perSecond = static_cast<double>(iterations) / cpu;
    const double wallPerSecond = static_cast<double>(iterations) / elapsed;
    if (sink == 0) return 1;

    // Where the time goes: each stage alone, per call.
    const Value tree = source;
    const wire::Buffer encoded = encodeValue(tree);  // a copy: the scratch buffer is reused
    auto stage = [&](auto&& body) {
        const int n = 2000;
        const auto t0 = Clock::now();
        for (int i = 0; i < n; ++i) sink += body();
        return std::chrono::duration<double, std::micro>(Clock::now() - t0).count() / n;
    };
    const double toTree = stage([&] { return Value(source).size(); });
    const double encode = stage([&] { return encodeValue(tree).size(); });
    const double decode = stage([&] { return decodeValue(encoded).size(); });
    const double fromTree = stage([&] { return tree.get<SourceInfo>().mName.size(); });

    if (json) {
        std::printf("{\"sourceinfo_roundtrips_per_s\": %.0f, \"wall_roundtrips_per_s\": %.0f, "
                    "\"us_per_roundtrip\": %.3f, "
                    "\"wire_bytes\": %zu, \"iterations\": %llu, \"us_to_tree\": %.3f, "
                    "\"us_encode\": %.3f, \"us_decode\": %.3f, \"us_from_tree\": %.3f}\n",
                    perSecond, wallPerSecond, 1e6 / perSecond, wireBytes,
                    static_cast<unsigned long long>(iterations), toTree, encode, decode, fromTree);
    } else {
        std::printf("SourceInfo round trips: %.0f per CPU second, %.0f per wall second "
                    "(%.3f us CPU each, %zu wire bytes)\n",
                    perSecond, wallPerSecond, 1e6 / perSecond, wireBytes);
        std::printf("  to tree %.3f us, encode %.3f us, decode %.3f us, from tree %.3f us\n",
                    toTree, encode, decode, fromTree);
    }
    return 0;
}
