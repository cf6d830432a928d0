#include "utils/sys_env.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "tests/common/log_capture.h"
#include "utils/file_util.h"

extern char** environ;

namespace android {
namespace Orvane {
namespace {

// Set in the environment of the copy of this binary that runs as a second process.
constexpr const char* kHelperVariable = "ORVANE_SYS_ENV_HELPER";

// The store reads ORVANE_PROPERTY_FILE once, at its first use, so the file is chosen during
// static initialisation, before any test. The helper process inherits its parent's file.
class PropertyFile {
public:
    PropertyFile() {
        if (getenv(kHelperVariable) != nullptr) {
            path_ = getenv("ORVANE_PROPERTY_FILE");
            return;
        }
        char templ[] = "/tmp/orvane_sys_env_XXXXXX";
        if (mkdtemp(templ) != nullptr) {
            folder_ = templ;
            path_ = folder_ + "/build.prop";
            setenv("ORVANE_PROPERTY_FILE", path_.c_str(), 1);
        }
    }
    ~PropertyFile() {
        if (!folder_.empty()) {
            std::string cmd = "rm -rf '" + folder_ + "'";
            if (system(cmd.c_str()) != 0) {
                fprintf(stderr, "could not remove %s\n", folder_.c_str());
            }
        }
    }
    const std::string& Path() const { return path_; }

private:
    std::string folder_;
    std::string path_;
};

const PropertyFile gFile;

std::string Get(const std::string& key, const std::string& def = "unset") {
    return SysEnv::GetSysProperity(key, def);
}

std::string FileText() {
    std::string text;
    FileUtil::LoadStringFromFile(gFile.Path(), text);
    return text;
}

class SysEnvTest : public testing::Test {
protected:
    void SetUp() override {
        ASSERT_FALSE(gFile.Path().empty());
        unlink(gFile.Path().c_str());
    }
};

TEST_F(SysEnvTest, ReadsBuildPropFormatAndWarnsOnceAboutMalformedLines) {
    ASSERT_TRUE(FileUtil::SaveStringToFile(gFile.Path(),
                                           "# comment line\n"
                                           "ro.a=1\n"
                                           "this line is malformed\n"
                                           "=novalue\n"
                                           "  spaced.key = spaced value\n"
                                           "with.equals=a=b\n"
                                           "dup=old\n"
                                           "dup=new\n"
                                           "empty=\n",
                                           true));
    LogCapture logs;
    EXPECT_EQ("1", Get("ro.a"));
    EXPECT_EQ(" spaced value", Get("spaced.key"));
    EXPECT_EQ("a=b", Get("with.equals"));
    EXPECT_EQ("new", Get("dup"));
    EXPECT_EQ("unset", Get("empty"));  // an empty value reads as unset, as on a device
    EXPECT_EQ("unset", Get("ro.missing"));
    EXPECT_EQ(1u, logs.Count(ANDROID_LOG_WARN, "GetSysProperity skipped 2 malformed lines in " + gFile.Path()))
        << logs.Dump();

    // A write keeps comments and foreign lines, replaces the key in place and drops its duplicates.
    ASSERT_TRUE(SysEnv::SetSysProperity("dup", "newest"));
    ASSERT_TRUE(SysEnv::SetSysProperity("ro.b", "2"));
    EXPECT_EQ("newest", Get("dup"));
    EXPECT_EQ("2", Get("ro.b"));
    std::string text = FileText();
    EXPECT_NE(std::string::npos, text.find("# comment line\nro.a=1\nthis line is malformed\n")) << text;
    EXPECT_NE(std::string::npos, text.find("dup=newest\nempty=\nro.b=2\n")) << text;
    EXPECT_EQ(std::string::npos, text.find("dup=new\n")) << text;
    // The same bad lines do not warn again.
    EXPECT_EQ(1u, logs.Count(ANDROID_LOG_WARN, "malformed")) << logs.Dump();
}

TEST_F(SysEnvTest, ValuesLongerThanTheDeviceLimitAreRefused) {
    LogCapture logs;
    const std::string longest(91, 'v');
    ASSERT_TRUE(SysEnv::SetSysProperity("persist.sys.long", longest));
    EXPECT_FALSE(SysEnv::SetSysProperity("persist.sys.long", std::string(92, 'w')));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "SetSysProperity value of persist.sys.long is 92 bytes, at most 91"))
        << logs.Dump();
    EXPECT_EQ(longest, Get("persist.sys.long"));

