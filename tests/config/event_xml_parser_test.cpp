#include "config/event_xml_parser.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <fstream>
#include <random>
#include <regex>
#include <thread>

namespace android::Orvane {
namespace {

// The parser is a process-wide singleton whose cache is keyed by id alone: each test uses ids of its own.
std::string Entry(uint32_t id, const std::string& attrs = "FaultType=\"FAULT\"", int params = 1) {
    std::string text = "  <Event id=\"" + std::to_string(id) + "\" " + attrs + ">\n";
    for (int i = 1; i <= params; ++i)
        text += "<Param id=\"" + std::to_string(i) + "\" name=\"p\" type=\"int\"/>\n";
    return text + "  </Event>\n";
}

class EventXmlParserTest : public ::testing::Test {
protected:
    void TearDown() override { std::filesystem::remove_all(dir_); }
    void Write(const std::string& entries) {
        std::ofstream(dir_ + "event.xml", std::ios::binary | std::ios::trunc)
                << "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<Events>\n" + entries + "</Events>\n";
    }
    sp<EventInfoConfig> Get(uint32_t id) { return parser_->GetEventInfoConfig(dir_, id); }

    std::string dir_ = mkdtemp(std::string("/tmp/event_xml_parser_test.XXXXXX").data()) + std::string("/");
    sp<EventXmlParser> parser_ = EventXmlParser::getInstance();
};

// First in this file, so that it starts with an empty cache when the whole file runs in one process.
TEST_F(EventXmlParserTest, CacheEvictsTheCheapestLookupAndNeverRemembersMisses) {
    std::string entries;
    for (uint32_t id = 913100000; entries.size() < 64 * 1024; ++id)
        entries += Entry(id, "", 0);  // varies the costs
    for (uint32_t id = 913000000; id < 913000050; ++id)
        entries += Entry(id);
    Write(entries);
    std::map<uint32_t, sp<EventInfoConfig>> cached;
    for (uint32_t id = 913000000; id < 913000050; ++id)
        ASSERT_NE(cached[id] = Get(id), nullptr);
    Write("");                           // from now on only cached entries are found
    EXPECT_EQ(Get(913000100), nullptr);  // a miss, not remembered
    Write(Entry(913000100));             // the 51st evicts exactly one
    ASSERT_NE(Get(913000100), nullptr);
    // The victim: the smallest non-zero cost, the first of equal ones.
    uint32_t victim = std::min_element(cached.begin(), cached.end(), [](const auto& a, const auto& b) {
                          return a.second->cost != 0 && (b.second->cost == 0 || a.second->cost < b.second->cost);
                      })->first;
    for (const auto& [id, entry] : cached)
        EXPECT_EQ(Get(id), id == victim ? nullptr : entry) << id;
}

TEST_F(EventXmlParserTest, EntryAttributesExtendAndLevelTables) {
    Write("  <Event id=\"910000001\" FaultType=\"FAULT\" FaultLevel=\"CRITICAL\" PrivacyLevel=\"L2\">\n"
          "    <Param id=\"1\" name=\"pkg\" type=\"string\" len=\"64\" PrivacyLevel=\"L1\" defVal=\"0\"/>\n"
          "    <Param id=\"2\" name=\"info\" type=\"class\" classID=\"901001002\" arrLen=\"8\"/>\n"
          "    <Param id=\"3\" name=\"ratio\" type=\"double\" PrivacyLevel=\"L9\"/>\n  </Event>\n" +
          Entry(910000002, "FaultType=\"STATICS\" FaultLevel=\"critical\" PrivacyLevel=\"4\" Extend=\"E:1|S:3|V:2\"",
                0) +
          Entry(910000003, "FaultType=\"fault\" FaultLevel=\"3\" Extend=\"x|S:7|junk|S:-9|V:|E:1E:2\"", 0) +
          Entry(910000005, "Extend=\"\"", 0));
    sp<EventInfoConfig> entry = Get(910000001);
    ASSERT_TRUE(entry != nullptr && entry->params.size() == 3u);
    const std::vector<EventParamInfoCfg>& p = entry->params;
    EXPECT_EQ(std::make_tuple(p[0].name, p[0].type, p[0].len, p[0].privacyLevel, p[0].defVal, p[1].type, p[1].classID,
                              p[1].arrLen, p[2].type, p[2].privacyLevel),
              std::make_tuple(std::string("pkg"), 1u, 64u, 1u, std::string("0"), 7u, 901001002u, 8u, 0u, 5u));
    EXPECT_EQ(Get(91000000), nullptr);  // a prefix of a catalogued id does not match it

    // id, faultType, faultLevel, privacyLevel, E, S, V: names are case-sensitive, a later item wins.
    const std::vector<uint32_t> rows[] = {{910000001, FAULT_TYPE_FAULT, 4, 2, 0, 0, 0},
                                          {910000002, FAULT_TYPE_STATICS, 0, 4, 1, 3, 2},
                                          {910000003, FAULT_TYPE_NONE, 3, 5, 1, uint32_t(-9), 0},
                                          {910000005, FAULT_TYPE_NONE, 0, 5, 0, 0, 0}};
    for (const auto& row : rows) {
        ASSERT_NE(entry = Get(row[0]), nullptr) << row[0];
        EXPECT_EQ(row, (std::vector<uint32_t>{entry->eventId, entry->faultType, entry->faultLevel, entry->privacyLevel,
                                              uint32_t(entry->extendE), uint32_t(entry->extendS),
                                              uint32_t(entry->extendV)}));
    }
    // text, fault level, privacy level
    const std::tuple<std::string, uint32_t, uint32_t> levels[] = {
            {"INFORMATIVE", 1, 5}, {"GENERAL", 2, 5}, {"IMPORTANT", 3, 5}, {"CRITICAL", 4, 5}, {"1", 1, 1}, {"4", 4, 4},
            {"L1", 0, 1},          {"L4", 0, 4},      {"l1", 0, 5},        {"0", 0, 5},        {"5", 0, 5}, {"", 0, 5}};
    for (const auto& [text, fault, privacy] : levels)
        EXPECT_EQ(std::make_tuple(text, EventUtil::GetFaultLevel(text), EventUtil::GetPrivacyLevel(text)),
                  std::make_tuple(text, fault, privacy));
    const char* types[] = {"Int", "string", "bool", "short", "int", "float", "long", "class"};
    for (uint32_t i = 0; i < 8; ++i)
        EXPECT_EQ(EventXmlParser::GetParamType(types[i]), i) << types[i];
}

TEST_F(EventXmlParserTest, EntriesAcrossBlockBoundariesAndHostileEntries) {
    std::string filler;  // puts the straddling entry's start a little before the first 4096-byte boundary
    for (uint32_t id = 912100000; filler.size() < 3900; ++id)
        filler += Entry(id, "", 0);
    std::string manyParams = "  <Event id=\"912000005\" FaultType=\"FAULT\">";
    for (int i = 0; i < 3000; ++i)
        manyParams += "<Param/>";
    Write(filler + Entry(912000001, "", 3) + Entry(912000003, "FaultType=\"" + std::string(100 * 1024, 'F') + "\"", 1) +
          manyParams + "</Event>\n" + Entry(912000006, "", 2));
    // A 100 KiB attribute and thousands of Params never fit the two blocks in view: not found, and no harm done
    // to the entries around them.
    for (uint32_t id : {912000003u, 912000005u})
        EXPECT_EQ(Get(id), nullptr) << id;
    for (auto [id, params] : {std::pair(912000001u, 3u), std::pair(912000006u, 2u)}) {
        ASSERT_NE(Get(id), nullptr) << id;
        EXPECT_EQ(Get(id)->params.size(), params) << id;
    }
}

TEST_F(EventXmlParserTest, AttributeScannerAgreesWithThePattern) {
    const std::regex pattern("(\\S+)=\"(.+?)\"");
    auto check = [&](const std::string& text) {
        std::map<std::string, std::string> pairs;
        for (std::sregex_iterator it(text.begin(), text.end(), pattern), end; it != end; ++it)
            pairs[(*it)[1]] = (*it)[2];
        ASSERT_EQ(EventXmlParser::ExtractAttributes(text), pairs) << text;
    };
    std::mt19937 random(7);  // short random texts of the characters that matter
    for (int round = 0; round < 5000; ++round) {
        std::string text(random() % 24, ' ');
        for (char& c : text)
            c = "ab=\"\" \n\t>"[random() % 9];
        check(text);
    }
}

TEST_F(EventXmlParserTest, ConcurrentLookupsGetTheirOwnEntries) {
    std::string entries;
    for (uint32_t id = 915000000; id < 915000016; ++id)
        entries += Entry(id, "", id % 4);
    Write(entries);
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; i < 60; ++i) {
                uint32_t id = 915000000 + static_cast<uint32_t>((i * 7 + t * 3) % 20);  // 16..19 are absent
                sp<EventInfoConfig> entry = Get(id);
                wrong += entry == nullptr ? id < 915000016 : entry->eventId != id || entry->params.size() != id % 4;
            }
        });
    }
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(wrong.load(), 0);
}

}  // namespace
}  // namespace android::Orvane
