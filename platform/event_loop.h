#ifndef ORVANE_PLATFORM_EVENT_LOOP_H
#define ORVANE_PLATFORM_EVENT_LOOP_H

#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <utils/Looper.h>
#include <utils/Mutex.h>
#include <utils/RefBase.h>
#include <utils/StrongPointer.h>
#include <utils/Thread.h>

#include "platform/event.h"
#include "platform/event_handler.h"
#include "utils/daemon_stats.h"

namespace android {
namespace Orvane {

// The platform thread behind a loop: calls its function over and over until exit is requested.
class ThreadImpl : public Thread {
public:
    ThreadImpl(const std::string& name, std::function<void()> function)
        : Thread(false), name_(name), function_(std::move(function)) {}

    const std::string& GetName() const { return name_; }

private:
    bool threadLoop() override {
        function_();
        return true;
    }

    const std::string name_;
    const std::function<void()> function_;
};

// Receiver of readiness of a file descriptor watched by a loop.
class FileEventHandler : public virtual RefBase {
public:
    virtual ~FileEventHandler() {}
    virtual int32_t OnFileEvent(int fd, int events) = 0;
};

// A named thread with a timed queue: entries run one at a time, in order of due time, on the
// loop's own thread, which sleeps in the looper while nothing is due.
//
// Threads: any thread may add entries (AddEvent, AddEventWaitResult, AddTask); only the loop's
// thread takes and runs them. `mutex_` guards the queue and is never held while an entry runs;
// producers wake the looper after releasing it, and only when the loop may sleep: a loop still
// running entries looks at the queue again before it sleeps, so waking it is a wasted syscall.
// A loop that hands an entry to another loop while entries of its own are due defers that wake
// until it has run them, for at most kMaxDeferredWakeNs: under load a loop then passes its events
// on a batch per wake, not with one thread switch each, and without a backlog it wakes the
// receiver at once. A wake owed is paid after each entry once it is that old, or at the entry's
// next hand-over; so an entry that hands over once and then runs on (or never ends, as an event
// source's read loop) while entries wait behind it holds that wake until it returns. Synchronous
// entries are never deferred.
// StartLoop and StopLoop belong to the loop's owner and must not race each other. Always hold a
// loop through sp<EventLoop>.
//
// Given statistics, the loop reports the high-water mark of its backlog as
// "loop.<name>.backlog_high" and counts the entries that ran 301 ms or more as "loop.<name>.slow".
class EventLoop : public RefBase {
public:
    explicit EventLoop(const std::string& name, std::shared_ptr<DaemonStats> stats = nullptr);
    ~EventLoop() override;

    void StartLoop();
    // Stops the thread and waits for it; entries still queued never run, and callers still
    // waiting for a synchronous entry are released with a failure.
    void StopLoop();

    // Delivers `event` to `handler` on this loop after `delaySeconds`, again every
    // `delaySeconds` when `repeat`. Returns the entry's identifier, or UINT64_MAX for an empty
    // handler or event.
    uint64_t AddEvent(sp<EventHandler> handler, sp<Event> event, unsigned long delaySeconds = 0, bool repeat = false);
    // Runs handler->OnEvent(event) on this loop and waits for it; false when it returned -1 or
    // cannot run: called on this loop's own thread, which would wait for itself for good, or
    // on a stopped loop. Each refusal logs one error line.
    bool AddEventWaitResult(sp<EventHandler> handler, sp<Event> event);
    uint64_t AddTask(std::function<void()> task, unsigned long delaySeconds = 0, bool repeat = false);

    const std::string& GetName() const { return name_; }
    // True when the caller runs on this loop's thread.
    bool IsCurrentThread() const;
    // The number of entries queued and not yet taken, without taking the lock.
    size_t GetBacklog() const { return backlog_.load(std::memory_order_relaxed); }

    static constexpr uint64_t kMaxDeferredWakeNs = 1000000;

private:
    LoopEvent NewEntry(unsigned long delaySeconds, bool repeat) const;
    // Queues the entry and wakes the loop if it may sleep; a synchronous entry given to a stopped loop is dropped,
    // which releases its caller.
    uint64_t Enqueue(LoopEvent entry);
    void PushLocked(LoopEvent&& entry) REQUIRES(mutex_);
    // One turn of the loop's thread: runs every due entry, then sleeps until the next is due
    // or a producer wakes it.
    void ProcessEventLoop();
    bool FetchNextEvent(unsigned long now, unsigned long& waitNs, LoopEvent& out);
    void ProcessEvent(LoopEvent& entry);
    void ReEnqueueEvent(LoopEvent& entry);
    // On this loop's thread: true when `receiver`'s wake is left for WakeDeferred, because
    // entries of this loop are due.
    bool DeferWake(EventLoop* receiver);
    bool HasDueEntryLocked() REQUIRES(mutex_);
    void WakeDeferred();

    const std::string name_;
    sp<ThreadImpl> thread_;
    const sp<Looper> looper_;
    // Kernel id of the loop's thread, 0 until it has run.
    std::atomic<pid_t> threadId_{0};
    // Keeps the counters below alive as long as this loop.
    const std::shared_ptr<DaemonStats> stats_;
    DaemonStats::Counter* const backlogHigh_;
    DaemonStats::Counter* const slow_;
    std::atomic<size_t> backlog_{0};
    Mutex mutex_;
    LoopEvent* current_ GUARDED_BY(mutex_) = nullptr;
    std::deque<LoopEvent> queue_ GUARDED_BY(mutex_);
    // From the loop's last look at the queue, when it found nothing due, until its next look.
    bool sleeping_ GUARDED_BY(mutex_) = true;
    // Set by StopLoop: synchronous entries are refused from then on.
    bool stopped_ GUARDED_BY(mutex_) = false;
    // Loops whose wake this loop's thread owes, and since when; that thread's only.
    std::vector<sp<EventLoop>> deferredWakes_;
    uint64_t deferredSinceNs_ = 0;
    // Kept for file-descriptor events; nothing registers any yet.
    std::map<int, sp<FileEventHandler>> fileHandlers_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLATFORM_EVENT_LOOP_H
