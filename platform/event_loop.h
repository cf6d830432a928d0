#ifndef ORVANE_PLATFORM_EVENT_LOOP_H
#define ORVANE_PLATFORM_EVENT_LOOP_H

#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <string>

#include <utils/Looper.h>
#include <utils/Mutex.h>
#include <utils/RefBase.h>
#include <utils/StrongPointer.h>
#include <utils/Thread.h>

#include "platform/event.h"
#include "platform/event_handler.h"

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
// thread takes and runs them. `mutex` guards `queue` and `current` and is never held while an
// entry runs; producers wake the looper after releasing it. StartLoop and StopLoop belong to
// the loop's owner and must not race each other. Always hold a loop through sp<EventLoop>.
class EventLoop : public RefBase {
public:
    explicit EventLoop(const std::string& name);
    ~EventLoop() override;

    void StartLoop();
    // Stops the thread and waits for it; entries still queued never run.
    void StopLoop();

    // Delivers `event` to `handler` on this loop after `delaySeconds`, again every
    // `delaySeconds` when `repeat`. Returns the entry's identifier, or UINT64_MAX for an empty
    // handler or event.
    uint64_t AddEvent(sp<EventHandler> handler, sp<Event> event, unsigned long delaySeconds = 0, bool repeat = false);
    // Runs handler->OnEvent(event) on this loop and waits for it; false when it returned -1 or
    // could not run. Never call it from this loop's own thread.
    bool AddEventWaitResult(sp<EventHandler> handler, sp<Event> event);
    uint64_t AddTask(std::function<void()> task, unsigned long delaySeconds = 0, bool repeat = false);

    const std::string& GetName() const { return name_; }

private:
    LoopEvent NewEntry(unsigned long delaySeconds, bool repeat) const;
    uint64_t Enqueue(LoopEvent&& entry);
    // One turn of the loop's thread: runs every due entry, then sleeps until the next is due
    // or a producer wakes it.
    void ProcessEventLoop();
    bool FetchNextEvent(unsigned long now, unsigned long& waitNs, LoopEvent& out);
    void ProcessEvent(LoopEvent& entry);
    void ReEnqueueEvent(LoopEvent& entry);

    const std::string name_;
    sp<ThreadImpl> thread_;
    const sp<Looper> looper_;
    LoopEvent* current_ = nullptr;
    Mutex mutex_;
    std::deque<LoopEvent> queue_;
    // Kept for file-descriptor events; nothing registers any yet.
    std::map<int, sp<FileEventHandler>> fileHandlers_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLATFORM_EVENT_LOOP_H
