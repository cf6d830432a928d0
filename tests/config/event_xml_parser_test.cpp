#include "config/event_xml_parser.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <random>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "tests/common/log_capture.h"
#include "utils/file_util.h"
#include "utils/zip_pack.h"

namespace android {
namespace Orvane {
namespace {

// The parser is a process-wide singleton whose cache is keyed by id alone, so every test below
// uses ids of its own.

std::string Entry(uint32_t id, const std::string& attrs = "FaultType=\"FAULT\" FaultLevel=\"GENERAL\"",
                  int params = 1) {
    std::string text = "  <Event id=\"" + std::to_string(id) + "\" " + attrs + ">\n";
    for (int i = 1; i <= params; ++i) {
        text += "    <Param id=\"" + std::to_string(i) + "\" name=\"p" + std::to_string(i) +
                "\" type=\"int\" PrivacyLevel=\"L3\"/>\n";
    }
    return text + "  </Event>\n";
}

std::string Catalogue(const std::string& entries) {
    return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<Events>\n" + entries + "</Events>\n";
}

class EventXmlParserTest : public ::testing::Test {
protected:
    void SetUp() override {
        char pattern[] = "/tmp/event_xml_parser_test.XXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir_ = std::string(pattern) + "/";
        parser_ = EventXmlParser::getInstance();
    }
    void TearDown() override {
        parser_->SetFileName("event.xml");
        ASSERT_EQ(chdir("/"), 0);
        uint64_t freed = 0;
        FileUtil::DeleteDirectoryOrFile(dir_, freed, true);
    }
    void WriteCatalogue(const std::string& content) {
        std::ofstream(dir_ + "event.xml", std::ios::binary | std::ios::trunc) << content;
    }

