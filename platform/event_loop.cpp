#include "platform/event_loop.h"

#include <unistd.h>

#include <algorithm>
#include <utility>

#include "utils/orvane_log.h"
#include "utils/time_util.h"

namespace android {
namespace Orvane {
namespace {

// The sleep of a loop with nothing due, in nanoseconds before and in milliseconds after.
constexpr unsigned long kWaitForever = 2147483647;
constexpr uint64_t kNsPerSecond = 1000000000;
constexpr uint64_t kNsPerMs = 1000000;
constexpr uint64_t kSlowEntryUs = 301000;
constexpr uint64_t kAddFailed = UINT64_MAX;

// The loop whose entries the calling thread runs, if any.
thread_local EventLoop* tRunningLoop = nullptr;

uint64_t Now() {
    return static_cast<uint64_t>(TimeUtil::GetNanoSecondSinceSystemStart());
}

DaemonStats::Counter* LoopCounter(DaemonStats* stats, const std::string& loop, const char* name) {
    return stats == nullptr ? nullptr : &stats->Get("loop." + loop + "." + name);
}

}  // namespace

EventLoop::EventLoop(const std::string& name, std::shared_ptr<DaemonStats> stats)
    : name_(name),
      looper_(new Looper(false)),
      stats_(std::move(stats)),
      backlogHigh_(LoopCounter(stats_.get(), name, "backlog_high")),
      slow_(LoopCounter(stats_.get(), name, "slow")) {}

EventLoop::~EventLoop() {
    OLOGD("%s name :%s exit", name_.c_str());
    StopLoop();
    // Released outside the lock: an entry's destructors may reach back into this loop.
    std::deque<LoopEvent> dropped;
    {
        Mutex::Autolock lock(mutex_);
        dropped.swap(queue_);
    }
}

void EventLoop::StartLoop() {
    if (thread_ != nullptr) {
        OLOGE("%s name :%s thread already exist", name_.c_str());
        return;
    }
    thread_ = new ThreadImpl(name_, [this] { ProcessEventLoop(); });
    status_t ret = thread_->run(name_.c_str(), PRIORITY_DEFAULT, 0);
    OLOGI("%s %s, run ret=%d", name_.c_str(), ret);
}

void EventLoop::StopLoop() {
    if (thread_ == nullptr) {
        return;
    }
    {
        Mutex::Autolock lock(mutex_);
        stopped_ = true;
    }
    thread_->requestExit();
    looper_->wake();
    thread_->requestExitAndWait();
    // A synchronous entry queued while the thread was ending would hold its caller for good;
    // released outside the lock, each gives its caller a failure.
    std::deque<LoopEvent> unrun;
    {
        Mutex::Autolock lock(mutex_);
        auto sync = std::partition(queue_.begin(), queue_.end(), [](const LoopEvent& e) { return e.taskType != 1; });
        std::move(sync, queue_.end(), std::back_inserter(unrun));
        queue_.erase(sync, queue_.end());
        std::make_heap(queue_.begin(), queue_.end());
        backlog_.store(queue_.size(), std::memory_order_relaxed);
    }
}

bool EventLoop::IsCurrentThread() const {
    pid_t loopThread = threadId_.load(std::memory_order_relaxed);
    return loopThread != 0 && loopThread == gettid();
}

LoopEvent EventLoop::NewEntry(unsigned long delaySeconds, bool repeat) const {
    LoopEvent entry;
    entry.isRepeat = repeat;
    entry.interval = delaySeconds * kNsPerSecond;
    entry.createTime = Now();
    entry.enqueueTime = entry.createTime;
    entry.targetTime = entry.enqueueTime + entry.interval;
    return entry;
}

uint64_t EventLoop::Enqueue(LoopEvent entry) {
    uint64_t id = entry.createTime;
    bool deferrable = entry.taskType == 0 && tRunningLoop != nullptr && tRunningLoop != this;
    bool wake = false;
    {
        Mutex::Autolock lock(mutex_);
        if (stopped_ && entry.taskType == 1) {
            return id;  // `entry` is released after the lock, which releases its caller
        }
        PushLocked(std::move(entry));
        wake = sleeping_;
    }
    if (wake && !(deferrable && tRunningLoop->DeferWake(this))) {
        looper_->wake();
    }
    return id;
}

bool EventLoop::DeferWake(EventLoop* receiver) {
    if (!deferredWakes_.empty() && Now() - deferredSinceNs_ >= kMaxDeferredWakeNs) {
        WakeDeferred();  // an entry that keeps handing over does not hold the wakes past the bound
        return false;
    }
    {
        Mutex::Autolock lock(mutex_);
        if (!HasDueEntryLocked()) {
            return false;
        }
    }
    if (deferredWakes_.empty()) {
        deferredSinceNs_ = Now();
    }
    for (const sp<EventLoop>& owed : deferredWakes_) {
        if (owed.get() == receiver) {
            return true;
        }
    }
    deferredWakes_.emplace_back(receiver);
    return true;
}

bool EventLoop::HasDueEntryLocked() {
    return !queue_.empty() && queue_.front().targetTime <= Now();
}

void EventLoop::WakeDeferred() {
    for (const sp<EventLoop>& owed : deferredWakes_) {
        owed->looper_->wake();
    }
    deferredWakes_.clear();
}

void EventLoop::PushLocked(LoopEvent&& entry) {
    queue_.push_back(std::move(entry));
    std::push_heap(queue_.begin(), queue_.end());
    size_t backlog = queue_.size();
    backlog_.store(backlog, std::memory_order_relaxed);
    if (backlogHigh_ != nullptr) {
        DaemonStats::RaiseTo(*backlogHigh_, backlog);
    }
}

uint64_t EventLoop::AddEvent(sp<EventHandler> handler, sp<Event> event, unsigned long delaySeconds, bool repeat) {
    if (handler == nullptr || event == nullptr) {
        OLOGE("%s handler or event is nullptr");
        return kAddFailed;
    }
    LoopEvent entry = NewEntry(delaySeconds, repeat);
    entry.handler = std::move(handler);
    entry.event = std::move(event);
    return Enqueue(std::move(entry));
}

bool EventLoop::AddEventWaitResult(sp<EventHandler> handler, sp<Event> event) {
    if (handler == nullptr || event == nullptr) {
        OLOGE("%s handler or event is nullptr");
        return false;
    }
    if (IsCurrentThread()) {
        OLOGE("%s %s would wait for its own thread for good, event %u refused", name_.c_str(), event->eventId);
        return false;
    }
    LoopEvent entry = NewEntry(0, false);
    entry.taskType = 1;
    entry.syncTask = std::make_shared<SyncTask>(name_, [handler, event]() mutable { return handler->OnEvent(event); });
    std::future<EVENT_RET> result = entry.syncTask->GetResult();
    Enqueue(std::move(entry));
    return result.get() != -1;
}

uint64_t EventLoop::AddTask(std::function<void()> task, unsigned long delaySeconds, bool repeat) {
    LoopEvent entry = NewEntry(delaySeconds, repeat);
    entry.task = std::move(task);
    return Enqueue(std::move(entry));
}

void EventLoop::ProcessEventLoop() {
    // An entry may hold the last reference to this loop. Then the loop is destroyed on its own
    // thread when `self` goes, and from there on only the local looper may be touched.
    sp<Looper> sleeper = looper_;
    if (threadId_.load(std::memory_order_relaxed) == 0) {
        threadId_.store(gettid(), std::memory_order_relaxed);
    }
    unsigned long waitNs = kWaitForever;
    {
        // Empty while another thread destroys this loop; that thread's stop wakes the sleep.
        sp<EventLoop> self = wp<EventLoop>(this).promote();
        bool pending = false;
        tRunningLoop = self.get();
        if (self != nullptr) {
            Mutex::Autolock lock(mutex_);
            pending = !queue_.empty();
            sleeping_ = !pending;
        }
        while (pending) {
            LoopEvent entry;
            if (!FetchNextEvent(Now(), waitNs, entry)) {
                break;
            }
            uint64_t startUs = TimeUtil::GetTimestampUS();
            ProcessEvent(entry);
            uint64_t costUs = TimeUtil::GetTimestampUS() - startUs;
            if (costUs >= kSlowEntryUs) {
                OLOGD("%s onevent name %s  consume time %dms", name_.c_str(), static_cast<int>(costUs / 1000));
                if (slow_ != nullptr) {
                    slow_->fetch_add(1, std::memory_order_relaxed);
                }
            }
            ReEnqueueEvent(entry);
            bool due = false;
            {
                Mutex::Autolock lock(mutex_);
                current_ = nullptr;
                pending = !queue_.empty();
                sleeping_ = !pending;
                due = !deferredWakes_.empty() && HasDueEntryLocked();
            }
            if (!deferredWakes_.empty() && (!due || Now() - deferredSinceNs_ >= kMaxDeferredWakeNs)) {
                WakeDeferred();
            }
        }
        // Nothing owed survives the turn: the loop may sleep next.
        if (self != nullptr) {
            WakeDeferred();
        }
        tRunningLoop = nullptr;
    }
    // An entry due beyond the longest sleep is looked at again after that sleep.
    unsigned long timeoutMs = waitNs == kWaitForever ? kWaitForever : std::min(waitNs / kNsPerMs, kWaitForever);
    sleeper->pollOnce(static_cast<int>(timeoutMs));
}

bool EventLoop::FetchNextEvent(unsigned long now, unsigned long& waitNs, LoopEvent& out) {
    Mutex::Autolock lock(mutex_);
    if (queue_.empty()) {
        sleeping_ = true;
        return false;
    }
    if (queue_.front().targetTime > now) {
        waitNs = queue_.front().targetTime - now;
        sleeping_ = true;
        return false;
    }
    std::pop_heap(queue_.begin(), queue_.end());
    out = std::move(queue_.back());
    queue_.pop_back();
    backlog_.store(queue_.size(), std::memory_order_relaxed);
    current_ = &out;
    return true;
}

void EventLoop::ProcessEvent(LoopEvent& entry) {
    switch (entry.taskType) {
        case 1:
            if (entry.syncTask == nullptr) {
                OLOGW_LIMITED("%s Loop event not execute, no sync task %s", name_.c_str());
                return;
            }
            (*entry.syncTask)();
            return;
        case 0:
            if (entry.task) {
                entry.task();
            } else if (entry.handler != nullptr && entry.event != nullptr) {
                entry.handler->OnEvent(entry.event);
            } else {
                OLOGW_LIMITED("%s Loop event not execute, no task or handler %s", name_.c_str());
            }
            return;
        default:
            OLOGW_LIMITED("%s unrecognized task type. %s", name_.c_str());
    }
}

void EventLoop::ReEnqueueEvent(LoopEvent& entry) {
    if (entry.createTime == 0 || !entry.isRepeat || entry.interval == 0) {
        return;
    }
    // Taken after the run, so a repeating entry drifts by its own run time.
    entry.enqueueTime = Now();
    entry.targetTime = entry.enqueueTime + entry.interval;
    Mutex::Autolock lock(mutex_);
    PushLocked(std::move(entry));
}

}  // namespace Orvane
}  // namespace android
