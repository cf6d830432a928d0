#include "storage/event_storage_manager.h"

#include <fcntl.h>
#include <stdio.h>
#include <unistd.h>

#include <memory>

#include <android-base/unique_fd.h>
#include <utils/Condition.h>
#include <utils/Mutex.h>

#include "platform/plugin_context.h"
#include "platform/plugin_factory.h"
#include "utils/dev_info.h"
#include "utils/file_util.h"
#include "utils/orvane_log.h"
#include "utils/string_util.h"

namespace android {
namespace Orvane {

ORVANE_REGISTER_PLUGIN(EventStorageManager);

namespace {
constexpr char kDbFileName[] = "event.db";
constexpr char kPropCheckSize[] = "orvane.store.checksize";
constexpr char kPropCheckTime[] = "orvane.store.checktime";
constexpr char kPropSafeCheck[] = "persist.sys.orvane.safecheck";
constexpr uint32_t kDefaultCheckSize = 209715200;
constexpr uint32_t kDefaultCheckTime = 86400;

constexpr uint32_t kUserActivateEventId = 105;
constexpr uint32_t kRawIdMin = 100000;
constexpr uint32_t kRawIdMax = 199999;
// Handed back for ids that are not stored; as a handler result it ends the pipeline.
constexpr EVENT_RET kNotStored = static_cast<EVENT_RET>(0xFFFFFFFFu);
// How long a dump waits for the storage loop before giving up, in nanoseconds.
constexpr nsecs_t kDumpWaitNs = 10000000000LL;

// A dump handed to the storage loop: its own copy of the caller's descriptor, which it closes when
// done, and the flag the caller waits on.
struct DumpTask {
    base::unique_fd fd;
    Mutex mutex;
    Condition finished;
    bool done GUARDED_BY(mutex) = false;
};
}  // namespace

EventStorageManager::EventStorageManager() : helper_(new EventDatabaseHelper()) {}

void EventStorageManager::OnLoad() {
    SetVersion("EventStorageManager-1.0");
    SetName("EventStorageManager");
    sp<EventLoop> loop = GetLooper();
    if (loop == nullptr) {
        helper_->Init(GetPluginContext(), kDbFileName, DevInfo::GetQuorVersion());
        OLOGE("%s storage manager looper not set");
        return;
    }
    // The database belongs to the loop, so it is opened there, ahead of every event and check.
    wp<EventStorageManager> weak = this;
    loop->AddTask([weak]() {
        sp<EventStorageManager> self = weak.promote();
        if (self != nullptr) {
            self->helper_->Init(self->GetPluginContext(), kDbFileName, DevInfo::GetQuorVersion());
            self->CheckEventStore();
        }
    });
}

void EventStorageManager::ScheduleCheck(const sp<EventLoop>& loop, uint32_t delaySeconds) {
    // Weak, so that the queued check does not keep the plugin (and with it its loop) alive.
    wp<EventStorageManager> weak = this;
    loop->AddTask(
            [weak]() {
                sp<EventStorageManager> self = weak.promote();
                if (self != nullptr) {
                    self->CheckEventStore();
                }
            },
            delaySeconds, false);
}

uint32_t EventStorageManager::GetStoreProperity(const std::string& name, uint32_t defaultValue) {
    PluginContext* context = GetPluginContext();
    std::string text = context != nullptr ? context->GetSysProperity(name, "") : "";
    uint32_t value = text.empty() ? 0 : StringUtil::ConvertUInt(text);
    if (value != 0) {
        return value;
    }
    OLOGD("%s prop %s use default value", name.c_str());
    return defaultValue;
}

void EventStorageManager::CheckEventStore() {
    uint32_t checkSize = GetStoreProperity(kPropCheckSize, kDefaultCheckSize);
    int64_t fileSize = FileUtil::GetFileSize(helper_->GetDbPath());
    if (fileSize >= 0 && static_cast<uint32_t>(fileSize) >= checkSize) {
        helper_->AbridgeDbSize(checkSize);
    }
    uint32_t checkTime = GetStoreProperity(kPropCheckTime, kDefaultCheckTime);
    sp<EventLoop> loop = GetLooper();
    if (loop != nullptr) {
        ScheduleCheck(loop, checkTime);
    }
}

EVENT_RET EventStorageManager::OnEvent(sp<Event>& event) {
    if (event == nullptr) {
        return 0;
    }
    sp<EventDatabase> database = EventDatabase::getInstance();
    database->BeginEvent();
    EVENT_RET result = Store(event);
    sp<EventLoop> loop = GetLooper();
    if (database->EndEvent() || loop == nullptr) {
        database->Commit();
    } else if (database->HasOpenBatch()) {
        QueueCommit(loop);
    }
    return result;
}

void EventStorageManager::QueueCommit(const sp<EventLoop>& loop) {
    if (commitQueued_) {
        return;
    }
    commitQueued_ = true;
    wp<EventStorageManager> weak = this;
    loop->AddTask([weak]() {
        sp<EventStorageManager> self = weak.promote();
        if (self != nullptr) {
            self->commitQueued_ = false;
            EventDatabase::getInstance()->Commit();
        }
    });
}

EVENT_RET EventStorageManager::Store(sp<Event>& event) {
    OLOGD("%s EventStorageManager event=%u,%d", event->eventId, static_cast<int>(event->eventType));
    switch (event->eventType) {
        case kEventTypeRaw:
            if (event->eventId >= kRawIdMin && event->eventId <= kRawIdMax) {
                helper_->SaveRawEvent(event);
            }
            return 0;
        case kEventTypeControl:
            if (event->eventId == kUserActivateEventId) {
                helper_->SaveUserActivateTime(event);
            }
            return 0;
        default:
            if (!IsFaultEventId(event->eventId)) {
                return kNotStored;
            }
            helper_->ProcessFaultEvent(event);
            return 0;
    }
}

void EventStorageManager::Dump(int fd, const std::vector<std::string>& args) {
    if (args.empty()) {
        return;
    }
    sp<EventLoop> loop = GetLooper();
    if (loop == nullptr) {
        RunDump(fd, args);
        return;
    }
    // The task owns a copy of the descriptor, so a dump that outlives the wait writes nowhere harmful.
    auto task = std::make_shared<DumpTask>();
    task->fd.reset(fcntl(fd, F_DUPFD_CLOEXEC, 0));
    if (task->fd < 0) {
        dprintf(fd, "dump failed\n");
        return;
    }
    sp<EventStorageManager> self = this;
    loop->AddTask([self, task, args]() {
        self->RunDump(task->fd.get(), args);
        task->fd.reset();
        Mutex::Autolock lock(task->mutex);
        task->done = true;
        task->finished.signal();
    });
    Mutex::Autolock lock(task->mutex);
    nsecs_t deadline = systemTime(SYSTEM_TIME_MONOTONIC) + kDumpWaitNs;
    for (nsecs_t now = systemTime(SYSTEM_TIME_MONOTONIC); !task->done && now < deadline;
         now = systemTime(SYSTEM_TIME_MONOTONIC)) {
        task->finished.waitRelative(task->mutex, deadline - now);
    }
    if (!task->done) {
        OLOGW("%s storage loop busy, dump %s not done in time", args[0].c_str());
        dprintf(fd, "storage busy, try again\n");
    }
}

void EventStorageManager::RunDump(int fd, const std::vector<std::string>& args) {
    const std::string& command = args[0];
    if (command == "query") {
        helper_->DumpQueryDb(fd, args);
    } else if (command == "update") {
        PluginContext* context = GetPluginContext();
        if (context != nullptr && context->GetSysProperity(kPropSafeCheck, "") == "0") {
            helper_->DumpUpdateDb(fd, args);
        } else {
            dprintf(fd, "not support cmd\n");
        }
    } else if (command == "quota" && args.size() >= 2) {
        helper_->DumpQuota(fd, args[1]);
    } else {
        dprintf(fd,
                "usage: query <table> [limit] | update <table> <column> <value> <whereColumn> <whereValue> | "
                "quota <eventId>\n");
    }
}

}  // namespace Orvane
}  // namespace android