    std::string dir_;
    sp<EventXmlParser> parser_;
};

// The victim by the eviction rule: the smallest non-zero cost in id order, a minimum of 0 always
// giving way to the next entry.
uint32_t ExpectedVictim(const std::map<uint32_t, uint32_t>& costs) {
    auto victim = costs.begin();
    for (auto it = std::next(costs.begin()); it != costs.end(); ++it) {
        if (victim->second == 0 || (it->second != 0 && it->second < victim->second)) {
            victim = it;
        }
    }
    return victim->first;
}

// First in this file, so that it starts with an empty cache when the whole file runs in one process.
TEST_F(EventXmlParserTest, CacheEvictsTheCheapestLookup) {
    std::string filler;
    for (uint32_t id = 913100000; filler.size() < 64 * 1024; ++id) {
        filler += Entry(id, "FaultType=\"FAULT\"", 0);
    }
    std::string own;
    for (uint32_t id = 913000000; id < 913000050; ++id) {
        own += Entry(id);
    }
    WriteCatalogue(Catalogue(filler + own));
    std::map<uint32_t, sp<EventInfoConfig>> entries;
    std::map<uint32_t, uint32_t> costs;
    for (uint32_t id = 913000000; id < 913000050; ++id) {
        entries[id] = parser_->GetEventInfoConfig(dir_, id);
        ASSERT_NE(entries[id], nullptr);
        costs[id] = entries[id]->cost;
    }
    // With the document gone only cached entries are found: all 50 fit.
    WriteCatalogue(Catalogue(""));
    for (const auto& [id, entry] : entries) {
        ASSERT_EQ(parser_->GetEventInfoConfig(dir_, id), entry) << id;
    }

    // The 51st entry evicts one; the document no longer holds the evicted one.
    WriteCatalogue(Catalogue(Entry(913000100)));
    sp<EventInfoConfig> added = parser_->GetEventInfoConfig(dir_, 913000100);
    ASSERT_NE(added, nullptr);
    uint32_t victim = ExpectedVictim(costs);
    for (const auto& [id, entry] : entries) {
        EXPECT_EQ(parser_->GetEventInfoConfig(dir_, id), id == victim ? nullptr : entry) << id;
    }
    costs.erase(victim);
    costs[913000100] = added->cost;
    victim = ExpectedVictim(costs);
    WriteCatalogue(Catalogue(Entry(913000101)));
    ASSERT_NE(parser_->GetEventInfoConfig(dir_, 913000101), nullptr);
    WriteCatalogue(Catalogue(""));
    for (const auto& [id, cost] : costs) {
        EXPECT_EQ(parser_->GetEventInfoConfig(dir_, id) == nullptr, id == victim) << id;
    }
    EXPECT_NE(parser_->GetEventInfoConfig(dir_, 913000101), nullptr);
}

TEST_F(EventXmlParserTest, ReadsOneEntryWithItsParametersAndExtendValues) {
    WriteCatalogue(Catalogue(
        Entry(910000001) +
        "  <Event id=\"910000002\" FaultType=\"FAULT\" FaultLevel=\"CRITICAL\" PrivacyLevel=\"L2\" "
        "Extend=\"E:1|S:30|V:2\">\n"
        "    <Param id=\"1\" name=\"pkg\" type=\"string\" len=\"64\" PrivacyLevel=\"L1\"/>\n"
        "    <Param id=\"2\" name=\"cnt\" type=\"int\" PrivacyLevel=\"L3\" defVal=\"0\"/>\n"
        "    <Param id=\"3\" name=\"info\" type=\"class\" classID=\"901001002\" arrLen=\"8\" PrivacyLevel=\"L2\"/>\n"
        "    <Param id=\"4\" name=\"ratio\" type=\"double\" PrivacyLevel=\"L9\"/>\n"
        "  </Event>\n" +
        Entry(910000003, "FaultType=\"STATICS\" FaultLevel=\"critical\" PrivacyLevel=\"4\" Extend=\"E:5\"", 0) +
        Entry(910000004, "FaultType=\"fault\" FaultLevel=\"3\" Extend=\"x|S:7|junk|S:-9|V:|E:1E:2\"", 0) +
        Entry(910000005, "Extend=\"\"", 0)));

    sp<EventInfoConfig> entry = parser_->GetEventInfoConfig(dir_, 910000002);
    ASSERT_NE(entry, nullptr);
    EXPECT_EQ(entry->eventId, 910000002u);
    EXPECT_EQ(entry->faultType, FAULT_TYPE_FAULT);
    EXPECT_EQ(entry->faultLevel, 4u);
    EXPECT_EQ(entry->privacyLevel, 2u);
    EXPECT_EQ(entry->extendE, 1);
    EXPECT_EQ(entry->extendS, 30);
    EXPECT_EQ(entry->extendV, 2);
    ASSERT_EQ(entry->params.size(), 4u);
    EXPECT_EQ(entry->params[0].name, "pkg");
    EXPECT_EQ(entry->params[0].type, PARAM_TYPE_STRING);
    EXPECT_EQ(entry->params[0].len, 64u);
    EXPECT_EQ(entry->params[0].privacyLevel, 1u);
    EXPECT_EQ(entry->params[0].defVal, "");
    EXPECT_EQ(entry->params[1].id, 2u);
    EXPECT_EQ(entry->params[1].type, PARAM_TYPE_INT);
    EXPECT_EQ(entry->params[1].defVal, "0");
    EXPECT_EQ(entry->params[2].type, PARAM_TYPE_CLASS);
    EXPECT_EQ(entry->params[2].classID, 901001002u);
    EXPECT_EQ(entry->params[2].arrLen, 8u);
    EXPECT_EQ(entry->params[3].type, PARAM_TYPE_UNKNOWN);
    EXPECT_EQ(entry->params[3].privacyLevel, 5u);

    entry = parser_->GetEventInfoConfig(dir_, 910000003);
    ASSERT_NE(entry, nullptr);
    EXPECT_EQ(entry->faultType, FAULT_TYPE_STATICS);
    EXPECT_EQ(entry->faultLevel, 0u);  // level names are case-sensitive
    EXPECT_EQ(entry->privacyLevel, 4u);
    EXPECT_EQ(entry->extendE, 5);
    EXPECT_EQ(entry->extendS, 0);
    EXPECT_EQ(entry->extendV, 0);
    EXPECT_TRUE(entry->params.empty());

    entry = parser_->GetEventInfoConfig(dir_, 910000004);
    ASSERT_NE(entry, nullptr);
    EXPECT_EQ(entry->faultType, FAULT_TYPE_NONE);
    EXPECT_EQ(entry->faultLevel, 3u);
    EXPECT_EQ(entry->privacyLevel, 5u);
    EXPECT_EQ(entry->extendS, -9);  // a later item wins
    EXPECT_EQ(entry->extendV, 0);
    EXPECT_EQ(entry->extendE, 1);  // "E:1E:2" finds the first marker

    entry = parser_->GetEventInfoConfig(dir_, 910000005);
    ASSERT_NE(entry, nullptr);
    EXPECT_EQ(entry->extendE + entry->extendS + entry->extendV, 0);
    EXPECT_EQ(entry->faultType, FAULT_TYPE_NONE);

    // A prefix of a catalogued id does not match it.
    EXPECT_EQ(parser_->GetEventInfoConfig(dir_, 91000000), nullptr);

    EXPECT_EQ(EventUtil::GetFaultLevel("INFORMATIVE"), 1u);
    EXPECT_EQ(EventUtil::GetFaultLevel("2"), 2u);
    EXPECT_EQ(EventUtil::GetFaultLevel("IMPORTANT"), 3u);
    EXPECT_EQ(EventUtil::GetFaultLevel(""), 0u);
    EXPECT_EQ(EventUtil::GetPrivacyLevel("L1"), 1u);
    EXPECT_EQ(EventUtil::GetPrivacyLevel("l1"), 5u);
    EXPECT_EQ(EventUtil::GetPrivacyLevel("0"), 5u);
    const std::vector<std::string> types = {"string", "bool", "short", "int", "float", "long", "class"};
    for (size_t i = 0; i < types.size(); ++i) {
        EXPECT_EQ(EventXmlParser::GetParamType(types[i]), i + 1);
    }
    EXPECT_EQ(EventXmlParser::GetParamType("Int"), 0u);
}

TEST_F(EventXmlParserTest, MissesAreNeverRememberedAndHitsAre) {
    WriteCatalogue(Catalogue(Entry(911000001)));
    LogCapture logs;
    EXPECT_EQ(parser_->GetEventInfoConfig(dir_, 911000002), nullptr);
    WriteCatalogue(Catalogue(Entry(911000001) + Entry(911000002, "FaultType=\"FAULT\"", 3)));
    sp<EventInfoConfig> entry = parser_->GetEventInfoConfig(dir_, 911000002);
    ASSERT_NE(entry, nullptr);
    EXPECT_EQ(entry->params.size(), 3u);

    // Found entries are served from the cache, even once the document is gone.
    ASSERT_EQ(unlink((dir_ + "event.xml").c_str()), 0);
    EXPECT_EQ(parser_->GetEventInfoConfig(dir_, 911000002), entry);
    EXPECT_EQ(parser_->GetEventInfoConfig(dir_, 911000001), nullptr);
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_WARN, "GetEventInfoConfig upload failed, " + dir_ + ", event.xml"));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "ReadXmlFileWithBuf not open file " + dir_ + "event.xml"));
}

