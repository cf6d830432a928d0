#include "utils/file_util.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>

#include <android-base/file.h>
#include <android-base/unique_fd.h>
#include <gtest/gtest.h>

#include "tests/common/log_capture.h"

namespace android::Orvane {
using namespace FileUtil;

const mode_t kOldMask = umask(022);  // so that no mode checked below can come from the mask

class FileUtilTest : public testing::Test {
protected:
    std::string Path(const std::string& name) const { return std::string(root_.path) + "/" + name; }
    static uint64_t Stat(const std::string& path, bool mode) {
        struct stat st;
        return lstat(path.c_str(), &st) != 0 ? 0 : mode ? (st.st_mode & 07777) : st.st_size;
    }
    static std::string Load(const std::string& path) {
        std::string content = "<failed>";
        LoadStringFromFile(path, content);
        return content;
    }
    TemporaryDir root_;
};

TEST_F(FileUtilTest, CreateDirectoryGivesTheModeOnlyToFoldersItCreates) {
    const std::string x = Path("x");
    ASSERT_EQ(0, mkdir(x.c_str(), 0751));
    // Slashes doubled or at the end change nothing; an existing folder is left as it is.
    ASSERT_TRUE(CreateDirectory(x + "/y//z/", 0770));
    ASSERT_TRUE(CreateDirectory(x + "/y/q", 0700) && CreateDirectory(x + "/y", 0700));
    struct {
        std::string path;
        mode_t mode;
    } cases[] = {{x, 0751}, {x + "/y", 0770}, {x + "/y/z", 0770}, {x + "/y/q", 0700}};
    for (const auto& c : cases) {
        EXPECT_EQ(c.mode, Stat(c.path, true)) << c.path;
    }
    ASSERT_TRUE(SaveStringToFile(Path("file"), "x", true));
    LogCapture logs;
    EXPECT_FALSE(CreateDirectory(Path("file/sub/deeper"), 0775) || CreateDirectory("", 0775));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "CreateDirectory mkdir " + Path("file/sub") + " failed, " +
                                                         Path("file/sub/deeper") + ", err:Not a directory"))
            << logs.Dump();
}

TEST_F(FileUtilTest, LoadLimitNulTrimmingAndSaveModes) {
    const std::string big = Path("big");
    constexpr off_t kLimit = 32 << 20;
    android::base::unique_fd fd(open(big.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644));
    // Sparse, so it costs no disk; markers at both ends prove the whole file was read.
    ASSERT_TRUE(fd >= 0 && ftruncate(fd, kLimit) == 0 && pwrite(fd, "A", 1, 0) + pwrite(fd, "Z", 1, kLimit - 1) == 2);
    std::string content = Load(big);
    EXPECT_TRUE(content.size() == size_t{kLimit} && content.front() == 'A' && content.back() == 'Z') << content.size();
    ASSERT_EQ(ftruncate(fd, kLimit + 1), 0);
    EXPECT_EQ("<failed>", Load(big));  // refused, content untouched
    // Files of /proc measure 0 bytes, yet have content; most of them cannot even seek to their end.
    EXPECT_NE(std::string::npos, Load("/proc/self/cmdline").find("file_util_test"));
    EXPECT_EQ(0u, Load("/proc/self/status").find("Name:"));

    const std::string file = Path("save");
    ASSERT_TRUE(SaveStringToFile(file, std::string("\0\0one\0", 6), true) &&
                SaveStringToFile(file, std::string("two\0\0", 5), false));
    EXPECT_EQ(std::string("one\0two", 7), Load(file));
    ASSERT_TRUE(SaveStringToFile(file, "three", true));
    EXPECT_TRUE(SaveStringToFile(file, "", true));  // empty: the file is not touched
    EXPECT_EQ("three", Load(file));
    EXPECT_FALSE(SaveStringToFile(Path("no/such/folder"), "x", true));
}

TEST_F(FileUtilTest, DeleteTreeCountsItsBytesAndLeavesWhatLinksPointTo) {
    const std::string top = Path("tree"), outside = Path("outside");
    ASSERT_TRUE(CreateDirectory(top + "/sub/deeper", 0775) && CreateDirectory(outside, 0775));
    ASSERT_TRUE(SaveStringToFile(top + "/f1", std::string(50, 'x'), true) &&
                SaveStringToFile(top + "/sub/deeper/f2", std::string(70, 'x'), true) &&
                SaveStringToFile(outside + "/keep", "keep", true));
    // A link to a folder outside is removed as a link; what it points to stays.
    ASSERT_EQ(0, symlink(outside.c_str(), (top + "/link").c_str()));
    uint64_t expected = 120, total = 0;
    for (const char* p : {"", "/sub", "/sub/deeper", "/link"}) {
        expected += Stat(top + p, false);
    }
    ASSERT_EQ(0, DeleteDirectoryOrFile(top, total, false));
    EXPECT_EQ(expected, total);
    // Emptied and kept; the folder behind the link untouched.
    EXPECT_TRUE(IsDirectory(top) && !FileExists(top + "/sub") && FileExists(outside + "/keep"));
    ASSERT_EQ(0, DeleteDirectoryOrFile(top, total, true));
    EXPECT_FALSE(FileExists(top));
    // A plain file sets the total to its size and goes whatever the flag says.
    ASSERT_EQ(0, DeleteDirectoryOrFile(outside + "/keep", total, false));
    EXPECT_TRUE(total == 4 && !FileExists(outside + "/keep")) << total;
    EXPECT_EQ(-1, DeleteDirectoryOrFile(Path("missing"), total, true));
}

}  // namespace android::Orvane
