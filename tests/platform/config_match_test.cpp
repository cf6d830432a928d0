// The plugin and pipeline lines are matched by hand instead of by their regular expressions; the
// hand-written matching must accept and split every line exactly as searching with the
// expressions does.

#include <random>
#include <regex>
#include <set>

#include <gtest/gtest.h>

#include "platform/config.h"
#include "utils/string_util.h"

namespace android::Orvane {
namespace {

// A random line of the given tokens, short enough for the expressions.
std::string RandomLine(std::mt19937& random, const std::vector<std::string>& tokens) {
    std::string line;
    for (size_t n = random() % 16; n > 0; --n)
        line += tokens[random() % tokens.size()];
    return line;
}

std::vector<std::string> Names(const std::string& text) {
    std::vector<std::string> names;
    for (const std::string& name : StringUtil::SplitStr(text, ' '))
        if (!name.empty())
            names.push_back(name);
    return names;
}

TEST(ConfigMatchTest, PluginLinesAsTheExpressionFindsThem) {
    const std::regex expression("([^\\[]+)\\[([^\\[:]*):?([^:]*)\\]\\s*:(\\d+)\\s+(dynamic|static)");
    const std::vector<std::string> tokens = {"a",       "[",        "]",  ":",          " ",          "\t",
                                             "\r",      "0",        "12", "thread",     "x",          "static",
                                             "dynamic", "[thread:", "]:", "]:3 static", "]:4 dynamic"};
    std::mt19937 random(11);
    int accepted = 0;
    for (int round = 0; round < 20000; ++round) {
        std::string line = RandomLine(random, tokens);
        std::smatch m;
        bool matched = std::regex_search(line, m, expression);
        Config config("");
        if (!config.ParsePlugin(line)) {
            // Refused by the expression, or by the checks of what it found.
            ASSERT_TRUE(!matched || (m[2] != "" && m[2] != "thread") || (m[2] == "") != (m[3] == ""))
                    << "[" << line << "]";
            continue;
        }
        ASSERT_TRUE(matched) << "[" << line << "]";
        const Config::PluginInfo& info = config.GetPluginInfoList().at(0);
        ASSERT_EQ(
                std::make_tuple(info.name, info.threadType, info.threadName, std::to_string(info.delay), info.isStatic),
                std::make_tuple(StringUtil::TrimStr(m[1], ' '), m[2].str(), m[3].str(), std::to_string(std::stoi(m[4])),
                                m[5] == "static"))
                << "[" << line << "]";
        accepted++;
    }
    EXPECT_GT(accepted, 500);  // the comparison is not vacuous
}

TEST(ConfigMatchTest, PipelineLinesAsTheExpressionFindsThem) {
    const std::regex expression("(\\S+)\\s*:(.+)");
    const std::set<std::string> defined = {"a", "b", "aa", "ab", "ba", "bb"};
    const std::vector<std::string> tokens = {"a", "b", ":", " ", "\t", "\r", "\n", "\v", ": "};
    std::mt19937 random(13);
    int accepted = 0;
    for (int round = 0; round < 20000; ++round) {
        std::string line = RandomLine(random, tokens);
        std::smatch m;
        bool matched = std::regex_search(line, m, expression);
        Config config("");
        for (const std::string& name : defined)
            ASSERT_TRUE(config.ParsePlugin(name + "[]:0 static"));
        if (!config.ParsePipeline(line)) {
            bool undefined = false;
            for (const std::string& name : matched ? Names(m[2]) : std::vector<std::string>())
                undefined |= defined.count(name) == 0;
            ASSERT_TRUE(!matched || undefined) << "[" << line << "]";
            continue;
        }
        ASSERT_TRUE(matched) << "[" << line << "]";
        const Config::PipelineInfo& info = config.GetPipelineInfoList().at(0);
        ASSERT_EQ(info.name, m[1].str()) << "[" << line << "]";
        ASSERT_EQ(info.plugins, Names(m[2])) << "[" << line << "]";
        accepted++;
    }
    EXPECT_GT(accepted, 500);
}

}  // namespace
}  // namespace android::Orvane
