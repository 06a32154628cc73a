#include "RenderService.h"

#include <algorithm>
#include <cstring>

#include "Arguments.h"
#include "FrameComposer.h"
#include "Generators.h"
#include "platform/SharedMemory.h"
#include "platform/Trace.h"
#include "processcoordination/MappedAudioData.h"
#include "processcoordination/ProcessCoordination.h"
#include "tidelink/render/FrameLayout.h"

namespace tidelink::peer {

using namespace platform;
namespace pc = processcoordination;

namespace {

constexpr const char* kCat = "TideLinkPeer";
constexpr const char* kNoFarland = "This peer serves no Farland productions";
// Only buffers of the link manager's buffer service are written by direct renders.
constexpr const char* kBufferPrefix = "tlmbuf-";

std::string Message(const char* name) { return std::string(kMessagePrefix) + name; }

const std::string kCreateVideoSession = Message("CreateVideoRenderingSession");
const std::string kCreateFarlandVideoSession = Message("CreateFarlandVideoRenderingSession");
const std::string kDisposeVideoSession = Message("DisposeVideoRenderingSession");
const std::string kRenderSessionVideo = Message("RenderSessionVideo");
const std::string kRenderVideo = Message("RenderVideo");
const std::string kRenderVideoForFarland = Message("RenderVideoForFarland");
const std::string kRenderSessionVideoDirect = Message("RenderSessionVideoDirect");
const std::string kRenderVideoDirect = Message("RenderVideoDirect");
const std::string kCancelVideoRender = Message("CancelVideoRender");
const std::string kCreateAudioSession = Message("CreateAudioRenderingSession");
const std::string kCreateFarlandAudioSession = Message("CreateFarlandAudioRenderingSession");
const std::string kRenderAudio = Message("RenderAudio");
const std::string kRenderAudioAtTime = Message("RenderAudioAtTime");
const std::string kCancelAudioRender = Message("CancelAudioRender");
const std::string kDisposeAudioSession = Message("DisposeAudioRenderingSession");

// A render that was cancelled before it was published.
struct Cancelled {};

class RenderHandler final : public MessageHandler {
public:
    RenderHandler(std::weak_ptr<RenderService> service, std::string name)
        : mService(std::move(service)), mName(std::move(name)) {}

    void HandleRequestFrom(const SessionPtr& session, const ResponderPtr& responder, const Value& args) override {
        auto service = mService.lock();
        if (!service) return responder->SendError(kPeerError, u"The peer is shutting down");
        service->Handle(session, mName, args, [responder](Outcome o) {
            if (o.ok) {
                responder->SendGeneralResult(o.value);
            } else {
                responder->SendError(o.code, o.message);
            }
        });
    }

