// libFuzzer target: bytes as the quota document "event_quota.xml", then the queries storage
// makes: the quota of a few ids (among them the ids and bounds the input names), the totals, and
// log counting; in the usual section and in the section the input's second element names.

#include <cctype>
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "config/event_quota_xml_parser.h"
#include "fuzz/fuzz_documents.h"

using namespace android;
using namespace android::Orvane;
using FuzzDocuments::Check;

namespace {

// The name of the second element of text, if any: a section the input defines.
std::string SecondElementName(const std::string& text) {
    size_t at = text.find('<');
    at = at == std::string::npos ? at : text.find('<', at + 1);
    if (at == std::string::npos) {
        return "";
    }
    size_t end = ++at;
    while (end < text.size() && (isalnum(static_cast<unsigned char>(text[end])) || text[end] == '_')) {
        ++end;
    }
    return text.substr(at, end - at);
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    FuzzDocuments::QuietLogs();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static const std::string dir = FuzzDocuments::Folder("quota_fuzzer");
    const std::string text(reinterpret_cast<const char*>(data), size);
    FuzzDocuments::Replace(dir + "event_quota.xml", text);

    std::vector<uint32_t> ids = {0, 901001001, UINT32_MAX};
    for (const char* key : {"eventMin=\"", "eventMax=\"", "eventId=\""}) {
        FuzzDocuments::AddNumbersAfter(text, key, 3, ids);
    }
    sp<EventQuotaXmlParser> parser = EventQuotaXmlParser::getInstance();
    for (const std::string& section : {std::string("unknown"), SecondElementName(text)}) {
        parser->StartParserXml(dir, section);
        EventQuotaXmlParser::SummaryQuota summary = parser->GetSummaryQuota(dir, section);
        Check(summary.defDailyCnt >= 1 && summary.defLogCnt >= 1 && summary.defLogSpace >= 1);
        for (uint32_t id : ids) {
            EventQuotaXmlParser::DomainQuota quota = parser->GetEventQuota(dir, section, id);
            Check(quota.dailyCnt >= 1 && quota.maxLogCnt >= 1 && quota.logSpace >= 1);
            EventQuotaXmlParser::DomainQuota record;
            parser->CheckLogCntLimitAfterIncr(dir, section, id, 1, &record);
            Check(record.eventMax == 0 || (record.eventMin <= id && id <= record.eventMax));
        }
    }
    return 0;
}
