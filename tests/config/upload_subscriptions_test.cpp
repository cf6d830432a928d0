// Subscriptions of "event_upload.xml": which one applies to an id, and what a bad entry costs.

#include <gtest/gtest.h>

#include "config/event_upload_xml_parser.h"
#include "tests/common/log_capture.h"
#include "tests/common/test_data.h"
#include "tests/storage/storage_test_util.h"

namespace android::Orvane {
namespace {

TEST(UploadSubscriptionsTest, SmallestRangeWinsAndBadEntriesAreLeftOut) {
    TempDir dir;
    WriteFile(dir.File("event_upload.xml"), R"(<?xml version="1.0"?>
<EventUpload>
  <Subscribe eventMin="901000000" eventMax="901999999" expire="30" visible="false"/>
  <Subscribe eventMin="901001000" eventMax="901001999" expire="45" visible="true"/>
  <Subscribe eventId="901001001" expire="90" visible="true"/>
  <Subscribe eventMin="901001000" eventMax="901001999" expire="7" visible="false"/>
  <LogRule eventId="902001001">
    <Subscribe eventId="902001001" expire="30" visible="true"/>
  </LogRule>
  <Subscribe eventId="801000001" expire="30" visible="true"/>
  <Subscribe eventMin="999000000" eventMax="1000000000" expire="30" visible="true"/>
  <Subscribe eventId="903000001" expire="0" visible="true"/>
  <Subscribe eventId="903000002" expire="3651" visible="true"/>
  <Subscribe eventId="903000003" expire="-5" visible="true"/>
  <Subscribe eventId="903000004" visible="true"/>
  <Subscribe eventId="903000005" expire="30" visible="yes"/>
  <Subscribe eventId="903000006" eventMin="903000006" eventMax="903000007" expire="30" visible="true"/>
  <Subscribe eventMin="903000009" eventMax="903000008" expire="30" visible="true"/>
  <Subscribe eventId="905001001" expire="3650" visible="false"/>
</EventUpload>)");
    LogCapture log;
    DaemonStats stats;
    auto rules = EventUploadXmlParser::ReadRules(dir.File("event_upload.xml"), &stats);

    ASSERT_EQ(rules->subscriptions.size(), 5u);
    EXPECT_EQ(rules->rejected, 10u);
    EXPECT_EQ(stats.Value("config.event_upload.rejected"), 10u);
    EXPECT_TRUE(log.Contains(ANDROID_LOG_WARN, "Subscribe left out, it stands inside a LogRule"));
    // The rule set around the misplaced subscription is kept.
    ASSERT_NE(rules->Find(902001001), nullptr);

    auto expireOf = [&](uint32_t id) {
        const UploadRules::Subscription* found = rules->FindSubscription(id);
        return found == nullptr ? 0u : found->expireDays;
    };
    EXPECT_EQ(expireOf(901001001), 90u);  // the single id inside both ranges
    EXPECT_EQ(expireOf(901001002), 45u);  // the first of two equal ranges
    EXPECT_EQ(expireOf(901002000), 30u);
    EXPECT_EQ(expireOf(900999999), 0u);
    EXPECT_EQ(expireOf(901999999), 30u);
    EXPECT_EQ(expireOf(902001001), 0u);
    EXPECT_EQ(expireOf(905001001), 3650u);
    EXPECT_TRUE(rules->FindSubscription(901001001)->visible);
    EXPECT_FALSE(rules->FindSubscription(901001999 + 1)->visible);
}

TEST(UploadSubscriptionsTest, ShippedRulesSubscribe) {
    auto rules = EventUploadXmlParser::ReadRules(TestDataDir() + "/etc/event_upload.xml", nullptr);
    EXPECT_EQ(rules->rejected, 0u);
    ASSERT_NE(rules->FindSubscription(901001001), nullptr);
    EXPECT_EQ(rules->FindSubscription(901001001)->expireDays, 90u);
    EXPECT_EQ(rules->FindSubscription(908002001), nullptr);
}

}  // namespace
}  // namespace android::Orvane