TEST_F(EventXmlParserTest, EntriesAcrossBlockBoundariesAndHostileEntries) {
    // The straddling entry starts a little before the first 4096-byte boundary.
    std::string head = Catalogue("");
    head.resize(head.size() - std::string("</Events>\n").size());
    std::string filler;
    for (uint32_t id = 912100000; filler.size() + head.size() < 4000; ++id) {
        filler += Entry(id, "FaultType=\"FAULT\"", 0);
    }
    std::string straddling = Entry(912000001, "FaultType=\"FAULT\" FaultLevel=\"IMPORTANT\"", 3);
    std::string tooLong = Entry(912000002, "FaultType=\"FAULT\"", 150);  // about 9 KiB
    std::string hugeValue = Entry(912000003, "FaultType=\"" + std::string(100 * 1024, 'F') + "\"", 1);
    std::string quotes;
    for (int i = 0; i < 1300; ++i) {
        quotes += "a=\"";  // many '="' on one line, no value ever closing
    }
    std::string noisy = "  <Event id=\"912000004\" " + quotes + ">\n" + "  </Event>\n";
    std::string manyParams = "  <Event id=\"912000005\" FaultType=\"FAULT\">";
    for (int i = 0; i < 3000; ++i) {
        manyParams += "<Param/>";
    }
    manyParams += "</Event>\n";
    std::string afterwards = Entry(912000006, "FaultType=\"FAULT\" FaultLevel=\"CRITICAL\"", 2);
    WriteCatalogue(head + filler + straddling + tooLong + hugeValue + noisy + manyParams + afterwards +
                   "</Events>\n");
    ASSERT_LT((head + filler).size(), 4096u);
    ASSERT_GT((head + filler + straddling).size(), 4096u);

    sp<EventInfoConfig> entry = parser_->GetEventInfoConfig(dir_, 912000001);
    ASSERT_NE(entry, nullptr);
    EXPECT_EQ(entry->faultLevel, 3u);
    EXPECT_EQ(entry->params.size(), 3u);

    // Longer than a block plus what precedes it in the previous one: never seen whole.
    EXPECT_EQ(parser_->GetEventInfoConfig(dir_, 912000002), nullptr);
    EXPECT_EQ(parser_->GetEventInfoConfig(dir_, 912000003), nullptr);
    EXPECT_EQ(parser_->GetEventInfoConfig(dir_, 912000005), nullptr);
    entry = parser_->GetEventInfoConfig(dir_, 912000004);
    ASSERT_NE(entry, nullptr);
    EXPECT_EQ(entry->faultType, FAULT_TYPE_NONE);
    entry = parser_->GetEventInfoConfig(dir_, 912000006);
    ASSERT_NE(entry, nullptr);
    EXPECT_EQ(entry->faultLevel, 4u);
    EXPECT_EQ(entry->params.size(), 2u);
}

