#include "plugins/privacy_path_check.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <thread>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/fake_plugin_context.h"
#include "tests/common/log_capture.h"
#include "tests/common/write_document.h"
#include "utils/zip_pack.h"

namespace android::Orvane {
namespace {

using android::base::ReadFdToString;

class PrivacyPathCheckTest : public ::testing::Test {
protected:
    void SetUp() override {
        for (const char* folder : {"/etc", "/logs", "/logs/sub", "/logs/private", "/private"}) {
            ASSERT_EQ(mkdir((root_ + folder).c_str(), 0775), 0);
        }
        WritePolicy("<Allow prefix=\"" + root_ + "/logs/\"/><Deny pattern=\"*/private/*\"/><Deny pattern=\"*.db\"/>");
        ASSERT_TRUE(WriteDocument("log line", root_ + "/logs/a.txt"));
        ASSERT_TRUE(WriteDocument("secret", root_ + "/private/secret.txt"));
        ASSERT_TRUE(WriteDocument("inner secret", root_ + "/logs/private/inner.txt"));
    }
    void WritePolicy(const std::string& paths) {
        ASSERT_TRUE(WriteDocument("<PrivacyPolicy><Levels switchOn=\"1\" switchOff=\"1\"/><LogPaths>" + paths +
                                          "</LogPaths></PrivacyPolicy>",
                                  root_ + "/etc/tmp"));
        ASSERT_EQ(rename((root_ + "/etc/tmp").c_str(), (root_ + "/etc/privacy_policy.xml").c_str()), 0);
    }
    std::string Read(const android::base::unique_fd& fd) {
        std::string text;
        EXPECT_TRUE(ReadFdToString(fd.get(), &text));
        return text;
    }

    TemporaryDir dir_;
    std::string root_ = dir_.path;
    FakePluginContext context_{root_ + "/work/", root_ + "/etc/"};
    PrivacyPathCheck check_{context_};
};

// Paths are judged by what they resolve to: "..", relative parts and links are followed, a link
// from an allowed folder into a forbidden one is refused, and so are folders, FIFOs (without
// blocking), files with a second name elsewhere, missing files and forbidden patterns. No refused
// path reaches the log.
TEST_F(PrivacyPathCheckTest, JudgesTheResolvedFile) {
    std::string logs = root_ + "/logs/";
    ASSERT_EQ(symlink((root_ + "/private/secret.txt").c_str(), (logs + "escape").c_str()), 0);
    ASSERT_EQ(symlink((logs + "private/inner.txt").c_str(), (logs + "inner").c_str()), 0);
    ASSERT_EQ(symlink("a.txt", (logs + "sub/../same").c_str()), 0);
    ASSERT_EQ(link((root_ + "/private/secret.txt").c_str(), (logs + "hard").c_str()), 0);
    ASSERT_EQ(mkfifo((logs + "fifo").c_str(), 0600), 0);
    ASSERT_TRUE(WriteDocument("x", logs + "events.db"));
    LogCapture capture;
    for (const std::string& allowed : {logs + "a.txt", logs + "sub/../a.txt", logs + "./same", logs + "/a.txt"}) {
        EXPECT_TRUE(check_.IsPrivacycompliance(allowed)) << allowed;
        android::base::unique_fd fd = check_.OpenCompliantFile(allowed);
        ASSERT_GE(fd.get(), 0) << allowed;
        EXPECT_EQ(Read(fd), "log line");
    }
    const std::string refused[] = {logs + "escape",
                                   logs + "inner",
                                   logs + "hard",
                                   logs + "fifo",
                                   logs + "events.db",
                                   logs,
                                   logs + "../private/secret.txt",
                                   logs + "missing",
                                   "",
                                   root_ + "/private/secret.txt"};
    for (const std::string& path : refused) {
        EXPECT_FALSE(check_.IsPrivacycompliance(path)) << path;
        EXPECT_LT(check_.OpenCompliantFile(path).get(), 0) << path;
    }
    EXPECT_EQ(context_.GetStats().Value("privacy.path.refused"), 2 * std::size(refused));
    EXPECT_EQ(capture.Dump().find("secret"), std::string::npos) << capture.Dump();

    WritePolicy("");  // a changed policy applies from the next file on
    EXPECT_FALSE(check_.IsPrivacycompliance(logs + "a.txt"));
}

// A path that flips between a log file and a link to a secret while it is checked and opened
// never yields the secret; a file opened and then replaced is packed as it was opened.
TEST_F(PrivacyPathCheckTest, SwapsBetweenCheckAndOpenCannotPass) {
    std::string path = root_ + "/logs/current.log";
    std::string plain = root_ + "/logs/plain.tmp", link = root_ + "/logs/link.tmp";
    std::atomic<bool> done{false};
    std::thread swapper([&] {
        while (!done) {
            WriteDocument("log line", plain);
            rename(plain.c_str(), path.c_str());
            symlink((root_ + "/private/secret.txt").c_str(), link.c_str());
            rename(link.c_str(), path.c_str());
        }
    });
    // Until both kinds were met many times: the swapper may not even have run yet at the start.
    // No pause between tries, so a loaded machine slows the sampling as little as the swapping.
    int opened = 0, refused = 0, leaked = 0;
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    while ((opened < 200 || refused < 200) && std::chrono::steady_clock::now() < deadline) {
        check_.IsPrivacycompliance(path);  // a check that passes says nothing about the open after it
        android::base::unique_fd fd = check_.OpenCompliantFile(path);
        if (fd.get() >= 0) {
            ++opened;
            leaked += Read(fd) == "secret" ? 1 : 0;
        } else {
            ++refused;
        }
    }
    bool mixed = opened >= 200 && refused >= 200;
    done = true;
    swapper.join();
    EXPECT_EQ(leaked, 0);
    EXPECT_TRUE(mixed) << opened << " opened, " << refused << " refused";

    // Packed from the descriptor: the file that was judged and opened, whatever the path names now.
    ASSERT_TRUE(WriteDocument("log line", plain));
    ASSERT_EQ(rename(plain.c_str(), path.c_str()), 0);
    android::base::unique_fd fd = check_.OpenCompliantFile(path);
    ASSERT_GE(fd.get(), 0);
    ASSERT_EQ(unlink(path.c_str()), 0);
    ASSERT_EQ(symlink((root_ + "/private/secret.txt").c_str(), path.c_str()), 0);
    std::string zip = root_ + "/work.zip";
    {
        ZipPack pack;
        ASSERT_TRUE(pack.CreateZip(zip));
        EXPECT_TRUE(pack.AddFileFromFd(fd.get(), "logs/current.log"));
        EXPECT_FALSE(pack.AddFileFromFd(-1, "logs/none"));
        pack.Close();
    }
    ZipReader reader;
    ASSERT_TRUE(reader.Open(zip));
    std::string packed;
    char buffer[64];
    ASSERT_TRUE(
            reader.ExtractFile("logs/current.log", buffer, sizeof(buffer), [&](const char* data, uint32_t, int32_t n) {
                packed.append(data, n > 0 ? static_cast<size_t>(n) : 0);
                return 0;
            }));
    EXPECT_EQ(packed, "log line");
}

}  // namespace
}  // namespace android::Orvane
