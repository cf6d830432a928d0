#include "config/perf_config_xml_parser.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/fake_plugin_context.h"
#include "tests/common/log_capture.h"
#include "tests/common/test_data.h"
#include "tests/common/write_document.h"

namespace android::Orvane {
namespace {

std::string Describe(const std::vector<PerfResourceConfig>& resources) {
    std::string text;
    for (const PerfResourceConfig& r : resources) {
        text += r.name + ":" + std::to_string(r.someStallUs) + "/" + std::to_string(r.fullStallUs) + "/" +
                std::to_string(r.windowUs) + "/" + std::to_string(r.coolDownSec) + "/" + std::to_string(r.topCount) +
                " ";
    }
    return text;
}

// Every value is checked before a trigger is built from it: a resource with one bad value is
// left out whole, with a line naming the value and a count; the good ones around it stay.
TEST(PerfConfigXmlParserTest, BadValuesLeaveOutTheirResourceOnly) {
    TemporaryDir dir;
    std::string path = std::string(dir.path) + "/perf_config.xml";
    ASSERT_TRUE(WriteDocument(R"(<?xml version="1.0"?>
<Settings><Other><Resource name="cpu" someStallUs="1" windowUs="2000000"/></Other>
<PerfConfig>
  <Resource name="memory" someStallUs="300000" fullStallUs="100000" windowUs="2000000" coolDownSec="60" topCount="3"/>
  <Resource name="cpu" someStallUs="2000000" windowUs="2000000"/>
  <Resource name="memory" someStallUs="1" windowUs="2000000"/>
  <Resource name="io" someStallUs="1" windowUs="499999"/>
  <Resource name="io" someStallUs="1" windowUs="10000001"/>
  <Resource name="io" someStallUs="1"/>
  <Resource name="io" someStallUs="2000001" windowUs="2000000"/>
  <Resource name="io" fullStallUs="-5" windowUs="2000000"/>
  <Resource name="io" windowUs="2000000"/>
  <Resource name="io" someStallUs="0" fullStallUs="0" windowUs="2000000"/>
  <Resource name="io" someStallUs="12abc" windowUs="2000000"/>
  <Resource name="io" someStallUs="1" windowUs="2000000" coolDownSec="0"/>
  <Resource name="io" someStallUs="1" windowUs="2000000" topCount="21"/>
  <Resource name="disk" someStallUs="1" windowUs="2000000"/>
  <Resource someStallUs="1" windowUs="2000000"/>
  <Trigger name="io"/>
  <Resource name="io" fullStallUs="10000000" windowUs="10000000" coolDownSec="4294967295" topCount="0"/>
</PerfConfig></Settings>)",
                              path));
    DaemonStats stats;
    LogCapture capture;
    std::vector<PerfResourceConfig> resources;
    ASSERT_TRUE(PerfConfigXmlParser::Read(path, resources, &stats));
    // The defaults: a cool-down of 600 s and 5 processes.
    EXPECT_EQ("memory:300000/100000/2000000/60/3 cpu:2000000/0/2000000/600/5 io:0/10000000/10000000/4294967295/0 ",
              Describe(resources));
    EXPECT_EQ(13u, stats.Value("config.perf_config.rejected"));
    EXPECT_EQ(13u, capture.Count(ANDROID_LOG_WARN, "left out")) << capture.Dump();
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "resource \"memory\" left out: defined twice, the first stays"));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "resource \"io\" left out: topCount must lie in [0, 20]"));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "resource \"disk\" left out: name is not cpu, memory or io"));

    // A document that breaks off keeps what came before the break, and says so.
    ASSERT_TRUE(WriteDocument(R"(<PerfConfig><Resource name="io" someStallUs="1" windowUs="2000000"/><Resource name=)",
                              path));
    ASSERT_FALSE(PerfConfigXmlParser::Read(path, resources, &stats));
    EXPECT_EQ("io:1/0/2000000/600/5 ", Describe(resources));
    ASSERT_FALSE(PerfConfigXmlParser::Read(std::string(dir.path) + "/missing.xml", resources, &stats));
    EXPECT_TRUE(resources.empty());
    EXPECT_EQ(2u, capture.Count(ANDROID_LOG_WARN, "cannot be read as a performance configuration"));
}

