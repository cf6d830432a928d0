#ifndef ORVANE_STORAGE_EVENT_QUERY_H
#define ORVANE_STORAGE_EVENT_QUERY_H

#include <cstdint>
#include <string>
#include <vector>

namespace android {
namespace Orvane {

// Describes one query against one table and renders it as SQL text; every compared value is
// escaped and quoted. A plain value object, built and used on its caller's thread.
class EventQuery {
public:
    enum Op : int32_t {
        EQ = 1,
        NE,
        LT,
        LE,
        GT,
        GE,
        LIKE,
        NOT_LIKE,
    };

    EventQuery& Select(const std::vector<std::string>& columns);
    EventQuery& And(const std::string& column, Op op, const std::string& value);
    EventQuery& And(const std::string& column, Op op, int64_t value);
    EventQuery& Where(const std::string& column, Op op, const std::string& value) { return And(column, op, value); }
    EventQuery& Where(const std::string& column, Op op, int64_t value) { return And(column, op, value); }
    EventQuery& AppendWhereStatement(const std::string& column, Op op, const std::string& value, bool isAnd);
    EventQuery& AddBeginGroup(bool isAnd);
    EventQuery& AddEndGroup();
    EventQuery& Order(const std::string& column, bool ascending);
    EventQuery& Clear();

    static std::string GenerateCondStatement(const std::string& column, Op op, std::string value);

    const std::vector<std::string>& GetSelectList() const { return selectList_; }
    bool GetSelectStatement(std::string& out) const;
    std::string GetOrderStatement() const;
    // The WHERE part of an UPDATE or DELETE, with its leading blanks; empty without conditions.
    std::string GetWhereStatement() const;
    // A negative limit reads all rows.
    std::string BuildQueryStatement(const std::string& table, int32_t limit) const;

private:
    std::vector<std::string> selectList_;
    std::string ascOrder_;
    std::string descOrder_;
    std::string where_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_STORAGE_EVENT_QUERY_H
