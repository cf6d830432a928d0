#include "platform/config.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <unistd.h>

#include <fstream>
#include <string>

#include "tests/common/log_capture.h"

namespace android {
namespace Orvane {
namespace {

class ConfigTest : public testing::Test {
protected:
    void SetUp() override {
        char pattern[] = "/tmp/config_test_XXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir_ = pattern;
    }
    void TearDown() override { system(("rm -rf " + dir_).c_str()); }

    std::string Write(const std::string& content) {
        std::string path = dir_ + "/plugin_config";
        std::ofstream(path, std::ios::binary | std::ios::trunc) << content;
        return path;
    }

    // Parses `content` and expects the parse to fail with one line of `priority` containing `text`.
    void ExpectRejected(const std::string& content, int priority, const std::string& text) {
        LogCapture capture;
        Config config(Write(content));
        std::string head = content.substr(0, 120);
        EXPECT_FALSE(config.Parse()) << head;
        EXPECT_TRUE(capture.Contains(priority, text)) << head << "\n" << capture.Dump().substr(0, 2000);
        EXPECT_FALSE(capture.Contains(ANDROID_LOG_INFO, "prase config ok")) << head;
    }

    std::string dir_;
};

TEST_F(ConfigTest, ParsesSectionsInAnyOrderWithBlankLines) {
    LogCapture capture;
    Config config(
            Write("plugins:4\n"
                  "EventRadiator[thread:source_loop]:0 static\n"
                  "\n"
                  "   EventPrivacyCompliance[thread:privacy_loop]:0 static   \n"
                  "EventStorageManager[thread:storage_loop]:0 static\n"
                  "PerfLogAnalyzer[]:30 dynamic\n"
                  "\n"
                  "pipelines:1\n"
                  "faultpipeline: EventPrivacyCompliance  EventStorageManager\n"
                  "pipelinetriggers : 1\n"
                  "EventRadiator: faultpipeline\n"
                  "plugins:1\n"
                  "Late[thread:late_loop]:5 static trailing words\n"
                  "pipelines:1\n"
                  "second:Late EventRadiator\n"));
    ASSERT_TRUE(config.Parse()) << capture.Dump();
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_INFO, "Parse find field:plugins 4"));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_INFO, "Parse find field:pipelinetriggers 1"));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_DEBUG, "ParsePipelineTrigger EventRadiator is an event source"));
    EXPECT_TRUE(capture.Contains(ANDROID_LOG_INFO, "Parse prase config ok"));

    const auto& plugins = config.GetPluginInfoList();
    ASSERT_EQ(plugins.size(), 5u);
    EXPECT_EQ(plugins[0].name, "EventRadiator");
    EXPECT_EQ(plugins[0].threadType, "thread");
    EXPECT_EQ(plugins[0].threadName, "source_loop");
    EXPECT_TRUE(plugins[0].isStatic);
    EXPECT_TRUE(plugins[0].isEventSource);
    EXPECT_EQ(plugins[0].pipelines, std::vector<std::string>({"faultpipeline"}));
    EXPECT_EQ(plugins[1].name, "EventPrivacyCompliance");
    EXPECT_FALSE(plugins[1].isEventSource);
    EXPECT_EQ(plugins[3].name, "PerfLogAnalyzer");
    EXPECT_EQ(plugins[3].threadType, "");
    EXPECT_EQ(plugins[3].threadName, "");
    EXPECT_EQ(plugins[3].delay, 30);
    EXPECT_FALSE(plugins[3].isStatic);
    EXPECT_EQ(plugins[4].name, "Late");
    EXPECT_EQ(plugins[4].delay, 5);
    EXPECT_TRUE(plugins[4].isStatic);

    const auto& pipelines = config.GetPipelineInfoList();
    ASSERT_EQ(pipelines.size(), 2u);
    EXPECT_EQ(pipelines[0].name, "faultpipeline");
    EXPECT_EQ(pipelines[0].plugins, std::vector<std::string>({"EventPrivacyCompliance", "EventStorageManager"}));
    EXPECT_EQ(pipelines[1].plugins, std::vector<std::string>({"Late", "EventRadiator"}));

    Config copy("");
    copy = config;
    EXPECT_EQ(copy.GetPluginInfoList().size(), 5u);
}

