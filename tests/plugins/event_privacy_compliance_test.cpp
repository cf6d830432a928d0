#include "plugins/event_privacy_compliance.h"

#include <stdio.h>

#include <atomic>
#include <thread>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "platform/plugin_factory.h"
#include "tests/common/envelope_opener.h"
#include "tests/common/fake_plugin_context.h"
#include "tests/common/log_capture.h"
#include "tests/common/write_document.h"
#include "tests/storage/storage_test_util.h"
#include "utils/dev_info.h"

namespace android::Orvane {
namespace {

// The catalogue of these tests. Its parser caches entries by id for the whole process, so every
// test writes this same text.
const char kCatalogue[] = R"(<Events>
<Event id="901000001" FaultType="FAULT" PrivacyLevel="L2">
  <Param id="1" name="reason" type="string" len="8" PrivacyLevel="L1"/>
  <Param id="2" name="uptime" type="long" PrivacyLevel="L1" defVal="0"/>
  <Param id="3" name="stack" type="string" len="64" PrivacyLevel="L3" defVal="none"/>
  <Param id="4" name="path" type="string" PrivacyLevel="L3"/>
  <Param id="5" name="cnt" type="int" PrivacyLevel="L1" defVal="0"/>
  <Param id="6" name="level" type="short" PrivacyLevel="L1"/>
  <Param id="7" name="load" type="float" PrivacyLevel="L1" defVal="1.5"/>
  <Param id="8" name="ok" type="bool" PrivacyLevel="L1" defVal="true"/>
  <Param id="9" name="tags" type="string" arrLen="3" len="4" PrivacyLevel="L1"/>
  <Param id="10" name="cpus" type="class" classID="901000100" arrLen="2" PrivacyLevel="L1"/>
  <Param id="11" name="pkg" type="string" len="64" PrivacyLevel="L1"/>
  <Param id="12" name="serial" type="string" len="12" PrivacyLevel="L4"/>
  <Param id="13" name="imeis" type="string" arrLen="2" PrivacyLevel="L4"/>
  <Param id="14" name="chain" type="class" classID="901000200" PrivacyLevel="L1"/>
  <Param id="15" name="ghost" type="class" classID="901000999" PrivacyLevel="L1"/>
</Event>
<Event id="901000100" PrivacyLevel="L1">
  <Param id="1" name="cpu" type="short" PrivacyLevel="L1"/>
  <Param id="2" name="freq" type="long" PrivacyLevel="L3" defVal="0"/>
  <Param id="3" name="owner" type="string" len="4" PrivacyLevel="L1"/>
</Event>
<Event id="901000200" PrivacyLevel="L1">
  <Param id="1" name="next" type="class" classID="901000200" PrivacyLevel="L1"/>
  <Param id="2" name="v" type="int" PrivacyLevel="L1"/>
</Event>
<Event id="901000002" FaultType="FAULT" PrivacyLevel="L3">
  <Param id="1" name="pkg" type="string" PrivacyLevel="L1"/>
</Event>
</Events>
)";

constexpr uint32_t kRich = 901000001;
constexpr uint32_t kLevel3 = 901000002;
constexpr uint32_t kUnknown = 901000777;

class EventPrivacyComplianceTest : public ::testing::Test {
protected:
    void SetUp() override {
        ASSERT_TRUE(WriteDocument(kCatalogue, config_ + "event.xml"));
        EnvelopeOpener::MakeKeyPair(publicPem_, privatePem_);
        ASSERT_TRUE(WriteDocument(publicPem_, config_ + "server.pem"));
        WritePolicy("strip");
        DevInfo::SetUploadSwitch(1);
        plugin_->SetPluginContext(&context_);
        plugin_->OnLoad();
    }
    void TearDown() override { DevInfo::SetUploadSwitch(0); }

    // Replaced through a rename, as a configuration update does, so every version has a stamp of its own.
    void WritePolicy(const std::string& unknown, const std::string& key = "server.pem") {
        std::string text = "<PrivacyPolicy><Levels switchOn=\"3\" switchOff=\"2\"/><UnknownEvent action=\"" + unknown +
                           "\"/><Identifiers key=\"" + key +
                           "\" level=\"4\"/><FilterList params=\"pkg process\"><Name value=\"com.secret\"/>"
                           "<Name pattern=\"com.bank.*\"/></FilterList></PrivacyPolicy>";
        ASSERT_TRUE(WriteDocument(text, config_ + "policy.tmp"));
        ASSERT_EQ(rename((config_ + "policy.tmp").c_str(), (config_ + "privacy_policy.xml").c_str()), 0);
    }

    // A plugin started afresh, which reads the documents at its first event.
    void Restart() {
        plugin_ = new EventPrivacyCompliance();
        plugin_->SetPluginContext(&context_);
        plugin_->OnLoad();
    }

