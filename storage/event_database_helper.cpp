#include "storage/event_database_helper.h"

#include <errno.h>
#include <stdio.h>
#include <stdlib.h>

#include "config/event_upload_xml_parser.h"
#include "config/event_xml_parser.h"
#include "storage/event_table.h"
#include "utils/dev_info.h"
#include "utils/orvane_log.h"
#include "utils/string_util.h"
#include "utils/time_util.h"

namespace android {
namespace Orvane {

namespace {
constexpr uint64_t kDaySeconds = 86400;
constexpr uint64_t kHourSeconds = 3600;
// Abridging first removes what is older than 60 days.
constexpr uint64_t kAbridgeKeepSeconds = 5184000;
constexpr int kAbridgeMaxRounds = 8;
constexpr int32_t kDumpDefaultRows = 20;
constexpr uint32_t kOverQuotaEventId = 908001001;
constexpr uint32_t kFaultEventType = 2;
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
    database_ = EventDatabase::getInstance();
    database_->InitDatabase(dbPath_);
    if (!database_->IsInitialised()) {
        return false;
    }
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
    }
    OLOG_AS(ANDROID_LOG_INFO, "Init", "%s version %s id=%d, db version id=%d, start time=%lu", osVersion_.c_str(),
            versionId_, dbVersionRowId_, static_cast<unsigned long>(dbStartTime_));
}

EventDatabaseHelper::DomainQuota EventDatabaseHelper::GetQuota(uint32_t eventId) {
    if (context_ == nullptr) {
        return DomainQuota();
    }
    return EventQuotaXmlParser::getInstance()->GetEventQuota(context_->GetConfigDir(), osVersion_, eventId);
}

void EventDatabaseHelper::ProcessFaultEvent(sp<Event> event) {
    if (context_ == nullptr || event == nullptr) {
        return;
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
    if (rows.empty()) {
        database_->Insert(
                kTblEventInfo,
                {kColEventId, kColVersionId, kColOccuredCnt, kColFirstTime, kColParamList, kColExpire, kColVisible},
                {std::to_string(event->eventId), std::to_string(versionId_), "1", happenTime, params,
                 MarkOrZero(event->GetValue(kKeyExpire)), MarkOrZero(event->GetValue(kKeyVisible))});
        return;
    }
    // first_time follows the latest occurrence of the day, so the row stays matched all day.
    int64_t occurred = static_cast<int64_t>(StringUtil::ConvertInt(rows[0][kColOccuredCnt])) + 1;
    EventQuery byId;
    byId.And(kColId, EventQuery::EQ, rows[0][kColId]);
    database_->Update(kTblEventInfo, {kColOccuredCnt, kColFirstTime}, {std::to_string(occurred), happenTime}, byId);
}

bool EventDatabaseHelper::DetectCanDrop(sp<Event> event) {
    if (!ProcessNewDayEvent(event)) {
        if (database_->GetTable(kTblEventDaily) == nullptr) {
            OLOGE("%s failed get tbl %s no drop", kTblEventDaily);
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
        OLOGI("%s event %d over daily cnt drop it, dailyCnt=%d maxCnt=%u", eventId, static_cast<int>(dailyCnt), maxCnt);
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
                OLOGI("%s event %d over hour cnt drop it, hourCnt=%d halfCnt=%d, maxCnt=%u", eventId,
                      static_cast<int>(newHour), static_cast<int>(halfCnt), maxCnt);
                dailyCnt--;  // the stored count stays as it was
                overCnt++;
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
    report->eventType = kFaultEventType;
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
    sp<EventInfoConfig> info =
            EventXmlParser::getInstance()->GetEventInfoConfig(context_->GetConfigDir(), event->eventId);
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

int32_t EventDatabaseHelper::CountRows(const std::string& table, EventQuery query) {
    std::vector<SqlRow> rows = database_->Query(table, query.Select({"count(*)"}), 1);
    return rows.empty() ? 0 : StringUtil::ConvertInt(rows[0]["count(*)"]);
}

void EventDatabaseHelper::AbridgeDbSize(uint32_t sizeLimit) {
    if (database_ == nullptr) {
        return;
    }
    uint64_t now = TimeUtil::GetTimestampSecond();
    uint64_t cutOff = now > kAbridgeKeepSeconds ? now - kAbridgeKeepSeconds : 0;
    for (int round = 1; round <= kAbridgeMaxRounds; round++) {
        EventQuery oldEvents;
        oldEvents.And(kColFirstTime, EventQuery::LT, static_cast<int64_t>(cutOff));
        EventQuery oldRaw;
        oldRaw.And(kColTimestamp, EventQuery::LT, static_cast<int64_t>(cutOff));
        int32_t events = CountRows(kTblEventInfo, oldEvents);
        int32_t raws = CountRows(kTblRawEvents, oldRaw);
        database_->Delete(kTblEventInfo, oldEvents);
        database_->Delete(kTblRawEvents, oldRaw);
        int64_t liveSize = database_->GetLiveSize();
        OLOGI("%s round %d cut-off %lu deleted %d events %d raw events, %ld bytes left", round,
              static_cast<unsigned long>(cutOff), events, raws, static_cast<long>(liveSize));
        if (liveSize < static_cast<int64_t>(sizeLimit)) {
            break;
        }
        cutOff += (now - cutOff) / 2;
    }
    database_->Vacuum();
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
    EventQuotaXmlParser::getInstance()->CheckLogCntLimitAfterIncr(context_->GetConfigDir(), osVersion_, id, 0, &range);
    dprintf(fd,
            "EventId %u quota :\n    dailyCnt = %u\n    logCnt = %u    realLog = %u    logSpace = %u    sameLog = %u   "
            " "
            "inSub = %u\n    minEvent = %u    maxEvent = %u\n",
            id, quota.dailyCnt, quota.maxLogCnt, static_cast<uint32_t>(quota.logCnt), quota.logSpace,
            static_cast<uint32_t>(quota.same), static_cast<uint32_t>(quota.sub), range.eventMin, range.eventMax);
}

}  // namespace Orvane
}  // namespace android