    EXPECT_FALSE(SysEnv::SetSysProperity("bad key", "1"));
    EXPECT_FALSE(SysEnv::SetSysProperity("", "1"));
    EXPECT_FALSE(SysEnv::SetSysProperity("k", "two\nlines"));
    EXPECT_EQ(4u, logs.Count(ANDROID_LOG_ERROR, "SetSysProperity ")) << logs.Dump();
    EXPECT_EQ(std::string::npos, FileText().find("two")) << FileText();
}

TEST_F(SysEnvTest, MissingOrUnreadableFileNeverStopsTheCaller) {
    EXPECT_EQ("default", Get("ro.any", "default"));

    // A folder where the file should be: it opens, but cannot be read.
    ASSERT_EQ(0, mkdir(gFile.Path().c_str(), 0755));
    LogCapture logs;
    EXPECT_EQ("default", Get("ro.any", "default"));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_WARN, "GetSysProperity cannot read " + gFile.Path())) << logs.Dump();
    EXPECT_FALSE(SysEnv::SetSysProperity("ro.any", "1"));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "SetSysProperity cannot read " + gFile.Path())) << logs.Dump();
    ASSERT_EQ(0, rmdir(gFile.Path().c_str()));

    ASSERT_TRUE(SysEnv::SetSysProperity("ro.any", "1"));
    EXPECT_EQ("1", Get("ro.any", "default"));
    unlink(gFile.Path().c_str());
    EXPECT_EQ("default", Get("ro.any", "default"));
}

// Runs this binary again as a separate process that executes only SysEnvHelper.ChildProcess.
int RunHelper() {
    std::vector<std::string> envStrings;
    for (char** e = environ; *e != nullptr; ++e) {
        envStrings.emplace_back(*e);
    }
    envStrings.push_back(std::string(kHelperVariable) + "=1");
    std::vector<char*> env;
    for (auto& s : envStrings) {
        env.push_back(s.data());
    }
    env.push_back(nullptr);
    std::string self = "/proc/self/exe";
    std::string filter = "--gtest_filter=SysEnvHelper.ChildProcess";
    char* argv[] = {self.data(), filter.data(), nullptr};
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, "/dev/null", O_WRONLY, 0);
    pid_t pid;
    int ret = posix_spawn(&pid, self.c_str(), &actions, nullptr, argv, env.data());
    posix_spawn_file_actions_destroy(&actions);
    if (ret != 0) {
        return -1;
    }
    int status = 0;
    waitpid(pid, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

TEST(SysEnvHelper, ChildProcess) {
    if (getenv(kHelperVariable) == nullptr) {
        GTEST_SKIP() << "runs only as the second process of SysEnvTest.OtherProcessesShareTheFile";
    }
    ASSERT_TRUE(SysEnv::SetSysProperity("child.saw", Get("parent.key")));
    ASSERT_TRUE(SysEnv::SetSysProperity("child.key", "from-child"));
}

TEST_F(SysEnvTest, OtherProcessesShareTheFile) {
    ASSERT_TRUE(SysEnv::SetSysProperity("parent.key", "from-parent"));
    EXPECT_EQ("unset", Get("child.key"));  // cached now; the child's write must invalidate it
    ASSERT_EQ(0, RunHelper());
    EXPECT_EQ("from-parent", Get("child.saw"));
    EXPECT_EQ("from-child", Get("child.key"));
    EXPECT_EQ("from-parent", Get("parent.key"));

    // An edit in place (same file, new size) is seen as well.
    std::string cmd = "printf 'shell.key=yes\\n' >> '" + gFile.Path() + "'";
    ASSERT_EQ(0, system(cmd.c_str()));
    EXPECT_EQ("yes", Get("shell.key"));
}

TEST_F(SysEnvTest, ConcurrentWritersLoseNoKey) {
    constexpr int kWriters = 3;
    constexpr int kKeys = 40;
    auto writeAll = [](int writer) {
        bool ok = true;
        for (int k = 0; k < kKeys; ++k) {
            ok = SysEnv::SetSysProperity("w" + std::to_string(writer) + ".k" + std::to_string(k), std::to_string(k)) && ok;
        }
        return ok;
    };
    std::vector<pid_t> children;
    for (int w = 1; w < kWriters; ++w) {
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            _exit(writeAll(w) ? 0 : 1);
        }
        children.push_back(pid);
    }
    EXPECT_TRUE(writeAll(0));
    for (pid_t pid : children) {
        int status = 0;
        ASSERT_EQ(pid, waitpid(pid, &status, 0));
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    }
    for (int w = 0; w < kWriters; ++w) {
        for (int k = 0; k < kKeys; ++k) {
            EXPECT_EQ(std::to_string(k), Get("w" + std::to_string(w) + ".k" + std::to_string(k))) << w << " " << k;
        }
    }
}

}  // namespace
}  // namespace Orvane
}  // namespace android
