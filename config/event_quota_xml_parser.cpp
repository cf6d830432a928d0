#include "config/event_quota_xml_parser.h"

#include "utils/orvane_log.h"
#include "utils/string_util.h"

namespace android {
namespace Orvane {

namespace {

constexpr uint32_t kIdsPerDomain = 1000000;
constexpr uint32_t kFallbackLogCntLimit = 10;
// Counts kept for ranges that the document in force leaves out; beyond this many (far more than
// a document has ranges) they are let go, so that a stream of documents cannot grow the memory.
constexpr size_t kMaxKeptLogCounters = 4096;

// The attribute's value when it is a number of 1 or more; otherwise the default.
void InitValue(const std::map<std::string, std::string>& attributes, const std::string& key, uint32_t& field,
               uint32_t defaultValue) {
    field = defaultValue;
    auto it = attributes.find(key);
    if (it == attributes.end()) {
        return;
    }
    int32_t value = StringUtil::ConvertInt(it->second);
    if (value >= 1) {
        field = static_cast<uint32_t>(value);
    }
}

bool InRange(const EventQuotaXmlParser::DomainQuota& quota, uint32_t id) {
    return quota.eventMin <= id && id <= quota.eventMax;
}

// Copies what a counted collection reports; the daily count only when none was set yet.
void FillRecord(const EventQuotaXmlParser::DomainQuota& from, EventQuotaXmlParser::DomainQuota& record) {
    record.same = from.same;
    record.eventMin = from.eventMin;
    record.eventMax = from.eventMax;
    record.maxLogCnt = from.maxLogCnt;
    record.logSpace = from.logSpace;
    record.logCnt = from.logCnt;
    if (record.dailyCnt == 0) {
        record.dailyCnt = from.dailyCnt;
    }
}

}  // namespace

sp<EventQuotaXmlParser> EventQuotaXmlParser::getInstance() {
    static sp<EventQuotaXmlParser> instance(new EventQuotaXmlParser());
    return instance;
}

int32_t EventQuotaXmlParser::StartParserXml(const DocumentFolders& folders, const std::string& section) {
    Mutex::Autolock lock(mutex_);
    return LoadLocked(folders, section);
}

// Reads the chosen copy's section when the copy, its version or the section changed; the new
// document replaces everything read from the last one, except the log counters (see the class).
int32_t EventQuotaXmlParser::LoadLocked(const DocumentFolders& folders, const std::string& section) {
    DocumentChoice choice = ConfigDocument::Choose(folders, GetFileName());
    if (loaded_ && choice.SameVersion(loadedDocument_) && section == section_) {
        return loadResult_;
    }
    for (const auto& [key, count] : LogCounters()) {
        if (*count != 0) {
            keptLogCnt_[key] = *count;
        } else {
            keptLogCnt_.erase(key);
        }
    }
    summary_ = SummaryQuota();
    domains_.clear();
    subDomains_.clear();
    eventDailyCnt_.clear();
    currentDomain_.clear();
    section_ = section;
    loadedDocument_ = choice;
    loaded_ = true;
    loadResult_ = ParserXmlFile(choice.path, true);
    if (loadResult_ != 0) {
        OLOG_AS(ANDROID_LOG_WARN, "StartParserXml", "%s parse xml file failed %s", choice.path.c_str());
        folders.Count("read_failed", GetFileName());
    }
    for (const auto& [key, count] : LogCounters()) {
        auto kept = keptLogCnt_.find(key);
        if (kept != keptLogCnt_.end()) {
            *count = kept->second;
        }
    }
    if (keptLogCnt_.size() > kMaxKeptLogCounters) {
        keptLogCnt_.clear();  // the counts of this document's ranges live on in its records
    }
    return loadResult_;
}

std::vector<std::pair<EventQuotaXmlParser::CounterKey, int32_t*>> EventQuotaXmlParser::LogCounters() {
    std::vector<std::pair<CounterKey, int32_t*>> counters;
    std::map<CounterKey, uint32_t> places;  // records met so far of each kind and bounds
    auto add = [&counters, &places](bool sub, DomainQuota& quota) {
        CounterKey key{sub, quota.eventMin, quota.eventMax, 0};
        std::get<3>(key) = places[key]++;
        counters.emplace_back(key, &quota.logCnt);
    };
    for (auto& [name, domain] : domains_) {
        add(false, domain);
    }
    for (DomainQuota& sub : subDomains_) {
        add(true, sub);
    }
    return counters;
}

EventQuotaXmlParser::DomainQuota EventQuotaXmlParser::GetEventQuota(const DocumentFolders& folders,
                                                                    const std::string& section, uint32_t id) {
    Mutex::Autolock lock(mutex_);
    LoadLocked(folders, section);
    DomainQuota record;
    auto event = eventDailyCnt_.find(id);
    bool eventDaily = event != eventDailyCnt_.end();
    if (eventDaily) {
        record.dailyCnt = event->second;
    }
    auto fallback = fallbackLogCnt_.find(id / kIdsPerDomain);
    if (fallback != fallbackLogCnt_.end()) {
        record.logCnt = fallback->second;
    }
    const DomainQuota* domain = FindDomain(id);
    if (domain != nullptr) {
        record.maxLogCnt = domain->maxLogCnt;
        record.logSpace = domain->logSpace;
        record.same = domain->same;
        record.logCnt = domain->logCnt;
        if (!eventDaily) {
            record.dailyCnt = domain->dailyCnt;
        }
        const DomainQuota* sub = nullptr;
        if (domain->sub) {
            for (const DomainQuota& candidate : subDomains_) {
                if (InRange(candidate, id)) {
                    sub = &candidate;
                    break;
                }
            }
        }
        if (sub != nullptr) {
            record.maxLogCnt = sub->maxLogCnt;
            record.logSpace = sub->logSpace;
            record.same = sub->same;
            record.logCnt = sub->logCnt;
            if (!eventDaily) {
                record.dailyCnt = sub->dailyCnt;
            }
            OLOGD("%s parser retrun sub domain %u in [%u,%u]", id, sub->eventMin, sub->eventMax);
        } else {
            OLOGD("%s parser retrun domain %u in [%u,%u]", id, domain->eventMin, domain->eventMax);
        }
    }
    if (record.dailyCnt == 0) {
        record.dailyCnt = summary_.defDailyCnt;
    }
    if (record.maxLogCnt == 0) {
        record.maxLogCnt = summary_.defLogCnt;
    }
    if (record.logSpace == 0) {
        record.logSpace = summary_.defLogSpace;
    }
    return record;
}

EventQuotaXmlParser::SummaryQuota EventQuotaXmlParser::GetSummaryQuota(const DocumentFolders& folders,
                                                                       const std::string& section) {
    Mutex::Autolock lock(mutex_);
    LoadLocked(folders, section);
    return summary_;
}

bool EventQuotaXmlParser::CheckLogCntLimitAfterIncr(const DocumentFolders& folders, const std::string& section,
                                                    uint32_t id, int32_t incr, DomainQuota* record) {
    Mutex::Autolock lock(mutex_);
    LoadLocked(folders, section);
    if (record != nullptr) {
        *record = DomainQuota();
    }
    DomainQuota* domain = FindDomain(id);
    if (domain == nullptr) {
        uint32_t key = id / kIdsPerDomain;
        int32_t& count = fallbackLogCnt_[key];  // a new counter starts at 0, then takes incr
        count += incr;
        uint32_t limit = summary_.defLogCnt != 0 ? summary_.defLogCnt : kFallbackLogCntLimit;
        OLOGD("%s parser retrun %u, rel=%u, max=%u", key, static_cast<uint32_t>(count), limit);
        if (record != nullptr) {
            record->maxLogCnt = limit;
        }
        return static_cast<int64_t>(count) >= limit;
    }
    domain->logCnt += incr;
    if (record != nullptr) {
        FillRecord(*domain, *record);
    }
    if (domain->sub) {
        for (DomainQuota& sub : subDomains_) {
            if (!InRange(sub, id)) {
                continue;
            }
            sub.logCnt += incr;
            if (record != nullptr && static_cast<int64_t>(domain->logCnt) < domain->maxLogCnt) {
                FillRecord(sub, *record);
            }
            OLOGD("%s sub domain log, %u in [%u,%u] %d < %d by incr %d", id, sub.eventMin, sub.eventMax, sub.logCnt,
                  static_cast<int32_t>(sub.maxLogCnt), incr);
            if (static_cast<int64_t>(sub.logCnt) >= sub.maxLogCnt) {
                return true;
            }
        }
    }
    OLOGD("%s domain log, %u in [%u,%u] %d < %d by incr %d", id, domain->eventMin, domain->eventMax, domain->logCnt,
          static_cast<int32_t>(domain->maxLogCnt), incr);
    return static_cast<int64_t>(domain->logCnt) >= domain->maxLogCnt;
}

bool EventQuotaXmlParser::IsMatch(const std::string& name) {
    if (name != section_) {
        return false;
    }
    SetStart();
    return true;
}

void EventQuotaXmlParser::OnStartElement(const std::string& name,
                                         const std::map<std::string, std::string>& attributes) {
    if (name == "Summary") {
        SaveTotalQuota(attributes);
    } else if (name == "Domain") {
        SaveDomainQuota(attributes);
    } else if (name == "SubDomain") {
        SaveSubDomainQuota(attributes);
    } else if (name == "Event") {
        SaveEventQuota(attributes);
    }
}

void EventQuotaXmlParser::OnEndElement(const std::string& name) {
    if (name == section_) {
        SetFinish();  // the rest of the document holds other sections
    } else if (name == "Domain") {
        currentDomain_.clear();
    }
}

void EventQuotaXmlParser::SaveTotalQuota(const std::map<std::string, std::string>& attributes) {
    InitValue(attributes, "defDailyCnt", summary_.defDailyCnt, 200);
    InitValue(attributes, "defLogCnt", summary_.defLogCnt, 10);
    InitValue(attributes, "defLogSpace", summary_.defLogSpace, 300);
    InitValue(attributes, "UploadExpireYear", summary_.uploadExpireYear, 0);
    InitValue(attributes, "Level1Month", summary_.level1Month, 0);
    InitValue(attributes, "Level1Max", summary_.level1Max, 0);
    InitValue(attributes, "Level2Month", summary_.level2Month, 0);
    InitValue(attributes, "Level2Max", summary_.level2Max, 0);
    InitValue(attributes, "Level3Month", summary_.level3Month, 0);
    InitValue(attributes, "Level3Max", summary_.level3Max, 0);
    InitValue(attributes, "LogStatic", summary_.logStatic, 0);
}

EventQuotaXmlParser::DomainQuota EventQuotaXmlParser::ReadDomainQuota(
        const std::map<std::string, std::string>& attributes) const {
    DomainQuota quota;
    InitValue(attributes, "eventMin", quota.eventMin, 0);
    InitValue(attributes, "eventMax", quota.eventMax, 0);
    InitValue(attributes, "dailyCnt", quota.dailyCnt, summary_.defDailyCnt);
    InitValue(attributes, "maxLogCnt", quota.maxLogCnt, summary_.defLogCnt);
    InitValue(attributes, "logSpace", quota.logSpace, summary_.defLogSpace);
    quota.same = GetAttribute(attributes, "logSame") == "true";
    return quota;
}

void EventQuotaXmlParser::SaveDomainQuota(const std::map<std::string, std::string>& attributes) {
    DomainQuota quota = ReadDomainQuota(attributes);
    currentDomain_ = GetAttribute(attributes, "name");
    domains_[currentDomain_] = quota;
    OLOGD("%s domain %s:dailycnt=%u,max=%u,min=%u,logcnt=%u,space=%u,same=%d,sub=%d", currentDomain_.c_str(),
          quota.dailyCnt, quota.eventMax, quota.eventMin, quota.maxLogCnt, quota.logSpace, quota.same, quota.sub);
}

void EventQuotaXmlParser::SaveSubDomainQuota(const std::map<std::string, std::string>& attributes) {
    auto domain = currentDomain_.empty() ? domains_.end() : domains_.find(currentDomain_);
    if (domain == domains_.end()) {
        OLOGD("%s not find domain");
        return;
    }
    DomainQuota quota = ReadDomainQuota(attributes);
    subDomains_.push_back(quota);
    domain->second.sub = true;
    OLOGD("%s domain %s: dailycnt=%u,max=%u,min=%u,logcnt=%u, space=%u, same=%d, sub=%d",
          GetAttribute(attributes, "name").c_str(), quota.dailyCnt, quota.eventMax, quota.eventMin, quota.maxLogCnt,
          quota.logSpace, quota.same, quota.sub);
}

void EventQuotaXmlParser::SaveEventQuota(const std::map<std::string, std::string>& attributes) {
    eventDailyCnt_[StringUtil::ConvertUInt(GetAttribute(attributes, "eventId"))] =
            StringUtil::ConvertUInt(GetAttribute(attributes, "dailyCnt"));
}

EventQuotaXmlParser::DomainQuota* EventQuotaXmlParser::FindDomain(uint32_t id) {
    for (auto& [name, domain] : domains_) {
        if (InRange(domain, id)) {
            return &domain;
        }
    }
    return nullptr;
}

}  // namespace Orvane
}  // namespace android
