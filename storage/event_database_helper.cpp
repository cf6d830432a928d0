#include "storage/event_database_helper.h"

#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/statvfs.h>

#include <algorithm>
#include <cinttypes>
#include <cmath>

#include <android-base/file.h>

#include "config/event_upload_xml_parser.h"
#include "config/event_xml_parser.h"
#include "storage/event_table.h"
#include "utils/dev_info.h"
#include "utils/file_util.h"
#include "utils/orvane_log.h"
#include "utils/string_util.h"
#include "utils/time_util.h"

namespace android {
namespace Orvane {

namespace {
constexpr uint64_t kDaySeconds = 86400;
constexpr uint64_t kHourSeconds = 3600;
// A happen time further ahead of the wall clock than this is taken as the clock's time, and a
// stored day start further ahead is brought back to today at start-up.
constexpr uint64_t kFutureMarginSeconds = 86400;
// Abridging first removes what is older than 60 days.
constexpr uint64_t kAbridgeKeepSeconds = 5184000;
// Later rounds take the oldest rows in proportion to the excess, at least this many per table.
constexpr int kAbridgeMaxRounds = 16;
constexpr int64_t kAbridgeMinRows = 8;
constexpr int32_t kDumpDefaultRows = 20;
constexpr uint32_t kOverQuotaEventId = 908001001;
constexpr char kFaultPipeline[] = "dftFaultEvent";
constexpr char kSender[] = "EventStorageManager";

constexpr char kUsageQuery[] = "usage: query <table> [limit]\n";
constexpr char kUsageUpdate[] = "usage: update <table> <column> <value> <whereColumn> <whereValue>\n";

// INTEGER values stand verbatim in the SQL text, so only whole numbers may reach them.
bool IsInteger(const std::string& text) {
    if (text.empty()) {
        return false;
    }
    char* end = nullptr;
    errno = 0;
    strtoll(text.c_str(), &end, 10);
    return errno == 0 && *end == '\0' && text.find_first_of(" \t\n\r\f\v") == std::string::npos;
}

// An event's mark as an INTEGER column's value: "0" when absent or not a number.
std::string MarkOrZero(const std::string& value) {
    return IsInteger(value) ? value : "0";
}

uint64_t ToU64(const std::string& text) {
    return strtoull(text.c_str(), nullptr, 10);
}

// The rows to take from a table of `rows` rows to remove `excess` (a share) of its data.
int64_t ShareOf(int64_t rows, double excess) {
    int64_t share = static_cast<int64_t>(std::ceil(static_cast<double>(rows) * excess));
    return std::min(rows, std::max(share, kAbridgeMinRows));
}

std::string Join(const std::vector<std::string>& items, const char* separator) {
    std::string joined;
    for (size_t i = 0; i < items.size(); i++) {
        joined += (i > 0 ? separator : "") + items[i];
    }
    return joined;
}
}  // namespace

bool EventDatabaseHelper::Init(PluginContext* context, const std::string& fileName, const std::string& osVersion) {
    if (context == nullptr) {
        OLOGE("%s no plugin context");
        return false;
    }
    context_ = context;
    osVersion_ = osVersion;
    if (!logRuleLookup_) {
        logRuleLookup_ = [context](uint32_t eventId) {
            return EventUploadXmlParser::getInstance()->HasLogRules(*context, eventId);
        };
    }
    dbPath_ = context->GetWorkDir() + fileName;
    DaemonStats& stats = context->GetStats();
    stored_ = &stats.Get("storage.events.stored");
    storeFailed_ = &stats.Get("storage.events.store_failed");
    droppedOverQuota_ = &stats.Get("storage.events.dropped.over_daily_quota");
    droppedPunished_ = &stats.Get("storage.events.dropped.punished");
    futureTimes_ = &stats.Get("storage.events.future_time");
    dayStartHealed_ = &stats.Get("storage.day_start.healed");
    trimRuns_ = &stats.Get("storage.trim.runs");
    trimRows_ = &stats.Get("storage.trim.rows");
    vacuumSkipped_ = &stats.Get("storage.trim.vacuum_skipped");
    database_ = EventDatabase::getInstance();
    database_->SetStats(&stats);
    database_->InitDatabase(dbPath_);
    if (!database_->IsInitialised()) {
        return false;
    }
    // A damaged file is replaced by an empty one, which needs its version rows again.
    wp<EventDatabaseHelper> weak = this;
    database_->SetRecoveryListener([weak]() {
        sp<EventDatabaseHelper> self = weak.promote();
        if (self != nullptr) {
            self->InitVersionRows();
        }
    });
    InitVersionRows();
    return true;
}

void EventDatabaseHelper::InitVersionRows() {
    EventQuery byVersion;
    byVersion.Select({kColId}).And(kColVersion, EventQuery::EQ, osVersion_);
    std::vector<SqlRow> rows = database_->Query(kTblVersion, byVersion, 1);
    versionId_ = rows.empty() ? database_->InsertAndGetID(kTblVersion, {kColVersion}, {osVersion_})
                              : StringUtil::ConvertInt(rows[0][kColId]);

    EventQuery newest;
    newest.Select({kColId, kColStartTime}).Order(kColId, false);
    rows = database_->Query(kTblDbVersion, newest, 1);
    if (rows.empty()) {
        dbStartTime_ = TimeUtil::GetZeroTimestampSec(TimeUtil::GetTimestampSecond());
        dbVersionRowId_ = database_->InsertAndGetID(kTblDbVersion, {kColDbVersion, kColDevVersion, kColStartTime},
                                                    {"1", osVersion_, std::to_string(dbStartTime_)});
    } else {
        dbVersionRowId_ = StringUtil::ConvertInt(rows[0][kColId]);
        dbStartTime_ = ToU64(rows[0][kColStartTime]);
        HealFutureDayStart();
    }
    OLOG_AS(ANDROID_LOG_INFO, "Init", "%s version %s id=%d, db version id=%d, start time=%lu", osVersion_.c_str(),
            versionId_, dbVersionRowId_, static_cast<unsigned long>(dbStartTime_));
}

// No event can start a new day before the stored day start plus a day, so a day start far ahead of
// the clock (left by a daemon that took absurd happen times as they came) would stop the daily
// counting until then.
void EventDatabaseHelper::HealFutureDayStart() {
    uint64_t now = TimeUtil::GetTimestampSecond();
    if (now == 0 || dbStartTime_ <= now + kFutureMarginSeconds) {
        return;
    }
    uint64_t today = static_cast<uint64_t>(TimeUtil::GetZeroTimestampSec(static_cast<int64_t>(now)));
    OLOG_AS(ANDROID_LOG_WARN, "Init",
            "%s day start %" PRIu64 " lies beyond the clock %" PRIu64 ", starts again at %" PRIu64, dbStartTime_, now,
            today);
    dbStartTime_ = today;
    EventQuery byId;
    byId.And(kColId, EventQuery::EQ, static_cast<int64_t>(dbVersionRowId_));
    database_->Update(kTblDbVersion, {kColStartTime}, {std::to_string(dbStartTime_)}, byId);
    dayStartHealed_->fetch_add(1, std::memory_order_relaxed);
}

EventDatabaseHelper::DomainQuota EventDatabaseHelper::GetQuota(uint32_t eventId) {
    if (context_ == nullptr) {
        return DomainQuota();
    }
    return EventQuotaXmlParser::getInstance()->GetEventQuota(*context_, osVersion_, eventId);
}

void EventDatabaseHelper::ProcessFaultEvent(sp<Event> event) {
    if (context_ == nullptr || event == nullptr) {
        return;
    }
    // Taken as it came, such a time would move the counting day far ahead (see HealFutureDayStart).
    uint64_t now = TimeUtil::GetTimestampSecond();
    if (now != 0 && event->happenTime > now + kFutureMarginSeconds) {
        OLOGW_LIMITED("%s event %u happen time %" PRIu64 " is more than %" PRIu64
                      " s ahead of the clock, taken as %" PRIu64,
                      event->eventId, event->happenTime, kFutureMarginSeconds, now);
        futureTimes_->fetch_add(1, std::memory_order_relaxed);
        event->happenTime = now;
    }
    if (DetectCanDrop(event)) {
        return;
    }
    int64_t dayStart = TimeUtil::GetZeroTimestampSec(static_cast<int64_t>(event->happenTime));
    std::string params = event->GetValue(kKeyParamList);
    EventQuery sameDay;
    sameDay.Select({kColId, kColOccuredCnt})
            .And(kColEventId, EventQuery::EQ, static_cast<int64_t>(event->eventId))
            .And(kColVersionId, EventQuery::EQ, static_cast<int64_t>(versionId_))
            .And(kColParamList, EventQuery::EQ, params)
            .And(kColFirstTime, EventQuery::GE, dayStart)
            .And(kColFirstTime, EventQuery::LT, dayStart + static_cast<int64_t>(kDaySeconds));
    std::vector<SqlRow> rows = database_->Query(kTblEventInfo, sameDay, 1);
    std::string happenTime = std::to_string(event->happenTime);
    bool stored = false;
    if (rows.empty()) {
        stored = database_->Insert(
                kTblEventInfo,
                {kColEventId, kColVersionId, kColOccuredCnt, kColFirstTime, kColParamList, kColExpire, kColVisible},
                {std::to_string(event->eventId), std::to_string(versionId_), "1", happenTime, params,
                 MarkOrZero(event->GetValue(kKeyExpire)), MarkOrZero(event->GetValue(kKeyVisible))});
    } else {
        // first_time follows the latest occurrence of the day, so the row stays matched all day.
        int64_t occurred = static_cast<int64_t>(StringUtil::ConvertInt(rows[0][kColOccuredCnt])) + 1;
        EventQuery byId;
        byId.And(kColId, EventQuery::EQ, rows[0][kColId]);
        stored = database_->Update(kTblEventInfo, {kColOccuredCnt, kColFirstTime},
                                   {std::to_string(occurred), happenTime}, byId);
    }
    (stored ? stored_ : storeFailed_)->fetch_add(1, std::memory_order_relaxed);
}

bool EventDatabaseHelper::DetectCanDrop(sp<Event> event) {
    if (!ProcessNewDayEvent(event)) {
        if (database_->GetTable(kTblEventDaily) == nullptr) {
            OLOGE_LIMITED("%s failed get tbl %s no drop", kTblEventDaily);
            return false;
        }
        EventQuery byEvent;
        byEvent.Select(database_->GetTable(kTblEventDaily)->GetFieldNameList())
                .And(kColEventId, EventQuery::EQ, static_cast<int64_t>(event->eventId));
        std::vector<SqlRow> rows = database_->Query(kTblEventDaily, byEvent, 1);
        if (!rows.empty()) {
            return DetectDropByTime(event, rows[0]);
        }
    }
    DomainQuota quota = GetQuota(event->eventId);
    uint64_t lastLog = CheckAndGetLogTime(event, quota, 0);
    database_->Insert(kTblEventDaily,
                      {kColEventId, kColDailyCnt, kColOverCnt, kColHourCnt, kColNextExpireTime, kColLastHappenTime,
                       kColLastLogTime},
                      {std::to_string(event->eventId), "1", "0", "1", std::to_string(event->happenTime + kHourSeconds),
                       std::to_string(event->happenTime), std::to_string(lastLog)});
    return false;
}

bool EventDatabaseHelper::DetectDropByTime(sp<Event> event, SqlRow& row) {
    DomainQuota quota = GetQuota(event->eventId);
    uint32_t maxCnt = quota.dailyCnt;
    auto read = [&row](const char* column) -> uint32_t {
        auto it = row.find(column);
        return it == row.end() ? 0 : StringUtil::ConvertUInt(it->second);
    };
    uint32_t overCnt = read(kColOverCnt);
    uint32_t dailyCnt = read(kColDailyCnt);
    uint32_t hourCnt = read(kColHourCnt);
    uint64_t nextExpire = read(kColNextExpireTime);
    uint64_t lastHappen = read(kColLastHappenTime);
    uint64_t lastLog = read(kColLastLogTime);
    int eventId = static_cast<int>(event->eventId);
    OLOGD("%s event %d parser maxCnt=%u lastTime=%lu same=%d", eventId, maxCnt, static_cast<unsigned long>(lastHappen),
          quota.same);

    bool dropped = false;
    if (maxCnt <= dailyCnt) {
        event->SetValue(kKeyDropReason, "over daily quota");
        overCnt++;
        ReportEventOverQuota(event, dailyCnt, maxCnt);
        OLOGI_LIMITED("%s event %d over daily cnt drop it, dailyCnt=%d maxCnt=%u", eventId, static_cast<int>(dailyCnt),
                      maxCnt);
        droppedOverQuota_->fetch_add(1, std::memory_order_relaxed);
        dropped = true;
    } else {
        uint64_t now = event->happenTime;
        uint64_t remaining = maxCnt - dailyCnt;
        if (now >= nextExpire) {
            // The period advances one hour per event, so it catches up after a quiet spell.
            nextExpire += kHourSeconds;
            hourCnt = 1;
        } else {
            uint64_t halfCnt = ((remaining + 23) / 24 + 1) / 2;
            uint64_t newHour = static_cast<uint64_t>(hourCnt) + 1;
            if (newHour > halfCnt &&
                now - lastHappen < (dbStartTime_ + kDaySeconds - now) * (newHour - halfCnt) / remaining) {
                event->SetValue(kKeyDropReason, "event happen too sequence, drop it by punish");
                OLOGI_LIMITED("%s event %d over hour cnt drop it, hourCnt=%d halfCnt=%d, maxCnt=%u", eventId,
                              static_cast<int>(newHour), static_cast<int>(halfCnt), maxCnt);
                dailyCnt--;  // the stored count stays as it was
                overCnt++;
                droppedPunished_->fetch_add(1, std::memory_order_relaxed);
                dropped = true;
            } else {
                hourCnt = static_cast<uint32_t>(newHour);
            }
        }
        if (!dropped) {
            lastLog = CheckAndGetLogTime(event, quota, lastLog);
            lastHappen = now;
        }
    }
    EventQuery byId;
    byId.And(kColId, EventQuery::EQ, row[kColId]);
    database_->Update(
            kTblEventDaily,
            {kColDailyCnt, kColHourCnt, kColNextExpireTime, kColOverCnt, kColLastHappenTime, kColLastLogTime},
            {std::to_string(static_cast<uint64_t>(dailyCnt) + 1), std::to_string(hourCnt), std::to_string(nextExpire),
             std::to_string(overCnt), std::to_string(lastHappen), std::to_string(lastLog)},
            byId);
    return dropped;
}

bool EventDatabaseHelper::ProcessNewDayEvent(sp<Event> event) {
    // A clock set back never starts a new day.
    if (event->happenTime < dbStartTime_ + kDaySeconds) {
        return false;
    }
    uint64_t oldEnd = dbStartTime_ + kDaySeconds;
    dbStartTime_ = TimeUtil::GetZeroTimestampSec(static_cast<int64_t>(event->happenTime));
    OLOGD("%s daily tbl truncate event happen time %ld, start time=%lddb time =%ld",
          static_cast<long>(event->happenTime), static_cast<long>(dbStartTime_), static_cast<long>(oldEnd));
    database_->TruncateAndCreate(kTblEventDaily);
    EventQuery byId;
    byId.And(kColId, EventQuery::EQ, static_cast<int64_t>(dbVersionRowId_));
    database_->Update(kTblDbVersion, {kColStartTime}, {std::to_string(dbStartTime_)}, byId);
    return true;
}

void EventDatabaseHelper::ReportEventOverQuota(sp<Event> event, uint32_t dailyCnt, uint32_t maxCnt) {
    // Only the first drop of the day is reported; later ones have a higher dailyCnt.
    if (dailyCnt != maxCnt) {
        return;
    }
    sp<EventLoop> loop = context_->GetSharedWorkLoop();
    if (loop == nullptr) {
        OLOGE("%s no work loop, event %u not reported", event->eventId);
        return;
    }
    sp<Event> report = new Event(kSender);
    report->eventType = kEventTypeFault;
    report->eventId = kOverQuotaEventId;
    report->happenTime = event->happenTime;
    char params[96];
    snprintf(params, sizeof(params), "{\"EventId\":%u,\"DailyCnt\":%u,\"MaxCnt\":%u}", event->eventId, dailyCnt,
             maxCnt);
    report->SetValue(kKeyParamList, params);
    OLOGI("%s event %u reached its daily quota %u", event->eventId, maxCnt);
    // Posted, so that the report never re-enters the storage step that is running now.
    PluginContext* context = context_;
    loop->AddTask([context, report]() {
        if (!context->InsertEventToPipeline(kFaultPipeline, report)) {
            OLOG_AS(ANDROID_LOG_WARN, "ReportEventOverQuota", "%s no pipeline %s", kFaultPipeline);
        }
    });
}

uint64_t EventDatabaseHelper::CheckAndGetLogTime(sp<Event> event, const DomainQuota& quota, uint64_t lastLogTime) {
    if (!logRuleLookup_ || !logRuleLookup_(event->eventId)) {
        event->SetValue(kKeyNoCatchLog, kNoLogConfig);
        return lastLogTime;
    }
    sp<EventInfoConfig> info = EventXmlParser::getInstance()->GetEventInfoConfig(*context_, event->eventId);
    int32_t spacing = info != nullptr ? info->extendS : 0;
    uint64_t now = event->happenTime;
    bool tooSoon = spacing > 0 && now < lastLogTime + static_cast<uint64_t>(spacing);
    bool caughtToday = !quota.same && lastLogTime >= dbStartTime_ && lastLogTime < dbStartTime_ + kDaySeconds;
    if (tooSoon || caughtToday) {
        event->SetValue(kKeyNoCatchLog, kWaitLogCatch);
        return lastLogTime;
    }
    return now;
}

void EventDatabaseHelper::SaveRawEvent(sp<Event> event) {
    if (database_ == nullptr || event == nullptr) {
        return;
    }
    int32_t id = database_->InsertAndGetID(
            kTblRawEvents, {kColEventId, kColParamList, kColTimestamp},
            {std::to_string(event->eventId), event->GetValue(kKeyParamList), std::to_string(event->happenTime)});
    event->SetValue(kKeyRawEventDbId, std::to_string(id));
}

void EventDatabaseHelper::SaveUserActivateTime(sp<Event> event) {
    if (database_ == nullptr || event == nullptr) {
        return;
    }
    EventQuery byId;
    byId.And(kColId, EventQuery::EQ, static_cast<int64_t>(dbVersionRowId_));
    database_->Update(kTblDbVersion, {kColActivateTime}, {std::to_string(event->happenTime)}, byId);
    DevInfo::SetActivateTime(event->happenTime);
}

int64_t EventDatabaseHelper::CountRows(const std::string& table) {
    EventQuery all;
    std::vector<SqlRow> rows = database_->Query(table, all.Select({"count(*)"}), 1);
    return rows.empty() ? 0 : StringUtil::ConvertInt(rows[0]["count(*)"]);
}

// The cap holds for the stored data: rows older than 60 days go first, then, while the data is still
// at or above the cap, the oldest rows of each event table in proportion to the excess, today's
// included. The bookkeeping tables (event_daily, db_version, version) are never trimmed.
void EventDatabaseHelper::AbridgeDbSize(uint32_t sizeLimit) {
    if (context_ == nullptr || database_ == nullptr || !database_->IsInitialised()) {
        return;
    }
    trimRuns_->fetch_add(1, std::memory_order_relaxed);
    bool canVacuum = HasRoomToVacuum();
    uint64_t now = TimeUtil::GetTimestampSecond();
    int64_t cutOff = static_cast<int64_t>(now > kAbridgeKeepSeconds ? now - kAbridgeKeepSeconds : 0);
    int64_t deleted = database_->DeleteOlderThan(kTblEventInfo, kColFirstTime, cutOff) +
                      database_->DeleteOlderThan(kTblRawEvents, kColTimestamp, cutOff);
    int64_t liveSize = Compact(canVacuum);
    OLOGI("%s round 1 cut-off %" PRId64 " deleted %" PRId64 " rows, %" PRId64 " bytes left", cutOff, deleted, liveSize);
    for (int round = 2; liveSize >= static_cast<int64_t>(sizeLimit) && round <= kAbridgeMaxRounds; round++) {
        int64_t events = CountRows(kTblEventInfo);
        int64_t raws = CountRows(kTblRawEvents);
        if (events + raws == 0) {
            OLOGW("%s no events left to trim, %" PRId64 " bytes stay at or above the cap %u", liveSize, sizeLimit);
            break;
        }
        double excess = static_cast<double>(liveSize - static_cast<int64_t>(sizeLimit)) / static_cast<double>(liveSize);
        int64_t removed = database_->DeleteOldest(kTblEventInfo, kColFirstTime, ShareOf(events, excess)) +
                          database_->DeleteOldest(kTblRawEvents, kColTimestamp, ShareOf(raws, excess));
        liveSize = Compact(canVacuum);
        OLOGI("%s round %d deleted the oldest %" PRId64 " rows, %" PRId64 " bytes left", round, removed, liveSize);
        deleted += removed;
        if (removed == 0) {
            break;
        }
    }
    trimRows_->fetch_add(static_cast<uint64_t>(deleted), std::memory_order_relaxed);
}

// A vacuum writes a copy of the live data and journals the pages it rewrites; on a disk without
// room for both it would fail after doing most of the work. Freed pages are reused by later rows
// either way, so the file only shrinks when there is room for that.
bool EventDatabaseHelper::HasRoomToVacuum() {
    uint64_t fileSize = static_cast<uint64_t>(std::max<int64_t>(FileUtil::GetFileSize(dbPath_), 0));
    struct statvfs fs;
    uint64_t room = statvfs(base::Dirname(dbPath_).c_str(), &fs) == 0
                            ? static_cast<uint64_t>(fs.f_bavail) * static_cast<uint64_t>(fs.f_frsize)
                            : 0;
    if (room >= 2 * fileSize) {
        return true;
    }
    OLOGI("%s %" PRIu64 " bytes free, %" PRIu64 " needed to vacuum %s; its freed pages are reused instead", room,
          2 * fileSize, dbPath_.c_str());
    vacuumSkipped_->fetch_add(1, std::memory_order_relaxed);
    return false;
}

// The bytes of the pages that hold data, after giving the free ones back when `canVacuum`; a
// vacuum also packs what is left, so that the next round's share is measured on real data.
int64_t EventDatabaseHelper::Compact(bool& canVacuum) {
    int64_t liveSize = database_->GetLiveSize();
    if (canVacuum && liveSize >= 0 && liveSize < FileUtil::GetFileSize(dbPath_)) {
        canVacuum = database_->Vacuum();
        liveSize = database_->GetLiveSize();
    }
    return liveSize;
}

void EventDatabaseHelper::DumpQueryDb(int fd, const std::vector<std::string>& args) {
    if (args.size() < 2 || args.size() > 3) {
        dprintf(fd, "%s", kUsageQuery);
        return;
    }
    int32_t limit = kDumpDefaultRows;
    if (args.size() == 3) {
        limit = StringUtil::ConvertInt(args[2]);
        if (limit <= 0) {
            dprintf(fd, "%s", kUsageQuery);
            return;
        }
    }
    DumpTable(fd, args[1], limit);
}

void EventDatabaseHelper::DumpTable(int fd, const std::string& table, int32_t limit) {
    sp<BaseTable> tbl = database_ != nullptr ? database_->GetTable(table) : nullptr;
    if (tbl == nullptr) {
        dprintf(fd, "unknown table %s\n", table.c_str());
        return;
    }
    std::vector<std::string> names = tbl->GetFieldNameList();
    dprintf(fd, "%s\n", Join(names, " | ").c_str());
    EventQuery newestFirst;
    newestFirst.Select(names).Order(kColId, false);
    for (auto& row : database_->Query(table, newestFirst, limit)) {
        std::vector<std::string> values;
        for (const auto& name : names) {
            values.push_back(row[name]);
        }
        dprintf(fd, "%s\n", Join(values, " | ").c_str());
    }
}

void EventDatabaseHelper::DumpUpdateDb(int fd, const std::vector<std::string>& args) {
    if (args.size() != 6) {
        dprintf(fd, "%s", kUsageUpdate);
        return;
    }
    const std::string& table = args[1];
    sp<BaseTable> tbl = database_ != nullptr ? database_->GetTable(table) : nullptr;
    if (tbl == nullptr) {
        dprintf(fd, "unknown table %s\n", table.c_str());
        return;
    }
    for (const std::string* column : {&args[2], &args[4]}) {
        if (tbl->GetField(*column) == nullptr) {
            dprintf(fd, "unknown column %s\n", column->c_str());
            return;
        }
    }
    if (tbl->GetField(args[2])->GetType() != SqlFieldType::TEXT && !IsInteger(args[3])) {
        dprintf(fd, "invalid value %s\n", args[3].c_str());
        return;
    }
    EventQuery where;
    where.And(args[4], EventQuery::EQ, args[5]);
    bool ok = database_->Update(table, {args[2]}, {args[3]}, where);
    dprintf(fd, "%s", ok ? "update ok\n" : "update failed\n");
}

void EventDatabaseHelper::DumpQuota(int fd, const std::string& eventId) {
    uint32_t id = StringUtil::ConvertUInt(eventId);
    if (id == 0 || context_ == nullptr) {
        dprintf(fd, "EventId %s invalid\n", eventId.c_str());
        return;
    }
    DomainQuota quota = GetQuota(id);
    // The range comes with the log counting lookup; an increment of 0 counts nothing.
    DomainQuota range;
    EventQuotaXmlParser::getInstance()->CheckLogCntLimitAfterIncr(*context_, osVersion_, id, 0, &range);
    dprintf(fd,
            "EventId %u quota :\n    dailyCnt = %u\n    logCnt = %u    realLog = %u    logSpace = %u    sameLog = %u   "
            " "
            "inSub = %u\n    minEvent = %u    maxEvent = %u\n",
            id, quota.dailyCnt, quota.maxLogCnt, static_cast<uint32_t>(quota.logCnt), quota.logSpace,
            static_cast<uint32_t>(quota.same), static_cast<uint32_t>(quota.sub), range.eventMin, range.eventMax);
}

}  // namespace Orvane
}  // namespace android
