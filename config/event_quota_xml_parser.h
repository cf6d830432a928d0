#ifndef ORVANE_CONFIG_EVENT_QUOTA_XML_PARSER_H
#define ORVANE_CONFIG_EVENT_QUOTA_XML_PARSER_H

#include <cstdint>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include <utils/RefBase.h>

#include "config/xml_parser.h"

namespace android {
namespace Orvane {

// The quota document "event_quota.xml": daily event counts and log collection limits per event
// range, read once per directory and section, with the running log counters of each range.
//
// Concurrency: every public operation may be called from any thread; all of them take this
// parser's mutex (loading included, before the document lock).
class EventQuotaXmlParser : public XmlParser {
public:
    // A domain, a sub-domain, or the quota that applies to one event id.
    struct DomainQuota {
        bool same = false;  // "logSame" is "true"
        bool sub = false;   // a domain that has sub-domains
        uint32_t eventMin = 0;
        uint32_t eventMax = 0;
        uint32_t dailyCnt = 0;   // events of the range stored per day
        uint32_t maxLogCnt = 0;  // log collections allowed for the range
        uint32_t logSpace = 0;   // log space allowed for the range
        int32_t logCnt = 0;      // log collections so far, in memory only
    };

    // The totals of the section's "Summary" element.
    struct SummaryQuota {
        uint32_t defDailyCnt = 200;
        uint32_t defLogCnt = 10;
        uint32_t defLogSpace = 300;
        uint32_t uploadExpireYear = 0;
        uint32_t level1Month = 0;
        uint32_t level1Max = 0;
        uint32_t level2Month = 0;
        uint32_t level2Max = 0;
        uint32_t level3Month = 0;
        uint32_t level3Max = 0;
        uint32_t logStatic = 0;
    };

    static sp<EventQuotaXmlParser> getInstance();

    // Loads section of directory + "event_quota.xml" unless that directory and section were
    // the last loaded; 0 when loaded, otherwise the reader's failure (the loading is not retried
    // for the same directory and section, and the defaults apply).
    int32_t StartParserXml(const std::string& directory, const std::string& section);
    DomainQuota GetEventQuota(const std::string& directory, const std::string& section, uint32_t id);
    SummaryQuota GetSummaryQuota(const std::string& directory, const std::string& section);
    // Counts incr more log collections for id; true when its range's limit is now reached.
    // record, when given, receives the quota that was counted against.
    bool CheckLogCntLimitAfterIncr(const std::string& directory, const std::string& section, uint32_t id, int32_t incr,
                                   DomainQuota* record = nullptr);

    // Reached through XmlParser while the document is read.
    bool IsMatch(const std::string& name) override;
    void OnStartElement(const std::string& name, const std::map<std::string, std::string>& attributes) override;
    void OnEndElement(const std::string& name) override;

private:
    EventQuotaXmlParser() : XmlParser("event_quota.xml") {}
    int32_t LoadLocked(const std::string& directory, const std::string& section);
    void SaveTotalQuota(const std::map<std::string, std::string>& attributes);
    void SaveDomainQuota(const std::map<std::string, std::string>& attributes);
    void SaveSubDomainQuota(const std::map<std::string, std::string>& attributes);
    void SaveEventQuota(const std::map<std::string, std::string>& attributes);
    DomainQuota ReadDomainQuota(const std::map<std::string, std::string>& attributes) const;
    // The first domain in name order whose range holds id; null when none.
    DomainQuota* FindDomain(uint32_t id);

    std::mutex mutex_;
    SummaryQuota summary_;
    std::map<std::string, DomainQuota> domains_;
    std::vector<DomainQuota> subDomains_;  // document order, of all domains
    std::map<uint32_t, uint32_t> eventDailyCnt_;
    std::map<uint32_t, int32_t> fallbackLogCnt_;  // by id / 1,000,000, for ids in no domain
    std::string currentDomain_;
    std::string section_;  // the section being read, then last loaded
    std::string loadedDirectory_;
    bool loaded_ = false;
    int32_t loadResult_ = 0;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_CONFIG_EVENT_QUOTA_XML_PARSER_H
