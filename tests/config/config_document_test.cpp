#include "config/config_document.h"

#include <fstream>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/log_capture.h"

namespace android::Orvane {
namespace {

void Write(const std::string& path, const std::string& content) {
    std::ofstream(path, std::ios::binary | std::ios::trunc) << content;
}

// The cloud copy wins only while it parses; a broken one is reported once per version and
// counted; every rewrite is seen at the next choice, so readers reload after an update.
TEST(ConfigDocumentTest, CloudCopyFirstWhileItParsesAndEachVersionIsJudgedOnce) {
    TemporaryDir system, cloud;
    std::string sys = std::string(system.path) + "/", cld = std::string(cloud.path) + "/";
    DaemonStats stats;
    LogCapture capture;

    DocumentChoice none = ConfigDocument::Choose(cld, sys, "a.xml", &stats);
    EXPECT_EQ(none.directory, sys);
    EXPECT_EQ(none.stamp.size, -1);

    Write(sys + "a.xml", "<a/>");
    Write(cld + "a.xml", "<a><b></a>");  // not well-formed
    for (int i = 0; i < 3; ++i) {
        DocumentChoice choice = ConfigDocument::Choose(cld, sys, "a.xml", &stats);
        EXPECT_EQ(choice.path, sys + "a.xml");
        EXPECT_FALSE(choice.fromCloud);
    }
    EXPECT_EQ(capture.Count(ANDROID_LOG_WARN, "does not parse"), 1u) << capture.Dump();
    EXPECT_EQ(stats.Value("config.cloud_rejected.a.xml"), 1u);

    Write(cld + "a.xml", "<a><b/></a>\n");  // the update: a new version that parses
    DocumentChoice pushed = ConfigDocument::Choose(cld, sys, "a.xml", &stats);
    EXPECT_TRUE(pushed.fromCloud);
    EXPECT_EQ(pushed.path, cld + "a.xml");
    EXPECT_EQ(pushed.stamp, FileUtil::GetFileStamp(cld + "a.xml"));

    Write(cld + "a.xml", "");  // an empty copy is not a document
    EXPECT_FALSE(ConfigDocument::Choose(cld, sys, "a.xml", &stats).fromCloud);
    EXPECT_EQ(stats.Value("config.cloud_rejected.a.xml"), 2u);
    // Entities are never loaded: a copy that needs one to parse is passed over.
    Write(cld + "a.xml", "<!DOCTYPE a [<!ENTITY x SYSTEM \"file:///etc/passwd\">]><a>&x;</a>");
    EXPECT_FALSE(ConfigDocument::Choose(cld, sys, "a.xml", &stats).fromCloud);
    EXPECT_EQ(stats.Value("config.cloud_rejected.a.xml"), 3u);
}

}  // namespace
}  // namespace android::Orvane