TEST_F(ConfigTest, RejectsEachBadLineAndKeepsWhatCameBefore) {
    ExpectRejected("plugins:2\nA[]:0 static\nB[]:0 static\nC[]:0 static\n", ANDROID_LOG_ERROR,
                   "Parse match field failed");
    ExpectRejected("nothing here\n", ANDROID_LOG_ERROR, "Parse match field failed");
    ExpectRejected("plugins:1\nA[thread:]:0 static\n", ANDROID_LOG_WARN,
                   "ParsePlugin plugin A thread type thread or name  invalid");
    ExpectRejected("plugins:1\nA[thread]:0 static\n", ANDROID_LOG_WARN,
                   "ParsePlugin plugin A thread type thread or name  invalid");
    ExpectRejected("plugins:1\nA[:loop]:0 static\n", ANDROID_LOG_WARN,
                   "ParsePlugin plugin A thread type  or name loop invalid");
    ExpectRejected("plugins:1\nA[process:loop]:0 static\n", ANDROID_LOG_WARN,
                   "ParsePlugin plugin A thread type process invalid");
    ExpectRejected("plugins:1\nA[thread:x]:0 sometimes\n", ANDROID_LOG_WARN,
                   "ParsePlugin no match plugin expression found");
    ExpectRejected("plugins:1\nA[thread:x]:-1 static\n", ANDROID_LOG_WARN,
                   "ParsePlugin no match plugin expression found");
    ExpectRejected("plugins:1\nA[thread:x]:99999999999 static\n", ANDROID_LOG_WARN,
                   "ParsePlugin no match plugin expression found");
    ExpectRejected("plugins:2\nA[thread:x]:0 static\nA[thread:y]:0 static\n", ANDROID_LOG_WARN,
                   "ParsePlugin redefine plugin A");
    ExpectRejected("plugins:1\nA[]:0 static\npipelines:1\np: A B\nplugins:1\nB[]:0 static\n", ANDROID_LOG_WARN,
                   "ParsePipeline pipeline p include undefine plugin B");
    ExpectRejected("plugins:1\nA[]:0 static\npipelines:1\nno colon here\n", ANDROID_LOG_WARN,
                   "ParsePipeline Fail to match pipeline expression");
    ExpectRejected("plugins:1\nA[]:0 static\npipelinetriggers:1\nA\n", ANDROID_LOG_WARN,
                   "ParsePipelineTrigger Fail to match pipeline trigger expression");
    ExpectRejected("plugins:1\nA[]:0 static\npipelines:1\np:A\npipelinetriggers:1\nB: p\n", ANDROID_LOG_ERROR,
                   "ParsePipelineTrigger B not define in plugins");
    ExpectRejected("plugins:1\nA[]:0 static\npipelines:1\np:A\npipelinetriggers:1\nA: p q\n", ANDROID_LOG_WARN,
                   "ParsePipelineTrigger pipelinetriggers A include undefine pipeline q");

    // The lines accepted before the rejected one stay; the trigger is not half applied.
    Config config(Write("plugins:2\nA[thread:a]:0 static\nB[]:0 static\npipelines:2\np:A B\nq:C\n"));
    EXPECT_FALSE(config.Parse());
    ASSERT_EQ(config.GetPluginInfoList().size(), 2u);
    ASSERT_EQ(config.GetPipelineInfoList().size(), 1u);
    EXPECT_EQ(config.GetPipelineInfoList()[0].name, "p");

    Config trigger(Write("plugins:1\nA[]:0 static\npipelines:1\np:A\npipelinetriggers:1\nA: p q\n"));
    EXPECT_FALSE(trigger.Parse());
    EXPECT_FALSE(trigger.GetPluginInfoList()[0].isEventSource);
    EXPECT_TRUE(trigger.GetPluginInfoList()[0].pipelines.empty());
}

TEST_F(ConfigTest, BadFilesEndWithALogLine) {
    {
        LogCapture capture;
        Config missing(dir_ + "/absent");
        EXPECT_FALSE(missing.Parse());
        EXPECT_TRUE(capture.Contains(ANDROID_LOG_ERROR, "Parse fail to open config file. " + dir_ + "/absent"));
        Config folder(dir_);
        EXPECT_FALSE(folder.Parse());
        EXPECT_TRUE(capture.Contains(ANDROID_LOG_ERROR, "Parse fail to open config file. " + dir_));
    }

    std::string garbage;
    for (int i = 0; i < 4096; i++) {
        garbage += static_cast<char>((i * 7919) % 256);
    }
    ExpectRejected(garbage, ANDROID_LOG_ERROR, "Parse match field failed");

    // Huge lines are refused before any regular expression sees them.
    std::string huge(100000, 'x');
    ExpectRejected("plugins:" + huge + "\n", ANDROID_LOG_ERROR, "Parse match field failed");
    ExpectRejected("plugins:1\n" + huge + "[thread:a]:0 static\n", ANDROID_LOG_WARN,
                   "ParsePlugin no match plugin expression found");
    ExpectRejected("plugins:1\nA[]:0 static\npipelines:1\np: " + huge + "\n", ANDROID_LOG_WARN,
                   "ParsePipeline Fail to match pipeline expression");
    ExpectRejected("plugins:1\nA[]:0 static\npipelines:1\np:A\npipelinetriggers:1\nA: " + huge + "\n", ANDROID_LOG_WARN,
                   "ParsePipelineTrigger Fail to match pipeline trigger expression");
    // A line just under the bound still reaches the expression.
    ExpectRejected("plugins:1\nA[]:0 static\npipelines:1\np: A " + std::string(900, 'y') + "\n", ANDROID_LOG_WARN,
                   "include undefine plugin yyy");

    ExpectRejected(std::string(10 * 1024 * 1024, 'a'), ANDROID_LOG_ERROR, "too large");

    {
        LogCapture capture;
        Config crlf(Write("plugins:2\r\nA[thread:a]:0 static\r\nB[]:0 static\r\n\r\npipelines:1\r\np: A B\r\n"));
        EXPECT_TRUE(crlf.Parse()) << capture.Dump();
        ASSERT_EQ(crlf.GetPipelineInfoList().size(), 1u);
        EXPECT_EQ(crlf.GetPipelineInfoList()[0].plugins, std::vector<std::string>({"A", "B"}));
        EXPECT_EQ(crlf.GetPluginInfoList()[0].threadName, "a");
    }
    {
        LogCapture capture;
        Config shortSection(Write("plugins:5\nA[]:0 static\n"));
        EXPECT_TRUE(shortSection.Parse());
        EXPECT_EQ(shortSection.GetPluginInfoList().size(), 1u);
        EXPECT_TRUE(capture.Contains(ANDROID_LOG_WARN,
                                     "Parse section plugins of " + dir_ + "/plugin_config lacks its last 4 lines"));
    }
}

}  // namespace
}  // namespace Orvane
}  // namespace android
