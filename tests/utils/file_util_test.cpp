#include "utils/file_util.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <string>

#include "tests/common/log_capture.h"

namespace android {
namespace Orvane {
namespace {

class FileUtilTest : public testing::Test {
protected:
    void SetUp() override {
        char templ[] = "/tmp/orvane_file_util_XXXXXX";
        ASSERT_NE(nullptr, mkdtemp(templ));
        root_ = templ;
        oldMask_ = umask(022);
    }
    void TearDown() override {
        umask(oldMask_);
        std::string cmd = "rm -rf '" + root_ + "'";
        ASSERT_EQ(0, system(cmd.c_str()));
    }

    std::string Path(const std::string& name) const { return root_ + "/" + name; }

    static mode_t ModeOf(const std::string& path) {
        struct stat st;
        return stat(path.c_str(), &st) == 0 ? (st.st_mode & 07777) : 0;
    }
    static uint64_t StatSize(const std::string& path) {
        struct stat st;
        return stat(path.c_str(), &st) == 0 ? st.st_size : 0;
    }
    static void Write(const std::string& path, const std::string& content) {
        ASSERT_TRUE(FileUtil::SaveStringToFile(path, content, true)) << path;
    }

    std::string root_;
    mode_t oldMask_ = 0;
};

TEST_F(FileUtilTest, CreateDirectoryGivesTheModeOnlyToFoldersItCreates) {
    const std::string x = Path("x");
    ASSERT_EQ(0, mkdir(x.c_str(), 0751));
    ASSERT_EQ(0, chmod(x.c_str(), 0751));

    // 0770 cannot come from the process mask (022), so the mode is set explicitly.
    ASSERT_TRUE(FileUtil::CreateDirectory(x + "/y/z", 0770));
    EXPECT_EQ(0770u, ModeOf(x + "/y"));
    EXPECT_EQ(0770u, ModeOf(x + "/y/z"));
    EXPECT_EQ(0751u, ModeOf(x));

    // An existing path is left as it is.
    EXPECT_TRUE(FileUtil::CreateDirectory(x + "/y", 0700));
    EXPECT_EQ(0770u, ModeOf(x + "/y"));

    // Slashes at either end and doubled ones make no difference.
    ASSERT_TRUE(FileUtil::CreateDirectory(x + "/y//q/r/", 0700));
    EXPECT_TRUE(FileUtil::IsDirectory(x + "/y/q/r"));
    EXPECT_EQ(0700u, ModeOf(x + "/y/q"));
    EXPECT_EQ(0770u, ModeOf(x + "/y"));

    EXPECT_TRUE(FileUtil::CreateDirectoryWithOwner(Path("owned/a"), getuid(), getgid()));
    EXPECT_EQ(0775u, ModeOf(Path("owned/a")));
    EXPECT_EQ(0775u, ModeOf(Path("owned")));
}

TEST_F(FileUtilTest, CreateDirectoryReportsWhatItCouldNotCreate) {
    Write(Path("file"), "x");
    LogCapture logs;
    const std::string wanted = Path("file/sub/deeper");
    EXPECT_FALSE(FileUtil::CreateDirectory(wanted, 0775));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "CreateDirectory mkdir " + Path("file/sub") + " failed, " + wanted +
                                                     ", err:Not a directory"))
        << logs.Dump();
    EXPECT_FALSE(FileUtil::CreateDirectory("", 0775));
}

TEST_F(FileUtilTest, SmallQueries) {
    const std::string file = Path("f");
    Write(file, "12345");
    EXPECT_TRUE(FileUtil::FileExists(file));
    EXPECT_FALSE(FileUtil::IsDirectory(file));
    EXPECT_TRUE(FileUtil::IsDirectory(root_));
    EXPECT_EQ(5, FileUtil::GetFileSize(file));
    EXPECT_TRUE(FileUtil::CheckFilePermission(file, R_OK | W_OK));
    EXPECT_FALSE(FileUtil::CheckFilePermission(file, X_OK));

    EXPECT_TRUE(FileUtil::ChangeMode(file, 0600));
    EXPECT_EQ(0600u, ModeOf(file));
    EXPECT_FALSE(FileUtil::ChangeMode(Path("missing"), 0600));

    LogCapture logs;
    EXPECT_EQ(0, FileUtil::GetFileSize(Path("missing")));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_INFO, "GetFileSize errno 2,err No such file or directory")) << logs.Dump();
}

