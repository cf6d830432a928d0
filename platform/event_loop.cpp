#include "platform/event_loop.h"

#include <algorithm>
#include <exception>
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

uint64_t Now() {
    return static_cast<uint64_t>(TimeUtil::GetNanoSecondSinceSystemStart());
}

}  // namespace

EventLoop::EventLoop(const std::string& name) : name_(name), looper_(new Looper(false)) {}

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
    thread_->requestExit();
    looper_->wake();
    thread_->requestExitAndWait();
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

uint64_t EventLoop::Enqueue(LoopEvent&& entry) {
    uint64_t id = entry.createTime;
    {
        Mutex::Autolock lock(mutex_);
        queue_.push_back(std::move(entry));
        std::push_heap(queue_.begin(), queue_.end());
    }
    looper_->wake();
    return id;
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
    LoopEvent entry = NewEntry(0, false);
    entry.taskType = 1;
    entry.syncTask = std::make_shared<std::packaged_task<EVENT_RET()>>(
            [handler, event]() mutable { return handler->OnEvent(event); });
    std::future<EVENT_RET> result = entry.syncTask->get_future();
    Enqueue(std::move(entry));
    try {
        return result.get() != -1;
    } catch (const std::exception& e) {
        // The handler threw: its failure stays on this side.
        OLOGE("%s %s event not handled: %s", name_.c_str(), e.what());
        return false;
    }
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
    unsigned long waitNs = kWaitForever;
    {
        // Empty while another thread destroys this loop; that thread's stop wakes the sleep.
        sp<EventLoop> self = wp<EventLoop>(this).promote();
        bool pending = false;
        if (self != nullptr) {
            Mutex::Autolock lock(mutex_);
            pending = !queue_.empty();
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
            }
            ReEnqueueEvent(entry);
            Mutex::Autolock lock(mutex_);
            current_ = nullptr;
            pending = !queue_.empty();
        }
    }
    // An entry due beyond the longest sleep is looked at again after that sleep.
    unsigned long timeoutMs = waitNs == kWaitForever ? kWaitForever : std::min(waitNs / kNsPerMs, kWaitForever);
    sleeper->pollOnce(static_cast<int>(timeoutMs));
}

bool EventLoop::FetchNextEvent(unsigned long now, unsigned long& waitNs, LoopEvent& out) {
    Mutex::Autolock lock(mutex_);
    if (queue_.empty()) {
        return false;
    }
    if (queue_.front().targetTime > now) {
        waitNs = queue_.front().targetTime - now;
        return false;
    }
    std::pop_heap(queue_.begin(), queue_.end());
    out = std::move(queue_.back());
    queue_.pop_back();
    current_ = &out;
    return true;
}

void EventLoop::ProcessEvent(LoopEvent& entry) {
    switch (entry.taskType) {
        case 1:
            if (entry.syncTask == nullptr) {
                OLOGW("%s Loop event not execute, no sync task %s", name_.c_str());
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
                OLOGW("%s Loop event not execute, no task or handler %s", name_.c_str());
            }
            return;
        default:
            OLOGW("%s unrecognized task type. %s", name_.c_str());
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
    queue_.push_back(std::move(entry));
    std::push_heap(queue_.begin(), queue_.end());
}

}  // namespace Orvane
}  // namespace android
