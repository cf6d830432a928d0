// Documents built to hurt, as the system copy and as a pushed copy: no reader crashes, loads or
// expands an entity, or takes a broken pushed copy; the answers come from the defaults or from the
// system copy.

#include <random>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "config/event_quota_xml_parser.h"
#include "config/event_xml_parser.h"
#include "tests/common/write_document.h"

namespace android::Orvane {
namespace {

constexpr uint32_t kId = 915001001;
constexpr size_t kMiB = 1024 * 1024;

std::string Quota(const std::string& inside) {
    return "<EventQuota><unknown>" + inside + "</unknown></EventQuota>";
}
std::string Catalogue(const std::string& inside) {
    return "<Events>" + inside + "</Events>";
}

struct Hostile {
    const char* name;
    std::string quota, catalogue;
    bool wellFormed;
    std::vector<uint32_t> quotaAsRead;  // dailyCnt, maxLogCnt: what was read before any error
};

std::vector<Hostile> HostileDocuments() {
    std::mt19937 random(5);
    std::string junk(kMiB, '\0');
    for (char& c : junk)
        c = static_cast<char>(random());
    std::string laughs = "<!ENTITY a \"SECRET\">";
    for (char name = 'b'; name <= 'k'; ++name) {
        std::string refs;
        for (int i = 0; i < 10; ++i)
            refs += std::string("&") + static_cast<char>(name - 1) + ";";
        laughs += std::string("<!ENTITY ") + name + " \"" + refs + "\">";
    }
    const std::string xxe = "<!DOCTYPE x [<!ENTITY e SYSTEM \"file:///etc/passwd\">]>";
    const std::string deep = [] {
        std::string text;
        for (int i = 0; i < 100000; ++i)
            text += "<a>";
        return text;
    }();
    const std::string id = std::to_string(kId);
    return {
            {"1 MiB of junk", junk, junk, false, {200, 10}},
            {"1 MiB attribute",
             Quota("<Summary defDailyCnt=\"7\"/><Domain name=\"" + std::string(kMiB, 'n') + "\" eventMin=\"" + id +
                   "\" eventMax=\"" + id + "\" maxLogCnt=\"3\"/>"),
             Catalogue("<Event id=\"" + id + "\" FaultType=\"" + std::string(kMiB, 'F') + "\"/>"),
             true,
             {7, 3}},
            {"deep nesting",
             Quota(deep + "<Summary defDailyCnt=\"7\"/>"),
             Catalogue(deep + "<Event id=\"" + id + "\" FaultLevel=\"1\"></Event>"),
             false,
             {7, 10}},
            {"entity expansion",
             "<!DOCTYPE EventQuota [" + laughs + "]>" + Quota("<Domain name=\"&k;\" eventMin=\"1\" eventMax=\"2\"/>"),
             "<!DOCTYPE Events [" + laughs + "]>" + Catalogue("<Event id=\"" + id + "\" FaultType=\"&k;\"/>"),
             false,
             {200, 10}},
            {"external entity",
             xxe + Quota("<Domain name=\"&e;\" eventMin=\"1\" eventMax=\"2\"/>"),
             xxe + Catalogue("<Event id=\"" + id + "\" FaultType=\"&e;\"/>"),
             false,
             {200, 10}},
    };
}

TEST(HostileDocumentsTest, NeitherCrashNorLeakNorPassAsAPushedCopy) {
    sp<EventQuotaXmlParser> quota = EventQuotaXmlParser::getInstance();
    sp<EventXmlParser> catalogue = EventXmlParser::getInstance();
    for (const Hostile& hostile : HostileDocuments()) {
        SCOPED_TRACE(hostile.name);
        TemporaryDir system, cloud;
        const std::string sys = std::string(system.path) + "/", cld = std::string(cloud.path) + "/";
        // As the system copy: what was read before the error, else the defaults. Deep nesting
        // costs the push parser memory, not stack: it reads on to the mismatched end tag.
        ASSERT_TRUE(WriteDocument(hostile.quota, sys + "event_quota.xml"));
        ASSERT_TRUE(WriteDocument(hostile.catalogue, sys + "event.xml"));
        EventQuotaXmlParser::DomainQuota q = quota->GetEventQuota(sys, "unknown", kId);
        EXPECT_EQ((std::vector<uint32_t>{q.dailyCnt, q.maxLogCnt}), hostile.quotaAsRead);
        sp<EventInfoConfig> entry = catalogue->GetEventInfoConfig(sys, kId);
        // Text mode never parses the document, so an entry that fits is found even in a document
        // that does not parse; its attributes are taken as written, never expanded.
        if (entry != nullptr) {
            EXPECT_TRUE(entry->faultType == FAULT_TYPE_NONE && entry->faultLevel <= 1);
        }

        // As a pushed copy over a good system copy: passed over unless well-formed.
        DaemonStats stats;
        DocumentFolders folders(cld, sys, &stats);
        ASSERT_TRUE(WriteDocument(Quota("<Summary defDailyCnt=\"5\"/>"), sys + "event_quota.xml"));
        ASSERT_TRUE(WriteDocument(Catalogue("<Event id=\"" + std::to_string(kId) + "\" FaultLevel=\"2\"/>"),
                                  sys + "event.xml"));
        ASSERT_TRUE(WriteDocument(hostile.quota, cld + "event_quota.xml"));
        ASSERT_TRUE(WriteDocument(hostile.catalogue, cld + "event.xml"));
        EXPECT_EQ(quota->GetEventQuota(folders, "unknown", kId).dailyCnt, hostile.wellFormed ? 7u : 5u);
        entry = catalogue->GetEventInfoConfig(folders, kId);
        EXPECT_EQ(entry != nullptr && entry->faultLevel == 2, !hostile.wellFormed);
        EXPECT_EQ(stats.Value("config.cloud_rejected.event_quota.xml") + stats.Value("config.cloud_rejected.event.xml"),
                  hostile.wellFormed ? 0u : 2u);
    }
}

}  // namespace
}  // namespace android::Orvane
