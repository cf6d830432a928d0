#ifndef ORVANE_STORAGE_EVENT_STORAGE_MANAGER_H
#define ORVANE_STORAGE_EVENT_STORAGE_MANAGER_H

#include <cstdint>
#include <string>
#include <vector>

#include "platform/plugin.h"
#include "storage/event_database_helper.h"

namespace android {
namespace Orvane {

// The plugin that stores events: routes each event by category and id to its kind of storage,
// checks the database size periodically and answers dump commands.
// Threads: OnEvent and CheckEventStore run on the plugin's loop, which owns the helper and,
// through it, the database (opened there as the loop's first task). Dump, entered from a binder
// thread, runs its work as a task on that loop and waits for it, a bounded time, so the database
// is never used from two threads at once. The events of one pass through a backlog share one
// transaction (see EventDatabase::BeginEvent), committed by a task queued behind them.
class EventStorageManager : public Plugin {
public:
    EventStorageManager();

    void OnLoad() override;
    EVENT_RET OnEvent(sp<Event>& event) override;
    void Dump(int fd, const std::vector<std::string>& args) override;

    uint32_t GetStoreProperity(const std::string& name, uint32_t defaultValue);
    void CheckEventStore();
    const sp<EventDatabaseHelper>& GetHelper() const { return helper_; }

private:
    void ScheduleCheck(const sp<EventLoop>& loop, uint32_t delaySeconds);
    void RunDump(int fd, const std::vector<std::string>& args);
    EVENT_RET Store(sp<Event>& event);
    // Commits the events stored so far once the entries queued on the loop ahead of this commit
    // have run, so that a backlog shares one transaction and a lone event commits at once.
    void QueueCommit(const sp<EventLoop>& loop);

    sp<EventDatabaseHelper> helper_;
    // Owned by the plugin's loop.
    bool commitQueued_ = false;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_STORAGE_EVENT_STORAGE_MANAGER_H
