#ifndef ORVANE_PLATFORM_EVENT_THREAD_POOL_H
#define ORVANE_PLATFORM_EVENT_THREAD_POOL_H

#include <chrono>
#include <cstdint>
#include <functional>
#include <queue>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include <utils/Condition.h>
#include <utils/Mutex.h>
#include <utils/RefBase.h>

namespace android {
namespace Orvane {

// A fixed number of named worker threads sharing one queue of tasks. Among the tasks that are
// due, the one with the lowest priority value runs first, then the one due earliest; tasks not
// yet due wait in a second queue ordered by due time.
// Threads: any thread may add tasks; `mutex_` guards both queues and the state and is never
// held while a task runs. Start and Stop belong to the owner (a Stop from one of the pool's own
// tasks detaches that thread instead of joining it).
class EventThreadPool : public virtual RefBase {
public:
    using Task = std::function<void()>;

    EventThreadPool(size_t count, const std::string& name);
    ~EventThreadPool() override;
    EventThreadPool(const EventThreadPool&) = delete;
    EventThreadPool& operator=(const EventThreadPool&) = delete;

    // Starts the threads once; tasks added before run as soon as they are due.
    bool Start();
    // Lets running tasks finish, joins the threads and drops the tasks not yet started; the
    // pool refuses tasks from then on.
    void Stop();
    // False, with a warning line, once the pool is stopped or for an empty task.
    bool AddTask(Task task, const std::string& taskName, uint32_t delaySeconds, int32_t priority);

    const std::string& GetName() const { return name_; }
    size_t GetPendingCount();

private:
    using Clock = std::chrono::steady_clock;

    struct Entry {
        Task task;
        std::string name;
        Clock::time_point due;
        int32_t priority;
        uint64_t sequence;  // keeps equal entries in the order they were added
    };
    struct ReadyOrder {
        bool operator()(const Entry& a, const Entry& b) const {
            if (a.priority != b.priority) {
                return a.priority < b.priority;
            }
            if (a.due != b.due) {
                return a.due < b.due;
            }
            return a.sequence < b.sequence;
        }
    };
    struct DelayedOrder {
        // Inverted: the earliest due entry on top of the heap.
        bool operator()(const Entry& a, const Entry& b) const {
            return a.due != b.due ? a.due > b.due : a.sequence > b.sequence;
        }
    };

    void WorkerLoop();
    // Moves every delayed entry that has fallen due into the ready set.
    void PromoteDueLocked(Clock::time_point now) REQUIRES(mutex_);

    const size_t count_;
    const std::string name_;
    Mutex mutex_;
    Condition wakeup_;
    bool started_ GUARDED_BY(mutex_) = false;
    bool stopped_ GUARDED_BY(mutex_) = false;
    uint64_t nextSequence_ GUARDED_BY(mutex_) = 0;
    std::set<Entry, ReadyOrder> ready_ GUARDED_BY(mutex_);
    std::priority_queue<Entry, std::vector<Entry>, DelayedOrder> delayed_ GUARDED_BY(mutex_);
    std::vector<std::thread> threads_ GUARDED_BY(mutex_);
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLATFORM_EVENT_THREAD_POOL_H
