#include "platform/Executor.h"

#include <algorithm>
#include <condition_variable>
#include <deque>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/Trace.h"

namespace tidelink::platform {
namespace {

void RunGuarded(const Executor::Task& task) {
    try {
        task();
    } catch (const std::exception& e) {
        TL_TRACE("platform", 0) << "Executor task threw: " << e.what();
    } catch (...) {
        TL_TRACE("platform", 0) << "Executor task threw an unknown exception";
    }
}

class ThreadPool final : public Executor {
public:
    explicit ThreadPool(unsigned threads) {
        for (unsigned i = 0; i < threads; ++i) mThreads.emplace_back([this] { Run(); });
        for (auto& t : mThreads) t.detach();  // the pool lives until the process ends
    }

    void Post(Task task) override {
        {
            std::lock_guard lock(mMutex);
            mTasks.push_back(std::move(task));
            ++mOutstanding;
        }
        mWake.notify_one();
    }

    void WaitUntilIdle() override {
        std::unique_lock lock(mMutex);
        mIdle.wait(lock, [this] { return mOutstanding == 0; });
    }

private:
    void Run() {
        std::unique_lock lock(mMutex);
        for (;;) {
            mWake.wait(lock, [this] { return !mTasks.empty(); });
            Task task = std::move(mTasks.front());
            mTasks.pop_front();
            lock.unlock();
            RunGuarded(task);
            task = nullptr;  // release captures before counting the task as done
            lock.lock();
            if (--mOutstanding == 0) mIdle.notify_all();
        }
    }

    std::mutex mMutex;
    std::condition_variable mWake;
    std::condition_variable mIdle;
    std::deque<Task> mTasks;
    size_t mOutstanding = 0;
    std::vector<std::thread> mThreads;
};

// Shared state outlives the sub-executor object while tasks are queued on the parent.
class SubExecutor final : public Executor {
    struct State {
        std::mutex mutex;
        std::condition_variable idle;
        std::deque<Task> queue;
        int running = 0;
        size_t outstanding = 0;
    };

public:
    SubExecutor(ExecutorPtr parent, int limit)
        : mParent(std::move(parent)), mLimit(limit), mState(std::make_shared<State>()) {}

    void Post(Task task) override {
        {
            std::lock_guard lock(mState->mutex);
            ++mState->outstanding;
            if (mLimit > 0 && mState->running >= mLimit) {
                mState->queue.push_back(std::move(task));
                return;
            }
            ++mState->running;
        }
        Dispatch(std::move(task));
    }

    void WaitUntilIdle() override {
        std::unique_lock lock(mState->mutex);
        mState->idle.wait(lock, [this] { return mState->outstanding == 0; });
    }

private:
    void Dispatch(Task task) {
        mParent->Post([state = mState, parent = mParent, task = std::move(task)]() mutable {
            Task current = std::move(task);
            for (;;) {
                RunGuarded(current);
                current = nullptr;
                std::unique_lock lock(state->mutex);
                if (--state->outstanding == 0) state->idle.notify_all();
                if (state->queue.empty()) {
                    --state->running;
                    return;
                }
                // Keep the slot and run the next queued task on this same thread: a serial
                // sub-executor then costs no extra hand-off per task.
                current = std::move(state->queue.front());
                state->queue.pop_front();
            }
        });
    }

    ExecutorPtr mParent;
    int mLimit;
    std::shared_ptr<State> mState;
};

// Threads of its own; they end when the pool goes, after the queue is empty.
class WorkerPool final : public Executor {
    struct State {
        std::mutex mutex;
        std::condition_variable wake;
        std::condition_variable idle;
        std::deque<Task> tasks;
        size_t outstanding = 0;
        bool closing = false;
    };

public:
    explicit WorkerPool(unsigned threads) : mState(std::make_shared<State>()) {
        for (unsigned i = 0; i < threads; ++i) mThreads.emplace_back([state = mState] { Run(*state); });
    }

    ~WorkerPool() override {
        {
            std::lock_guard lock(mState->mutex);
            mState->closing = true;
        }
        mState->wake.notify_all();
        for (auto& t : mThreads) {
            if (t.get_id() == std::this_thread::get_id()) {
                t.detach();  // let go by one of its own tasks: this thread ends after it
            } else {
                t.join();
            }
        }
    }

    void Post(Task task) override {
        {
            std::lock_guard lock(mState->mutex);
            mState->tasks.push_back(std::move(task));
            ++mState->outstanding;
        }
        mState->wake.notify_one();
    }

    void WaitUntilIdle() override {
        std::unique_lock lock(mState->mutex);
        mState->idle.wait(lock, [this] { return mState->outstanding == 0; });
    }

private:
    static void Run(State& state) {
        std::unique_lock lock(state.mutex);
        for (;;) {
            state.wake.wait(lock, [&state] { return !state.tasks.empty() || state.closing; });
            if (state.tasks.empty()) return;
            Task task = std::move(state.tasks.front());
            state.tasks.pop_front();
            lock.unlock();
            RunGuarded(task);
            task = nullptr;
            lock.lock();
            if (--state.outstanding == 0) state.idle.notify_all();
        }
    }

    std::shared_ptr<State> mState;
    std::vector<std::thread> mThreads;
};

}  // namespace

ExecutorPtr CreateWorkerPool(unsigned threads) {
    return std::make_shared<WorkerPool>(threads == 0 ? std::max(2u, HardwareThreadCount()) : threads);
}

unsigned HardwareThreadCount() { return std::max(1u, std::thread::hardware_concurrency()); }

ExecutorPtr CreateCPUBoundExecutor() {
    static ExecutorPtr* pool = new ExecutorPtr(std::make_shared<ThreadPool>(
        std::max(2u, std::thread::hardware_concurrency())));
    return *pool;
}

ExecutorPtr CreateSubExecutor(ExecutorPtr parent, int limit) {
    return std::make_shared<SubExecutor>(std::move(parent), limit <= 0 ? -1 : limit);
}

}  // namespace tidelink::platform
