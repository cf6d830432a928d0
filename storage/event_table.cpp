#include "storage/event_table.h"

namespace android {
namespace Orvane {

namespace {
sp<SqlField> KeyField() {
    return new SqlField(COL_ID, SqlFieldType::INTEGER, true, true, false);
}

sp<SqlField> NotNull(const char* name, SqlFieldType type) {
    return new SqlField(name, type, false);
}

sp<SqlField> Nullable(const char* name, SqlFieldType type) {
    return new SqlField(name, type);
}
}  // namespace

EventTable::EventTable() : BaseTable(TBL_EVENT_INFO) {
    AddField(KeyField());
    AddField(NotNull(COL_EVENT_ID, SqlFieldType::INTEGER));
    AddField(Nullable(COL_TRACE_ID, SqlFieldType::TEXT));
    AddField(Nullable(COL_PSPAN_ID, SqlFieldType::TEXT));
    AddField(Nullable(COL_SPAN_ID, SqlFieldType::TEXT));
    AddField(NotNull(COL_VERSION_ID, SqlFieldType::INTEGER));
    AddField(Nullable(COL_OCCURED_CNT, SqlFieldType::INTEGER));
    AddField(Nullable(COL_FIRST_TIME, SqlFieldType::INTEGER));
    AddField(Nullable(COL_PARAM_LIST, SqlFieldType::TEXT));
    AddField(Nullable(COL_EXPIRE, SqlFieldType::INTEGER));
    AddField(Nullable(COL_VISIBLE, SqlFieldType::INTEGER));
}

EventDailyTable::EventDailyTable() : BaseTable(TBL_EVENT_DAILY) {
    AddField(KeyField());
    AddField(NotNull(COL_EVENT_ID, SqlFieldType::INTEGER));
    AddField(NotNull(COL_DAILY_CNT, SqlFieldType::INTEGER));
    AddField(NotNull(COL_OVER_CNT, SqlFieldType::INTEGER));
    AddField(NotNull(COL_HOUR_CNT, SqlFieldType::INTEGER));
    AddField(Nullable(COL_NEXT_EXPIRE_TIME, SqlFieldType::INTEGER));
    AddField(Nullable(COL_LAST_HAPPEN_TIME, SqlFieldType::INTEGER));
    AddField(Nullable(COL_LAST_LOG_TIME, SqlFieldType::INTEGER));
}

EventVersionTable::EventVersionTable() : BaseTable(TBL_VERSION) {
    AddField(KeyField());
    AddField(NotNull(COL_VERSION, SqlFieldType::TEXT));
}

EventDBVersionTable::EventDBVersionTable() : BaseTable(TBL_DB_VERSION) {
    AddField(KeyField());
    AddField(NotNull(COL_DB_VERSION, SqlFieldType::INTEGER));
    AddField(NotNull(COL_DEV_VERSION, SqlFieldType::TEXT));
    AddField(NotNull(COL_START_TIME, SqlFieldType::INTEGER));
    AddField(Nullable(COL_ACTIVATE_TIME, SqlFieldType::INTEGER));
}

EventUploadTable::EventUploadTable() : BaseTable(TBL_UPLOAD) {
    AddField(KeyField());
    AddField(NotNull(COL_YEAR, SqlFieldType::INTEGER));
    for (const char* month : COL_MONTHS) {
        AddField(Nullable(month, SqlFieldType::TEXT));
    }
}

RawEventTable::RawEventTable() : BaseTable(TBL_RAW_EVENTS) {
    AddField(KeyField());
    AddField(NotNull(COL_EVENT_ID, SqlFieldType::INTEGER));
    AddField(Nullable(COL_EXTRA_DATA, SqlFieldType::TEXT));
    AddField(NotNull(COL_TIMESTAMP, SqlFieldType::INTEGER));
    AddField(Nullable(COL_PARAM_LIST, SqlFieldType::TEXT));
}

}  // namespace Orvane
}  // namespace android
