// The commands that walk a project and render from it: items, describe, render, audio.
#include <algorithm>
#include <iomanip>
#include <cmath>
#include <condition_variable>
#include <deque>
#include <filesystem>
#include <iostream>
#include <map>
#include <mutex>

#include "Commands.h"
#include "MediaFiles.h"
#include "platform/Process.h"
#include "processcoordination/MappedAudioData.h"
#include "tidelink/render/FrameLayout.h"

namespace tidelink::cli {

using namespace platform;

namespace {

constexpr double kRequestSeconds = 60.0;

const char* TypeName(int32_t type) {
    switch (type) {
        case 1: return "bin";
        case 2: return "composition";
        case 3: return "footage";
        default: return "item";
    }
}

struct TreeItem {
    ItemInfo info;
    std::string path;
    int depth = 0;
};

ContainerPtr FetchContainer(const ProjectPtr& project, const Guid& id) {
    Await<ContainerPtr> got;
    project->GetContainer(got.Callback(), id);
    auto result = got.Wait(kRequestSeconds);
    if (!result) throw HostError{"The application did not answer"};
    if (result->first != ConnectionStatus::Connected || !result->second) {
        throw HostError{"Cannot read the bin " + id.ToString() + " of the project"};
    }
    return result->second;
}

// Every item of the project, depth first, bins before their contents.
std::vector<TreeItem> Walk(const ProjectPtr& project) {
    std::vector<TreeItem> out;
    std::function<void(const Guid&, const std::string&, int)> visit = [&](const Guid& id, const std::string& prefix,
                                                                          int depth) {
        for (const auto& item : FetchContainer(project, id)->GetContainedItems()) {
            const std::string path = prefix.empty() ? ToUTF8(item.mName) : prefix + "/" + ToUTF8(item.mName);
            out.push_back({item, path, depth});
            if (item.mType == 1 && depth < 64) visit(item.mID, path, depth + 1);
        }
    };
    visit(Guid(), std::string(), 0);
    return out;
}

// The item named by |name| (its id, its path, or its name when that is unique).
TreeItem FindItem(const ProjectPtr& project, const std::string& name) {
    const auto items = Walk(project);
    const auto id = Guid::Parse(name);
    std::vector<const TreeItem*> byName;
    for (const auto& item : items) {
        if ((id && item.info.mID == *id) || item.path == name) return item;
        if (ToUTF8(item.info.mName) == name) byName.push_back(&item);
    }
    if (byName.size() == 1) return *byName.front();
    if (byName.empty()) throw HostError{"No item '" + name + "' in the project (tidelink items lists them)"};
    std::string message = "'" + name + "' names several items; give the path or the id:";
    for (const auto* item : byName) message += "\n  " + item->path + "  " + item->info.mID.ToString();
    throw HostError{message};
}

SourcePtr FetchSource(const ProjectPtr& project, const TreeItem& item) {
    if (item.info.mType == 1) throw HostError{"'" + item.path + "' is a bin, not something to render"};
    Await<SourcePtr> got;
    project->GetSource(got.Callback(), item.info.mID);
    auto result = got.Wait(kRequestSeconds);
    if (!result) throw HostError{"The application did not answer"};
    if (result->first != ConnectionStatus::Connected || !result->second) {
        throw HostError{"Cannot describe '" + item.path + "'"};
    }
    return result->second;
}

double Fps(const FrameRate& rate) {
    return rate.IsSet() && rate.TicksPerFrame() > 0 ? static_cast<double>(kTicksPerSecond) / rate.TicksPerFrame() : 0;
}

std::string Seconds(const RatioTime& t) {
    char buf[64];
    std::snprintf(buf, sizeof(buf), "%.3f s", boost::rational_cast<double>(t));
    return buf;
}

// "1.5", "3", "1001/1000" as exact seconds.
std::optional<RatioTime> ParseTime(const std::string& text) {
    try {
        const auto slash = text.find('/');
        if (slash != std::string::npos) {
            const int64_t n = std::stoll(text.substr(0, slash));
            const int64_t d = std::stoll(text.substr(slash + 1));
            if (d <= 0) return std::nullopt;
            return RatioTime(n, d);
        }
        const auto dot = text.find('.');
        if (dot == std::string::npos) return RatioTime(std::stoll(text));
        const std::string frac = text.substr(dot + 1);
        if (frac.size() > 9 || frac.find_first_not_of("0123456789") != std::string::npos) return std::nullopt;
        int64_t scale = 1;
        for (size_t i = 0; i < frac.size(); ++i) scale *= 10;
        const std::string whole = text.substr(0, dot);
        const bool negative = !whole.empty() && whole[0] == '-';
        const int64_t w = whole.empty() || whole == "-" ? 0 : std::stoll(whole);
        const int64_t f = frac.empty() ? 0 : std::stoll(frac);
        return RatioTime(w * scale + (negative ? -f : f), scale);
    } catch (const std::exception&) {
        return std::nullopt;
    }
}

// Results handed from the delivery executor to the command's thread.
template <class T>
class Inbox {
public:
    void Push(T value) {
        {
            std::lock_guard lock(mMutex);
            mItems.push_back(std::move(value));
        }
        mCond.notify_one();
    }
    std::optional<T> Pop(double seconds) {
        std::unique_lock lock(mMutex);
        if (!mCond.wait_for(lock, std::chrono::duration<double>(seconds), [&] { return !mItems.empty(); })) {
            return std::nullopt;
        }
        T value = std::move(mItems.front());
        mItems.pop_front();
        return value;
    }

private:
    std::mutex mMutex;
    std::condition_variable mCond;
    std::deque<T> mItems;
};

struct Delivery {
    int64_t index = 0;
    processcoordination::BinaryReferencePtr reference;
    int result = 0;
};

}  // namespace

int RunItems(const std::string& file, bool json) {
    ProjectPtr project = OpenProjectFile(file, {});
    const auto items = Walk(project);
    if (json) {
        Value out = Value::array();
        for (const auto& item : items) {
            Value v(item.info);
            v["typename"] = TypeName(item.info.mType);
            v["path"] = item.path;
            out.push_back(std::move(v));
        }
        std::cout << ToJSONText(out, 4) << "\n";
        return 0;
    }
    std::cout << ToUTF8(project->GetName()) << "\n";
    for (const auto& item : items) {
        std::cout << std::string(static_cast<size_t>(2 + 2 * item.depth), ' ') << ToUTF8(item.info.mName) << "  ("
                  << TypeName(item.info.mType) << ", " << item.info.mID.ToString() << ")\n";
    }
    return 0;
}

int RunDescribe(const std::string& file, const std::string& name, bool json) {
    ProjectPtr project = OpenProjectFile(file, {});
    SourcePtr source = FetchSource(project, FindItem(project, name));
    const SourceInfo& info = source->GetSourceInfo();
    if (json) {
        std::cout << ToJSONText(Value(info), 4) << "\n";
        return 0;
    }
    const auto frame = info.mFrameRect;
    std::cout << ToUTF8(info.mName) << "\n"
              << "  id: " << info.mID.ToString() << "\n"
              << "  video: " << (info.mHasVideo ? "yes" : "no") << ", " << frame.mSize.mX << "x" << frame.mSize.mY
              << ", " << Fps(info.mFrameRate) << " fps, pixel aspect " << info.mPixelAspectRatio.Numerator() << ":"
              << info.mPixelAspectRatio.Denominator() << "\n"
              << "  duration: " << Seconds(info.mDuration) << "\n"
              << "  audio: " << (info.mHasAudio ? "yes" : "no") << ", " << Fps(info.mAudioSampleRate) << " Hz, "
              << info.mAudioChannelLayout.size() << " channels\n"
              << "  rendering sessions: " << (info.mSupportsVideoRenderingSessions ? "yes" : "no") << "\n";
    return 0;
}

int RunRender(const RenderArgs& args) {
    if (args.output.find('%') == std::string::npos && args.first != args.last) {
        throw HostError{"The output name needs a frame number field such as %05d when rendering several frames"};
    }
    ProjectPtr project = OpenProjectFile(args.project, {});
    const TreeItem item = FindItem(project, args.item);
    SourcePtr source = FetchSource(project, item);
    SourceInfo info = source->GetSourceInfo();
    if (!info.mHasVideo) throw HostError{"'" + item.path + "' has no video"};
    if (args.sessions) info.mSupportsVideoRenderingSessions = *args.sessions;
    // A source of our own, so that the session choice applies.
    SourcePtr chosen = Source::CreateSource(source->GetReconnect(), nullptr);
    chosen->Init(info);

    VideoRenderOptions options;
    options.SetPixelFormats({PixelFormat{kPixelFormatBGRA}});
    if (args.width > 0) options.SetBounds(args.width, args.height);
    Await<VideoRendererPtr> started;
    chosen->GetVideoRenderer(started.Callback(), options);
    auto renderer = started.Wait(kRequestSeconds);
    if (!renderer || renderer->first != ConnectionStatus::Connected) throw HostError{"Cannot start rendering"};

    const int64_t tpf = info.mFrameRate.IsSet() ? info.mFrameRate.TicksPerFrame() : kTicksPerSecond / 25;
    auto timeOf = [&](int64_t frame) {
        return args.time ? *args.time : RatioTime(frame * tpf, kTicksPerSecond);
    };
    const std::filesystem::path outDir = std::filesystem::path(args.output).parent_path();
    if (!outDir.empty()) std::filesystem::create_directories(outDir);

    auto inbox = std::make_shared<Inbox<Delivery>>();
    const int64_t total = args.last - args.first + 1;
    Progress progress("frames", static_cast<uint64_t>(total));
    const double start = NowSeconds();
    int64_t next = args.first, written = 0, inFlight = 0;
    std::string failure;
    std::map<int64_t, Guid> pending;
    while (written + static_cast<int64_t>(failure.empty() ? 0 : total) < total) {
        while (failure.empty() && inFlight < args.depth && next <= args.last) {
            const int64_t index = next++;
            const Guid frameID = Guid::New();
            pending[index] = frameID;
            ++inFlight;
            renderer->second->RenderVideo(
                [inbox, index](const Guid&, processcoordination::BinaryReferencePtr reference, int result) {
                    inbox->Push({index, std::move(reference), result});
                },
                frameID, timeOf(index));
        }
        if (inFlight == 0) break;
        auto delivery = inbox->Pop(kRequestSeconds);
        if (!delivery) {
            failure = "no frame arrived within " + std::to_string(static_cast<int>(kRequestSeconds)) + " s";
            break;
        }
        --inFlight;
        pending.erase(delivery->index);
        if (delivery->result != 0 || !delivery->reference) {
            if (failure.empty()) {
                failure = "frame " + std::to_string(delivery->index) + " failed (code " +
                          std::to_string(delivery->result) + ")";
            }
            continue;
        }
        const void* data = delivery->reference->MapIntoCurrentProcess();
        if (!data) {
            failure = "cannot map frame " + std::to_string(delivery->index);
            continue;
        }
        const auto header = ReadFrameHeader(data, delivery->reference->GetSize());
        std::string error = header ? std::string() : "frame " + std::to_string(delivery->index) + " is malformed";
        if (header) {
            const std::string path = FormatFrameName(args.output, delivery->index);
            error = WritePNG(path, static_cast<const uint8_t*>(data) + kFrameHeaderBytes, header->mWidth,
                             header->mHeight, header->mRowBytes, header->mPixelFormat == kPixelFormatBGRA,
                             args.compression);
        }
        delivery->reference->UnmapFromCurrentProcess(data);
        if (!error.empty()) {
            if (failure.empty()) failure = error;
            continue;
        }
        ++written;
        progress.Update(static_cast<uint64_t>(written));
    }
    for (const auto& [index, frameID] : pending) renderer->second->CancelVideoRender(frameID);
    progress.Finish();
    if (!failure.empty()) throw HostError{"Rendering stopped: " + failure};
    const double seconds = NowSeconds() - start;
    std::cerr << "rendered " << written << " frame" << (written == 1 ? "" : "s") << " in " << std::fixed
              << std::setprecision(2) << seconds << " s (" << std::setprecision(1)
              << (seconds > 0 ? static_cast<double>(written) / seconds : 0.0) << " fps) to "
              << (outDir.empty() ? std::string(".") : outDir.string()) << "\n";
    return 0;
}

int RunAudio(const AudioArgs& args) {
    ProjectPtr project = OpenProjectFile(args.project, {});
    const TreeItem item = FindItem(project, args.item);
    SourcePtr source = FetchSource(project, item);
    const SourceInfo& info = source->GetSourceInfo();
    if (!info.mHasAudio) throw HostError{"'" + item.path + "' has no audio"};
    const auto rate = static_cast<uint32_t>(std::lround(Fps(source->GetAudioSampleRate())));
    const auto layout = source->GetAudioChannelLayout();
    if (rate == 0 || layout.empty()) throw HostError{"'" + item.path + "' has no usable audio format"};

    AudioRenderOptions options;
    options.SetSampleRate(source->GetAudioSampleRate());
    options.SetAudioChannelLayout(layout);
    Await<AudioRendererPtr> started;
    source->GetAudioRenderer(started.Callback(), options, args.start, args.samplesPerChunk);
    auto renderer = started.Wait(kRequestSeconds);
    if (!renderer || renderer->first != ConnectionStatus::Connected) throw HostError{"Cannot start the audio render"};

    const auto totalSamples =
        static_cast<uint64_t>(std::llround(boost::rational_cast<double>(args.duration) * rate));
    const uint64_t chunks = (totalSamples + args.samplesPerChunk - 1) / args.samplesPerChunk;
    WavWriter wav;
    if (auto error = wav.Open(args.output, static_cast<uint32_t>(layout.size()), rate, args.format); !error.empty()) {
        throw HostError{error};
    }
    auto inbox = std::make_shared<Inbox<Delivery>>();
    Progress progress("chunks", chunks);
    std::map<int64_t, processcoordination::BinaryReferencePtr> arrived;
    uint64_t sent = 0, done = 0, writtenSamples = 0;
    constexpr uint64_t kDepth = 4;
    while (done < chunks) {
        // Chunks follow one another in the session: request them in order, a few ahead.
        while (sent < chunks && sent - done < kDepth) {
            const auto index = static_cast<int64_t>(sent++);
            renderer->second->RenderAudio(
                [inbox, index](const Guid&, processcoordination::BinaryReferencePtr reference, int result) {
                    inbox->Push({index, std::move(reference), result});
                },
                Guid::New());
        }
        auto delivery = inbox->Pop(kRequestSeconds);
        if (!delivery) throw HostError{"No audio arrived within 60 s"};
        if (delivery->result != 0 || !delivery->reference) {
            throw HostError{"Audio chunk " + std::to_string(delivery->index) + " failed (code " +
                            std::to_string(delivery->result) + ")"};
        }
        arrived[delivery->index] = delivery->reference;
        while (!arrived.empty() && arrived.begin()->first == static_cast<int64_t>(done)) {
            processcoordination::MappedAudioData chunk;
            if (chunk.Init(arrived.begin()->second) != 0 || chunk.GetChannelCount() != layout.size()) {
                throw HostError{"Audio chunk " + std::to_string(done) + " is malformed"};
            }
            const uint64_t take = std::min<uint64_t>(chunk.GetSampleCount(), totalSamples - writtenSamples);
            if (!wav.Write(chunk.GetAudioDataBuffer(), static_cast<uint32_t>(take))) {
                throw HostError{"Cannot write " + args.output};
            }
            writtenSamples += take;
            arrived.erase(arrived.begin());
            progress.Update(++done);
        }
    }
    progress.Finish();
    if (auto error = wav.Close(); !error.empty()) throw HostError{error};
    std::cerr << "wrote " << writtenSamples << " samples (" << layout.size() << " channels, " << rate << " Hz, "
              << Seconds(RatioTime(static_cast<int64_t>(writtenSamples), rate)) << ") to " << args.output << "\n";
    return 0;
}

std::optional<RatioTime> ParseSeconds(const std::string& text) { return ParseTime(text); }

}  // namespace tidelink::cli
