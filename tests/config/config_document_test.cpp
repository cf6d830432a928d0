#include "config/config_document.h"

#include <zip.h>

#include <chrono>
#include <thread>
#include <tuple>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/log_capture.h"
#include "tests/common/write_document.h"

namespace android::Orvane {
namespace {

// The cloud copy wins only while it parses; a broken one is reported once per version and
// counted; every rewrite is seen at the next choice, so readers reload after an update.
TEST(ConfigDocumentTest, CloudCopyFirstWhileItParsesAndEachVersionIsJudgedOnce) {
    TemporaryDir system, cloud;
    std::string sys = std::string(system.path) + "/", cld = std::string(cloud.path) + "/";
    DaemonStats stats;
    LogCapture capture;

    DocumentChoice none = ConfigDocument::Choose({cld, sys, &stats}, "a.xml");
    EXPECT_EQ(none.directory, sys);
    EXPECT_EQ(none.stamp.size, -1);

    ASSERT_TRUE(WriteDocument("<a/>", sys + "a.xml"));
    ASSERT_TRUE(WriteDocument("<a><b></a>", cld + "a.xml"));  // not well-formed
    for (int i = 0; i < 3; ++i) {
        DocumentChoice choice = ConfigDocument::Choose({cld, sys, &stats}, "a.xml");
        EXPECT_EQ(choice.path, sys + "a.xml");
        EXPECT_FALSE(choice.fromCloud);
    }
    EXPECT_EQ(capture.Count(ANDROID_LOG_WARN, "does not parse"), 1u) << capture.Dump();
    EXPECT_EQ(stats.Value("config.cloud_rejected.a.xml"), 1u);

    ASSERT_TRUE(WriteDocument("<a><b/></a>\n", cld + "a.xml"));  // the update: a new version that parses
    DocumentChoice pushed = ConfigDocument::Choose({cld, sys, &stats}, "a.xml");
    EXPECT_TRUE(pushed.fromCloud);
    EXPECT_EQ(pushed.path, cld + "a.xml");
    EXPECT_EQ(pushed.stamp, FileUtil::GetFileStamp(cld + "a.xml"));

    ASSERT_TRUE(WriteDocument("", cld + "a.xml"));  // an empty copy is not a document
    EXPECT_FALSE(ConfigDocument::Choose({cld, sys, &stats}, "a.xml").fromCloud);
    EXPECT_EQ(stats.Value("config.cloud_rejected.a.xml"), 2u);
    // Entities are never loaded: a copy that needs one to parse is passed over.
    ASSERT_TRUE(WriteDocument("<!DOCTYPE a [<!ENTITY x SYSTEM \"file:///etc/passwd\">]><a>&x;</a>", cld + "a.xml"));
    EXPECT_FALSE(ConfigDocument::Choose({cld, sys, &stats}, "a.xml").fromCloud);
    EXPECT_EQ(stats.Value("config.cloud_rejected.a.xml"), 3u);
}

// A copy changed without an announcement still reaches the readers, once the stamp taken of
// the file has aged (a second), without a restart.
TEST(ConfigDocumentTest, UnannouncedChangeIsSeenSoon) {
    TemporaryDir system, cloud;
    std::string sys = std::string(system.path) + "/", cld = std::string(cloud.path) + "/";
    ASSERT_TRUE(WriteDocument("<a/>", sys + "a.xml"));
    ASSERT_FALSE(ConfigDocument::Choose({cld, sys, nullptr}, "a.xml").fromCloud);
    ASSERT_TRUE(base::WriteStringToFile("<a><b/></a>", cld + "a.xml"));
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (!ConfigDocument::Choose({cld, sys, nullptr}, "a.xml").fromCloud &&
           std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    EXPECT_TRUE(ConfigDocument::Choose({cld, sys, nullptr}, "a.xml").fromCloud);
}

// An archive copy is judged by its document entry ("x.zip" holds "x.xml"), not as XML itself.
TEST(ConfigDocumentTest, ArchiveCopyIsJudgedByItsEntry) {
    TemporaryDir system, cloud;
    std::string sys = std::string(system.path) + "/", cld = std::string(cloud.path) + "/";
    auto zip = [&](const std::string& entry, const std::string& content) {
        zipFile archive = zipOpen((cld + "x.zip").c_str(), APPEND_STATUS_CREATE);
        ASSERT_NE(archive, nullptr);
        EXPECT_EQ(zipOpenNewFileInZip(archive, entry.c_str(), nullptr, nullptr, 0, nullptr, 0, nullptr, Z_DEFLATED,
                                      Z_DEFAULT_COMPRESSION),
                  ZIP_OK);
        EXPECT_EQ(zipWriteInFileInZip(archive, content.data(), content.size()), ZIP_OK);
        EXPECT_EQ(zipCloseFileInZip(archive), ZIP_OK);
        EXPECT_EQ(zipClose(archive, nullptr), ZIP_OK);
        ConfigDocument::Forget();
    };
    DaemonStats stats;
    const std::tuple<std::string, std::string, bool> cases[] = {
            {"x.xml", "<x><y/></x>", true}, {"x.xml", "<x><y></x>", false}, {"other.xml", "<x/>", false}};
    for (const auto& [entry, content, chosen] : cases) {
        zip(entry, content);
        EXPECT_EQ(ConfigDocument::Choose({cld, sys, &stats}, "x.zip").fromCloud, chosen) << entry << " " << content;
    }
    EXPECT_EQ(stats.Value("config.cloud_rejected.x.zip"), 2u);
}

}  // namespace
}  // namespace android::Orvane
