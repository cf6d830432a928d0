// libFuzzer target: bytes as the event catalogue, then lookups of a few ids, among them the ids
// the input names. The first byte chooses how the catalogue is read: as "event.xml" (text scan) or
// inside "event.zip" (element mode), and from the system folder or as a pushed copy that must
// parse first.

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "config/event_xml_parser.h"
#include "fuzz/fuzz_documents.h"

using namespace android;
using namespace android::Orvane;
using FuzzDocuments::Check;

namespace {

void CheckEntry(const sp<EventInfoConfig>& entry, uint32_t id) {
    Check(entry->eventId == id);
    Check(entry->faultType == FAULT_TYPE_NONE || entry->faultType == FAULT_TYPE_FAULT ||
          entry->faultType == FAULT_TYPE_STATICS);
    Check(entry->faultLevel <= 4 && entry->privacyLevel >= 1 && entry->privacyLevel <= 5);
    for (const EventParamInfoCfg& param : entry->params) {
        Check(param.type <= PARAM_TYPE_CLASS && param.privacyLevel >= 1 && param.privacyLevel <= 5);
    }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    FuzzDocuments::QuietLogs();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static const std::string systemDir = FuzzDocuments::Folder("catalogue_fuzzer_system");
    static const std::string cloudDir = FuzzDocuments::Folder("catalogue_fuzzer_cloud");
    if (size == 0) {
        return 0;
    }
    const bool archive = (data[0] & 1) != 0, pushed = (data[0] & 2) != 0;
    const std::string text(reinterpret_cast<const char*>(data) + 1, size - 1);
    const std::string fileName = archive ? "event.zip" : "event.xml";
    sp<EventXmlParser> parser = EventXmlParser::getInstance();
    parser->SetFileName(fileName);
    unlink((systemDir + fileName).c_str());
    unlink((cloudDir + fileName).c_str());
    FuzzDocuments::Replace((pushed ? cloudDir : systemDir) + fileName, text, archive ? "event.xml" : "");

    std::vector<uint32_t> ids = {0, 901001001, UINT32_MAX};
    FuzzDocuments::AddNumbersAfter(text, "id=\"", 6, ids);
    DocumentFolders folders(cloudDir, systemDir, nullptr);
    for (uint32_t id : ids) {
        sp<EventInfoConfig> entry = parser->GetEventInfoConfig(folders, id);
        if (entry != nullptr) {
            CheckEntry(entry, id);
        }
        Check(parser->GetEventInfoConfig(folders, id) == entry);  // a hit is cached, a miss stays one
    }
    return 0;
}
