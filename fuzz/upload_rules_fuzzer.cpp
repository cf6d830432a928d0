// libFuzzer target: bytes as the log collection rules "event_upload.xml" (a cloud copy is outside
// input), read the way the daemon reads them; the rules are then asked what log collection, storage
// and EventInfoPack ask: the rule set and the subscription of a few ids (among them the ids and
// bounds the input names), and each dynamic source's pattern is matched against names like those
// of a log folder.

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "config/event_upload_xml_parser.h"
#include "fuzz/fuzz_documents.h"

using namespace android;
using namespace android::Orvane;
using FuzzDocuments::Check;

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    FuzzDocuments::QuietLogs();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static const std::string dir = FuzzDocuments::Folder("upload_rules_fuzzer");
    const std::string text(reinterpret_cast<const char*>(data), size);
    const std::string path = dir + EventUploadXmlParser::kFileName;
    FuzzDocuments::Replace(path, text);

    std::shared_ptr<const UploadRules> rules = EventUploadXmlParser::ReadRules(path, nullptr);
    Check(rules != nullptr);
    std::vector<uint32_t> ids = {0, 901001001, 999999999, UINT32_MAX};
    for (const char* key : {"eventMin=\"", "eventMax=\"", "eventId=\""}) {
        FuzzDocuments::AddNumbersAfter(text, key, 3, ids);
    }
    for (uint32_t id : ids) {
        const UploadRules::Subscription* subscription = rules->FindSubscription(id);
        Check(subscription == nullptr ||
              (subscription->eventMin <= id && id <= subscription->eventMax && subscription->eventMin >= 900000000 &&
               subscription->eventMax <= 999999999 && subscription->expireDays >= 1 &&
               subscription->expireDays <= UploadRules::Subscription::kMaxExpireDays));
        const UploadRules::RuleSet* ruleSet = rules->Find(id);
        if (ruleSet == nullptr) {
            continue;
        }
        Check(ruleSet->eventMin <= id && id <= ruleSet->eventMax);
        for (const LogCollectInfo& log : ruleSet->logs) {
            switch (log.kind) {
                case LogCollectInfo::Kind::kStatic:
                    Check(!log.path.empty() && log.path[0] == '/');
                    break;
                case LogCollectInfo::Kind::kDynamic:
                    Check(log.pattern != nullptr && log.count >= 1 && log.count <= LogCollectInfo::kMaxCount);
                    for (const char* name : {"tombstone_01", "trace_12.txt", "", "a b", ".."}) {
                        log.pattern->Matches(name);
                    }
                    break;
                case LogCollectInfo::Kind::kCommand:
                    Check(!log.command.empty() && !log.fileName.empty() &&
                          log.fileName.find('/') == std::string::npos && log.timeoutSec >= 1 &&
                          log.timeoutSec <= LogCollectInfo::kMaxTimeoutSec);
                    break;
            }
        }
    }
    return 0;
}
