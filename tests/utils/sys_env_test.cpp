#include "utils/sys_env.h"

#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <vector>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/log_capture.h"
#include "utils/file_util.h"

namespace android::Orvane {

// The store reads ORVANE_PROPERTY_FILE once, at its first use, so the file is chosen during
// static initialisation; the helper process (ORVANE_SYS_ENV_HELPER set) inherits its parent's.
std::string ChooseFile() {
    if (getenv("ORVANE_SYS_ENV_HELPER") == nullptr) {
        // Removed with the process, also when no test runs; without it every test fails.
        static TemporaryDir dir;
        setenv("ORVANE_PROPERTY_FILE", (std::string(dir.path) + "/build.prop").c_str(), 1);
    }
    return getenv("ORVANE_PROPERTY_FILE");
}
const std::string kGPath = ChooseFile();

std::string Get(const std::string& key) {
    return SysEnv::GetSysProperity(key, "unset");
}

class SysEnvTest : public testing::Test {
protected:
    void SetUp() override { unlink(kGPath.c_str()); }
};

TEST_F(SysEnvTest, ReadsBuildPropFormatAndRewritesOnlyTheKey) {
    ASSERT_TRUE(FileUtil::SaveStringToFile(kGPath,
                                           "# comment line\nro.a=1\nthis line is malformed\n=novalue\n"
                                           "  spaced.key = spaced value\nwith.equals=a=b\ndup=old\ndup=new\nempty=\n",
                                           true));
    LogCapture logs;
    struct {
        const char* key;
        const char* value;
    } cases[] = {{"ro.a", "1"},
                 {"spaced.key", " spaced value"},
                 {"with.equals", "a=b"},
                 {"dup", "new"},
                 {"empty", "unset"} /* empty reads as unset */,
                 {"ro.missing", "unset"}};
    for (const auto& c : cases) {
        EXPECT_EQ(c.value, Get(c.key)) << c.key;
    }
    EXPECT_EQ(1u, logs.Count(ANDROID_LOG_WARN, "GetSysProperity skipped 2 malformed lines in " + kGPath))
            << logs.Dump();
    // A write keeps comments and foreign lines, replaces the key in place and drops its duplicates.
    ASSERT_TRUE(SysEnv::SetSysProperity("dup", "newest") && SysEnv::SetSysProperity("ro.b", "2"));
    std::string text;
    ASSERT_TRUE(FileUtil::LoadStringFromFile(kGPath, text));
    EXPECT_EQ(
            "# comment line\nro.a=1\nthis line is malformed\n=novalue\n  spaced.key = spaced value\n"
            "with.equals=a=b\ndup=newest\nempty=\nro.b=2\n",
            text);
    EXPECT_EQ(1u, logs.Count(ANDROID_LOG_WARN, "malformed")) << logs.Dump();  // no second warning
}

TEST_F(SysEnvTest, BadValuesKeysAndUnreadableFilesAreRefused) {
    LogCapture logs;
    const std::string longest(91, 'v');
    ASSERT_TRUE(SysEnv::SetSysProperity("persist.sys.long", longest));
    EXPECT_FALSE(SysEnv::SetSysProperity("persist.sys.long", std::string(92, 'w')));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "SetSysProperity value of persist.sys.long is 92 bytes, at most 91"))
            << logs.Dump();
    EXPECT_EQ(longest, Get("persist.sys.long"));
    EXPECT_FALSE(SysEnv::SetSysProperity("bad key", "1") || SysEnv::SetSysProperity("", "1") ||
                 SysEnv::SetSysProperity("k", "two\nlines"));
    EXPECT_EQ(4u, logs.Count(ANDROID_LOG_ERROR, "SetSysProperity ")) << logs.Dump();
    EXPECT_EQ("unset", Get("k"));

    // A folder where the file should be: it opens, but cannot be read; the caller goes on.
    ASSERT_TRUE(unlink(kGPath.c_str()) == 0 && mkdir(kGPath.c_str(), 0755) == 0);
    EXPECT_EQ("unset", Get("persist.sys.long"));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_WARN, "GetSysProperity cannot read " + kGPath)) << logs.Dump();
    EXPECT_FALSE(SysEnv::SetSysProperity("ro.any", "1"));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "SetSysProperity cannot read " + kGPath)) << logs.Dump();
    ASSERT_EQ(0, rmdir(kGPath.c_str()));
}

constexpr int kKeys = 40;
std::string Key(int writer, int k) {
    return "w" + std::to_string(writer) + ".k" + std::to_string(k);
}
bool WriteKeys(int writer) {
    bool ok = true;
    for (int k = 0; k < kKeys; ++k) {
        ok = SysEnv::SetSysProperity(Key(writer, k), std::to_string(k)) && ok;
    }
    return ok;
}

// Runs only as a fresh process of this binary (ORVANE_SYS_ENV_HELPER=<writer>).
TEST(SysEnvHelper, ChildProcess) {
    const char* writer = getenv("ORVANE_SYS_ENV_HELPER");
    if (writer == nullptr) {
        GTEST_SKIP() << "runs only as a child of SysEnvTest.ProcessesShareTheFileAndLoseNoKey";
    }
    ASSERT_TRUE(SysEnv::SetSysProperity("saw" + std::string(writer), Get("parent.key")) && WriteKeys(atoi(writer)));
}

TEST_F(SysEnvTest, ProcessesShareTheFileAndLoseNoKey) {
    ASSERT_TRUE(SysEnv::SetSysProperity("parent.key", "from-parent"));
    EXPECT_EQ("unset", Get(Key(1, 0)));  // cached now; the children's writes must invalidate it
    std::vector<pid_t> children;
    for (int w = 1; w <= 2; ++w) {
        if (children.emplace_back(fork()) == 0) {
            setenv("ORVANE_SYS_ENV_HELPER", std::to_string(w).c_str(), 1);
            freopen("/dev/null", "w", stdout);
            execl("/proc/self/exe", "sys_env_test", "--gtest_filter=SysEnvHelper.ChildProcess", nullptr);
            _exit(127);
        }
    }
    // Writes while the children write.
    EXPECT_TRUE(WaitUntil([] { return Get(Key(1, 0)) != "unset"; }));
    EXPECT_TRUE(WriteKeys(0));
    for (pid_t pid : children) {
        int status = -1;
        EXPECT_TRUE(waitpid(pid, &status, 0) == pid && WIFEXITED(status) && WEXITSTATUS(status) == 0);
    }
    for (int w = 0; w <= 2; ++w) {
        EXPECT_EQ(w == 0 ? "unset" : "from-parent", Get("saw" + std::to_string(w)));
        for (int k = 0; k < kKeys; ++k) {
            EXPECT_EQ(std::to_string(k), Get(Key(w, k)));
        }
    }
    // An edit in place (same file, new size) is seen as well.
    ASSERT_EQ(0, system(("printf 'shell.key=yes\\n' >> '" + kGPath + "'").c_str()));
    EXPECT_EQ("yes", Get("shell.key"));
}

}  // namespace android::Orvane
