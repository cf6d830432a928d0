// libFuzzer target: bytes as the log collection rules "event_upload.xml" (rule sets and
// subscriptions), then the lookups log collection and EventInfoPack make for a few ids, among
// them the ids and bounds the input names.

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "config/event_upload_xml_parser.h"
#include "fuzz/fuzz_documents.h"

using namespace android;
using namespace android::Orvane;

namespace {

void Check(bool holds) {
    if (!holds) {
        __builtin_trap();
    }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    FuzzDocuments::QuietLogs();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static const std::string dir = FuzzDocuments::Folder("upload_rules_fuzzer");
    const std::string text(reinterpret_cast<const char*>(data), size);
    FuzzDocuments::Replace(dir + "event_upload.xml", text);

    std::vector<uint32_t> ids = {0, 901001001, 999999999, UINT32_MAX};
    for (const char* key : {"eventMin=\"", "eventMax=\"", "eventId=\""}) {
        FuzzDocuments::AddNumbersAfter(text, key, 3, ids);
    }
    std::shared_ptr<const UploadRules> rules = EventUploadXmlParser::ReadRules(dir + "event_upload.xml", nullptr);
    Check(rules != nullptr);
    for (uint32_t id : ids) {
        const UploadRules::RuleSet* ruleSet = rules->Find(id);
        Check(ruleSet == nullptr || (ruleSet->eventMin <= id && id <= ruleSet->eventMax));
        const UploadRules::Subscription* subscription = rules->FindSubscription(id);
        Check(subscription == nullptr ||
              (subscription->eventMin <= id && id <= subscription->eventMax && subscription->eventMin >= 900000000 &&
               subscription->eventMax <= 999999999 && subscription->expireDays >= 1 &&
               subscription->expireDays <= UploadRules::Subscription::kMaxExpireDays));
    }
    return 0;
}
