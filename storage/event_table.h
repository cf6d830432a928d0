#ifndef ORVANE_STORAGE_EVENT_TABLE_H
#define ORVANE_STORAGE_EVENT_TABLE_H

#include "storage/sql_database.h"

namespace android {
namespace Orvane {

// Table and column names of the event database; every statement of the storage code refers
// to columns through these.
inline constexpr char kTblEventInfo[] = "event_info";
inline constexpr char kTblEventDaily[] = "event_daily";
inline constexpr char kTblVersion[] = "version";
inline constexpr char kTblDbVersion[] = "db_version";
inline constexpr char kTblUpload[] = "upload";
inline constexpr char kTblRawEvents[] = "raw_events";

inline constexpr char kColId[] = "id";
inline constexpr char kColEventId[] = "event_id";
// event_info
inline constexpr char kColTraceId[] = "trace_id";
inline constexpr char kColPspanId[] = "pspan_id";
inline constexpr char kColSpanId[] = "span_id";
inline constexpr char kColVersionId[] = "version_id";
inline constexpr char kColOccuredCnt[] = "occured_cnt";
inline constexpr char kColFirstTime[] = "first_time";
inline constexpr char kColParamList[] = "param_list";
inline constexpr char kColExpire[] = "expire";
inline constexpr char kColVisible[] = "visible";
// event_daily
inline constexpr char kColDailyCnt[] = "daily_cnt";
inline constexpr char kColOverCnt[] = "over_cnt";
inline constexpr char kColHourCnt[] = "hour_cnt";
inline constexpr char kColNextExpireTime[] = "next_expire_time";
inline constexpr char kColLastHappenTime[] = "last_happen_time";
inline constexpr char kColLastLogTime[] = "last_log_time";
// version
inline constexpr char kColVersion[] = "version";
// db_version
inline constexpr char kColDbVersion[] = "db_version";
inline constexpr char kColDevVersion[] = "dev_version";
inline constexpr char kColStartTime[] = "start_time";
inline constexpr char kColActivateTime[] = "activate_time";
// upload: June to August are spelled with a capital M in existing files.
inline constexpr char kColYear[] = "year";
inline constexpr const char* kColMonths[12] = {"m1", "m2", "m3", "m4",  "m5",  "M6",
                                               "M7", "M8", "m9", "m10", "m11", "m12"};
// raw_events
inline constexpr char kColExtraData[] = "extra_data";
inline constexpr char kColTimestamp[] = "timestamp";

// The six tables. Each only names itself and declares its columns in their fixed order.
class EventTable : public BaseTable {
public:
    EventTable();
};

class EventDailyTable : public BaseTable {
public:
    EventDailyTable();
};

class EventVersionTable : public BaseTable {
public:
    EventVersionTable();
};

class EventDBVersionTable : public BaseTable {
public:
    EventDBVersionTable();
};

class EventUploadTable : public BaseTable {
public:
    EventUploadTable();
};

class RawEventTable : public BaseTable {
public:
    RawEventTable();
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_STORAGE_EVENT_TABLE_H