// A platform whose cloud folder is its own.
class CloudContext : public FakePluginContext {
public:
    CloudContext(const std::string& work, const std::string& system, const std::string& cloud)
        : FakePluginContext(work, system), cloud_(cloud) {}
    std::string GetCloudConfigDir() override { return cloud_; }

private:
    const std::string cloud_;
};

// The cloud copy wins; each new version of the chosen copy is read once, and only then.
TEST(PerfConfigXmlParserTest, DocumentFollowsTheChosenCopyAndItsVersions) {
    TemporaryDir work, system, cloud;
    CloudContext context(work.path, std::string(system.path) + "/", std::string(cloud.path) + "/");
    PerfConfigDocument document;
    ASSERT_TRUE(document.Refresh(context));  // the first call always reads
    EXPECT_TRUE(document.Path().empty());
    EXPECT_TRUE(document.Resources().empty());
    EXPECT_FALSE(document.Refresh(context));

    std::string systemCopy = std::string(system.path) + "/perf_config.xml";
    ASSERT_TRUE(WriteDocument(R"(<PerfConfig><Resource name="cpu" someStallUs="5" windowUs="2000000"/></PerfConfig>)",
                              systemCopy));
    ASSERT_TRUE(document.Refresh(context));
    EXPECT_EQ(systemCopy, document.Path());
    EXPECT_EQ("cpu:5/0/2000000/600/5 ", Describe(document.Resources()));
    EXPECT_FALSE(document.Refresh(context));

    // A rewrite of the same size is still a new version.
    ASSERT_TRUE(WriteDocument(R"(<PerfConfig><Resource name="cpu" someStallUs="6" windowUs="2000000"/></PerfConfig>)",
                              systemCopy));
    struct timespec later[2] = {{0, UTIME_OMIT}, {time(nullptr) + 5, 0}};
    ASSERT_EQ(0, utimensat(AT_FDCWD, systemCopy.c_str(), later, 0));
    ConfigDocument::Forget();
    ASSERT_TRUE(document.Refresh(context));
    EXPECT_EQ("cpu:6/0/2000000/600/5 ", Describe(document.Resources()));

    std::string cloudCopy = std::string(cloud.path) + "/perf_config.xml";
    ASSERT_TRUE(WriteDocument(R"(<PerfConfig><Resource name="io" someStallUs="7" windowUs="4000000"/></PerfConfig>)",
                              cloudCopy));
    ASSERT_TRUE(document.Refresh(context));
    EXPECT_EQ(cloudCopy, document.Path());
    EXPECT_EQ("io:7/0/4000000/600/5 ", Describe(document.Resources()));
    EXPECT_FALSE(document.Refresh(context));
    ASSERT_EQ(0, unlink(cloudCopy.c_str()));
    ConfigDocument::Forget();
    ASSERT_TRUE(document.Refresh(context));
    EXPECT_EQ(systemCopy, document.Path());
    EXPECT_EQ("cpu:6/0/2000000/600/5 ", Describe(document.Resources()));
}

// The shipped settings are valid everywhere the kernel has triggers: windows in whole multiples
// of 2 s need no privilege from 6.5 on.
TEST(PerfConfigXmlParserTest, ShippedSettingsArmWithoutPrivilege) {
    DaemonStats stats;
    std::vector<PerfResourceConfig> resources;
    ASSERT_TRUE(PerfConfigXmlParser::Read(TestDataDir() + "/etc/perf_config.xml", resources, &stats));
    ASSERT_EQ(3u, resources.size());
    EXPECT_EQ(0u, stats.Value("config.perf_config.rejected"));
    for (const PerfResourceConfig& resource : resources) {
        EXPECT_EQ(0u, resource.windowUs % 2000000) << resource.name;
        EXPECT_GE(resource.coolDownSec, 60u) << resource.name;
    }
}

}  // namespace
}  // namespace android::Orvane
