#include "config/event_quota_xml_parser.h"

#include <atomic>
#include <thread>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/log_capture.h"
#include "tests/common/write_document.h"

namespace android::Orvane {
namespace {

using DomainQuota = EventQuotaXmlParser::DomainQuota;
const char kSection[] = "unknown";

// The parser is a singleton: every test loads its own folder, and the fallback counters, which
// outlive a reload, use range keys of their own in each test.
class EventQuotaXmlParserTest : public ::testing::Test {
protected:
    // Replaces the document at once, as a push does, so a concurrent reader sees the old or the new one.
    void Write(const std::string& content) {
        ASSERT_TRUE(WriteDocument(content, dir_ + "next.xml"));
        ASSERT_EQ(rename((dir_ + "next.xml").c_str(), (dir_ + "event_quota.xml").c_str()), 0);
    }
    // dailyCnt maxLogCnt logSpace same logCnt of the quota for id.
    std::vector<int64_t> Quota(uint32_t id, const DocumentFolders& folders) {
        DomainQuota q = parser_->GetEventQuota(folders, kSection, id);
        return {q.dailyCnt, q.maxLogCnt, q.logSpace, q.same, q.logCnt};
    }
    std::vector<int64_t> Quota(uint32_t id) { return Quota(id, dir_); }
    bool Incr(uint32_t id, int32_t incr, DomainQuota* record = nullptr) {
        return parser_->CheckLogCntLimitAfterIncr(dir_, kSection, id, incr, record);
    }
    TemporaryDir temp_;
    std::string dir_ = std::string(temp_.path) + "/";
    sp<EventQuotaXmlParser> parser_ = EventQuotaXmlParser::getInstance();
};

TEST_F(EventQuotaXmlParserTest, PrecedenceInOrderAndLogCountsAfterTheIncrement) {
    Write(R"(<Quota><other><Domain name="aaa" eventMin="1" eventMax="999999999" maxLogCnt="99"/></other><unknown>
    <Summary defDailyCnt="150" defLogCnt="6" defLogSpace="250"/>
    <Domain name="kernel" eventMin="901000000" eventMax="901999999" dailyCnt="50" maxLogCnt="5" logSpace="100" logSame="true">
      <SubDomain name="kernel" eventMin="901001000" eventMax="901001999" maxLogCnt="2" logSpace="20"/>
      <SubDomain name="kernel" eventMin="901001500" eventMax="901001599" maxLogCnt="1" dailyCnt="7"/>
    </Domain>
    <SubDomain name="late" eventMin="901002000" eventMax="901002999" maxLogCnt="1"/>
    <Domain name="zeta" eventMin="901000000" eventMax="902999999" dailyCnt="80" maxLogCnt="0" logSpace="-3"/>
    <Domain name="beta" eventMin="902500000" eventMax="902599999" maxLogCnt="abc" logSame="TRUE"/>
    <Event eventId="901001001" dailyCnt="3"/>
    <Event eventId="902000001" dailyCnt="9"/></unknown></Quota>)");
    ASSERT_EQ(parser_->StartParserXml(dir_, kSection), 0);
    const std::pair<uint32_t, std::vector<int64_t>> cases[] = {
            {901001001, {3, 2, 20, 0, 0}},      // event count, then the first sub-domain holding the id
            {901001550, {150, 2, 20, 0, 0}},    // the sub-domain's own count, defaulted from the totals
            {901002001, {50, 5, 100, 1, 0}},    // a sub-domain outside a domain is ignored; "kernel" before "zeta"
            {902000001, {9, 6, 250, 0, 0}},     // only "zeta": its 0 and -3 keep the defaults
            {902500001, {150, 6, 250, 0, 0}},   // "beta": text keeps the default, "TRUE" is not "true"
            {930000001, {150, 6, 250, 0, 0}}};  // nothing at all: the totals
    for (const auto& [id, expected] : cases)
        EXPECT_EQ(Quota(id), expected) << id;

    DomainQuota record;
    EXPECT_FALSE(Incr(901001001, 1, &record));  // the sub-domain's limit of 2 counts, the domain is far below 5
    EXPECT_EQ((std::vector<int64_t>{record.maxLogCnt, record.logSpace, record.eventMin, record.logCnt}),
              (std::vector<int64_t>{2, 20, 901001000, 1}));
    EXPECT_TRUE(Incr(901001002, 1));
    EXPECT_FALSE(Incr(901500000, 2, &record));  // the domain counts every collection in its range
    EXPECT_EQ(record.logCnt, 4);
    EXPECT_TRUE(Incr(901500000, 1, &record));
    for (int i = 1; i <= 8; ++i)  // no domain: a counter per id / 1,000,000 with the summary's limit of 6
        EXPECT_TRUE(Incr(940000000 + i * 1000, 1, &record) == (i >= 6) && record.maxLogCnt == 6u) << "call " << i;
    std::vector<std::thread> threads;  // concurrent counting loses nothing
    for (int t = 0; t < 4; ++t)        // the sub-domain and its domain, or a fallback
        threads.emplace_back([this, t] {
            for (int i = 0; i < 400; ++i)
                Incr((i % 2 ? 901001000 : 971000000) + t, 1);
        });
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ((std::vector<int64_t>{Quota(901001500)[4], Quota(901500000)[4], Quota(971000000)[4]}),
              (std::vector<int64_t>{802, 805, 800}));
}

// The document is read again exactly when the copy in force, its version or the section changed.
TEST_F(EventQuotaXmlParserTest, ReadsAgainOnlyWhenTheChosenCopyOrTheSectionChanges) {
    LogCapture logs;
    // Everything after the wanted section lies in a later block and is broken; it is never read.
    Write(R"(<Quota><unknown><Summary defDailyCnt="11"/><Domain name="once" eventMin="1" eventMax="2"/></unknown>
<beta><Summary defDailyCnt="22" defLogCnt="3"/><Domain name="d" eventMin="950000000" eventMax="950999999"/></beta>
<!-- )" + std::string(9000, 'x') +
          " -->\n<broken attr=no quotes></Quota>");
    for (int i = 0; i < 3; ++i)
        EXPECT_EQ(parser_->GetSummaryQuota(dir_, kSection).defDailyCnt, 11u);
    EXPECT_EQ(logs.Count(ANDROID_LOG_DEBUG, "SaveDomainQuota domain once:"), 1u);
    EXPECT_EQ(parser_->StartParserXml(dir_, "beta"), 0);
    EXPECT_EQ(parser_->GetEventQuota(dir_, "beta", 950000001).maxLogCnt, 3u);
    Write("<beta><Summary defDailyCnt=\"33\"/></beta>");  // a new version, seen by the next query
    EXPECT_EQ(parser_->GetSummaryQuota(dir_, "beta").defDailyCnt, 33u);