    // The event after the plugin, and what the plugin returned.
    sp<Event> Run(uint32_t id, const std::string& params, EVENT_RET expected = 0) {
        sp<Event> event = MakeEvent(2, id, 1700000000, params);
        EXPECT_EQ(plugin_->OnEvent(event), expected) << params.substr(0, 200);
        return event;
    }
    uint64_t Stat(const std::string& name) { return context_.GetStats().Value("privacy." + name); }

    TemporaryDir root_;
    std::string config_ = std::string(root_.path) + "/";
    FakePluginContext context_{config_, config_};
    sp<EventPrivacyCompliance> plugin_ = new EventPrivacyCompliance();
    std::string publicPem_, privatePem_;
};

const char kRichParams[] =
        R"({"reason":"a\u00e9\u00e9\u00e9\u00e9","uptime":2.5,"stack":"deep","path":"/sdcard/x",)"
        R"("cnt":"7","level":40000,"load":3,"ok":"yes","tags":["abcdef","ok",5,"x","y"],)"
        R"("cpus":[{"cpu":1,"freq":100,"owner":"rootuser","extra":1},{"cpu":"x"},{"cpu":3}],)"
        R"("chain":{"v":1,"next":{"v":2,"next":{"v":3,"next":{"v":4,"next":{"v":5}}}}},)"
        R"("ghost":{"a":1},"nickname":"bob","serial":"SN-1234567890XYZ","imeis":["111","222","333"]})";

// Every member rule on one event, in both consent states: unknown names go, wrong types take
// their default or go, strings are cut on a character boundary, arrays to their length, nested
// classes are checked against their own entries down to 4 levels of objects, levels above the
// consent state's take their default or go, and identifiers are sealed (with consent) or go.
TEST_F(EventPrivacyComplianceTest, EveryMemberRuleInBothConsentStates) {
    sp<Event> on = Run(kRich, kRichParams);
    Json::Value result;
    ASSERT_TRUE(Json::Reader().parse(on->GetValue("param_list"), result)) << on->GetValue("param_list");
    EnvelopeOpener server(privatePem_);
    std::string serial, imei0, imei1;
    ASSERT_TRUE(server.Open(result["serial"].asString(), serial));
    ASSERT_TRUE(server.Open(result["imeis"][0].asString(), imei0));
    ASSERT_TRUE(server.Open(result["imeis"][1].asString(), imei1));
    EXPECT_EQ(serial, "SN-123456789");  // cut to its length before sealing
    EXPECT_EQ(imei0 + imei1, "111222");
    EXPECT_EQ(result["imeis"].size(), 2u);
    result.removeMember("serial"), result.removeMember("imeis");
    Json::StreamWriterBuilder compact;
    compact["indentation"] = "", compact["emitUTF8"] = true;
    EXPECT_EQ(
            Json::writeString(compact, result),
            R"({"chain":{"next":{"next":{"v":3},"v":2},"v":1},"cnt":0,"cpus":[{"cpu":1,"freq":100,"owner":"root"},{}],)"
            R"("load":3,"ok":true,"path":"/sdcard/x","reason":")"
            "a\u00e9\u00e9\u00e9"
            R"(","stack":"deep",)"
            R"("tags":["abcd","ok"],"uptime":0})");
    const std::pair<const char*, uint64_t> counted[] = {
            {"cut.string", 4},           {"replaced.type", 3},    {"removed.type", 3},          {"cut.array", 3},
            {"removed.unknown_name", 2}, {"removed.too_deep", 1}, {"removed.unknown_class", 1}, {"encrypted", 2},
            {"removed.level", 0},        {"replaced.level", 0},   {"removed.identifier", 0}};
    for (const auto& [name, count] : counted) {
        EXPECT_EQ(Stat(name), count) << name;
    }

    DevInfo::SetUploadSwitch(0);  // level 2: L3 members take their default or go, identifiers go
    sp<Event> off = Run(kRich, kRichParams);
    ASSERT_TRUE(Json::Reader().parse(off->GetValue("param_list"), result));
    EXPECT_EQ(result["stack"], "none");
    EXPECT_EQ(result["cpus"][0]["freq"], 0);
    for (const char* gone : {"path", "serial", "imeis"}) {
        EXPECT_FALSE(result.isMember(gone)) << gone;
    }
    EXPECT_EQ(Stat("replaced.level"), 2u);
    EXPECT_EQ(Stat("removed.level"), 1u);
    EXPECT_EQ(Stat("removed.identifier"), 2u);
    EXPECT_EQ(Stat("encrypted"), 2u);

    // The event's own level: L3 passes with consent and is dropped without.
    EXPECT_EQ(Run(kLevel3, R"({"pkg":"a"})", -1)->GetValue("dropReason"), "privacy.event_level");
    DevInfo::SetUploadSwitch(1);
    EXPECT_EQ(Run(kLevel3, R"({"pkg":"a"})")->GetValue("dropReason"), "");
    EXPECT_EQ(Stat("dropped.event_level"), 1u);
}

