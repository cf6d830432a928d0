// libFuzzer target: an event's parameter text (written by drivers and services, so outside
// input) through the compliance plugin's filter, against catalogue entries of every parameter
// type, arrays and nested (also self-nesting) classes. The first byte picks the consent state,
// the action for unchecked parameters, whether the catalogue knows the event and whether
// identifiers are sealed. Checks beyond "no crash": a rewritten text is a strict JSON object
// that the filter, asked again, leaves untouched.

#include <cstddef>
#include <cstdint>
#include <map>
#include <string>

#include "plugins/param_filter.h"

using namespace android;
using namespace android::Orvane;

namespace {

const char kServerKey[] =
        "-----BEGIN PUBLIC KEY-----\nMCowBQYDK2VuAyEA+LJhE1XjLgoFr86eUxbKQ4iIBbSYzaa/v6PZP0p/02U=\n"
        "-----END PUBLIC KEY-----\n";

EventParamInfoCfg Param(const char* name, uint32_t type, uint32_t level, const char* defVal = "", uint32_t len = 0,
                        uint32_t arrLen = 0, uint32_t classId = 0) {
    EventParamInfoCfg param;
    param.name = name, param.type = type, param.privacyLevel = level, param.defVal = defVal;
    param.len = len, param.arrLen = arrLen, param.classID = classId;
    return param;
}

struct Fixture {
    Fixture() : counters(stats), filter(counters, [this](uint32_t id) { return Find(id); }) {
        sp<EventInfoConfig> event = new EventInfoConfig(901000001);
        event->privacyLevel = 2;
        event->params = {Param("reason", PARAM_TYPE_STRING, 1, "", 8),
                         Param("uptime", PARAM_TYPE_LONG, 1, "0"),
                         Param("stack", PARAM_TYPE_STRING, 3, "none", 16),
                         Param("cnt", PARAM_TYPE_INT, 1, "0"),
                         Param("level", PARAM_TYPE_SHORT, 2, "-1"),
                         Param("load", PARAM_TYPE_FLOAT, 1, "1.5"),
                         Param("ok", PARAM_TYPE_BOOL, 4, "true"),
                         Param("odd", PARAM_TYPE_UNKNOWN, 1, "x", 3),
                         Param("tags", PARAM_TYPE_STRING, 1, "", 4, 3),
                         Param("cpus", PARAM_TYPE_CLASS, 1, "", 0, 2, 901000100),
                         Param("chain", PARAM_TYPE_CLASS, 1, "", 0, 0, 901000200),
                         Param("ghost", PARAM_TYPE_CLASS, 1, "", 0, 0, 901000999),
                         Param("pkg", PARAM_TYPE_STRING, 1),
                         Param("serial", PARAM_TYPE_STRING, 4, "", 12),
                         Param("imeis", PARAM_TYPE_STRING, 5, "", 0, 2)};
        sp<EventInfoConfig> cpu = new EventInfoConfig(901000100);
        cpu->params = {Param("cpu", PARAM_TYPE_SHORT, 1), Param("freq", PARAM_TYPE_LONG, 3, "0"),
                       Param("owner", PARAM_TYPE_STRING, 1, "", 4)};
        sp<EventInfoConfig> chain = new EventInfoConfig(901000200);
        chain->params = {Param("next", PARAM_TYPE_CLASS, 1, "", 0, 2, 901000200), Param("v", PARAM_TYPE_INT, 1)};
        entries = {{901000001, event}, {901000100, cpu}, {901000200, chain}};

        auto base = std::make_shared<PrivacyPolicy>();
        base->levelConsented = 3, base->levelOtherwise = 2;
        base->identifierLevel = 4;
        base->identifierNames = {"imeis"};
        base->filterParams = {"pkg", "process"};
        base->filterNames = {"com.secret"};
        base->filterPatterns = {"com.bank.*"};
        for (int i = 0; i < 3; ++i) {
            auto policy = std::make_shared<PrivacyPolicy>(*base);
            policy->unchecked = static_cast<UncheckedAction>(i);
            plain[i] = policy;
            auto sealing = std::make_shared<PrivacyPolicy>(*policy);
            sealing->cipher = IdentifierCipher::FromPem(kServerKey);
            sealed[i] = sealing;
        }
    }
    sp<EventInfoConfig> Find(uint32_t id) {
        auto found = entries.find(id);
        return found == entries.end() ? nullptr : found->second;
    }

    DaemonStats stats;
    PrivacyCounters counters;
    ParamFilter filter;
    std::map<uint32_t, sp<EventInfoConfig>> entries;
    std::shared_ptr<const PrivacyPolicy> plain[3], sealed[3];
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static Fixture* fixture = new Fixture();
    if (size == 0) {
        return 0;
    }
    uint8_t flags = data[0];
    bool consented = (flags & 1) != 0;
    int action = (flags >> 1) % 3;
    bool seal = (flags & 8) != 0;
    const EventInfoConfig* entry = (flags & 16) != 0 ? nullptr : fixture->entries[901000001].get();
    const PrivacyPolicy& policy = seal ? *fixture->sealed[action] : *fixture->plain[action];
    const std::string original(reinterpret_cast<const char*>(data + 1), size - 1);
    std::string params = original, reason;
    ParamFilter::Verdict verdict = fixture->filter.Apply(policy, consented, entry, params, reason);
    if ((verdict == ParamFilter::Verdict::kUntouched && params != original) ||
        (verdict == ParamFilter::Verdict::kDropped && reason.empty())) {
        __builtin_trap();
    }
    if (verdict == ParamFilter::Verdict::kRewritten && !seal) {
        std::string again = params;
        if (fixture->filter.Apply(policy, consented, entry, again, reason) != ParamFilter::Verdict::kUntouched) {
            __builtin_trap();  // what the filter wrote is what it allows
        }
    }
    return 0;
}
