#ifndef ORVANE_STORAGE_EVENT_DATABASE_H
#define ORVANE_STORAGE_EVENT_DATABASE_H

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include <utils/RefBase.h>

#include "storage/event_query.h"
#include "storage/sql_database.h"

namespace android {
namespace Orvane {

// The process-wide access point to the event database file: opens it, creates and upgrades
// its tables, and runs table-level statements.
// Threads: takes no lock. Only the storage plugin's loop and the dump command (which the
// service runs while that loop is the only other user) reach the instance; any other caller
// must serialise with that loop. Only the creation of the instance is locked.
class EventDatabase : public RefBase {
public:
    static sp<EventDatabase> getInstance();

    void InitDatabase(const std::string& path);
    bool IsInitialised() const { return initialised_; }
    sp<BaseTable> GetTable(const std::string& name) const;
    bool Insert(const std::string& table, std::vector<std::string> names, std::vector<std::string> values);
    // The id of the new row, 0 on failure.
    int32_t InsertAndGetID(const std::string& table, std::vector<std::string> names, std::vector<std::string> values);
    // A query without conditions updates every row.
    bool Update(const std::string& table, std::vector<std::string> names, std::vector<std::string> values,
                EventQuery query);
    std::vector<SqlRow> Query(const std::string& table, EventQuery query, int32_t limit);
    // A query without conditions deletes every row.
    bool Delete(const std::string& table, EventQuery query);
    // Empties the table, restarts its ids and creates it again.
    bool TruncateAndCreate(const std::string& table);
    // Adds the declared columns that the file's table lacks.
    bool UpdateTableColumn(const sp<BaseTable>& table);
    // Rebuilds the file so that the space of deleted rows is given back.
    bool Vacuum();
    // Bytes of the pages that hold data, which is what a vacuum would leave; -1 on failure.
    int64_t GetLiveSize();
    void Close();

    EventDatabase() = default;

private:
    static bool CheckLists(const char* op, const std::vector<std::string>& names,
                           const std::vector<std::string>& values);
    void RaiseDbRevision();

    bool initialised_ = false;
    sp<SqlDatabase> database_;
    std::map<std::string, sp<BaseTable>> tables_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_STORAGE_EVENT_DATABASE_H
