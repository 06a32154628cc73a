// Locks and rendezvous.
//
// RecursiveMutex is taken with a label naming the operation and a limit in milliseconds (the
// library passes 60,000). Reaching the limit is treated as a probable deadlock: a level-0 trace
// line names the waiting operation and the holder's, and the wait then goes on (it never gives
// up the lock it was asked for, since running the caller's critical section unlocked would
// corrupt its state). The line repeats at every further limit.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <string>
#include <thread>

#include "platform/Export.h"

namespace tidelink::platform {

inline constexpr int kDefaultLockTimeoutMs = 60000;

// Transport threads mark themselves; a blocking wait (SyncPoint, Gate) on one of them is a bug
// that can stall every session of the transport, and is traced at level 0.
TIDELINK_EXPORT void MarkTransportThread();
TIDELINK_EXPORT bool IsTransportThread();

class TIDELINK_EXPORT RecursiveMutex {
public:
    void Lock(const char* label, int timeoutMs = kDefaultLockTimeoutMs);
    void Unlock();

    class Guard {
    public:
        Guard(RecursiveMutex& m, const char* label, int timeoutMs = kDefaultLockTimeoutMs)
            : mMutex(m) {
            mMutex.Lock(label, timeoutMs);
        }
        ~Guard() { mMutex.Unlock(); }
        Guard(const Guard&) = delete;
        Guard& operator=(const Guard&) = delete;

    private:
        RecursiveMutex& mMutex;
    };

private:
    // A plain mutex and condition variable rather than std::recursive_timed_mutex, whose timed
    // wait the thread sanitizer cannot see.
    std::mutex mMutex;
    std::condition_variable mFree;
    std::thread::id mOwner;       // guarded by mMutex
    int mDepth = 0;               // guarded by mMutex
    const char* mHolder = nullptr;  // guarded by mMutex
};

// A rendezvous of a fixed number of parties: each Arrive blocks until all have arrived (or the
// wait times out). Used to wait for an answer that arrives on another thread.
class TIDELINK_EXPORT SyncPoint {
public:
    explicit SyncPoint(int parties = 2) : mParties(parties) {}
    // Returns false on timeout (a negative timeout waits forever). A party that timed out still
    // counts as arrived, so the others are not held up.
    bool Arrive(int timeoutMs = -1);

private:
    std::mutex mMutex;
    std::condition_variable mCond;
    int mParties;
    int mArrived = 0;
};

// A gate: closed or open; Wait blocks while it is closed. A waiter may destroy the gate as soon
// as Wait returns true.
class TIDELINK_EXPORT Gate {
public:
    explicit Gate(bool open = false) : mOpen(open) {}
    void Open();
    void Close();
    bool IsOpen();
    // Returns true when the gate was (or became) open, false on timeout (negative = forever).
    bool Wait(int timeoutMs = -1);

private:
    std::mutex mMutex;
    std::condition_variable mCond;
    bool mOpen;
};

}  // namespace tidelink::platform