TEST_F(FileUtilTest, LoadRefusesFilesOverThirtyTwoMebibytes) {
    const std::string big = Path("big");
    constexpr off_t kLimit = 33554432;
    int fd = open(big.c_str(), O_RDWR | O_CREAT, 0644);
    ASSERT_GE(fd, 0);
    // Sparse, so it costs no disk; markers at both ends prove the whole file was read.
    ASSERT_EQ(0, ftruncate(fd, kLimit));
    ASSERT_EQ(1, pwrite(fd, "A", 1, 0));
    ASSERT_EQ(1, pwrite(fd, "Z", 1, kLimit - 1));
    std::string content;
    ASSERT_TRUE(FileUtil::LoadStringFromFile(big, content));
    ASSERT_EQ(static_cast<size_t>(kLimit), content.size());
    EXPECT_EQ('A', content.front());
    EXPECT_EQ('Z', content.back());

    ASSERT_EQ(0, ftruncate(fd, kLimit + 1));
    close(fd);
    content = "kept";
    EXPECT_FALSE(FileUtil::LoadStringFromFile(big, content));
    EXPECT_EQ("kept", content);
    EXPECT_FALSE(FileUtil::LoadStringFromFile(Path("missing"), content));
    EXPECT_EQ("kept", content);
}

TEST_F(FileUtilTest, LoadTrimsNulsAndReadsFilesWithoutASize) {
    const std::string file = Path("nuls");
    Write(file, std::string("\0\0abc\0def\0\0", 11));
    std::string content = "old";
    ASSERT_TRUE(FileUtil::LoadStringFromFile(file, content));
    EXPECT_EQ(std::string("abc\0def", 7), content);

    // Files of /proc measure 0 bytes, yet have content.
    ASSERT_TRUE(FileUtil::LoadStringFromFile("/proc/self/cmdline", content));
    EXPECT_NE(std::string::npos, content.find("file_util_test"));
}

TEST_F(FileUtilTest, SaveTruncatesOrAppends) {
    const std::string file = Path("save");
    EXPECT_TRUE(FileUtil::SaveStringToFile(file, "", true));
    EXPECT_FALSE(FileUtil::FileExists(file));

    ASSERT_TRUE(FileUtil::SaveStringToFile(file, "one", true));
    ASSERT_TRUE(FileUtil::SaveStringToFile(file, "two", false));
    std::string content;
    ASSERT_TRUE(FileUtil::LoadStringFromFile(file, content));
    EXPECT_EQ("onetwo", content);
    ASSERT_TRUE(FileUtil::SaveStringToFile(file, "three", true));
    ASSERT_TRUE(FileUtil::LoadStringFromFile(file, content));
    EXPECT_EQ("three", content);
    EXPECT_TRUE(FileUtil::SaveStringToFile(file, "", true));
    ASSERT_TRUE(FileUtil::LoadStringFromFile(file, content));
    EXPECT_EQ("three", content);

    EXPECT_FALSE(FileUtil::SaveStringToFile(Path("no/such/folder"), "x", true));
}

TEST_F(FileUtilTest, DeleteMoveAndTheirLogLines) {
    const std::string a = Path("a");
    const std::string b = Path("b");
    Write(a, "data");
    LogCapture logs;
    ASSERT_TRUE(FileUtil::MoveFile(a, b));
    EXPECT_FALSE(FileUtil::FileExists(a));
    EXPECT_FALSE(FileUtil::MoveFile(a, b));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR,
                              "MoveFile move file " + a + " to " + b + " failed, err:2, No such file or directory"))
        << logs.Dump();

    FileUtil::DeleteFile(b);
    EXPECT_FALSE(FileUtil::FileExists(b));
    FileUtil::DeleteFile(b);
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "DeleteFile  file not exist " + b)) << logs.Dump();

    ASSERT_TRUE(FileUtil::CreateDirectory(Path("full/inner"), 0775));
    FileUtil::DeleteFile(Path("full"));
    EXPECT_TRUE(FileUtil::IsDirectory(Path("full")));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR,
                              "DeleteFile remove file " + Path("full") + " errno:39, err:Directory not empty"))
        << logs.Dump();
}

