#include "platform/config.h"

#include <unistd.h>

#include <fstream>

#include <gtest/gtest.h>

#include "tests/common/log_capture.h"

namespace android::Orvane {

const std::string kPath = "/tmp/config_test_" + std::to_string(getpid());

// Writes `content` as the configuration file and returns its path.
std::string Write(const std::string& content) {
    std::ofstream(kPath, std::ios::binary | std::ios::trunc) << content;
    return kPath;
}

TEST(ConfigTest, ParsesSectionsInAnyOrderWithBlanksAndCrLfAndAcceptsAShortSection) {
    LogCapture capture;
    Config config(
            Write("plugins:3\r\nSource[thread:source_loop]:0 static\r\n\n"
                  "   Privacy[thread:privacy_loop]:0 static   \nPerf[]:30 dynamic\n"
                  "pipelines:1\nfault: Privacy  Perf\npipelinetriggers : 1\nSource: fault\n"
                  "plugins:5\nLate[thread:late_loop]:5 static trailing words\n"));
    ASSERT_TRUE(config.Parse()) << capture.Dump();
    const auto& plugins = config.GetPluginInfoList();
    ASSERT_EQ(plugins.size(), 4u);
    EXPECT_EQ(plugins[0].threadName, "source_loop");
    EXPECT_TRUE(plugins[0].isEventSource && !plugins[1].isEventSource);
    EXPECT_TRUE(plugins[2].delay == 30 && !plugins[2].isStatic);
    EXPECT_TRUE(plugins[3].delay == 5 && plugins[3].isStatic);
    ASSERT_EQ(config.GetPipelineInfoList().size(), 1u);
    EXPECT_EQ(config.GetPipelineInfoList()[0].plugins, std::vector<std::string>({"Privacy", "Perf"}));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN, "Parse section plugins of " + kPath + " lacks its last 4 lines"));
    unlink(kPath.c_str());
}

TEST(ConfigTest, EachRejectionFailsTheParseWithItsLogLine) {
    std::string garbage;
    for (int i = 0; i < 4096; i++)
        garbage += static_cast<char>((i * 7919) % 256);
    // Huge lines are refused before any regular expression sees them.
    const std::string huge(100000, 'x');
    const std::string head = "plugins:1\nA[]:0 static\npipelines:1\n";
    struct {
        std::string content;
        int priority;
        std::string text;
    } cases[] = {
            {"plugins:2\nA[]:0 static\nB[]:0 static\nC[]:0 static\n", ANDROID_LOG_ERROR, "Parse match field failed"},
            {garbage, ANDROID_LOG_ERROR, "Parse match field failed"},
            {std::string(10 * 1024 * 1024, 'a'), ANDROID_LOG_ERROR, "too large"},
            {"plugins:1\nA[thread:]:0 static\n", ANDROID_LOG_WARN,
             "ParsePlugin plugin A thread type thread or name  invalid"},
            {"plugins:1\nA[process:loop]:0 static\n", ANDROID_LOG_WARN,
             "ParsePlugin plugin A thread type process invalid"},
            {"plugins:1\nA[]:99999999999 static\n", ANDROID_LOG_WARN, "ParsePlugin no match plugin expression found"},
            {"plugins:1\n" + huge + "[thread:a]:0 static\n", ANDROID_LOG_WARN,
             "ParsePlugin no match plugin expression found"},
            {"plugins:2\nA[]:0 static\nA[thread:y]:0 static\n", ANDROID_LOG_WARN, "ParsePlugin redefine plugin A"},
            {head + "p: A B\n", ANDROID_LOG_WARN, "ParsePipeline pipeline p include undefine plugin B"},
            {head + "no colon here\n", ANDROID_LOG_WARN, "ParsePipeline Fail to match pipeline expression"},
            // A line just under the bound still reaches the expression.
            {head + "p: A " + std::string(900, 'y') + "\n", ANDROID_LOG_WARN, "include undefine plugin yyy"},
            {head + "p:A\npipelinetriggers:1\nA\n", ANDROID_LOG_WARN,
             "ParsePipelineTrigger Fail to match pipeline trigger expression"},
            {head + "p:A\npipelinetriggers:1\nB: p\n", ANDROID_LOG_ERROR,
             "ParsePipelineTrigger B not define in plugins"},
            {head + "p:A\npipelinetriggers:1\nA: p q\n", ANDROID_LOG_WARN,
             "ParsePipelineTrigger pipelinetriggers A include undefine pipeline q"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.content.substr(0, 80));
        LogCapture capture;
        Config config(Write(c.content));
        EXPECT_FALSE(config.Parse());
        EXPECT_TRUE(capture.Contains(c.priority, c.text)) << capture.Dump().substr(0, 2000);
        // A rejected trigger is not half applied.
        EXPECT_TRUE(config.GetPluginInfoList().empty() || !config.GetPluginInfoList()[0].isEventSource);
    }
    LogCapture capture;
    unlink(kPath.c_str());
    EXPECT_FALSE(Config(kPath).Parse());  // neither a missing file nor a folder opens
    EXPECT_FALSE(Config("/tmp").Parse());
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_ERROR, "Parse fail to open config file. " + kPath));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_ERROR, "Parse fail to open config file. /tmp"));
}

}  // namespace android::Orvane
