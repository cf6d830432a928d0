#include "utils/file_util.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>

#include "tests/common/log_capture.h"

namespace android::Orvane {
using namespace FileUtil;

const mode_t kOldMask = umask(022);  // so that no mode checked below can come from the mask

class FileUtilTest : public testing::Test {
protected:
    void SetUp() override { ASSERT_NE(nullptr, mkdtemp(root_)); }
    void TearDown() override { ASSERT_EQ(0, system(("rm -rf '" + Path("") + "'").c_str())); }
    std::string Path(const std::string& name) const { return std::string(root_) + "/" + name; }
    static uint64_t Stat(const std::string& path, bool mode) {
        struct stat st;
        return lstat(path.c_str(), &st) != 0 ? 0 : mode ? (st.st_mode & 07777) : st.st_size;
    }
    static std::string Load(const std::string& path) {
        std::string content = "<failed>";
        LoadStringFromFile(path, content);
        return content;
    }
    char root_[32] = "/tmp/orvane_file_util_XXXXXX";
};

TEST_F(FileUtilTest, CreateDirectoryGivesTheModeOnlyToFoldersItCreates) {
    const std::string x = Path("x");
    ASSERT_TRUE(mkdir(x.c_str(), 0751) == 0 && chmod(x.c_str(), 0751) == 0);
    // Slashes doubled or at the end change nothing; an existing folder is left as it is.
    ASSERT_TRUE(CreateDirectory(x + "/y//z/", 0770));
    ASSERT_TRUE(CreateDirectory(x + "/y/q", 0700) && CreateDirectory(x + "/y", 0700));
    ASSERT_TRUE(CreateDirectoryWithOwner(Path("owned/a"), getuid(), getgid()));
    struct { std::string path; mode_t mode; } cases[] = {
        {x, 0751}, {x + "/y", 0770}, {x + "/y/z", 0770}, {x + "/y/q", 0700}, {Path("owned"), 0775}};
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
    int fd = open(big.c_str(), O_RDWR | O_CREAT, 0644);
    // Sparse, so it costs no disk; markers at both ends prove the whole file was read.
    ASSERT_TRUE(fd >= 0 && ftruncate(fd, kLimit) == 0 && pwrite(fd, "A", 1, 0) + pwrite(fd, "Z", 1, kLimit - 1) == 2);
    std::string content = Load(big);
    EXPECT_TRUE(content.size() == size_t{kLimit} && content.front() == 'A' && content.back() == 'Z') << content.size();
    ASSERT_TRUE(ftruncate(fd, kLimit + 1) == 0 && close(fd) == 0);
    EXPECT_EQ("<failed>", Load(big));  // refused, content untouched
    // Files of /proc measure 0 bytes, yet have content.
    EXPECT_NE(std::string::npos, Load("/proc/self/cmdline").find("file_util_test"));

    const std::string file = Path("save");
    EXPECT_TRUE(SaveStringToFile(file, "", true));  // empty: nothing created
    EXPECT_FALSE(FileExists(file));
    ASSERT_TRUE(SaveStringToFile(file, std::string("\0\0one\0", 6), true) &&
                SaveStringToFile(file, std::string("two\0\0", 5), false));
    EXPECT_EQ(std::string("one\0two", 7), Load(file));
    ASSERT_TRUE(SaveStringToFile(file, "three", true));
    EXPECT_TRUE(SaveStringToFile(file, "", true));  // empty: the file is not touched
    EXPECT_EQ("three", Load(file));
    EXPECT_FALSE(SaveStringToFile(Path("no/such/folder"), "x", true));
}

TEST_F(FileUtilTest, MoveLatestAndDeleteTreeTotals) {
    const std::string a = Path("a"), b = Path("b");
    ASSERT_TRUE(SaveStringToFile(a, "a", true) && MoveFile(a, b));
    LogCapture logs;
    EXPECT_FALSE(MoveFile(a, b));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "MoveFile move file " + a + " to " + b +
                                                     " failed, err:2, No such file or directory"))
        << logs.Dump();
    ASSERT_TRUE(SaveStringToFile(a, "a", true));
    // Whole seconds count: b later within the same second is still equal.
    struct { long aSec, aNsec, bSec, bNsec; bool aLatest, bLatest; } cases[] = {
        {1000, 0, 1001, 0, false, true}, {1001, 100, 1001, 900000000, true, true}};
    for (const auto& c : cases) {
        struct timespec ta[2] = {{c.aSec, c.aNsec}, {c.aSec, c.aNsec}}, tb[2] = {{c.bSec, c.bNsec}, {c.bSec, c.bNsec}};
        ASSERT_TRUE(utimensat(AT_FDCWD, a.c_str(), ta, 0) == 0 && utimensat(AT_FDCWD, b.c_str(), tb, 0) == 0);
        EXPECT_EQ(c.aLatest, IsFileLatest(a, b)) << c.aSec;
        EXPECT_EQ(c.bLatest, IsFileLatest(b, a)) << c.aSec;
    }
    EXPECT_TRUE(IsFileLatest(a, Path("missing")) && !IsFileLatest(Path("missing"), b));

    const std::string top = Path("tree"), outside = Path("outside");
    ASSERT_TRUE(CreateDirectory(top + "/sub/deeper", 0775) && CreateDirectory(top + "/empty", 0775));
    ASSERT_TRUE(CreateDirectory(outside, 0775) && SaveStringToFile(outside + "/keep", "keep", true));
    for (const char* f : {"/f1", "/sub/f2", "/sub/deeper/f3"}) {
        ASSERT_TRUE(SaveStringToFile(top + f, std::string(50, 'x'), true));
    }
    // A link to a folder outside is removed as a link; what it points to stays.
    ASSERT_EQ(0, symlink(outside.c_str(), (top + "/link").c_str()));
    uint64_t expected = 150, total = 0;
    for (const char* p : {"", "/sub", "/sub/deeper", "/empty", "/link"}) {
        expected += Stat(top + p, false);
    }
    DeleteFile(top);  // a single remove, which cannot delete a full folder: the totals below stay whole
    ASSERT_EQ(0, DeleteDirectoryOrFile(top, total, false));
    EXPECT_EQ(expected, total);
    // Emptied and kept; the folder behind the link untouched.
    EXPECT_TRUE(IsDirectory(top) && !FileExists(top + "/sub") && FileExists(outside + "/keep"));
    // The emptied folder itself, added onto the running total.
    const uint64_t emptied = Stat(top, false);
    total = 10;
    ASSERT_EQ(0, DeleteDirectoryOrFile(top, total, true));
    EXPECT_FALSE(FileExists(top));
    EXPECT_EQ(10 + emptied, total);
    // A plain file sets the total to its size and goes whatever the flag says.
    ASSERT_TRUE(SaveStringToFile(outside + "/keep", std::string(33, 'p'), true));
    ASSERT_EQ(0, DeleteDirectoryOrFile(outside + "/keep", total, false));
    EXPECT_TRUE(total == 33 && !FileExists(outside + "/keep")) << total;
    EXPECT_EQ(-1, DeleteDirectoryOrFile(Path("missing"), total, true));
}

}  // namespace android::Orvane