TEST_F(FileUtilTest, LatestComparesWholeSeconds) {
    const std::string a = Path("a");
    const std::string b = Path("b");
    Write(a, "a");
    Write(b, "b");
    auto setTime = [](const std::string& path, time_t sec, long nsec) {
        struct timespec times[2] = {{sec, nsec}, {sec, nsec}};
        ASSERT_EQ(0, utimensat(AT_FDCWD, path.c_str(), times, 0));
    };
    setTime(a, 1000, 0);
    setTime(b, 1001, 0);
    EXPECT_FALSE(FileUtil::IsFileLatest(a, b));
    EXPECT_TRUE(FileUtil::IsFileLatest(b, a));
    setTime(a, 1001, 100);
    setTime(b, 1001, 900000000);  // later within the same second: still equal
    EXPECT_TRUE(FileUtil::IsFileLatest(a, b));
    EXPECT_TRUE(FileUtil::IsFileLatest(a, Path("missing")));
    EXPECT_FALSE(FileUtil::IsFileLatest(Path("missing"), b));
}

TEST_F(FileUtilTest, DeleteTreeCountsFilesFoldersAndItself) {
    const std::string top = Path("tree");
    ASSERT_TRUE(FileUtil::CreateDirectory(top + "/sub/deeper", 0775));
    ASSERT_TRUE(FileUtil::CreateDirectory(top + "/empty", 0775));
    Write(top + "/f1", std::string(100, 'x'));
    Write(top + "/sub/f2", std::string(50, 'y'));
    Write(top + "/sub/deeper/f3", std::string(7, 'z'));
    // A link to a folder outside is removed as a link; what it points to stays.
    const std::string outside = Path("outside");
    ASSERT_TRUE(FileUtil::CreateDirectory(outside, 0775));
    Write(outside + "/keep", "keep");
    ASSERT_EQ(0, symlink(outside.c_str(), (top + "/link").c_str()));
    struct stat linkStat;
    ASSERT_EQ(0, lstat((top + "/link").c_str(), &linkStat));

    const uint64_t expected = 100 + 50 + 7 + StatSize(top) + StatSize(top + "/sub") + StatSize(top + "/sub/deeper") +
                              StatSize(top + "/empty") + linkStat.st_size;
    uint64_t total = 0;
    ASSERT_EQ(0, FileUtil::DeleteDirectoryOrFile(top, total, false));
    EXPECT_EQ(expected, total);
    EXPECT_TRUE(FileUtil::IsDirectory(top));
    EXPECT_FALSE(FileUtil::FileExists(top + "/f1"));
    EXPECT_FALSE(FileUtil::FileExists(top + "/sub"));
    EXPECT_TRUE(FileUtil::FileExists(outside + "/keep"));

    // The emptied folder itself, counted onto the running total.
    total = 10;
    ASSERT_EQ(0, FileUtil::DeleteDirectoryOrFile(top, total, true));
    EXPECT_FALSE(FileUtil::FileExists(top));
    EXPECT_GT(total, 10u);

    // A plain file sets the total to its size and goes whatever the flag says.
    const std::string file = Path("plain");
    Write(file, std::string(33, 'p'));
    total = 999;
    ASSERT_EQ(0, FileUtil::DeleteDirectoryOrFile(file, total, false));
    EXPECT_EQ(33u, total);
    EXPECT_FALSE(FileUtil::FileExists(file));

    total = 5;
    EXPECT_EQ(-1, FileUtil::DeleteDirectoryOrFile(Path("missing"), total, true));
}

}  // namespace
}  // namespace Orvane
}  // namespace android