TEST_F(EventXmlParserTest, AttributeScannerAgreesWithThePattern) {
    const std::regex pattern("(\\S+)=\"(.+?)\"");
    auto expected = [&](const std::string& text) {
        std::map<std::string, std::string> pairs;
        for (std::sregex_iterator it(text.begin(), text.end(), pattern), end; it != end; ++it) {
            pairs[(*it)[1].str()] = (*it)[2].str();
        }
        return pairs;
    };
    const std::vector<std::string> samples = {
        "<Event id=\"1\" FaultType=\"FAULT\"",
        "<Param id=\"1\" name=\"\" type=\"int\" defVal=\"\"/",  // an empty value swallows the next
        "a=\"b\"c=\"d\"",
        "x=\"1\"=\"2\" y==\"3\"",
        "k=\"line\nbreak\" j=\"ok\"",
        "k=\"\r\" m=\"1\"",
        "=\"novalue\" a=\"1\"",
        "a=\"1\" a=\"2\"",
        "\t\va\f=\"x y z\"",
        "a=\"b=\"c\"",
        "a=\"",
    };
    for (const std::string& sample : samples) {
        EXPECT_EQ(EventXmlParser::ExtractAttributes(sample), expected(sample)) << sample;
    }
    std::mt19937 random(7);
    const std::string alphabet = "ab=\"\" \n\t>";
    for (int round = 0; round < 3000; ++round) {
        std::string text(random() % 24, ' ');
        for (char& c : text) {
            c = alphabet[random() % alphabet.size()];
        }
        ASSERT_EQ(EventXmlParser::ExtractAttributes(text), expected(text)) << text;
    }
}

