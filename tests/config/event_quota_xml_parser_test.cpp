#include "config/event_quota_xml_parser.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "tests/common/log_capture.h"
#include "utils/file_util.h"

namespace android {
namespace Orvane {
namespace {

using DomainQuota = EventQuotaXmlParser::DomainQuota;

const char kSection[] = "unknown";

// The parser is a singleton; every test loads its own folder, and the fallback counters, which
// outlive a reload, use range keys of their own in each test.
class EventQuotaXmlParserTest : public ::testing::Test {
protected:
    void SetUp() override {
        char pattern[] = "/tmp/event_quota_xml_parser_test.XXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir_ = std::string(pattern) + "/";
        parser_ = EventQuotaXmlParser::getInstance();
    }
    void TearDown() override {
        uint64_t freed = 0;
        FileUtil::DeleteDirectoryOrFile(dir_, freed, true);
    }
    void WriteDocument(const std::string& content) {
        std::ofstream(dir_ + "event_quota.xml", std::ios::binary | std::ios::trunc) << content;
    }

    std::string dir_;
    sp<EventQuotaXmlParser> parser_;
};

TEST_F(EventQuotaXmlParserTest, DomainsSubDomainsAndEventsTakePrecedenceInOrder) {
    WriteDocument(R"(<?xml version="1.0" encoding="UTF-8"?>
<Quota>
  <other><Domain name="aaa" eventMin="1" eventMax="999999999" maxLogCnt="99"/></other>
  <unknown>
    <SubDomain name="early" eventMin="901000000" eventMax="901999999" maxLogCnt="1"/>
    <Summary defDailyCnt="150" defLogCnt="6" defLogSpace="250" UploadExpireYear="1" Level1Month="3" Level1Max="100"
             Level2Month="0" Level2Max="-4" LogStatic="x"/>
    <Domain name="kernel" eventMin="901000000" eventMax="901999999" dailyCnt="50" maxLogCnt="5" logSpace="100" logSame="true">
      <SubDomain name="kernel" eventMin="901001000" eventMax="901001999" maxLogCnt="2" logSpace="20"/>
      <SubDomain name="kernel" eventMin="901001500" eventMax="901001599" maxLogCnt="1" dailyCnt="7"/>
    </Domain>
    <SubDomain name="late" eventMin="901002000" eventMax="901002999" maxLogCnt="1"/>
    <Domain name="zeta" eventMin="901000000" eventMax="902999999" dailyCnt="80" maxLogCnt="0" logSpace="-3"/>
    <Domain name="beta" eventMin="902500000" eventMax="902599999" maxLogCnt="abc" logSame="TRUE"/>
    <Event eventId="901001001" dailyCnt="3"/>
    <Event eventId="902000001" dailyCnt="9"/>
  </unknown>
</Quota>
)");
    LogCapture logs;
    ASSERT_EQ(parser_->StartParserXml(dir_, kSection), 0);
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_DEBUG, "SaveSubDomainQuota not find domain"));
    EXPECT_EQ(logs.Count(ANDROID_LOG_DEBUG, "SaveSubDomainQuota not find domain"), 2u);
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_DEBUG, "SaveDomainQuota domain kernel:dailycnt=50,max=901999999,"
                                                 "min=901000000,logcnt=5,space=100,same=1,sub=0"));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_DEBUG, "SaveSubDomainQuota domain kernel: dailycnt=150,max=901001999,"
                                                 "min=901001000,logcnt=2, space=20, same=0, sub=0"));

    EventQuotaXmlParser::SummaryQuota summary = parser_->GetSummaryQuota(dir_, kSection);
    EXPECT_EQ(summary.defDailyCnt, 150u);
    EXPECT_EQ(summary.defLogCnt, 6u);
    EXPECT_EQ(summary.defLogSpace, 250u);
    EXPECT_EQ(summary.uploadExpireYear, 1u);
    EXPECT_EQ(summary.level1Month, 3u);
    EXPECT_EQ(summary.level1Max, 100u);
    EXPECT_EQ(summary.level2Max, 0u);
    EXPECT_EQ(summary.level3Month, 0u);
    EXPECT_EQ(summary.logStatic, 0u);

    // Event count wins over the sub-domain's, which wins over the domain's for everything else.
    DomainQuota quota = parser_->GetEventQuota(dir_, kSection, 901001001);
    EXPECT_EQ(quota.dailyCnt, 3u);
    EXPECT_EQ(quota.maxLogCnt, 2u);
    EXPECT_EQ(quota.logSpace, 20u);
    EXPECT_FALSE(quota.same);
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_DEBUG, "GetEventQuota parser retrun sub domain 901001001 in [901001000,901001999]"));
    // The first sub-domain in document order holding the id; without an event count it gives its own.
    quota = parser_->GetEventQuota(dir_, kSection, 901001550);
    EXPECT_EQ(quota.maxLogCnt, 2u);
    EXPECT_EQ(quota.dailyCnt, 150u);  // the sub-domain's, defaulted from the totals
    // Sub-domains outside a domain element were ignored; "kernel" sorts before "zeta", which also
    // holds the id.
    quota = parser_->GetEventQuota(dir_, kSection, 901002001);
    EXPECT_EQ(quota.dailyCnt, 50u);
    EXPECT_EQ(quota.maxLogCnt, 5u);
    EXPECT_EQ(quota.logSpace, 100u);
    EXPECT_TRUE(quota.same);
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_DEBUG, "GetEventQuota parser retrun domain 901002001 in [901000000,901999999]"));
    // Only "zeta" holds it; its 0 and -3 keep the defaults.
    quota = parser_->GetEventQuota(dir_, kSection, 902000001);
    EXPECT_EQ(quota.dailyCnt, 9u);
    EXPECT_EQ(quota.maxLogCnt, 6u);
    EXPECT_EQ(quota.logSpace, 250u);
    // "beta" sorts before "zeta"; text that is not a number keeps the default, "TRUE" is not "true".
    quota = parser_->GetEventQuota(dir_, kSection, 902500001);
    EXPECT_EQ(quota.dailyCnt, 150u);
    EXPECT_EQ(quota.maxLogCnt, 6u);
    EXPECT_FALSE(quota.same);
    // Nothing at all: the totals.
    quota = parser_->GetEventQuota(dir_, kSection, 930000001);
    EXPECT_EQ(quota.dailyCnt, 150u);
    EXPECT_EQ(quota.maxLogCnt, 6u);
    EXPECT_EQ(quota.logSpace, 250u);
    EXPECT_EQ(quota.logCnt, 0);
}

