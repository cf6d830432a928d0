#ifndef ORVANE_CONFIG_EVENT_QUOTA_XML_PARSER_H
#define ORVANE_CONFIG_EVENT_QUOTA_XML_PARSER_H

#include <cstdint>
#include <map>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include <utils/Mutex.h>
#include <utils/RefBase.h>

#include "config/config_document.h"
#include "config/xml_parser.h"

namespace android {
namespace Orvane {

// The quota document "event_quota.xml": daily event counts and log collection limits per event
// range, with the running log counters of each range. Every query chooses the copy in force
// (ConfigDocument::Choose) and reads the section again when the copy, its version or the section
// differ from what was read last; otherwise nothing is read.
//
// The log counters live in memory only and outlive a reload: each belongs to its range (domain or
// sub-domain, bounds, and its place among records of the same bounds), and a reloaded document's
// record of the same range goes on from it. A range that a new document leaves out keeps its
// count until a later document brings the range back (up to 4096 such counts).
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

    // Loads section of the chosen "event_quota.xml" unless that version of that copy and section
    // were the last loaded; 0 when loaded, otherwise the reader's failure (the loading is not
    // retried until the choice changes, and the defaults apply).
    int32_t StartParserXml(const DocumentFolders& folders, const std::string& section) EXCLUDES(mutex_);
    DomainQuota GetEventQuota(const DocumentFolders& folders, const std::string& section, uint32_t id) EXCLUDES(mutex_);
    SummaryQuota GetSummaryQuota(const DocumentFolders& folders, const std::string& section) EXCLUDES(mutex_);
    // Counts incr more log collections for id; true when its range's limit is now reached.
    // record, when given, receives the quota that was counted against.
    bool CheckLogCntLimitAfterIncr(const DocumentFolders& folders, const std::string& section, uint32_t id,
                                   int32_t incr, DomainQuota* record = nullptr) EXCLUDES(mutex_);

    // Reached through XmlParser while the document is read.
    bool IsMatch(const std::string& name) REQUIRES(mutex_, gXmlDocumentMutex) override;
    void OnStartElement(const std::string& name, const std::map<std::string, std::string>& attributes)
            REQUIRES(mutex_, gXmlDocumentMutex) override;
    void OnEndElement(const std::string& name) REQUIRES(mutex_, gXmlDocumentMutex) override;

private:
    // A range's log counter: sub-domain or domain, eventMin, eventMax, place among the records of
    // the same kind and bounds.
    using CounterKey = std::tuple<bool, uint32_t, uint32_t, uint32_t>;

    EventQuotaXmlParser() : XmlParser("event_quota.xml") {}
    int32_t LoadLocked(const DocumentFolders& folders, const std::string& section) REQUIRES(mutex_);
    // The log counter of every domain and sub-domain, with its key.
    std::vector<std::pair<CounterKey, int32_t*>> LogCounters() REQUIRES(mutex_);
    void SaveTotalQuota(const std::map<std::string, std::string>& attributes) REQUIRES(mutex_);
    void SaveDomainQuota(const std::map<std::string, std::string>& attributes) REQUIRES(mutex_);
    void SaveSubDomainQuota(const std::map<std::string, std::string>& attributes) REQUIRES(mutex_);
    void SaveEventQuota(const std::map<std::string, std::string>& attributes) REQUIRES(mutex_);
    DomainQuota ReadDomainQuota(const std::map<std::string, std::string>& attributes) const REQUIRES(mutex_);
    // The first domain in name order whose range holds id; null when none.
    DomainQuota* FindDomain(uint32_t id) REQUIRES(mutex_);

    Mutex mutex_;
    SummaryQuota summary_ GUARDED_BY(mutex_);
    std::map<std::string, DomainQuota> domains_ GUARDED_BY(mutex_);
    std::vector<DomainQuota> subDomains_ GUARDED_BY(mutex_);  // document order, of all domains
    std::map<uint32_t, uint32_t> eventDailyCnt_ GUARDED_BY(mutex_);
    std::map<uint32_t, int32_t> fallbackLogCnt_ GUARDED_BY(mutex_);  // by id / 1,000,000, for ids in no domain
    std::map<CounterKey, int32_t> keptLogCnt_ GUARDED_BY(mutex_);    // non-zero counts as of the last reload
    std::string currentDomain_ GUARDED_BY(mutex_);
    std::string section_ GUARDED_BY(mutex_);  // the section being read, then last loaded
    DocumentChoice loadedDocument_ GUARDED_BY(mutex_);
    bool loaded_ GUARDED_BY(mutex_) = false;
    int32_t loadResult_ GUARDED_BY(mutex_) = 0;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_CONFIG_EVENT_QUOTA_XML_PARSER_H
