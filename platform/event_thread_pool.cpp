#include "platform/event_thread_pool.h"

#include <pthread.h>

#include <algorithm>

#include "utils/orvane_log.h"

namespace android {
namespace Orvane {

EventThreadPool::EventThreadPool(size_t count, const std::string& name) : count_(count), name_(name) {}

EventThreadPool::~EventThreadPool() {
    Stop();
}

bool EventThreadPool::Start() {
    Mutex::Autolock lock(mutex_);
    if (started_ || stopped_ || count_ == 0) {
        OLOGW("%s pool %s not started: %s", name_.c_str(),
              count_ == 0 ? "no threads" : (stopped_ ? "stopped" : "already running"));
        return false;
    }
    started_ = true;
    for (size_t i = 0; i < count_; i++) {
        threads_.emplace_back(&EventThreadPool::WorkerLoop, this);
    }
    OLOGI("%s pool %s started with %zu threads", name_.c_str(), count_);
    return true;
}

void EventThreadPool::Stop() {
    std::set<Entry, ReadyOrder> dropped;
    std::priority_queue<Entry, std::vector<Entry>, DelayedOrder> droppedDelayed;
    std::vector<std::thread> threads;
    {
        Mutex::Autolock lock(mutex_);
        if (stopped_) {
            return;
        }
        stopped_ = true;
        dropped.swap(ready_);
        droppedDelayed.swap(delayed_);
        threads.swap(threads_);
    }
    wakeup_.broadcast();
    for (auto& thread : threads) {
        if (thread.get_id() == std::this_thread::get_id()) {
            thread.detach();
        } else {
            thread.join();
        }
    }
    if (!dropped.empty() || !droppedDelayed.empty()) {
        OLOGI("%s pool %s stopped, %zu tasks dropped", name_.c_str(), dropped.size() + droppedDelayed.size());
    }
    // The dropped tasks are released here, outside the lock, in case their captures add tasks.
}

bool EventThreadPool::AddTask(Task task, const std::string& taskName, uint32_t delaySeconds, int32_t priority) {
    {
        Mutex::Autolock lock(mutex_);
        if (stopped_ || !task) {
            OLOGW("%s pool %s refuses task %s: %s", name_.c_str(), taskName.c_str(),
                  stopped_ ? "stopped" : "empty task");
            return false;
        }
        Entry entry{std::move(task), taskName, Clock::now() + std::chrono::seconds(delaySeconds), priority,
                    nextSequence_++};
        if (delaySeconds == 0) {
            ready_.insert(std::move(entry));
        } else {
            delayed_.push(std::move(entry));
        }
    }
    wakeup_.signal();
    return true;
}

size_t EventThreadPool::GetPendingCount() {
    Mutex::Autolock lock(mutex_);
    return ready_.size() + delayed_.size();
}

void EventThreadPool::PromoteDueLocked(Clock::time_point now) {
    while (!delayed_.empty() && delayed_.top().due <= now) {
        // The heap only hands out const tops; the entry is copied once on its way to the set.
        ready_.insert(delayed_.top());
        delayed_.pop();
    }
}

void EventThreadPool::WorkerLoop() {
    pthread_setname_np(pthread_self(), name_.substr(0, 15).c_str());
    mutex_.lock();
    while (!stopped_) {
        PromoteDueLocked(Clock::now());
        if (!ready_.empty()) {
            auto node = ready_.extract(ready_.begin());
            mutex_.unlock();
            node.value().task();
            node = {};  // release the task's captures before taking the lock again
            mutex_.lock();
            continue;
        }
        if (delayed_.empty()) {
            wakeup_.wait(mutex_);
        } else {
            // Measured now: the heap may change while waiting.
            Clock::duration wait = delayed_.top().due - Clock::now();
            wakeup_.waitRelative(mutex_, std::max<nsecs_t>(0, std::chrono::nanoseconds(wait).count()));
        }
    }
    mutex_.unlock();
}

}  // namespace Orvane
}  // namespace android
