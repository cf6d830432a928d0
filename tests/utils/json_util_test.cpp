#include "utils/json_util.h"

#include <gtest/gtest.h>

#include "tests/common/log_capture.h"

namespace android::Orvane {

TEST(JsonUtilTest, ParsesTextAndLogsBadText) {
    Json::Value value;
    ASSERT_TRUE(JsonUtil::ConvertStrToJson(R"({"id":901001001,"list":[1,2]})", value));
    EXPECT_EQ(901001001, value["id"].asInt());
    LogCapture logs;
    EXPECT_FALSE(JsonUtil::ConvertStrToJson(R"({"id":)", value));
    EXPECT_FALSE(JsonUtil::ConvertStrToJson("", value));
    EXPECT_EQ(2u, logs.Count(ANDROID_LOG_ERROR, "ConvertStrToJson json convert failed ")) << logs.Dump();
}

TEST(JsonUtilTest, MapBecomesAnObjectOfStringsAndWritesOneLine) {
    Json::Value out(Json::objectValue);
    out["kept"] = 1;
    EXPECT_FALSE(JsonUtil::ConvertMapToJson({}, out));
    std::map<std::string, std::string> map = {{"b", "2"}, {"a", "x\"y\nz"}, {"empty", ""}};
    ASSERT_TRUE(JsonUtil::ConvertMapToJson(map, out));
    out["pi"] = 3.14159265;  // three significant digits
    out["big"] = 123456.789;
    EXPECT_EQ(R"({"a":"x\"y\nz","b":"2","big":1.23e+05,"empty":"","kept":1,"pi":3.14})",
              JsonUtil::ConvertJsonToStr(out));
    // Members cannot be set on an array: refused, not thrown, and left untouched.
    Json::Value array(Json::arrayValue);
    array.append(1);
    EXPECT_FALSE(JsonUtil::ConvertMapToJson(map, array));
    EXPECT_EQ("[1]", JsonUtil::ConvertJsonToStr(array));
}

}  // namespace android::Orvane
