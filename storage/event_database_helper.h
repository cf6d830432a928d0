#ifndef ORVANE_STORAGE_EVENT_DATABASE_HELPER_H
#define ORVANE_STORAGE_EVENT_DATABASE_HELPER_H

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include <utils/RefBase.h>

#include "config/event_quota_xml_parser.h"
#include "platform/event.h"
#include "platform/plugin_context.h"
#include "storage/event_database.h"

namespace android {
namespace Orvane {

// The storage bookkeeping: counts fault events under their quotas, drops or records them,
// keeps the day state, stores raw events and the activation time, shrinks the file and
// answers the dump commands.
// Threads: owned by the storage plugin and used only on its loop (the dump commands run there
// too), like the database it reaches. No locks.
class EventDatabaseHelper : public RefBase {
public:
    using DomainQuota = EventQuotaXmlParser::DomainQuota;
    // Whether log collection rules cover an event id; without rules no logs are caught.
    using LogRuleLookup = std::function<bool(uint32_t eventId)>;

    // Opens work folder + `fileName`, finds or makes the version rows and reads the day start.
    // False when the database cannot be opened; events are then still handled, unstored.
    bool Init(PluginContext* context, const std::string& fileName, const std::string& osVersion);
    void SetLogRuleLookup(LogRuleLookup lookup) { logRuleLookup_ = std::move(lookup); }

    void ProcessFaultEvent(sp<Event> event);
    // True when the event is to be dropped; it then carries its "dropReason".
    bool DetectCanDrop(sp<Event> event);
    bool DetectDropByTime(sp<Event> event, SqlRow& row);
    // True when the event started a new counting day.
    bool ProcessNewDayEvent(sp<Event> event);

    void SaveRawEvent(sp<Event> event);
    void SaveUserActivateTime(sp<Event> event);
    // Removes the oldest events until the stored data is below `sizeLimit` bytes, then gives the
    // space back when the disk has room for that.
    void AbridgeDbSize(uint32_t sizeLimit);

    void DumpQueryDb(int fd, const std::vector<std::string>& args);
    void DumpUpdateDb(int fd, const std::vector<std::string>& args);
    void DumpTable(int fd, const std::string& table, int32_t limit);
    void DumpQuota(int fd, const std::string& eventId);

    const std::string& GetDbPath() const { return dbPath_; }
    uint64_t GetDbStartTime() const { return dbStartTime_; }
    int32_t GetVersionId() const { return versionId_; }
    int32_t GetDbVersionRowId() const { return dbVersionRowId_; }
    DomainQuota GetQuota(uint32_t eventId);

private:
    void InitVersionRows();
    void HealFutureDayStart();
    bool HasRoomToVacuum();
    int64_t Compact(bool& canVacuum);
    // Reports the first daily-quota drop of an event id in a day as an event of its own.
    void ReportEventOverQuota(sp<Event> event, uint32_t dailyCnt, uint32_t maxCnt);
    // Decides whether the logs of a kept event may be caught; returns the new last-log time.
    uint64_t CheckAndGetLogTime(sp<Event> event, const DomainQuota& quota, uint64_t lastLogTime);
    int64_t CountRows(const std::string& table);

    PluginContext* context_ = nullptr;
    int32_t dbVersionRowId_ = 0;
    int32_t versionId_ = 0;
    uint64_t dbStartTime_ = 0;
    std::string osVersion_;
    std::string dbPath_;
    sp<EventDatabase> database_;
    LogRuleLookup logRuleLookup_;
    // Statistics, found once in Init.
    DaemonStats::Counter* stored_ = nullptr;
    DaemonStats::Counter* storeFailed_ = nullptr;
    DaemonStats::Counter* droppedOverQuota_ = nullptr;
    DaemonStats::Counter* droppedPunished_ = nullptr;
    DaemonStats::Counter* futureTimes_ = nullptr;
    DaemonStats::Counter* dayStartHealed_ = nullptr;
    DaemonStats::Counter* trimRuns_ = nullptr;
    DaemonStats::Counter* trimRows_ = nullptr;
    DaemonStats::Counter* vacuumSkipped_ = nullptr;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_STORAGE_EVENT_DATABASE_HELPER_H
