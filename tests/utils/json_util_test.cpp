#include "utils/json_util.h"

#include <gtest/gtest.h>

#include "tests/common/log_capture.h"

namespace android::Orvane {

TEST(JsonUtilTest, ParsedTextAndMapWriteOneLineAndBadInputIsRefused) {
    Json::Value value, bad;
    ASSERT_TRUE(JsonUtil::ConvertStrToJson(R"({"id":901001001,"list":[1,2]})", value));
    LogCapture logs;
    EXPECT_FALSE(JsonUtil::ConvertStrToJson(R"({"id":)", bad) || JsonUtil::ConvertStrToJson("", bad));
    // Outside input can repeat the line: the second within the window is only counted.
    EXPECT_EQ(1u, logs.Count(ANDROID_LOG_ERROR, "ConvertStrToJson json convert failed ")) << logs.Dump();

    std::map<std::string, std::string> map = {{"b", "2"}, {"a", "x\"y\nz"}, {"empty", ""}};
    ASSERT_TRUE(JsonUtil::ConvertMapToJson(map, value));
    value["pi"] = 3.14159265;  // three significant digits
    value["big"] = 123456.789;
    EXPECT_EQ(R"({"a":"x\"y\nz","b":"2","big":1.23e+05,"empty":"","id":901001001,"list":[1,2],"pi":3.14})",
              JsonUtil::ConvertJsonToStr(value));
    // Members cannot be set on an array: refused, not thrown.
    EXPECT_FALSE(JsonUtil::ConvertMapToJson(map, value["list"]));
}

}  // namespace android::Orvane
