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
// is never used from two threads at once.
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

    sp<EventDatabaseHelper> helper_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_STORAGE_EVENT_STORAGE_MANAGER_H
