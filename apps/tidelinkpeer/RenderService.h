// The reference peer's renders (docs/peer.md, "Rendering"; docs/frames.md): video rendering
// sessions and frames, and audio rendering sessions and chunks.
//
// A frame or chunk is drawn on the render executor (all cores), into a buffer of the link
// manager's buffer service, and published under the frame's GUID with hand-over; a failure is
// published as a generation error instead. Only then is the render request answered, so that a
// peer that dies mid-render fails the host's pending request. Direct renders write into the
// host's buffer and answer when done.
//
// Threading: Handle runs on transport threads and never blocks: it reads the arguments, assigns
// audio chunks their place in the session (in arrival order) and posts the work; session
// creation goes through the peer service's project queue (after the opens that came before it).
// Every request is answered exactly once, from the executor that did the work; no lock is held
// while answering, publishing or posting.
//
// Sessions belong to the host connection that created them and end with it (or when disposed,
// or at Shutdown).
#pragma once

#include <atomic>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "BufferMappings.h"
#include "PeerService.h"
#include "RenderRules.h"
#include "platform/Executor.h"
#include "platform/Rpc.h"

namespace tidelink::peer {

class RenderService : public std::enable_shared_from_this<RenderService> {
public:
    struct Limits {
        size_t sessions = 4096;        // video and audio sessions each
        size_t framesInFlight = 1024;  // frames and chunks queued or being drawn
        size_t rememberedCancels = 1024;  // cancels of frames not (yet) asked for
        size_t keptMappings = 16;      // buffer mappings kept between frames
        uint64_t keptMappingBytes = uint64_t{512} << 20;
    };

    // |renderExecutor| draws frames (several at once); |service| has the open projects.
    static std::shared_ptr<RenderService> Create(std::shared_ptr<PeerService> service,
                                                 platform::ExecutorPtr renderExecutor, Limits limits);
    static std::shared_ptr<RenderService> Create(std::shared_ptr<PeerService> service,
                                                 platform::ExecutorPtr renderExecutor) {
        return Create(std::move(service), std::move(renderExecutor), Limits{});
    }
    ~RenderService();
    RenderService(const RenderService&) = delete;
    RenderService& operator=(const RenderService&) = delete;

    static const std::vector<std::string>& MessageNames();
    void Register(const platform::MessageRegistrarPtr& registrar);
    void Unregister(const platform::MessageRegistrarPtr& registrar);

    // Handles message |name| from the host connection |from| (null: no owner). A request passes
    // |reply|, which runs exactly once; a notification passes null.
    void Handle(const platform::SessionPtr& from, const std::string& name, const platform::Value& args,
                ReplyFn reply);

    // Refuses new work, cancels what is queued (published as cancelled, answered with an error),
    // waits for frames being drawn, and lets the buffer service's client go. Not on a transport
    // thread or the render executor. Idempotent.
    void Shutdown();

    size_t VideoSessionCount() const;
    size_t AudioSessionCount() const;
    size_t FramesInFlight() const;
    const BufferMappings& Mappings() const { return mMappings; }
    // Waits until every posted frame is done (tests).
    void WaitUntilIdle();

private:
    struct Job {
        platform::Guid frame;
        std::atomic<bool> cancelled{false};
    };
    struct VideoSession {
        std::string project;
        platform::Guid source;
        VideoRenderOptions options;
        const void* owner = nullptr;
    };
    struct AudioSession {
        std::string project;
        platform::Guid source;
        AudioFormat format;
        uint32_t samplesPerBuffer = 0;
        int64_t next = 0;  // the first sample of the next chunk
        const void* owner = nullptr;
        // The composition at the session's rate, made again when the project changes.
        std::mutex cacheMutex;
        std::weak_ptr<const ProjectModel> cachedModel;
        std::shared_ptr<const Composition> cached;
    };
    // Where a direct render writes.
    struct Destination {
        std::string name;
        uint64_t size = 0;
        int64_t result = 0;
    };
    struct VideoWork {
        std::string project;
        platform::Guid source;
        platform::RatioTime time;
        VideoRenderOptions options;
        std::optional<Destination> destination;
    };
    struct Owner {
        std::weak_ptr<platform::Session> session;
        platform::Guid closeHandler;
    };

    RenderService(std::shared_ptr<PeerService> service, platform::ExecutorPtr renderExecutor, Limits limits);

    // These take |reply| by reference and move it only once the arguments are read: Handle
    // answers what they refuse.
    void CreateVideoSession(const platform::SessionPtr& from, const platform::Value& args, ReplyFn& reply);
    void CreateAudioSession(const platform::SessionPtr& from, const platform::Value& args, ReplyFn& reply);
    void RenderVideoMessage(const std::string& name, const platform::Value& args, ReplyFn& reply);
    void RenderAudioMessage(const std::string& name, const platform::Value& args, ReplyFn& reply);

    // Takes |frame| into the jobs in flight; null (and |reply| answered) when it cannot be.
    std::shared_ptr<Job> Admit(const platform::Guid& frame, bool publishes, ReplyFn& reply);
    void RunVideo(const std::shared_ptr<Job>& job, const VideoWork& work, const ReplyFn& reply);
    void RunAudio(const std::shared_ptr<Job>& job, const std::shared_ptr<AudioSession>& session, int64_t first,
                  const ReplyFn& reply);
    // Publishes |code| as the generation error of |frame| (when |publish|) and answers |message|,
    // on the render executor.
    void Fail(const platform::Guid& frame, bool publish, int code, const std::string& message, ReplyFn reply);
    void Finish(const std::shared_ptr<Job>& job);
    // Starts the buffer service's client once.
    void EnsureCoordination();

    // Records |from| as the owner of sessions; false when it has closed already.
    const void* TrackOwner(const platform::SessionPtr& from);
    void OwnerClosed(const void* owner);
    bool OwnerAlive(const void* owner) const;  // under mMutex

    const std::shared_ptr<PeerService> mService;
    const platform::ExecutorPtr mRender;
    const Limits mLimits;
    std::atomic<bool> mStopping{false};
    std::atomic<bool> mCoordination{false};
    std::mutex mCoordinationMutex;
    BufferMappings mMappings;

    mutable std::mutex mMutex;  // guards what follows
    std::map<platform::Guid, std::shared_ptr<VideoSession>> mVideoSessions;
    std::map<platform::Guid, std::shared_ptr<AudioSession>> mAudioSessions;
    std::map<platform::Guid, std::shared_ptr<Job>> mJobs;
    std::set<platform::Guid> mEarlyCancels;
    std::deque<platform::Guid> mEarlyCancelOrder;
    std::map<const void*, Owner> mOwners;
};

}  // namespace tidelink::peer
