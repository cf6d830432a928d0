#include "utils/json_util.h"

#include <gtest/gtest.h>

#include <map>
#include <string>

#include "tests/common/log_capture.h"

namespace android {
namespace Orvane {
namespace {

TEST(JsonUtilTest, ParsesTextAndLogsBadText) {
    Json::Value value;
    ASSERT_TRUE(JsonUtil::ConvertStrToJson(R"({"id":901001001,"name":"crash","list":[1,2]})", value));
    EXPECT_EQ(901001001, value["id"].asInt());
    EXPECT_EQ("crash", value["name"].asString());
    EXPECT_EQ(2u, value["list"].size());

    LogCapture logs;
    Json::Value bad;
    EXPECT_FALSE(JsonUtil::ConvertStrToJson(R"({"id":)", bad));
    EXPECT_FALSE(JsonUtil::ConvertStrToJson("", bad));
    EXPECT_EQ(2u, logs.Count(ANDROID_LOG_ERROR, "ConvertStrToJson json convert failed ")) << logs.Dump();
}

TEST(JsonUtilTest, MapBecomesAnObjectOfStrings) {
    Json::Value out(Json::objectValue);
    out["kept"] = 1;
    EXPECT_FALSE(JsonUtil::ConvertMapToJson({}, out));
    EXPECT_EQ(1u, out.size());

    std::map<std::string, std::string> map = {{"b", "2"}, {"a", "x\"y"}, {"empty", ""}};
    ASSERT_TRUE(JsonUtil::ConvertMapToJson(map, out));
    EXPECT_EQ(4u, out.size());
    EXPECT_TRUE(out["b"].isString());
    EXPECT_EQ("2", out["b"].asString());
    EXPECT_EQ(R"({"a":"x\"y","b":"2","empty":"","kept":1})", JsonUtil::ConvertJsonToStr(out));

    // Members cannot be set on an array: refused, not thrown.
    Json::Value array(Json::arrayValue);
    array.append(1);
    EXPECT_FALSE(JsonUtil::ConvertMapToJson(map, array));
    EXPECT_EQ(1u, array.size());
}

TEST(JsonUtilTest, WritesOneLineWithThreeSignificantDigits) {
    Json::Value value;
    value["pi"] = 3.14159265;
    value["big"] = 123456.789;
    value["list"].append("a\nb");
    value["list"].append(7);
    std::string text = JsonUtil::ConvertJsonToStr(value);
    EXPECT_EQ(R"({"big":1.23e+05,"list":["a\nb",7],"pi":3.14})", text);

    Json::Value back;
    ASSERT_TRUE(JsonUtil::ConvertStrToJson(text, back));
    EXPECT_EQ("a\nb", back["list"][0].asString());
    EXPECT_EQ("null", JsonUtil::ConvertJsonToStr(Json::Value()));
}

}  // namespace
}  // namespace Orvane
}  // namespace android
