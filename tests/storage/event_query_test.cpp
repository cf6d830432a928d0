#include "storage/event_query.h"

#include <gtest/gtest.h>

namespace android {
namespace Orvane {
namespace {

TEST(EventQueryTest, ConditionTexts) {
    EXPECT_EQ(EventQuery::GenerateCondStatement("event_id", EventQuery::GE, "902"), "event_id >= '902'");
    EXPECT_EQ(EventQuery::GenerateCondStatement("param_list", EventQuery::LIKE, "a'b"), "param_list like '%a''b%'");
    EXPECT_EQ(EventQuery::GenerateCondStatement("c", EventQuery::EQ, "v"), "c = 'v'");
    EXPECT_EQ(EventQuery::GenerateCondStatement("c", EventQuery::NE, "v"), "c != 'v'");
    EXPECT_EQ(EventQuery::GenerateCondStatement("c", EventQuery::LT, "v"), "c < 'v'");
    EXPECT_EQ(EventQuery::GenerateCondStatement("c", EventQuery::LE, "v"), "c <= 'v'");
    EXPECT_EQ(EventQuery::GenerateCondStatement("c", EventQuery::GT, "v"), "c > 'v'");
    EXPECT_EQ(EventQuery::GenerateCondStatement("c", EventQuery::NOT_LIKE, "v"), "c not like '%v%'");
    EXPECT_EQ(EventQuery::GenerateCondStatement("c", static_cast<EventQuery::Op>(0), "v"), "");
    EXPECT_EQ(EventQuery::GenerateCondStatement("c", static_cast<EventQuery::Op>(9), "v"), "");
    // The injection stays one quoted literal.
    EXPECT_EQ(EventQuery::GenerateCondStatement("param_list", EventQuery::EQ, "'; drop table event_info; --"),
              "param_list = '''; drop table event_info; --'");
}

TEST(EventQueryTest, WhereClauseConnectorsAndGroups) {
    EventQuery query;
    EXPECT_EQ(query.GetWhereStatement(), "");
    query.And("event_id", EventQuery::EQ, int64_t{7});
    EXPECT_EQ(query.GetWhereStatement(), "  where event_id = '7'");
    query.AddBeginGroup(true).And("daily_cnt", EventQuery::GT, int64_t{3}).AddEndGroup();
    EXPECT_EQ(query.GetWhereStatement(), "  where event_id = '7' and (daily_cnt > '3') ");
    // Unknown operators add nothing, not even a connector.
    query.And("x", static_cast<EventQuery::Op>(0), "1").Where("x", static_cast<EventQuery::Op>(9), "1");
    EXPECT_EQ(query.GetWhereStatement(), "  where event_id = '7' and (daily_cnt > '3') ");
    // After a closed group the next condition is joined again; OR groups keep their blank.
    query.AddBeginGroup(false)
        .AppendWhereStatement("a", EventQuery::EQ, "1", false)
        .AppendWhereStatement("b", EventQuery::EQ, "2", false)
        .AddEndGroup()
        .Where("c", EventQuery::LE, int64_t{-5});
    EXPECT_EQ(query.GetWhereStatement(),
              "  where event_id = '7' and (daily_cnt > '3')  or ( a = '1' or b = '2')  and c <= '-5'");

    EventQuery group;
    group.AddBeginGroup(false).And("a", EventQuery::EQ, "1");
    EXPECT_EQ(group.GetWhereStatement(), "  where  (a = '1'");
    group.AddBeginGroup(true).And("b", EventQuery::NE, "2");
    EXPECT_EQ(group.GetWhereStatement(), "  where  (a = '1' and (b != '2'");
}

TEST(EventQueryTest, SelectOrderAndFullStatements) {
    EventQuery query;
    std::string out = "keep:";
    EXPECT_FALSE(query.GetSelectStatement(out));
    EXPECT_EQ(out, "keep:");
    query.And("event_id", EventQuery::EQ, "1");
    EXPECT_EQ(query.BuildQueryStatement("event_daily", 1), "");

    query.Clear();
    query.Select({"id", "db_version"}).Select({"id"}).Order("id", false);
    EXPECT_EQ(query.BuildQueryStatement("db_version", 1), "select id,db_version from db_version order by id desc limit 1");
    EXPECT_TRUE(query.GetSelectStatement(out));
    EXPECT_EQ(out, "keep:select id,db_version");
    EXPECT_EQ(query.GetOrderStatement(), "order by id desc");
    // Ordering alone makes a WHERE part that starts with the order clause.
    EXPECT_EQ(query.GetWhereStatement(), " order by id desc");

    // Ascending columns always come first, whatever the order of the calls.
    query.Order("c", false).Order("a", true).Order("b", true);
    EXPECT_EQ(query.GetOrderStatement(), "order by a, b asc, id, c desc");
    query.And("x", EventQuery::EQ, int64_t{1});
    EXPECT_EQ(query.BuildQueryStatement("t", -1),
              "select id,db_version from t where x = '1' order by a, b asc, id, c desc limit -1");
    EXPECT_EQ(query.GetWhereStatement(), "  where x = '1'order by a, b asc, id, c desc");

    EventQuery copy = query;
    copy.Clear().Select({"z"});
    EXPECT_EQ(copy.BuildQueryStatement("t", 0), "select z from t limit 0");
    EXPECT_EQ(query.GetSelectList(), (std::vector<std::string>{"id", "db_version"}));
}

}  // namespace
}  // namespace Orvane
}  // namespace android
