#include "config/event_xml_parser.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <atomic>
#include <map>
#include <random>
#include <regex>
#include <thread>
#include <tuple>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/log_capture.h"
#include "tests/common/write_document.h"
#include "utils/string_util.h"

namespace android::Orvane {
namespace {

// The parser is a process-wide singleton whose cache is keyed by id alone: each test uses ids of its own.
std::string Entry(uint32_t id, const std::string& attrs = "FaultType=\"FAULT\"", int params = 1) {
    std::string text = "  <Event id=\"" + std::to_string(id) + "\" " + attrs + ">\n";
    for (int i = 1; i <= params; ++i)
        text += "<Param id=\"" + std::to_string(i) + "\" name=\"p\" type=\"int\"/>\n";
    return text + "  </Event>\n";
}

std::string Document(const std::string& entries) {
    return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<Events>\n" + entries + "</Events>\n";
}

class EventXmlParserTest : public ::testing::Test {
protected:
    void Write(const std::string& entries, const std::string& dir = "") {
        ASSERT_TRUE(WriteDocument(Document(entries), (dir.empty() ? dir_ : dir) + "event.xml"));
    }
    // Changes the text in place but leaves the file's stamp (size, time) as it was: a change the
    // cache cannot see, so that what the cache holds shows.
    void ReplaceUnseen(const std::string& from, const std::string& to) {
        ASSERT_EQ(from.size(), to.size());
        std::string path = dir_ + "event.xml", text;
        struct stat before;
        ASSERT_TRUE(stat(path.c_str(), &before) == 0 && android::base::ReadFileToString(path, &text));
        ASSERT_TRUE(WriteDocument(StringUtil::ReplaceStr(text, from, to), path));
        const struct timespec times[2] = {before.st_atim, before.st_mtim};
        ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
    }
    sp<EventInfoConfig> Get(uint32_t id) { return parser_->GetEventInfoConfig(dir_, id); }

    TemporaryDir temp_;
    std::string dir_ = std::string(temp_.path) + "/";
    sp<EventXmlParser> parser_ = EventXmlParser::getInstance();
};

TEST_F(EventXmlParserTest, CacheHoldsFiftyEntriesAndNeverRemembersMisses) {
    std::string entries = Entry(913000200);
    for (uint32_t id = 913000000; id < 913000050; ++id)
        entries += Entry(id);
    Write(entries);
    std::map<uint32_t, sp<EventInfoConfig>> cached;
    for (uint32_t id = 913000000; id < 913000050; ++id)
        ASSERT_NE(cached[id] = Get(id), nullptr);
    EXPECT_EQ(Get(913000100), nullptr);                           // a miss, not remembered:
    ReplaceUnseen("\"913000200\"", "\"913000100\"");              // it is found once there
    ASSERT_NE(Get(913000100), nullptr);                           // and as the 51st it evicts exactly one
    ReplaceUnseen("<Event id=\"9130000", "<Event id=\"9140000");  // only cached entries are found now
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

// Each lookup reads the copy in force, and a change of copy or version drops the cache. A
// catalogue that cannot be read fails every lookup: one line (collapsed), every failure counted.
TEST_F(EventXmlParserTest, CopyInForceIsReadAndItsChangeDropsTheCache) {
    TemporaryDir cloud;
    const std::string cloudDir = std::string(cloud.path) + "/";
    DaemonStats stats;
    DocumentFolders folders(cloudDir, dir_, &stats);
    auto level = [&](uint32_t id) {
        sp<EventInfoConfig> e = parser_->GetEventInfoConfig(folders, id);
        return e == nullptr ? -1 : static_cast<int>(e->faultLevel);
    };
    Write(Entry(914000001, "FaultLevel=\"1\""));
    EXPECT_EQ(level(914000001), 1);
    Write(Entry(914000001, "FaultLevel=\"3\""), cloudDir);  // pushed
    EXPECT_EQ(level(914000001), 3);
    Write(Entry(914000001, "FaultLevel=\"CRITICAL\""), cloudDir);  // pushed again
    EXPECT_EQ(level(914000001), 4);
    ASSERT_TRUE(WriteDocument("<Events><Event id=\"914000001\" FaultLevel=\"2\">", cloudDir + "event.xml"));
    EXPECT_EQ(level(914000001), 1);  // a broken push is passed over
    EXPECT_EQ(stats.Value("config.cloud_rejected.event.xml"), 1u);

    LogCapture logs;
    ASSERT_EQ(unlink((dir_ + "event.xml").c_str()), 0);
    ASSERT_EQ(unlink((cloudDir + "event.xml").c_str()), 0);
    ConfigDocument::Forget();
    for (int i = 0; i < 5; ++i)
        EXPECT_EQ(level(914000001), -1);
    EXPECT_EQ(logs.Count(ANDROID_LOG_WARN, "upload failed"), 1u) << logs.Dump();
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_WARN, "GetEventInfoConfig upload failed, " + dir_ + ", event.xml"));
    EXPECT_EQ(stats.Value("config.read_failed.event.xml"), 5u);
}

}  // namespace
}  // namespace android::Orvane