// What the rules leave alone goes on byte for byte, odd spacing and escapes included, also when
// a withheld member already holds its default; events outside the fault ranges are not looked at.
TEST_F(EventPrivacyComplianceTest, UntouchedEventsKeepTheirTextByteForByte) {
    DevInfo::SetUploadSwitch(0);
    const std::string texts[] = {"{ \"reason\" : \"ok\",\n \"uptime\":5, \"stack\":\"none\", \"load\": 1e2 }",
                                 R"({"reason":"\u0041\/","tags":[],"cpus":[{}]})", "", "{}"};
    for (const std::string& text : texts) {
        EXPECT_EQ(Run(kRich, text)->GetValue("param_list"), text);
    }
    EXPECT_EQ(Run(123, "\xff not json at all")->GetValue("param_list"), "\xff not json at all");
    for (const char* name : PrivacyCounters::kNames) {
        EXPECT_EQ(context_.GetStats().Value(name), 0u) << name;
    }
}

// Parameter lists the rules cannot check, and events the catalogue does not know, follow the
// policy's action: strip to "{}", keep as they came, or drop. Hostile texts (10,000 levels of
// nesting, repeated names, trailing text, a megabyte string, invalid UTF-8) cost one linear pass.
TEST_F(EventPrivacyComplianceTest, UncheckedParametersFollowThePolicyAction) {
    const std::string deep = "{\"cpus\":" + std::string(10000, '[') + std::string(10000, ']') + "}";
    const std::string bad[] = {"not json",
                               "[1,2]",
                               deep,
                               R"({"reason":"a","reason":"b"})",
                               R"({"reason":"a"} x)",
                               R"({"reason":"a",})",
                               "{\"reason\":\"a\"",
                               R"({"reason":"ok" /* hidden */})"};
    for (const std::string& text : bad) {
        EXPECT_EQ(Run(kRich, text)->GetValue("param_list"), "{}") << text.substr(0, 40);
    }
    EXPECT_EQ(Run(kUnknown, R"({"a":1})")->GetValue("param_list"), "{}");
    EXPECT_EQ(Run(kUnknown, "")->GetValue("param_list"), "");
    EXPECT_EQ(Stat("stripped.bad_param_list"), std::size(bad));
    EXPECT_EQ(Stat("stripped.unknown_event"), 1u);

    // A name with a NUL inside is still a name the catalogue does not list.
    EXPECT_EQ(Run(kRich, R"({"reason\u0000x":"secret","pkg\u0000":"p","reason":"ok"})")->GetValue("param_list"),
              R"({"reason":"ok"})");
    std::string huge = "{\"stack\":\"" + std::string(1 << 20, 'x') + "\",\"reason\":\"\xff\xfe\",\"\xc0\xaf\":1}";
    EXPECT_EQ(Run(kRich, huge)->GetValue("param_list"), "{\"stack\":\"" + std::string(64, 'x') + "\"}");

    WritePolicy("keep");
    Restart();
    for (const std::string& text : bad) {
        EXPECT_EQ(Run(kRich, text)->GetValue("param_list"), text);
    }
    EXPECT_EQ(Run(kUnknown, R"({"a":1})")->GetValue("param_list"), R"({"a":1})");

    WritePolicy("drop");  // reaches the running plugin within its recheck time
    EXPECT_TRUE(WaitUntil([this] {
        sp<Event> event = MakeEvent(2, kUnknown, 1, "");
        return plugin_->OnEvent(event) == -1;
    }));
    for (const std::string& text : bad) {
        EXPECT_EQ(Run(kRich, text, -1)->GetValue("dropReason"), "privacy.bad_param_list");
    }
    EXPECT_EQ(Run(kUnknown, "", -1)->GetValue("dropReason"), "privacy.unknown_event");
    EXPECT_EQ(Stat("dropped.bad_param_list"), std::size(bad));
    EXPECT_EQ(Stat("dropped.unknown_event"), 2u);  // with the one that showed the change
}