TEST_F(EventQuotaXmlParserTest, LogCountsReachTheirLimitsAfterTheIncrement) {
    WriteDocument(R"(<unknown>
  <Domain name="kernel" eventMin="901000000" eventMax="901999999" dailyCnt="50" maxLogCnt="5" logSpace="100">
    <SubDomain name="kernel" eventMin="901001000" eventMax="901001999" maxLogCnt="2" logSpace="20" dailyCnt="4"/>
  </Domain>
  <Domain name="storage" eventMin="905000000" eventMax="905999999" maxLogCnt="3"/>
</unknown>)");
    LogCapture logs;
    DomainQuota record;
    record.dailyCnt = 77;  // a given record is cleared first
    // The sub-domain reaches its limit of 2 while the domain is far below its 5.
    EXPECT_FALSE(parser_->CheckLogCntLimitAfterIncr(dir_, kSection, 901001001, 1, &record));
    EXPECT_EQ(record.maxLogCnt, 2u);
    EXPECT_EQ(record.logSpace, 20u);
    EXPECT_EQ(record.eventMin, 901001000u);
    EXPECT_EQ(record.logCnt, 1);
    EXPECT_EQ(record.dailyCnt, 50u);  // the domain's came first
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_DEBUG,
                              "CheckLogCntLimitAfterIncr sub domain log, 901001001 in [901001000,901001999] 1 < 2 by incr 1"));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_DEBUG,
                              "CheckLogCntLimitAfterIncr domain log, 901001001 in [901000000,901999999] 1 < 5 by incr 1"));
    EXPECT_TRUE(parser_->CheckLogCntLimitAfterIncr(dir_, kSection, 901001002, 1, nullptr));
    // The domain counts every collection in its range.
    EXPECT_FALSE(parser_->CheckLogCntLimitAfterIncr(dir_, kSection, 901500000, 2, &record));
    EXPECT_EQ(record.maxLogCnt, 5u);
    EXPECT_EQ(record.logCnt, 4);
    EXPECT_TRUE(parser_->CheckLogCntLimitAfterIncr(dir_, kSection, 901500000, 1, &record));
    // Once the domain is full the record keeps the domain's figures.
    EXPECT_TRUE(parser_->CheckLogCntLimitAfterIncr(dir_, kSection, 901001003, 0, &record));
    EXPECT_EQ(record.maxLogCnt, 5u);
    EXPECT_EQ(parser_->GetEventQuota(dir_, kSection, 901001003).logCnt, 2);  // the sub-domain's
    EXPECT_EQ(parser_->GetEventQuota(dir_, kSection, 901700000).logCnt, 5);

    // A maxLogCnt of 3: the third collection reaches it.
    EXPECT_FALSE(parser_->CheckLogCntLimitAfterIncr(dir_, kSection, 905000001, 1));
    EXPECT_FALSE(parser_->CheckLogCntLimitAfterIncr(dir_, kSection, 905000002, 1));
    EXPECT_TRUE(parser_->CheckLogCntLimitAfterIncr(dir_, kSection, 905000003, 1));

    // No domain: a counter per id / 1,000,000 with the default limit of 10.
    for (int i = 1; i <= 12; ++i) {
        DomainQuota fallback;
        bool reached = parser_->CheckLogCntLimitAfterIncr(dir_, kSection, 940000000 + i * 1000, 1, &fallback);
        EXPECT_EQ(reached, i >= 10) << "call " << i;
        EXPECT_EQ(fallback.maxLogCnt, 10u);
    }
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_DEBUG, "CheckLogCntLimitAfterIncr parser retrun 940, rel=10, max=10"));
    EXPECT_FALSE(parser_->CheckLogCntLimitAfterIncr(dir_, kSection, 941000000, 1));  // another range
    EXPECT_EQ(parser_->GetEventQuota(dir_, kSection, 940999999).logCnt, 12);
}

