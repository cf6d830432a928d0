#include "storage/event_table.h"

namespace android {
namespace Orvane {

namespace {
sp<SqlField> KeyField() {
    return new SqlField(kColId, SqlFieldType::INTEGER, true, true, false);
}

sp<SqlField> NotNull(const char* name, SqlFieldType type) {
    return new SqlField(name, type, false);
}

sp<SqlField> Nullable(const char* name, SqlFieldType type) {
    return new SqlField(name, type);
}
}  // namespace

EventTable::EventTable() : BaseTable(kTblEventInfo) {
    AddField(KeyField());
    AddField(NotNull(kColEventId, SqlFieldType::INTEGER));
    AddField(Nullable(kColTraceId, SqlFieldType::TEXT));
    AddField(Nullable(kColPspanId, SqlFieldType::TEXT));
    AddField(Nullable(kColSpanId, SqlFieldType::TEXT));
    AddField(NotNull(kColVersionId, SqlFieldType::INTEGER));
    AddField(Nullable(kColOccuredCnt, SqlFieldType::INTEGER));
    AddField(Nullable(kColFirstTime, SqlFieldType::INTEGER));
    AddField(Nullable(kColParamList, SqlFieldType::TEXT));
    AddField(Nullable(kColExpire, SqlFieldType::INTEGER));
    AddField(Nullable(kColVisible, SqlFieldType::INTEGER));
}

EventDailyTable::EventDailyTable() : BaseTable(kTblEventDaily) {
    AddField(KeyField());
    AddField(NotNull(kColEventId, SqlFieldType::INTEGER));
    AddField(NotNull(kColDailyCnt, SqlFieldType::INTEGER));
    AddField(NotNull(kColOverCnt, SqlFieldType::INTEGER));
    AddField(NotNull(kColHourCnt, SqlFieldType::INTEGER));
    AddField(Nullable(kColNextExpireTime, SqlFieldType::INTEGER));
    AddField(Nullable(kColLastHappenTime, SqlFieldType::INTEGER));
    AddField(Nullable(kColLastLogTime, SqlFieldType::INTEGER));
}

EventVersionTable::EventVersionTable() : BaseTable(kTblVersion) {
    AddField(KeyField());
    AddField(NotNull(kColVersion, SqlFieldType::TEXT));
}

EventDBVersionTable::EventDBVersionTable() : BaseTable(kTblDbVersion) {
    AddField(KeyField());
    AddField(NotNull(kColDbVersion, SqlFieldType::INTEGER));
    AddField(NotNull(kColDevVersion, SqlFieldType::TEXT));
    AddField(NotNull(kColStartTime, SqlFieldType::INTEGER));
    AddField(Nullable(kColActivateTime, SqlFieldType::INTEGER));
}

EventUploadTable::EventUploadTable() : BaseTable(kTblUpload) {
    AddField(KeyField());
    AddField(NotNull(kColYear, SqlFieldType::INTEGER));
    for (const char* month : kColMonths) {
        AddField(Nullable(month, SqlFieldType::TEXT));
    }
}

RawEventTable::RawEventTable() : BaseTable(kTblRawEvents) {
    AddField(KeyField());
    AddField(NotNull(kColEventId, SqlFieldType::INTEGER));
    AddField(Nullable(kColExtraData, SqlFieldType::TEXT));
    AddField(NotNull(kColTimestamp, SqlFieldType::INTEGER));
    AddField(Nullable(kColParamList, SqlFieldType::TEXT));
}

}  // namespace Orvane
}  // namespace android