TEST_F(EventXmlParserTest, ArchiveCatalogueIsReadElementByElement) {
    std::string entries;
    for (uint32_t id = 914000000; id < 914000040; ++id) {
        entries += Entry(id, "FaultType=\"FAULT\" FaultLevel=\"GENERAL\" Extend=\"V:" + std::to_string(id % 100) + "\"",
                         static_cast<int>(id % 5));
    }
    WriteCatalogue(Catalogue(entries));
    ASSERT_EQ(chdir(dir_.c_str()), 0);
    {
        ZipPack pack;
        ASSERT_TRUE(pack.CreateZip(dir_ + "event.zip"));
        ASSERT_TRUE(pack.AddFiles({"event.xml"}));
        pack.Close();
    }
    ASSERT_EQ(unlink((dir_ + "event.xml").c_str()), 0);
    parser_->SetFileName("event.zip");

    sp<EventInfoConfig> entry = parser_->GetEventInfoConfig(dir_, 914000023);
    ASSERT_NE(entry, nullptr);
    EXPECT_EQ(entry->extendV, 23);
    EXPECT_EQ(entry->faultLevel, 2u);
    EXPECT_EQ(entry->params.size(), 3u);  // only its own parameters
    entry = parser_->GetEventInfoConfig(dir_, 914000000);
    ASSERT_NE(entry, nullptr);
    EXPECT_TRUE(entry->params.empty());
    EXPECT_EQ(parser_->GetEventInfoConfig(dir_, 914000099), nullptr);

    LogCapture logs;
    ASSERT_EQ(rename((dir_ + "event.zip").c_str(), (dir_ + "good.zip").c_str()), 0);
    std::ofstream(dir_ + "event.zip", std::ios::binary | std::ios::trunc) << "PK\x03\x04 broken";
    EXPECT_EQ(parser_->GetEventInfoConfig(dir_, 914000001), nullptr);
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_WARN, "GetEventInfoConfig upload failed, " + dir_ + ", event.xml"));
    ASSERT_EQ(rename((dir_ + "good.zip").c_str(), (dir_ + "event.zip").c_str()), 0);
    entry = parser_->GetEventInfoConfig(dir_, 914000001);
    ASSERT_NE(entry, nullptr);
    EXPECT_EQ(entry->params.size(), 1u);
}

TEST_F(EventXmlParserTest, ShippedCatalogueHoldsTheDaemonsOwnEvents) {
    const std::string etc = ORVANE_SOURCE_DIR "/etc/";
    for (uint32_t id : {901001001u, 901001002u, 902001001u, 902001002u, 905001001u, 908001001u}) {
        sp<EventInfoConfig> entry = parser_->GetEventInfoConfig(etc, id);
        ASSERT_NE(entry, nullptr) << id;
        EXPECT_NE(entry->faultType, FAULT_TYPE_NONE) << id;
        EXPECT_NE(entry->faultLevel, 0u) << id;
        EXPECT_FALSE(entry->params.empty()) << id;
        for (const EventParamInfoCfg& param : entry->params) {
            EXPECT_NE(param.type, PARAM_TYPE_UNKNOWN) << id << " " << param.name;
            EXPECT_LT(param.privacyLevel, 5u) << id << " " << param.name;
        }
    }
    sp<EventInfoConfig> report = parser_->GetEventInfoConfig(etc, 908002001);
    ASSERT_NE(report, nullptr);
    EXPECT_EQ(report->faultType, FAULT_TYPE_STATICS);
    ASSERT_EQ(report->params.size(), 3u);
    EXPECT_EQ(report->params[2].type, PARAM_TYPE_CLASS);
    sp<EventInfoConfig> detail = parser_->GetEventInfoConfig(etc, report->params[2].classID);
    ASSERT_NE(detail, nullptr);
    EXPECT_EQ(detail->params.size(), 7u);
}

TEST_F(EventXmlParserTest, ConcurrentLookupsGetTheirOwnEntries) {
    std::string entries;
    for (uint32_t id = 915000000; id < 915000016; ++id) {
        entries += Entry(id, "FaultType=\"FAULT\" Extend=\"S:" + std::to_string(id % 1000) + "\"",
                         static_cast<int>(id % 4));
    }
    WriteCatalogue(Catalogue(entries));
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; i < 60; ++i) {
                uint32_t id = 915000000 + static_cast<uint32_t>((i * 7 + t * 3) % 20);  // 16..19 are absent
                sp<EventInfoConfig> entry = EventXmlParser::getInstance()->GetEventInfoConfig(dir_, id);
                bool present = id < 915000016;
                if ((entry != nullptr) != present ||
                    (entry != nullptr && (entry->eventId != id || entry->extendS != static_cast<int32_t>(id % 1000) ||
                                          entry->params.size() != id % 4))) {
                    wrong++;
                }
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(wrong.load(), 0);
}

}  // namespace
}  // namespace Orvane
}  // namespace android