TEST_F(EventQuotaXmlParserTest, LoadsOncePerFolderAndSectionAndStopsAtTheSectionEnd) {
    // Everything after the wanted section lies in a later block and is broken; it is never read.
    std::string doc = R"(<Quota><unknown><Summary defDailyCnt="11"/></unknown>
<beta><Summary defDailyCnt="22" defLogCnt="3"/><Domain name="d" eventMin="950000000" eventMax="950999999"/></beta>
<!-- )" + std::string(9000, 'x') +
                      " -->\n<broken attr=no quotes></Quota>";
    WriteDocument(doc);
    EXPECT_EQ(parser_->StartParserXml(dir_, kSection), 0);
    EXPECT_EQ(parser_->GetSummaryQuota(dir_, kSection).defDailyCnt, 11u);
    EXPECT_EQ(parser_->StartParserXml(dir_, "beta"), 0);
    EXPECT_EQ(parser_->GetSummaryQuota(dir_, "beta").defDailyCnt, 22u);
    EXPECT_EQ(parser_->GetEventQuota(dir_, "beta", 950000001).maxLogCnt, 3u);

    // The same folder and section are not read again.
    WriteDocument("<beta><Summary defDailyCnt=\"33\"/></beta>");
    EXPECT_EQ(parser_->GetSummaryQuota(dir_, "beta").defDailyCnt, 22u);
    // A section the document lacks: read to the end, totals at their defaults.
    EXPECT_EQ(parser_->StartParserXml(dir_, "gamma"), 0);
    EXPECT_EQ(parser_->GetSummaryQuota(dir_, "gamma").defDailyCnt, 200u);
    EXPECT_EQ(parser_->GetSummaryQuota(dir_, "beta").defDailyCnt, 33u);
}

