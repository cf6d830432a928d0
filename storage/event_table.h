#ifndef ORVANE_STORAGE_EVENT_TABLE_H
#define ORVANE_STORAGE_EVENT_TABLE_H

#include "storage/sql_database.h"

namespace android {
namespace Orvane {

// Table and column names of the event database; every statement of the storage code refers
// to columns through these.
inline constexpr char TBL_EVENT_INFO[] = "event_info";
inline constexpr char TBL_EVENT_DAILY[] = "event_daily";
inline constexpr char TBL_VERSION[] = "version";
inline constexpr char TBL_DB_VERSION[] = "db_version";
inline constexpr char TBL_UPLOAD[] = "upload";
inline constexpr char TBL_RAW_EVENTS[] = "raw_events";

inline constexpr char COL_ID[] = "id";
inline constexpr char COL_EVENT_ID[] = "event_id";
// event_info
inline constexpr char COL_TRACE_ID[] = "trace_id";
inline constexpr char COL_PSPAN_ID[] = "pspan_id";
inline constexpr char COL_SPAN_ID[] = "span_id";
inline constexpr char COL_VERSION_ID[] = "version_id";
inline constexpr char COL_OCCURED_CNT[] = "occured_cnt";
inline constexpr char COL_FIRST_TIME[] = "first_time";
inline constexpr char COL_PARAM_LIST[] = "param_list";
inline constexpr char COL_EXPIRE[] = "expire";
inline constexpr char COL_VISIBLE[] = "visible";
// event_daily
inline constexpr char COL_DAILY_CNT[] = "daily_cnt";
inline constexpr char COL_OVER_CNT[] = "over_cnt";
inline constexpr char COL_HOUR_CNT[] = "hour_cnt";
inline constexpr char COL_NEXT_EXPIRE_TIME[] = "next_expire_time";
inline constexpr char COL_LAST_HAPPEN_TIME[] = "last_happen_time";
inline constexpr char COL_LAST_LOG_TIME[] = "last_log_time";
// version
inline constexpr char COL_VERSION[] = "version";
// db_version
inline constexpr char COL_DB_VERSION[] = "db_version";
inline constexpr char COL_DEV_VERSION[] = "dev_version";
inline constexpr char COL_START_TIME[] = "start_time";
inline constexpr char COL_ACTIVATE_TIME[] = "activate_time";
// upload: June to August are spelled with a capital M in existing files.
inline constexpr char COL_YEAR[] = "year";
inline constexpr const char* COL_MONTHS[12] = {"m1", "m2", "m3", "m4", "m5", "M6",
                                               "M7", "M8", "m9", "m10", "m11", "m12"};
// raw_events
inline constexpr char COL_EXTRA_DATA[] = "extra_data";
inline constexpr char COL_TIMESTAMP[] = "timestamp";

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
