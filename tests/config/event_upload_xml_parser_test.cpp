#include "config/event_upload_xml_parser.h"

#include <stdio.h>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/log_capture.h"

namespace android::Orvane {
namespace {

class EventUploadXmlParserTest : public ::testing::Test {
protected:
    std::shared_ptr<const UploadRules> Read(const std::string& body) {
        std::string path = root_ + "/rules.xml";
        EXPECT_TRUE(base::WriteStringToFile(body, path));
        return EventUploadXmlParser::ReadRules(path, &stats_);
    }
    // Writes a document by renaming a new file over the old one, as a configuration push does.
    void Place(const std::string& dir, const std::string& body) {
        ASSERT_TRUE(base::WriteStringToFile(body, dir + "tmp"));
        ASSERT_EQ(rename((dir + "tmp").c_str(), (dir + EventUploadXmlParser::kFileName).c_str()), 0);
    }

    TemporaryDir dir_;
    std::string root_ = dir_.path;
    DaemonStats stats_;
};

// The smallest range wins whatever the document order, an id rule beats every range, an empty
// rule set means "no logs" for its range, and each kind of source keeps its settings.
TEST_F(EventUploadXmlParserTest, SmallestRangeWinsAndSourcesKeepTheirSettings) {
    auto rules = Read(R"(<EventUpload>
      <LogRule eventMin="900000000" eventMax="999999999"><Static path="/a/wide"/></LogRule>
      <LogRule eventId="901001001"><Command cmd="logcat -d -t 10" timeoutSec="7" file="logcat.txt"/></LogRule>
      <LogRule eventMin="901000000" eventMax="901999999">
        <Dynamic dir="/a/dir" pattern="trace_\d+\.txt" count="3" maxAgeSec="60" delete="true"/>
      </LogRule>
      <LogRule eventMin="901000500" eventMax="901000600"/>
      <Future attribute="x"/>
    </EventUpload>)");
    ASSERT_EQ(rules->ruleSets.size(), 4u);
    EXPECT_EQ(rules->rejected, 0u);
    EXPECT_EQ(rules->Find(900000000)->logs.at(0).path, "/a/wide");
    EXPECT_EQ(rules->Find(999999999)->logs.at(0).path, "/a/wide");
    EXPECT_EQ(rules->Find(1000000000), nullptr);
    EXPECT_EQ(rules->Find(899999999), nullptr);
    const LogCollectInfo& command = rules->Find(901001001)->logs.at(0);
    EXPECT_EQ(command.kind, LogCollectInfo::Kind::kCommand);
    EXPECT_EQ(command.command, "logcat -d -t 10");
    EXPECT_EQ(command.timeoutSec, 7u);
    EXPECT_EQ(command.fileName, "logcat.txt");
    EXPECT_FALSE(command.IsDeleteLog());
    const LogCollectInfo& dynamic = rules->Find(901001002)->logs.at(0);
    EXPECT_EQ(dynamic.kind, LogCollectInfo::Kind::kDynamic);
    EXPECT_EQ(dynamic.count, 3u);
    EXPECT_EQ(dynamic.maxAgeSec, 60u);
    EXPECT_TRUE(dynamic.IsDeleteLog());
    EXPECT_TRUE(dynamic.pattern->Matches("trace_12.txt"));
    EXPECT_FALSE(dynamic.pattern->Matches("trace_12.txt.bak"));
    EXPECT_TRUE(rules->Find(901000550)->logs.empty());
}

// Each bad element is left out on its own with a warning and a count; the rest of the document
// stays in force. A document that is not XML, has another root or is missing gives no rules.
TEST_F(EventUploadXmlParserTest, BadElementsAreLeftOutAndBadDocumentsGiveNoRules) {
    LogCapture capture;
    auto rules = Read(R"(<EventUpload>
      <LogRule eventId="901000001">
        <Static path="relative/path"/>
        <Static path="/ok/file"/>
        <Static path="/ok/other" delete="yes"/>
        <Dynamic dir="/d" pattern="(a*)*\1"/>
        <Dynamic dir="/d" pattern="x{2000}"/>
        <Dynamic dir="/d" pattern="x" count="0"/>
        <Command cmd="sh  -c" file="a.txt"/>
        <Command cmd="dmesg" file="../escape"/>
        <Command cmd="dmesg" file="k.txt" timeoutSec="100000"/>
        <Command cmd="dmesg" file="k.txt"/>
        <Command cmd="uptime" file="k.txt"/>
        <LogRule eventId="901000002"><Static path="/nested"/></LogRule>
      </LogRule>
      <LogRule eventMin="5" eventMax="4"><Static path="/never"/></LogRule>
      <LogRule eventId="-1"/>
      <LogRule eventId="7" eventMin="1" eventMax="9"/>
      <Static path="/outside"/>
    </EventUpload>)");
    ASSERT_EQ(rules->ruleSets.size(), 1u);
    const auto& logs = rules->ruleSets[0].logs;
    ASSERT_EQ(logs.size(), 2u);
    EXPECT_EQ(logs[0].path, "/ok/file");
    EXPECT_EQ(logs[1].fileName, "k.txt");
    EXPECT_EQ(rules->rejected, 14u);
    EXPECT_EQ(stats_.Value("config.event_upload.rejected"), 14u);
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "left out"));

    for (const char* broken : {"<EventUpload><LogRule eventId=\"1\">", "<Other/>", "", "<EventUpload"}) {
        EXPECT_TRUE(Read(broken)->ruleSets.empty()) << broken;
    }
    EXPECT_TRUE(EventUploadXmlParser::ReadRules(root_ + "/missing.xml", &stats_)->ruleSets.empty());
    EXPECT_EQ(stats_.Value("config.read_failed.event_upload.xml"), 5u);
}

// The cloud copy wins when it parses; a replaced document is read again at the next use after
// the re-check interval, a broken cloud copy falls back to the system copy, and no document at
// all means no rules for any id.
TEST_F(EventUploadXmlParserTest, CloudCopyFirstAndReloadAfterAChange) {
    std::string cloud = root_ + "/cloud/", system = root_ + "/system/";
    ASSERT_EQ(mkdir(cloud.c_str(), 0775), 0);
    ASSERT_EQ(mkdir(system.c_str(), 0775), 0);
    sp<EventUploadXmlParser> parser = new EventUploadXmlParser();
    auto has = [&](uint32_t id) {
        auto rules = parser->GetRules(cloud, system, &stats_);
        auto ruleSet = rules->Find(id);
        return ruleSet != nullptr && !ruleSet->logs.empty();
    };
    EXPECT_FALSE(has(901000001));
    Place(system, R"(<EventUpload><LogRule eventId="901000001"><Static path="/s"/></LogRule></EventUpload>)");
    // A new document in other folders is looked at at once; the same folders wait for the re-check.
    EXPECT_TRUE(parser->GetRules(cloud, system + "./", &stats_)->Find(901000001) != nullptr);
    Place(cloud, R"(<EventUpload><LogRule eventId="902000001"><Static path="/c"/></LogRule></EventUpload>)");
    EXPECT_TRUE(WaitUntil([&] { return has(902000001); }, std::chrono::seconds(5)));
    EXPECT_FALSE(has(901000001));
    Place(cloud, "<EventUpload><LogRule");
    EXPECT_TRUE(WaitUntil([&] { return has(901000001); }, std::chrono::seconds(5)));
    EXPECT_FALSE(has(902000001));
}

}  // namespace
}  // namespace android::Orvane
