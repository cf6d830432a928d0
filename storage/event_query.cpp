#include "storage/event_query.h"

#include <algorithm>

#include "utils/string_util.h"

namespace android {
namespace Orvane {

namespace {
struct OpText {
    const char* before;
    const char* after;
};

// Indexed by Op - 1.
constexpr OpText kOpTexts[] = {
        {" = '", "'"}, {" != '", "'"}, {" < '", "'"},      {" <= '", "'"},
        {" > '", "'"}, {" >= '", "'"}, {" like '%", "%'"}, {" not like '%", "%'"},
};

bool EndsWithOpenGroup(const std::string& where) {
    std::string trimmed = StringUtil::TrimStr(where, ' ');
    return trimmed.empty() || trimmed.back() == '(';
}
}  // namespace

EventQuery& EventQuery::Select(const std::vector<std::string>& columns) {
    for (const auto& column : columns) {
        if (std::find(selectList_.begin(), selectList_.end(), column) == selectList_.end()) {
            selectList_.push_back(column);
        }
    }
    return *this;
}

EventQuery& EventQuery::And(const std::string& column, Op op, const std::string& value) {
    return AppendWhereStatement(column, op, value, true);
}

EventQuery& EventQuery::And(const std::string& column, Op op, int64_t value) {
    return AppendWhereStatement(column, op, std::to_string(value), true);
}

std::string EventQuery::GenerateCondStatement(const std::string& column, Op op, std::string value) {
    if (op < EQ || op > NOT_LIKE) {
        return "";
    }
    const OpText& text = kOpTexts[op - EQ];
    return column + text.before + StringUtil::EscapeSqliteChar(value) + text.after;
}

EventQuery& EventQuery::AppendWhereStatement(const std::string& column, Op op, const std::string& value, bool isAnd) {
    std::string connector;
    if (!where_.empty() && !EndsWithOpenGroup(where_)) {
        connector = isAnd ? " and " : " or ";
    }
    std::string condition = GenerateCondStatement(column, op, value);
    if (!condition.empty()) {
        where_ += connector + condition;
    }
    return *this;
}

EventQuery& EventQuery::AddBeginGroup(bool isAnd) {
    if (EndsWithOpenGroup(where_)) {
        where_ += " (";
    } else {
        where_ += isAnd ? " and (" : " or ( ";
    }
    return *this;
}

EventQuery& EventQuery::AddEndGroup() {
    where_ += ") ";
    return *this;
}

EventQuery& EventQuery::Order(const std::string& column, bool ascending) {
    std::string& list = ascending ? ascOrder_ : descOrder_;
    if (!list.empty()) {
        list += ", ";
    }
    list += column;
    return *this;
}

EventQuery& EventQuery::Clear() {
    selectList_.clear();
    ascOrder_.clear();
    descOrder_.clear();
    where_.clear();
    return *this;
}

bool EventQuery::GetSelectStatement(std::string& out) const {
    if (selectList_.empty()) {
        return false;
    }
    out += "select ";
    for (size_t i = 0; i < selectList_.size(); i++) {
        if (i > 0) {
            out += ",";
        }
        out += selectList_[i];
    }
    return true;
}

std::string EventQuery::GetOrderStatement() const {
    if (ascOrder_.empty() && descOrder_.empty()) {
        return "";
    }
    std::string order = "order by";
    if (!ascOrder_.empty()) {
        order += " " + ascOrder_ + " asc,";
    }
    if (!descOrder_.empty()) {
        order += " " + descOrder_ + " desc,";
    }
    return StringUtil::TrimStr(order, ',');
}

std::string EventQuery::GetWhereStatement() const {
    std::string text;
    if (!where_.empty()) {
        text = " where " + where_;
    }
    text += GetOrderStatement();
    return text.empty() ? text : " " + text;
}

std::string EventQuery::BuildQueryStatement(const std::string& table, int32_t limit) const {
    std::string sql;
    if (!GetSelectStatement(sql)) {
        return "";
    }
    sql += " from " + table;
    if (!where_.empty()) {
        sql += " where " + where_;
    }
    std::string order = GetOrderStatement();
    if (!order.empty()) {
        sql += " " + order;
    }
    return sql + " limit " + std::to_string(limit);
}

}  // namespace Orvane
}  // namespace android
