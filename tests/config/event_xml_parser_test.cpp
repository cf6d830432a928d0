#include "config/event_xml_parser.h"

#include <atomic>
#include <filesystem>
#include <fstream>
#include <map>
#include <random>
#include <regex>
#include <thread>
#include <tuple>

#include <gtest/gtest.h>

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
        std::ofstream(dir_ + "event.xml", std::ios::trunc)
                << "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<Events>\n" + entries + "</Events>\n";
    }
    sp<EventInfoConfig> Get(uint32_t id) { return parser_->GetEventInfoConfig(dir_, id); }

    std::string dir_ = mkdtemp(std::string("/tmp/event_xml_parser_test.XXXXXX").data()) + std::string("/");
    sp<EventXmlParser> parser_ = EventXmlParser::getInstance();
};

// First in this file, so that it starts with an empty cache when the whole file runs in one process.
TEST_F(EventXmlParserTest, CacheHoldsFiftyEntriesAndNeverRemembersMisses) {
    std::string entries;
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
    size_t kept = 0;
    for (const auto& [id, entry] : cached) {
        sp<EventInfoConfig> now = Get(id);
        kept += now == entry;
        EXPECT_TRUE(now == nullptr || now == entry) << id;
    }
    EXPECT_EQ(kept, 49u);
}

TEST_F(EventXmlParserTest, EntryAttributesAndExtend) {
    // faultType, faultLevel, privacyLevel, E, S, V: names are case-sensitive, a later item wins.
    const std::pair<std::string, std::vector<uint32_t>> cases[] = {
            {"FaultType=\"FAULT\" FaultLevel=\"CRITICAL\" PrivacyLevel=\"L2\"", {FAULT_TYPE_FAULT, 4, 2, 0, 0, 0}},
            {"FaultType=\"STATICS\" FaultLevel=\"critical\" PrivacyLevel=\"4\" Extend=\"E:1|S:3|V:2\"",
             {FAULT_TYPE_STATICS, 0, 4, 1, 3, 2}},
            {"FaultType=\"fault\" FaultLevel=\"3\" PrivacyLevel=\"L9\" Extend=\"x|S:7|junk|S:-9|V:|E:1E:2\"",
             {FAULT_TYPE_NONE, 3, 5, 1, uint32_t(-9), 0}},
            {"FaultLevel=\"0\" PrivacyLevel=\"l1\" Extend=\"\"", {FAULT_TYPE_NONE, 0, 5, 0, 0, 0}}};
    std::string entries;
    for (uint32_t i = 0; i < 4; ++i)
        entries += Entry(910000001 + i, cases[i].first, 0);
    Write(entries +
          "  <Event id=\"910000009\">\n"
          "    <Param id=\"1\" name=\"pkg\" type=\"string\" len=\"64\" PrivacyLevel=\"L1\" defVal=\"0\"/>\n"
          "    <Param id=\"2\" name=\"info\" type=\"class\" classID=\"901001002\" arrLen=\"8\"/>\n"
          "    <Param id=\"3\" name=\"ratio\" type=\"double\" PrivacyLevel=\"L9\"/>\n  </Event>\n");
    sp<EventInfoConfig> withParams = Get(910000009);
    ASSERT_TRUE(withParams != nullptr && withParams->params.size() == 3u);
    const std::vector<EventParamInfoCfg>& p = withParams->params;
    EXPECT_EQ(std::make_tuple(p[0].name, p[0].type, p[0].len, p[0].privacyLevel, p[0].defVal, p[1].type, p[1].classID,
                              p[1].arrLen, p[2].type, p[2].privacyLevel),
              std::make_tuple(std::string("pkg"), 1u, 64u, 1u, std::string("0"), 7u, 901001002u, 8u, 0u, 5u));
    EXPECT_EQ(Get(91000000), nullptr);  // a prefix of a catalogued id does not match it
    for (uint32_t i = 0; i < 4; ++i) {
        sp<EventInfoConfig> e = Get(910000001 + i);
        ASSERT_TRUE(e != nullptr && e->eventId == 910000001 + i) << i;
        EXPECT_EQ(cases[i].second,
                  (std::vector<uint32_t>{e->faultType, e->faultLevel, e->privacyLevel, uint32_t(e->extendE),
                                         uint32_t(e->extendS), uint32_t(e->extendV)}))
                << i;
    }
}

// A 100 KiB attribute and thousands of Params never fit the two blocks in view: not found, and no
// harm done to the entries around them, one of which straddles the first 4096-byte boundary.
// Concurrent lookups, hits and misses, each get their own answer.
TEST_F(EventXmlParserTest, EntriesAcrossBlockBoundariesHostileEntriesAndConcurrentLookups) {
    std::string filler, manyParams = "  <Event id=\"912000005\" FaultType=\"FAULT\">";
    for (uint32_t id = 912100000; filler.size() < 3900; ++id)
        filler += Entry(id, "", 0);
    for (int i = 0; i < 3000; ++i)
        manyParams += "<Param/>";
    Write(filler + Entry(912000001, "", 3) + Entry(912000003, "FaultType=\"" + std::string(100 * 1024, 'F') + "\"", 1) +
          manyParams + "</Event>\n" + Entry(912000006, "", 2));
    const std::pair<uint32_t, int> expected[] = {
            {912000001u, 3}, {912000003u, -1}, {912000005u, -1}, {912000006u, 2}};  // -1: absent
    auto found = [this](uint32_t id, int params) {
        sp<EventInfoConfig> e = Get(id);
        return e == nullptr ? params == -1 : e->eventId == id && static_cast<int>(e->params.size()) == params;
    };
    for (const auto& [id, params] : expected)
        EXPECT_TRUE(found(id, params)) << id;
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([&, t] {
            for (int i = 0; i < 40; ++i)
                wrong += !found(expected[(i + t) % 4].first, expected[(i + t) % 4].second);
        });
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(wrong.load(), 0);
}

// The hand-written scanner must yield exactly the pairs of the documented pattern.
TEST_F(EventXmlParserTest, AttributeScannerAgreesWithThePattern) {
    const std::regex pattern("(\\S+)=\"(.+?)\"");
    std::mt19937 random(7);  // short random texts of the characters that matter
    for (int round = 0; round < 5000; ++round) {
        std::string text(random() % 24, ' ');
        for (char& c : text)
            c = "ab=\"\" \n\t>"[random() % 9];
        std::map<std::string, std::string> pairs;
        for (std::sregex_iterator it(text.begin(), text.end(), pattern), end; it != end; ++it)
            pairs[(*it)[1]] = (*it)[2];
        ASSERT_EQ(EventXmlParser::ExtractAttributes(text), pairs) << text;
    }
}

}  // namespace
}  // namespace android::Orvane
