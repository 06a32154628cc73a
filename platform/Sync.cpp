#include "platform/Sync.h"

#include "platform/Trace.h"

namespace tidelink::platform {

namespace {
thread_local bool tTransportThread = false;

void WarnIfTransportThread(const char* what) {
    if (tTransportThread) {
        TL_TRACE("platform", 0) << what << " blocks a transport thread; replies on its sessions wait";
    }
}
}  // namespace

void MarkTransportThread() { tTransportThread = true; }
bool IsTransportThread() { return tTransportThread; }

void RecursiveMutex::Lock(const char* label, int timeoutMs) {
    const auto limit = std::chrono::milliseconds(timeoutMs > 0 ? timeoutMs : kDefaultLockTimeoutMs);
    const auto me = std::this_thread::get_id();
    std::unique_lock lock(mMutex);
    if (mDepth > 0 && mOwner == me) {
        ++mDepth;
        return;
    }
    while (!mFree.wait_for(lock, limit, [this] { return mDepth == 0; })) {
        const char* holder = mHolder;
        lock.unlock();  // the trace sink is outside code
        TL_TRACE("platform", 0) << "RecursiveMutex: \"" << (label ? label : "?") << "\" waited "
                                << limit.count() << " ms for the lock held by \""
                                << (holder ? holder : "?") << "\"; still waiting";
        lock.lock();
    }
    mOwner = me;
    mDepth = 1;
    mHolder = label;
}

void RecursiveMutex::Unlock() {
    {
        std::lock_guard lock(mMutex);
        if (--mDepth > 0) return;
        mOwner = std::thread::id();
        mHolder = nullptr;
    }
    mFree.notify_one();
}

bool SyncPoint::Arrive(int timeoutMs) {
    std::unique_lock lock(mMutex);
    if (mArrived + 1 < mParties) WarnIfTransportThread("SyncPoint::Arrive");
    if (++mArrived >= mParties) {
        mCond.notify_all();
        return true;
    }
    auto done = [this] { return mArrived >= mParties; };
    if (timeoutMs < 0) {
        mCond.wait(lock, done);
        return true;
    }
    return mCond.wait_for(lock, std::chrono::milliseconds(timeoutMs), done);
}

void Gate::Open() {
    // Notify under the lock: a waiter may destroy the gate as soon as it sees it open, so Open
    // must not touch it after unlocking.
    std::lock_guard lock(mMutex);
    mOpen = true;
    mCond.notify_all();
}

void Gate::Close() {
    std::lock_guard lock(mMutex);
    mOpen = false;
}

bool Gate::IsOpen() {
    std::lock_guard lock(mMutex);
    return mOpen;
}

bool Gate::Wait(int timeoutMs) {
    std::unique_lock lock(mMutex);
    if (!mOpen) WarnIfTransportThread("Gate::Wait");
    if (timeoutMs < 0) {
        mCond.wait(lock, [this] { return mOpen; });
        return true;
    }
    return mCond.wait_for(lock, std::chrono::milliseconds(timeoutMs), [this] { return mOpen; });
}

}  // namespace tidelink::platform
