// Executors run posted tasks on platform threads.
//
// The CPU-bound executor is one process-wide pool (one thread per core, at least two); it lives
// for the rest of the process once created. Its tasks must not wait for other tasks of the
// process: work that waits (on another process, say) goes to a worker pool of its own. A sub-executor feeds a parent executor: with limit -1
// its tasks run concurrently, with limit 1 one at a time in posting order. A task that throws is
// traced and dropped; the executor carries on.
#pragma once

#include <functional>
#include <memory>

#include "platform/Export.h"

namespace tidelink::platform {

class TIDELINK_EXPORT Executor {
public:
    using Task = std::function<void()>;
    virtual ~Executor() = default;
    virtual void Post(Task task) = 0;
    // Blocks until every task posted before and during the wait has run. Must not be called from
    // one of this executor's own tasks.
    virtual void WaitUntilIdle() = 0;
};

using ExecutorPtr = std::shared_ptr<Executor>;

TIDELINK_EXPORT ExecutorPtr CreateCPUBoundExecutor();
// |limit| is -1 (no limit) or a positive number of tasks that may run at once.
TIDELINK_EXPORT ExecutorPtr CreateSubExecutor(ExecutorPtr parent, int limit);

// A pool of |threads| threads of its own (0: one per hardware thread, at least two), for work
// that may wait. When the last reference goes, the queued tasks still run and the threads end
// (it waits for them, unless it is let go on one of its own threads).
TIDELINK_EXPORT ExecutorPtr CreateWorkerPool(unsigned threads);

// Hardware threads of this machine (at least 1).
TIDELINK_EXPORT unsigned HardwareThreadCount();

}  // namespace tidelink::platform