    // An unreadable document: the defaults, one failed try per version, counted; read once it exists.
    TemporaryDir other;
    DaemonStats stats;
    const std::string otherDir = std::string(other.path) + "/";
    DocumentFolders absent(otherDir, otherDir, &stats);
    for (int i = 0; i < 3; ++i)
        EXPECT_EQ(Quota(960000001, absent), (std::vector<int64_t>{200, 10, 300, 0, 0}));
    EXPECT_EQ(logs.Count(ANDROID_LOG_WARN, "StartParserXml parse xml file failed " + absent.configDir), 1u);
    EXPECT_EQ(stats.Value("config.read_failed.event_quota.xml"), 1u);
    ASSERT_TRUE(WriteDocument("<Q><unknown><Summary defDailyCnt=\"44\"/></unknown></Q>",
                              absent.configDir + "event_quota.xml"));
    EXPECT_EQ(Quota(960000001, absent)[0], 44);
}

// Counters belong to their range: a reload with new limits goes on from the counts, a document
// that leaves a range out does not lose its count, and counting while documents are pushed loses
// nothing.
TEST_F(EventQuotaXmlParserTest, LogCountersOutliveReloadsByRange) {
    auto doc = [](const std::string& body) { return "<Quota><unknown>" + body + "</unknown></Quota>"; };
    auto kernel = [](const std::string& name, int domainMax, int subMax) {
        return "<Domain name=\"" + name + "\" eventMin=\"920000000\" eventMax=\"920999999\" maxLogCnt=\"" +
               std::to_string(domainMax) + "\"><SubDomain eventMin=\"920001000\" eventMax=\"920001999\" maxLogCnt=\"" +
               std::to_string(subMax) + "\"/></Domain>";
    };
    // Same range, sorts after the others: it is never counted, and its 0 must not win over their count.
    const std::string twin = R"(<Domain name="zz" eventMin="920000000" eventMax="920999999" maxLogCnt="2"/>)";
    Write(doc(kernel("k", 5, 4) + twin));
    EXPECT_FALSE(Incr(920001001, 3));  // sub-domain 3 < 4, domain 3 < 5

    Write(doc(kernel("renamed", 7, 9) + twin));  // new limits, the same ranges
    DomainQuota record;
    EXPECT_FALSE(Incr(920001001, 3, &record));  // 6 < 9 and 6 < 7
    EXPECT_EQ(record.logCnt, 6);
    EXPECT_TRUE(Incr(920500000, 1));  // the domain alone: 7 >= 7

    Write(doc("<Summary defLogCnt=\"50\" defDailyCnt=\"123\"/>"));  // the ranges are gone
    EXPECT_EQ(Quota(920001001)[0], 123);
    EXPECT_FALSE(Incr(920001001, 1));  // the fallback counter of 920 takes it
    Write(doc(kernel("k", 5, 4) + twin));
    EXPECT_EQ(Quota(920001001)[4], 6);  // back with the sub-domain's count
    EXPECT_TRUE(Incr(920500000, 0, &record));
    EXPECT_EQ(record.logCnt, 7);

    std::atomic<bool> counting{true};
    std::thread pusher([&] {
        for (int i = 0; counting; ++i)
            Write(doc(kernel("k", 100 + i % 2, 200)));
    });
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([this] {
            for (int i = 0; i < 300; ++i)
                Incr(920700000, 1);
        });
    for (std::thread& thread : threads)
        thread.join();
    counting = false;
    pusher.join();
    EXPECT_EQ(Quota(920700000)[4], 7 + 1200);
}

}  // namespace
}  // namespace android::Orvane
