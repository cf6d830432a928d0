#ifndef ORVANE_CONFIG_EVENT_XML_PARSER_H
#define ORVANE_CONFIG_EVENT_XML_PARSER_H

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include <utils/Mutex.h>
#include <utils/RefBase.h>

#include "config/config_document.h"
#include "config/xml_parser.h"

namespace android {
namespace Orvane {

// Codes of an event's FaultType attribute.
enum EventFaultType : uint32_t {
    FAULT_TYPE_NONE = 0,
    FAULT_TYPE_FAULT = 2,    // "FAULT"
    FAULT_TYPE_STATICS = 3,  // "STATICS"
};

// Codes of a parameter's type attribute (EventXmlParser::GetParamType).
enum EventParamType : uint32_t {
    PARAM_TYPE_UNKNOWN = 0,
    PARAM_TYPE_STRING = 1,
    PARAM_TYPE_BOOL = 2,
    PARAM_TYPE_SHORT = 3,
    PARAM_TYPE_INT = 4,
    PARAM_TYPE_FLOAT = 5,
    PARAM_TYPE_LONG = 6,
    PARAM_TYPE_CLASS = 7,
};

// One Param element of a catalogue entry.
struct EventParamInfoCfg {
    uint32_t id = 0;
    uint32_t len = 0;      // maximum length of a string value
    uint32_t arrLen = 0;   // maximum element count of an array value; 0: not an array
    uint32_t classID = 0;  // catalogue id of the nested structure of type "class"
    std::string name;
    uint32_t type = PARAM_TYPE_UNKNOWN;
    uint32_t privacyLevel = 5;
    std::string defVal;  // substituted by privacy compliance
};

// One catalogued event. Entries handed out by EventXmlParser are shared through its cache:
// treat them as read-only.
class EventInfoConfig : public RefBase {
public:
    explicit EventInfoConfig(uint32_t id) : eventId(id) {}

    uint32_t eventId;
    uint32_t cost = 0;  // microseconds its lookup took; cheap entries leave the cache first
    int32_t extendS = 0;
    int32_t extendE = 0;
    int32_t extendV = 0;
    uint32_t faultType = FAULT_TYPE_NONE;
    uint32_t faultLevel = 0;
    uint32_t privacyLevel = 5;
    std::vector<EventParamInfoCfg> params;  // in document order
};

// The level tables of the catalogue.
class EventUtil {
public:
    // "INFORMATIVE"/"1" .. "CRITICAL"/"4" give 1..4, anything else 0.
    static uint32_t GetFaultLevel(const std::string& level);
    // "L1"/"1" .. "L4"/"4" give 1..4, anything else 5.
    static uint32_t GetPrivacyLevel(const std::string& level);
};

// Looks up single events of the catalogue "event.xml" on demand, reading the document only up
// to the wanted entry, and keeps the 50 most expensive lookups cached. Every lookup chooses the
// copy in force (ConfigDocument::Choose); the cache holds entries of one version of one copy and
// is dropped when the choice changes.
//
// Concurrency: GetEventInfoConfig may be called from any thread; one lock of this parser covers
// the whole lookup (cache, entry being built, document reading), taken before the document lock.
class EventXmlParser : public XmlParser {
public:
    static sp<EventXmlParser> getInstance();

    // The catalogue entry of id from the copy in force, or null when the document cannot be read
    // or does not hold the id.
    sp<EventInfoConfig> GetEventInfoConfig(const DocumentFolders& folders, uint32_t id) EXCLUDES(lookupMutex_);
    static uint32_t GetParamType(const std::string& type);
    // The name="value" pairs of one start tag, read the way the pattern (\S+)="(.+?)" finds
    // them (a later name wins), in linear time however long or hostile the text is.
    static std::map<std::string, std::string> ExtractAttributes(const std::string& tag);

    // Reached through XmlParser while a document is read.
    bool IsMatch(const std::string& name) REQUIRES(gXmlDocumentMutex) override;
    bool OnProcess(const std::string& text) REQUIRES(lookupMutex_, gXmlDocumentMutex) override;
    void OnStartElement(const std::string& name, const std::map<std::string, std::string>& attributes)
            REQUIRES(lookupMutex_, gXmlDocumentMutex) override;
    void OnEndElement(const std::string& name) REQUIRES(lookupMutex_, gXmlDocumentMutex) override;

private:
    static constexpr size_t kCacheSize = 50;

    EventXmlParser() : XmlParser("event.xml") {}
    void InitEventInfoConfig(const std::map<std::string, std::string>& attributes) REQUIRES(lookupMutex_);
    void AddEventParamInfoCfg(const std::map<std::string, std::string>& attributes) REQUIRES(lookupMutex_);
    void SaveEventInfo(uint32_t id) REQUIRES(lookupMutex_);

    Mutex lookupMutex_;
    sp<EventInfoConfig> building_ GUARDED_BY(lookupMutex_);
    bool found_ GUARDED_BY(lookupMutex_) = false;
    uint32_t wantedId_ GUARDED_BY(lookupMutex_) = 0;
    std::map<uint32_t, sp<EventInfoConfig>> cache_ GUARDED_BY(lookupMutex_);
    DocumentChoice cachedDocument_ GUARDED_BY(lookupMutex_);  // the copy whose entries cache_ holds
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_CONFIG_EVENT_XML_PARSER_H