// While no policy could ever be read, an event of any level is kept but carries nothing above
// level 1: a broken document costs parameters, never events, and never lets one through.
TEST(SafestPolicyTest, KeepsEveryEventWithOnlyLevelOneParameters) {
    sp<EventInfoConfig> entry = new EventInfoConfig(kLevel3);
    entry->privacyLevel = 3;
    EventParamInfoCfg pkg, stack;
    pkg.name = "pkg", pkg.type = PARAM_TYPE_STRING, pkg.privacyLevel = 1;
    stack.name = "stack", stack.type = PARAM_TYPE_STRING, stack.privacyLevel = 3;
    entry->params = {pkg, stack};
    DaemonStats stats;
    PrivacyCounters counters(stats);
    ParamFilter filter(counters, [](uint32_t) { return sp<EventInfoConfig>(); });
    for (bool consented : {true, false}) {
        std::string params = R"({"pkg":"com.a","stack":"secret"})", dropReason;
        EXPECT_EQ(filter.Apply(*PrivacyPolicy::Safest(), consented, entry.get(), params, dropReason),
                  ParamFilter::Verdict::kRewritten);
        EXPECT_EQ(params, R"({"pkg":"com.a"})");
        EXPECT_EQ(dropReason, "");
    }
    std::string unknown = R"({"a":1})", dropReason;
    EXPECT_EQ(filter.Apply(*PrivacyPolicy::Safest(), true, nullptr, unknown, dropReason),
              ParamFilter::Verdict::kRewritten);
    EXPECT_EQ(unknown, "{}");
}

// Events of a filtered process or package are dropped whichever parameter named in the policy
// carries the name, exactly or by pattern, known to the catalogue or not.
TEST_F(EventPrivacyComplianceTest, FilterListDropsEventsOfListedProcesses) {
    for (const char* params :
         {R"({"pkg":"com.secret"})", R"({"pkg":"com.bank.app:remote"})", R"({"process":"com.secret","pkg":"other"})"}) {
        EXPECT_EQ(Run(kRich, params, -1)->GetValue("dropReason"), "privacy.filter_list") << params;
    }
    EXPECT_EQ(Run(kUnknown, R"({"pkg":"com.secret"})", -1)->GetValue("dropReason"), "privacy.filter_list");
    EXPECT_EQ(Run(kRich, R"({"pkg":"com.bank"})")->GetValue("param_list"), R"({"pkg":"com.bank"})");
    EXPECT_EQ(Run(kRich, R"({"pkg":["com.secret"]})")->GetValue("param_list"), "{}");
    EXPECT_EQ(Stat("dropped.filter_list"), 4u);
}

// Without a usable server key identifiers are removed, never stored in the clear, and the
// policy says so once at load; the dump shows the policy (never the key) and every counter,
// the same values as the daemon's statistics.
TEST_F(EventPrivacyComplianceTest, WithoutKeyIdentifiersGoAndTheDumpShowsTheCounters) {
    LogCapture capture;
    WritePolicy("strip", "missing.pem");
    Restart();
    sp<Event> event = Run(kRich, R"({"serial":"SN1","reason":"r"})");
    EXPECT_EQ(event->GetValue("param_list"), R"({"reason":"r"})");
    EXPECT_EQ(capture.Count(ANDROID_LOG_WARN, "identifiers are removed"), 1u);

    std::string dump = DumpOf([this](int fd) { plugin_->Dump(fd, {}); });
    EXPECT_NE(dump.find("no key, withheld"), std::string::npos) << dump;
    EXPECT_NE(dump.find("privacy.removed.identifier 1\n"), std::string::npos) << dump;
    EXPECT_NE(dump.find("privacy.encrypted 0\n"), std::string::npos) << dump;
    EXPECT_NE(context_.GetStats().Format().find("privacy.removed.identifier 1\n"), std::string::npos);
    WritePolicy("strip");
    dump = DumpOf([this](int fd) { plugin_->Dump(fd, {}); });
    EXPECT_NE(dump.find("(key server.pem)"), std::string::npos) << dump;
    EXPECT_EQ(dump.find(publicPem_.substr(30, 20)), std::string::npos);
}

// On its own loop the plugin filters a stream of events while dumps run on another thread; the
// counters add up exactly.
TEST_F(EventPrivacyComplianceTest, FiltersOnItsLoopWhileDumped) {
    sp<EventPrivacyCompliance> looped = new EventPrivacyCompliance();
    sp<EventLoop> loop = new EventLoop("privacy_loop");
    loop->StartLoop();
    looped->SetPluginContext(&context_);
    looped->SetLooper(loop);
    looped->OnLoad();
    std::atomic<bool> done{false};
    std::thread dumper([&] {
        while (!done) {
            DumpOf([&](int fd) { looped->Dump(fd, {}); });
        }
    });
    for (int i = 0; i < 500; ++i) {
        loop->AddEvent(looped, MakeEvent(2, kRich, 1, R"({"reason":"too long by far","x":1})"), 0, false);
    }
    EXPECT_TRUE(WaitUntil([&] { return Stat("removed.unknown_name") == 500; }));
    done = true;
    dumper.join();
    EXPECT_EQ(Stat("cut.string"), 500u);
    loop->StopLoop();
}

}  // namespace
}  // namespace android::Orvane