    void HandleNotificationFrom(const SessionPtr& session, const Value& args) override {
        if (auto service = mService.lock()) service->Handle(session, mName, args, nullptr);
    }

private:
    std::weak_ptr<RenderService> mService;
    std::string mName;
};

void Answer(const ReplyFn& reply, Outcome o) {
    if (reply) reply(std::move(o));
}

// The open project and composition a render names; throws ProjectError with the sentence.
std::pair<std::shared_ptr<const ProjectModel>, const Item*> FindComposition(PeerService& service,
                                                                           const std::string& project,
                                                                           const Guid& source) {
    std::shared_ptr<const ProjectModel> model;
    try {
        model = service.OpenProject(project);
    } catch (const ProjectError& e) {
        throw ProjectError("Project " + project + ": " + e.what());
    }
    if (!model) throw ProjectError("Project " + project + " is not open");
    const Item* item = model->Find(source);
    if (!item) throw ProjectError("The project " + project + " has no item " + source.ToString());
    if (item->type == ItemType::Footage) {
        throw ProjectError("\"" + item->path + "\" is footage; this peer does not decode media");
    }
    if (!item->composition) throw ProjectError("\"" + item->path + "\" is a bin, not a source");
    return {std::move(model), item};
}

std::vector<float>& AudioScratch(size_t floats) {
    thread_local std::vector<float> scratch;
    if (scratch.size() < floats) scratch.resize(floats);
    return scratch;
}

}  // namespace

// ---- set-up ----

std::shared_ptr<RenderService> RenderService::Create(std::shared_ptr<PeerService> service, ExecutorPtr renderExecutor,
                                                     Limits limits) {
    return std::shared_ptr<RenderService>(new RenderService(std::move(service), std::move(renderExecutor), limits));
}

RenderService::RenderService(std::shared_ptr<PeerService> service, ExecutorPtr renderExecutor, Limits limits)
    : mService(std::move(service)), mRender(std::move(renderExecutor)), mLimits(limits),
      mMappings(limits.keptMappings, limits.keptMappingBytes) {}

RenderService::~RenderService() = default;

const std::vector<std::string>& RenderService::MessageNames() {
    static const std::vector<std::string> names = {
        kCreateVideoSession,   kCreateFarlandVideoSession, kDisposeVideoSession,     kRenderSessionVideo,
        kRenderVideo,          kRenderVideoForFarland,     kRenderSessionVideoDirect, kRenderVideoDirect,
        kCancelVideoRender,    kCreateAudioSession,        kCreateFarlandAudioSession, kRenderAudio,
        kRenderAudioAtTime,    kCancelAudioRender,         kDisposeAudioSession};
    return names;
}

void RenderService::Register(const MessageRegistrarPtr& registrar) {
    for (const auto& name : MessageNames()) {
        registrar->Register(name, std::make_shared<RenderHandler>(weak_from_this(), name));
    }
}

void RenderService::Unregister(const MessageRegistrarPtr& registrar) {
    for (const auto& name : MessageNames()) registrar->UnRegister(name);
}

void RenderService::EnsureCoordination() {
    if (mCoordination.load()) return;
    std::lock_guard lock(mCoordinationMutex);
    // Not again once shutdown began: a frame that slipped in then fails with no client (-5).
    if (mCoordination.load() || mStopping.load()) return;
    // Starts in the background; the first buffer request waits for it.
    pc::InitializeClient();
    mCoordination.store(true);
}

void RenderService::Shutdown() {
    if (mStopping.exchange(true)) return;
    std::vector<std::pair<const void*, Owner>> owners;
    {
        std::lock_guard lock(mMutex);
        for (auto& [frame, job] : mJobs) job->cancelled = true;
        mVideoSessions.clear();
        mAudioSessions.clear();
        owners.assign(mOwners.begin(), mOwners.end());
        mOwners.clear();
    }
    for (auto& [key, owner] : owners) {
        if (auto session = owner.session.lock()) session->RemoveCloseHandler(owner.closeHandler);
    }
    mRender->WaitUntilIdle();
    mMappings.Clear();
    std::lock_guard lock(mCoordinationMutex);
    if (mCoordination.exchange(false)) pc::UninitializeClient();
}

void RenderService::WaitUntilIdle() { mRender->WaitUntilIdle(); }

size_t RenderService::VideoSessionCount() const {
    std::lock_guard lock(mMutex);
    return mVideoSessions.size();
}

size_t RenderService::AudioSessionCount() const {
    std::lock_guard lock(mMutex);
    return mAudioSessions.size();
}

size_t RenderService::FramesInFlight() const {
    std::lock_guard lock(mMutex);
    return mJobs.size();
}

// ---- owners ----

const void* RenderService::TrackOwner(const SessionPtr& from) {
    if (!from) return nullptr;
    const void* key = from.get();
    {
        std::lock_guard lock(mMutex);
        if (mOwners.count(key)) return key;
        mOwners[key].session = from;
    }
    std::weak_ptr<RenderService> weak = weak_from_this();
    // Runs at once (on a transport thread) when the session has closed already.
    const Guid handler = from->AddCloseHandler([weak, key](const SessionPtr&, TransportError) {
        if (auto self = weak.lock()) self->OwnerClosed(key);
    });
    std::lock_guard lock(mMutex);
    if (auto it = mOwners.find(key); it != mOwners.end()) it->second.closeHandler = handler;
    return key;
}

bool RenderService::OwnerAlive(const void* owner) const { return owner == nullptr || mOwners.count(owner) > 0; }

void RenderService::OwnerClosed(const void* owner) {
    size_t dropped = 0;
    {
        std::lock_guard lock(mMutex);
        mOwners.erase(owner);
        dropped += std::erase_if(mVideoSessions, [owner](const auto& s) { return s.second->owner == owner; });
        dropped += std::erase_if(mAudioSessions, [owner](const auto& s) { return s.second->owner == owner; });
    }
    if (dropped > 0) TL_TRACE(kCat, 3) << "A host went away; its " << dropped << " rendering sessions end";
}

// ---- messages ----

void RenderService::Handle(const SessionPtr& from, const std::string& name, const Value& args, ReplyFn reply) {
    if (mStopping.load()) return Answer(reply, Outcome::Error("The peer is shutting down"));
    try {
        if (name == kCreateVideoSession) return CreateVideoSession(from, args, reply);
        if (name == kCreateAudioSession) return CreateAudioSession(from, args, reply);
        if (name == kRenderVideo || name == kRenderSessionVideo || name == kRenderVideoDirect ||
            name == kRenderSessionVideoDirect || name == kRenderVideoForFarland) {
            return RenderVideoMessage(name, args, reply);
        }
        if (name == kRenderAudio || name == kRenderAudioAtTime) return RenderAudioMessage(name, args, reply);
        if (name == kCreateFarlandVideoSession || name == kCreateFarlandAudioSession) {
            return Answer(reply, Outcome::Error(kNoFarland));
        }
        if (name == kCancelVideoRender || name == kCancelAudioRender) {
            const bool audio = name == kCancelAudioRender;
            Args a(args, name, audio ? "(session, frame)" : "(frame)");
            const Guid frame = a.Id(audio ? 1 : 0, "the frame");
            {
                std::lock_guard lock(mMutex);
                if (auto it = mJobs.find(frame); it != mJobs.end()) {
                    it->second->cancelled = true;
                } else if (mEarlyCancels.insert(frame).second) {
                    // Its render request may still be on the way (it leaves the host only once the
                    // link manager has taken the host's registration).
                    mEarlyCancelOrder.push_back(frame);
                    if (mEarlyCancelOrder.size() > mLimits.rememberedCancels) {
                        mEarlyCancels.erase(mEarlyCancelOrder.front());
                        mEarlyCancelOrder.pop_front();
                    }
                }
            }
            return Answer(reply, Outcome::Ok(true));
        }
        if (name == kDisposeVideoSession || name == kDisposeAudioSession) {
            Args a(args, name, "(session)");
            const Guid session = a.Id(0, "the session");
            std::lock_guard lock(mMutex);
            if (name == kDisposeVideoSession) {
                mVideoSessions.erase(session);
            } else {
                mAudioSessions.erase(session);
            }
        } else {
            return Answer(reply, Outcome::Error("The peer does not answer \"" + name + "\""));
        }
        return Answer(reply, Outcome::Ok(true));
    } catch (const BadArguments& e) {
        TL_TRACE(kCat, 3) << e.what();
        return Answer(reply, Outcome::Error(e.what()));
    }
}

void RenderService::CreateVideoSession(const SessionPtr& from, const Value& args, ReplyFn& reply) {
    Args a(args, kCreateVideoSession, "(project path, source id, options)");
    auto session = std::make_shared<VideoSession>();
    session->project = a.Text(0, "the project path");
    session->source = a.Id(1, "the source id");
    session->options = a.Record<VideoRenderOptions>(2, "the render options");
    session->owner = TrackOwner(from);
    auto self = shared_from_this();
    mService->Queue(
        kCreateVideoSession,
        [self, session]() -> Outcome {
            try {
                const auto [model, item] = FindComposition(*self->mService, session->project, session->source);
                ResolveFrameGeometry(*item->composition, session->options);
            } catch (const ProjectError& e) {
                return Outcome::Error(e.what());
            } catch (const RenderError& e) {
                return Outcome::Error(e.what());
            }
            const Guid id = Guid::New();
            std::lock_guard lock(self->mMutex);
            if (self->mStopping.load()) return Outcome::Error("The peer is shutting down");
            if (!self->OwnerAlive(session->owner)) return Outcome::Error("The host went away");
            if (self->mVideoSessions.size() >= self->mLimits.sessions) {
                return Outcome::Error("Too many video rendering sessions");
            }
            self->mVideoSessions.emplace(id, session);
            return Outcome::Ok(Value(id));
        },
        std::move(reply));
}

void RenderService::CreateAudioSession(const SessionPtr& from, const Value& args, ReplyFn& reply) {
    Args a(args, kCreateAudioSession, "(project path, source id, options, start time, samples per buffer)");
    auto session = std::make_shared<AudioSession>();
    session->project = a.Text(0, "the project path");
    session->source = a.Id(1, "the source id");
    const auto options = a.Record<AudioRenderOptions>(2, "the audio options");
    const RatioTime start = a.Time(3, "the start time");
    const Value& count = a.At(4);
    if (!count.is_number_integer() || count.get<int64_t>() < 1 || count.get<int64_t>() > kMaxSamplesPerBuffer) {
        a.Bad("argument 5 (samples per buffer) must be a whole number from 1 to " + std::to_string(kMaxSamplesPerBuffer));
    }
    session->samplesPerBuffer = static_cast<uint32_t>(count.get<int64_t>());
    session->owner = TrackOwner(from);
    auto self = shared_from_this();
    mService->Queue(
        kCreateAudioSession,
        [self, session, options, start]() -> Outcome {
            try {
                const auto [model, item] = FindComposition(*self->mService, session->project, session->source);
                session->format = ResolveAudioFormat(*item->composition, options);
                if (session->format.Channels() == 0) throw RenderError("The channel layout is empty");
                session->next = SampleAtOrBefore(start, session->format.sampleRate);
            } catch (const ProjectError& e) {
                return Outcome::Error(e.what());
            } catch (const RenderError& e) {
                return Outcome::Error(e.what());
            }
            const Guid id = Guid::New();
            std::lock_guard lock(self->mMutex);
            if (self->mStopping.load()) return Outcome::Error("The peer is shutting down");
            if (!self->OwnerAlive(session->owner)) return Outcome::Error("The host went away");
            if (self->mAudioSessions.size() >= self->mLimits.sessions) {
                return Outcome::Error("Too many audio rendering sessions");
            }
            self->mAudioSessions.emplace(id, session);
            return Outcome::Ok(Value(id));
        },
        std::move(reply));
}

std::shared_ptr<RenderService::Job> RenderService::Admit(const Guid& frame, bool publishes, ReplyFn& reply) {
    auto job = std::make_shared<Job>();
    job->frame = frame;
    std::string refusal;
    int code = pc::kResultNotAvailable;
    {
        std::lock_guard lock(mMutex);
        if (mJobs.count(frame)) {
            // The frame is someone else's render: answer, but leave its publication alone.
            publishes = false;
            refusal = "Frame " + frame.ToString() + " is being rendered already";
        } else if (mEarlyCancels.erase(frame)) {
            mEarlyCancelOrder.erase(std::find(mEarlyCancelOrder.begin(), mEarlyCancelOrder.end(), frame));
            refusal = "The render of frame " + frame.ToString() + " was cancelled";
            code = pc::kResultCancelled;
        } else if (mJobs.size() >= mLimits.framesInFlight) {
            refusal = "Too many frames in flight (" + std::to_string(mLimits.framesInFlight) + ")";
        } else {
            mJobs.emplace(frame, job);
            return job;
        }
    }
    Fail(frame, publishes, code, refusal, std::move(reply));
    return nullptr;
}

void RenderService::Finish(const std::shared_ptr<Job>& job) {
    std::lock_guard lock(mMutex);
    if (auto it = mJobs.find(job->frame); it != mJobs.end() && it->second == job) mJobs.erase(it);
}

void RenderService::Fail(const Guid& frame, bool publish, int code, const std::string& message, ReplyFn reply) {
    auto self = shared_from_this();
    mRender->Post([self, frame, publish, code, message, reply = std::move(reply)] {
        if (publish) {
            self->EnsureCoordination();
            pc::PutBinaryDataGenerationError(frame, code);
        }
        TL_TRACE(kCat, 3) << "Frame " << frame.ToString() << ": " << message;
        Answer(reply, Outcome::Error(message));
    });
}

void RenderService::RenderVideoMessage(const std::string& name, const Value& args, ReplyFn& reply) {
    if (name == kRenderVideoForFarland) {
        Args a(args, name, "(Farland asset, frame, time, options)");
        const Guid frame = a.Id(1, "the frame");
        return Fail(frame, true, pc::kResultNotAvailable, kNoFarland, std::move(reply));
    }
    const bool session = name == kRenderSessionVideo || name == kRenderSessionVideoDirect;
    const bool direct = name == kRenderVideoDirect || name == kRenderSessionVideoDirect;
    const char* signature = name == kRenderSessionVideo ? "(project path, source id, frame, time, session)"
                            : name == kRenderVideo      ? "(project path, source id, frame, time, options)"
                            : session ? "(project path, source id, frame, time, destination, session)"
                                      : "(project path, source id, frame, time, options, destination)";
    Args a(args, name, signature);
    const Guid frame = a.Id(2, "the frame");
    VideoWork work;
    std::string problem;
    try {
        work.project = a.Text(0, "the project path");
        work.source = a.Id(1, "the source id");
        work.time = a.Time(3, "the time");
        if (direct) {
            const Value& d = a.At(session ? 4 : 5);
            Destination dest;
            if (!d.is_object() || !d.contains("filename") || !d["filename"].is_string() || !d.contains("size") ||
                !d["size"].is_number_integer() || d["size"].get<int64_t>() < 0 ||
                (d.contains("result") && !d["result"].is_number_integer())) {
                a.Bad("the destination must be {\"result\", \"filename\", \"size\"}");
            }
            dest.name = d["filename"].get<std::string>();
            dest.size = d["size"].get<uint64_t>();
            dest.result = d.contains("result") ? d["result"].get<int64_t>() : 0;
            work.destination = std::move(dest);
        }
        if (session) {
            const Guid id = a.Id(direct ? 5 : 4, "the session");
            std::lock_guard lock(mMutex);
            auto it = mVideoSessions.find(id);
            if (it == mVideoSessions.end()) {
                problem = "No video rendering session " + id.ToString();
            } else {
                // The session names what is rendered; the path and source sent along are the same.
                work.project = it->second->project;
                work.source = it->second->source;
                work.options = it->second->options;
            }
        } else {
            work.options = a.Record<VideoRenderOptions>(4, "the render options");
        }
    } catch (const BadArguments& e) {
        problem = e.what();
    }
    if (!problem.empty()) return Fail(frame, !direct, pc::kResultNotAvailable, problem, std::move(reply));
    auto job = Admit(frame, !direct, reply);
    if (!job) return;
    auto self = shared_from_this();
    mRender->Post([self, job, work = std::move(work), reply = std::move(reply)] { self->RunVideo(job, work, reply); });
}

void RenderService::RenderAudioMessage(const std::string& name, const Value& args, ReplyFn& reply) {
    const bool atTime = name == kRenderAudioAtTime;
    Args a(args, name, atTime ? "(session, frame, time)" : "(session, frame)");
    const Guid frame = a.Id(1, "the frame");
    std::string problem;
    std::shared_ptr<AudioSession> session;
    int64_t first = 0;
    try {
        const Guid id = a.Id(0, "the session");
        std::optional<RatioTime> time;
        if (atTime) time = a.Time(2, "the time");
        std::lock_guard lock(mMutex);
        auto it = mAudioSessions.find(id);
        if (it == mAudioSessions.end()) {
            problem = "No audio rendering session " + id.ToString();
        } else {
            // Chunks take their place in the session in the order their requests arrive.
            session = it->second;
            first = time ? SampleAtOrBefore(*time, session->format.sampleRate) : session->next;
            session->next = first > INT64_MAX - session->samplesPerBuffer ? INT64_MAX : first + session->samplesPerBuffer;
        }
    } catch (const BadArguments& e) {
        problem = e.what();
    }
    if (!problem.empty()) return Fail(frame, true, pc::kResultNotAvailable, problem, std::move(reply));
    auto job = Admit(frame, true, reply);
    if (!job) return;
    auto self = shared_from_this();
    mRender->Post([self, job, session, first, reply = std::move(reply)] { self->RunAudio(job, session, first, reply); });
}

// ---- drawing ----

void RenderService::RunVideo(const std::shared_ptr<Job>& job, const VideoWork& work, const ReplyFn& reply) {
    const bool direct = work.destination.has_value();
    int code = pc::kResultNotAvailable;
    std::string failure;
    try {
        if (job->cancelled) throw Cancelled{};
        const auto [model, item] = FindComposition(*mService, work.project, work.source);
        const Composition& comp = *item->composition;
        const FrameGeometry g = ResolveFrameGeometry(comp, work.options);
        const FrameHeader header = HeaderFor(g, work.time);
        const uint64_t bytes = g.FrameBytes();
        if (direct) {
            const Destination& d = *work.destination;
            if (d.result != 0) throw RenderError("The destination reports result " + std::to_string(d.result));
            if (d.name.rfind(kBufferPrefix, 0) != 0 || !MemoryMappedFile::IsValidName(d.name)) {
                throw RenderError("The destination \"" + d.name + "\" is not a buffer of the link manager");
            }
            if (d.size < bytes) {
                throw RenderError("The destination holds " + std::to_string(d.size) + " bytes; the frame needs " +
                                  std::to_string(bytes));
            }
            auto file = pc::GetCachedMemoryMappedFile(d.name, d.size, true);
            if (!file) throw RenderError("Cannot open the destination " + d.name + " of " + std::to_string(d.size) + " bytes");
            auto* data = static_cast<uint8_t*>(file->GetAddress());
            WriteFrameHeader(data, header);
            try {
                ComposeFrame(comp, work.time, g, data + kFrameHeaderBytes, g.RowBytes());
            } catch (...) {
                pc::ReturnCachedMemoryMappedFile(d.name, std::move(file));
                throw;
            }
            pc::ReturnCachedMemoryMappedFile(d.name, std::move(file));
        } else {
            EnsureCoordination();
            pc::WritableBinaryReferencePtr ref;
            const int got = pc::GetWritableBinaryData(bytes, ref);
            if (got != 0 || !ref) {
                throw RenderError("The link manager gave no buffer of " + std::to_string(bytes) + " bytes (" +
                                  std::to_string(got) + ")");
            }
            // Drawn through a mapping of our own kept between frames (the buffers come round again).
            std::string name;
            uint64_t size = 0;
            if (!pc::DescribeWritableBinaryData(ref, name, size) || size < bytes) {
                throw RenderError("The link manager's buffer cannot be described");
            }
            auto mapping = mMappings.Take(name, size);
            if (!mapping) throw RenderError("Cannot map the frame's buffer " + name);
            auto* data = static_cast<uint8_t*>(mapping->GetAddress());
            WriteFrameHeader(data, header);
            try {
                ComposeFrame(comp, work.time, g, data + kFrameHeaderBytes, g.RowBytes());
            } catch (...) {
                mMappings.Give(std::move(mapping));
                throw;
            }
            mMappings.Give(std::move(mapping));
            if (job->cancelled) throw Cancelled{};
            const int published = pc::PutCompletedBinaryData(job->frame, ref, true);
            if (published != 0) throw RenderError("The frame could not be published (" + std::to_string(published) + ")");
        }
    } catch (const Cancelled&) {
        code = pc::kResultCancelled;
        failure = "The render of frame " + job->frame.ToString() + " was cancelled";
    } catch (const std::exception& e) {
        failure = e.what();
    }
    Finish(job);
    if (failure.empty()) return Answer(reply, Outcome::Ok(true));
    if (!direct) {
        EnsureCoordination();
        pc::PutBinaryDataGenerationError(job->frame, code);
    }
    TL_TRACE(kCat, 3) << "Frame " << job->frame.ToString() << ": " << failure;
    Answer(reply, Outcome::Error(failure));
}

void RenderService::RunAudio(const std::shared_ptr<Job>& job, const std::shared_ptr<AudioSession>& session,
                             int64_t first, const ReplyFn& reply) {
    int code = pc::kResultNotAvailable;
    std::string failure;
    try {
        if (job->cancelled) throw Cancelled{};
        const auto [model, item] = FindComposition(*mService, session->project, session->source);
        std::shared_ptr<const Composition> comp;
        {
            std::lock_guard lock(session->cacheMutex);
            if (session->cachedModel.lock() != model || !session->cached) {
                session->cached = std::make_shared<const Composition>(AtSampleRate(*item->composition,
                                                                                   session->format.sampleRate));
                session->cachedModel = model;
            }
            comp = session->cached;
        }
        const uint32_t channels = session->format.Channels();
        const uint32_t samples = session->samplesPerBuffer;
        EnsureCoordination();
        pc::WritableBinaryReferencePtr ref;
        {
            pc::MappedAudioData chunk;
            if (chunk.Init(channels, samples, job->frame) != 0) {
                throw RenderError("The link manager gave no buffer for " + std::to_string(samples) + " samples");
            }
            const size_t sourceChannels = comp->channels.size();
            auto& interleaved = AudioScratch(sourceChannels * samples);
            RenderCompositionAudio(*comp, first, samples, interleaved.data());
            float** out = chunk.GetAudioDataBuffer();
            for (uint32_t c = 0; c < channels; ++c) {
                const int32_t from = session->format.sourceChannel[c];
                if (from < 0) {
                    std::fill(out[c], out[c] + samples, 0.0f);
                    continue;
                }
                const float* in = interleaved.data() + from;
                for (uint32_t s = 0; s < samples; ++s) out[c][s] = in[static_cast<size_t>(s) * sourceChannels];
            }
            ref = chunk.GetWritablePtr();
        }  // unmapped before it is handed over
        if (job->cancelled) throw Cancelled{};
        const int published = pc::PutCompletedBinaryData(job->frame, ref, true);
        if (published != 0) throw RenderError("The chunk could not be published (" + std::to_string(published) + ")");
    } catch (const Cancelled&) {
        code = pc::kResultCancelled;
        failure = "The render of chunk " + job->frame.ToString() + " was cancelled";
    } catch (const std::exception& e) {
        failure = e.what();
    }
    Finish(job);
    if (failure.empty()) return Answer(reply, Outcome::Ok(true));
    EnsureCoordination();
    pc::PutBinaryDataGenerationError(job->frame, code);
    TL_TRACE(kCat, 3) << "Audio chunk " << job->frame.ToString() << ": " << failure;
    Answer(reply, Outcome::Error(failure));
}

}  // namespace tidelink::peer