TEST_F(EventQuotaXmlParserTest, BadDocumentsFallBackToTheDefaults) {
    const std::vector<std::string> bad = {
        "",
        "<unknown><Summary defDailyCnt=\"5\"><Domain name=\"a\" eventMin=\"1\" eventMax=\"2\"></unknown>",
        "<?xml version=\"1.0\" encoding=\"bogus\"?><unknown/>",
        std::string("\x00\x01\xff\xfe garbage \x80\x81", 16),
        "<unknown><Summary defDailyCnt=\"5\"/><Domain name=\"a",
    };
    LogCapture logs;
    for (size_t i = 0; i < bad.size(); ++i) {
        std::string dir = dir_ + std::to_string(i) + "/";
        ASSERT_TRUE(FileUtil::CreateDirectory(dir, 0775));
        std::ofstream(dir + "event_quota.xml", std::ios::binary) << bad[i];
        EXPECT_EQ(parser_->StartParserXml(dir, kSection), -1) << i;
        EXPECT_TRUE(logs.Contains(ANDROID_LOG_WARN, "StartParserXml parse xml file failed " + dir + "event_quota.xml"));
        DomainQuota quota = parser_->GetEventQuota(dir, kSection, 960000001);
        EXPECT_EQ(quota.maxLogCnt, 10u);
        EXPECT_EQ(quota.logSpace, 300u);
    }
    // Missing: defaults, and the failure is reported once for the folder.
    logs.Clear();
    EXPECT_EQ(parser_->GetEventQuota(dir_ + "absent/", kSection, 960000001).dailyCnt, 200u);
    EXPECT_EQ(parser_->StartParserXml(dir_ + "absent/", kSection), -1);
    EXPECT_EQ(logs.Count(ANDROID_LOG_WARN, "StartParserXml parse xml file failed"), 1u);

    // A good document afterwards is read in full.
    WriteDocument("<unknown><Summary defDailyCnt=\"12\"/>"
                  "<Domain name=\"x\" eventMin=\"961000000\" eventMax=\"961999999\" maxLogCnt=\"4\"/></unknown>");
    EXPECT_EQ(parser_->StartParserXml(dir_, kSection), 0);
    EXPECT_EQ(parser_->GetEventQuota(dir_, kSection, 961000001).maxLogCnt, 4u);
    EXPECT_EQ(parser_->GetEventQuota(dir_, kSection, 961000001).dailyCnt, 12u);
}

TEST_F(EventQuotaXmlParserTest, ShippedDocumentHasTheDefaultVersionSection) {
    const std::string etc = ORVANE_SOURCE_DIR "/etc/";
    ASSERT_EQ(parser_->StartParserXml(etc, kSection), 0);
    EXPECT_EQ(parser_->GetSummaryQuota(etc, kSection).logStatic, 480u);
    DomainQuota quota = parser_->GetEventQuota(etc, kSection, 901001001);
    EXPECT_EQ(quota.dailyCnt, 3u);
    EXPECT_EQ(quota.maxLogCnt, 2u);
    quota = parser_->GetEventQuota(etc, kSection, 902001002);
    EXPECT_EQ(quota.dailyCnt, 50u);
    EXPECT_TRUE(quota.same);
    EXPECT_EQ(parser_->GetEventQuota(etc, kSection, 905001001).dailyCnt, 200u);
}

TEST_F(EventQuotaXmlParserTest, ConcurrentCountingLosesNothing) {
    WriteDocument(R"(<unknown>
  <Domain name="net" eventMin="970000000" eventMax="970999999" maxLogCnt="100000">
    <SubDomain name="net" eventMin="970001000" eventMax="970001999" maxLogCnt="100000"/>
  </Domain>
</unknown>)");
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&, t] {
            sp<EventQuotaXmlParser> parser = EventQuotaXmlParser::getInstance();
            for (int i = 0; i < 200; ++i) {
                DomainQuota record;
                parser->CheckLogCntLimitAfterIncr(dir_, kSection, 970001000 + t, 1, &record);
                parser->CheckLogCntLimitAfterIncr(dir_, kSection, 971000000 + t, 1, nullptr);  // fallback counter
                parser->GetEventQuota(dir_, kSection, 970000001);
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(parser_->GetEventQuota(dir_, kSection, 970500000).logCnt, 800);
    EXPECT_EQ(parser_->GetEventQuota(dir_, kSection, 970001500).logCnt, 800);
    EXPECT_EQ(parser_->GetEventQuota(dir_, kSection, 971000000).logCnt, 800);
}

}  // namespace
}  // namespace Orvane
}  // namespace android
