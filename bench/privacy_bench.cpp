// The compliance plugin's cost per event, side by side with a plain JsonCpp parse and compact
// write of the same 10-parameter text (the target: at most twice that), and the cost and size
// of sealing one identifier.
//
//   build/privacy_bench --benchmark_repetitions=5 --benchmark_report_aggregates_only=true

#include <unistd.h>

#include <memory>
#include <sstream>
#include <string>

#include <android/log.h>
#include <benchmark/benchmark.h>
#include <json/json.h>

#include "plugins/event_privacy_compliance.h"
#include "tests/common/fake_plugin_context.h"
#include "utils/dev_info.h"
#include "utils/file_util.h"
#include "utils/identifier_cipher.h"

namespace android {
namespace Orvane {
namespace {

constexpr uint32_t kEventId = 901000001;

const char kCatalogue[] = R"(<Events>
<Event id="901000001" FaultType="FAULT" PrivacyLevel="L2">
  <Param id="1" name="reason" type="string" len="128" PrivacyLevel="L1"/>
  <Param id="2" name="uptime" type="long" PrivacyLevel="L1" defVal="0"/>
  <Param id="3" name="stack" type="string" len="2048" PrivacyLevel="L3" defVal="none"/>
  <Param id="4" name="pkg" type="string" len="64" PrivacyLevel="L1"/>
  <Param id="5" name="pid" type="int" PrivacyLevel="L1" defVal="0"/>
  <Param id="6" name="uid" type="int" PrivacyLevel="L1" defVal="0"/>
  <Param id="7" name="load" type="float" PrivacyLevel="L1" defVal="0"/>
  <Param id="8" name="online" type="bool" PrivacyLevel="L1" defVal="true"/>
  <Param id="9" name="tags" type="string" arrLen="8" len="16" PrivacyLevel="L1"/>
  <Param id="10" name="version" type="string" len="32" PrivacyLevel="L1"/>
</Event>
</Events>
)";

const char kPolicy[] = R"(<PrivacyPolicy><Levels switchOn="3" switchOff="2"/><UnknownEvent action="strip"/>)"
                       R"(<FilterList params="pkg process"><Name value="com.secret"/><Name pattern="com.bank.*"/>)"
                       R"(</FilterList></PrivacyPolicy>)";

// Ten parameters, every one within the rules: the plugin leaves the text as it is.
const char kParams[] = R"({"reason":"watchdog: CPU2 stuck for 22s","uptime":5120331,"stack":"dump_stack+0x68/0x84",)"
                       R"("pkg":"com.android.systemui","pid":1834,"uid":10086,"load":3.75,"online":true,)"
                       R"("tags":["wdt","cpu2","hard"],"version":"13.0.0.118"})";
// The same with one member the catalogue does not list: the plugin removes it and writes the rest.
const char kParamsWithExtra[] = R"({"reason":"watchdog: CPU2 stuck for 22s","uptime":5120331,)"
                                R"("stack":"dump_stack+0x68/0x84","pkg":"com.android.systemui","pid":1834,)"
                                R"("uid":10086,"load":3.75,"online":true,"tags":["wdt","cpu2","hard"],"user":"alice"})";

void BM_PlainJsonParseAndWrite(benchmark::State& state) {
    Json::CharReaderBuilder readerBuilder;
    std::unique_ptr<Json::CharReader> reader(readerBuilder.newCharReader());
    Json::StreamWriterBuilder writerBuilder;
    writerBuilder["indentation"] = "";
    std::unique_ptr<Json::StreamWriter> writer(writerBuilder.newStreamWriter());
    const std::string text = kParams;
    std::ostringstream out;
    for (auto _ : state) {
        Json::Value root;
        reader->parse(text.data(), text.data() + text.size(), &root, nullptr);
        out.str("");
        writer->write(root, &out);
        benchmark::DoNotOptimize(out.str());
    }
}
BENCHMARK(BM_PlainJsonParseAndWrite);

// The plugin with its configuration in a folder of its own and the catalogue entry cached.
class PluginFixture {
public:
    PluginFixture() {
        __android_log_set_minimum_priority(ANDROID_LOG_WARN);
        char pattern[] = "/tmp/privacy_bench.XXXXXX";
        dir_ = std::string(mkdtemp(pattern)) + "/";
        FileUtil::SaveStringToFile(dir_ + "event.xml", kCatalogue, true);
        FileUtil::SaveStringToFile(dir_ + "privacy_policy.xml", kPolicy, true);
        context_ = std::make_unique<FakePluginContext>(dir_, dir_);
        plugin_ = new EventPrivacyCompliance();
        plugin_->SetPluginContext(context_.get());
        plugin_->OnLoad();
        DevInfo::SetUploadSwitch(1);
        event_ = new Event("bench");
        event_->eventType = 2;
        event_->eventId = kEventId;
    }
    ~PluginFixture() {
        uint64_t freed = 0;
        plugin_.clear();
        context_.reset();
        FileUtil::DeleteDirectoryOrFile(dir_, freed, true);
    }
    EVENT_RET Run(const char* params) {
        event_->SetValue("param_list", params);
        return plugin_->OnEvent(event_);
    }
    const sp<Event>& GetEvent() const { return event_; }

private:
    std::string dir_;
    std::unique_ptr<FakePluginContext> context_;
    sp<EventPrivacyCompliance> plugin_;
    sp<Event> event_;
};

void RunPlugin(benchmark::State& state, const char* params, bool rewritten) {
    PluginFixture fixture;
    if (fixture.Run(params) != 0 || (fixture.GetEvent()->GetValue("param_list") != params) != rewritten) {
        state.SkipWithError("the plugin did not treat the event as expected");
        return;
    }
    for (auto _ : state) {
        benchmark::DoNotOptimize(fixture.Run(params));
    }
}

void BM_PluginUntouchedEvent(benchmark::State& state) {
    RunPlugin(state, kParams, false);
}
BENCHMARK(BM_PluginUntouchedEvent);

void BM_PluginRewrittenEvent(benchmark::State& state) {
    RunPlugin(state, kParamsWithExtra, true);
}
BENCHMARK(BM_PluginRewrittenEvent);

void BM_SealIdentifier(benchmark::State& state) {
    std::shared_ptr<const IdentifierCipher> cipher = IdentifierCipher::FromPem(
            "-----BEGIN PUBLIC KEY-----\nMCowBQYDK2VuAyEA+LJhE1XjLgoFr86eUxbKQ4iIBbSYzaa/v6PZP0p/02U=\n"
            "-----END PUBLIC KEY-----\n");
    const std::string serial = "R58N12ABCDEF0042";  // 16 bytes, a phone's serial number
    size_t size = 0;
    for (auto _ : state) {
        std::string sealed = cipher->Seal(serial);
        size = sealed.size();
        benchmark::DoNotOptimize(sealed);
    }
    state.counters["envelope_bytes"] = static_cast<double>(IdentifierCipher::kOverhead + serial.size());
    state.counters["base64_chars"] = static_cast<double>(size);
}
BENCHMARK(BM_SealIdentifier);

}  // namespace
}  // namespace Orvane
}  // namespace android

BENCHMARK_MAIN();
