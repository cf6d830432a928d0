// The daemon as a process: a kernel record written to the emulated node ends as a log pack, and
// "orvanectl pack-log" hands it over for upload.
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "plugins/event_log_processor.h"
#include "tests/common/log_capture.h"
#include "tests/plugins/daemon_process.h"
#include "tests/plugins/devsim_process.h"
#include "tests/storage/storage_test_util.h"
#include "utils/time_util.h"

namespace android::Orvane {
namespace {

class LogCollectionDaemonTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::string failure;
        if (!DaemonProcess::Built() || access("/usr/bin/unzip", X_OK) != 0 || !devsim_.Start(&failure))
            GTEST_SKIP() << "the daemon, unzip or the device emulator is unavailable: " << failure;
        ASSERT_EQ(mkdir(root_.File("cloud").c_str(), 0775), 0);
        ASSERT_EQ(mkdir(root_.File("logs").c_str(), 0775), 0);
        WriteFile(root_.File("properties"),
                  "ro.quor.build.region=CN\npersist.sys.orvane.safecheck=0\npersist.sys.orvane.upload_switch=1\n"
                  "persist.sys.orvane.activate_time=" +
                          std::to_string(TimeUtil::GetTimestampSecond()) + "\n");
        WriteFile(root_.File("logs/kernel log.txt"), "kernel said something\n");
        // Pushed copies: rules whose sources exist here, and a policy that lets in the test's folders.
        WriteFile(root_.File("cloud/event_upload.xml"),
                  "<EventUpload><LogRule eventId=\"901001001\"><Static path=\"" + root_.File("logs/kernel log.txt") +
                          "\"/><Command cmd=\"uname -a\" file=\"uname.txt\"/></LogRule></EventUpload>");
        std::string policy = ReadFile(ORVANE_SOURCE_DIR "/etc/privacy_policy.xml");
        size_t paths = policy.find("<LogPaths>");
        ASSERT_NE(paths, std::string::npos);
        policy.insert(paths + 10, "<Allow prefix=\"" + root_.path_ + "\"/>");
        WriteFile(root_.File("cloud/privacy_policy.xml"), policy);
    }
    void StartDaemon() {
        ASSERT_TRUE(daemon_.Start("qxev=" + devsim_.Path("qxev") + ",qx_exception_log=" + root_.File("no_node")));
    }
    // Runs a command line; its standard output, and its exit status in `status`.
    static std::string Run(const std::string& command, int* status) {
        std::string out;
        FILE* pipe = popen(command.c_str(), "r");
        char buffer[4096];
        size_t n;
        while (pipe != nullptr && (n = fread(buffer, 1, sizeof(buffer), pipe)) > 0)
            out.append(buffer, n);
        *status = pipe != nullptr ? pclose(pipe) : -1;
        return out;
    }
    std::vector<std::string> Packs(const std::string& folder) {
        return EventLogProcessor::GetFileInDirByPattern(root_.File("work/" + folder),
                                                        "EventId_\\S+_\\d{14}_901001001\\.zip", -1);
    }

    DevSim devsim_;
    TempDir root_;
    DaemonProcess daemon_{root_.path_};
};

TEST_F(LogCollectionDaemonTest, RecordEndsAsAPackThatPackLogHandsOver) {
    StartDaemon();
    ASSERT_TRUE(devsim_.Inject("qxev", "EventId 901001001 -t " + std::to_string(TimeUtil::GetTimestampSecond()) +
                                               " -paraList {\"reason\":\"test\"}"));
    ASSERT_TRUE(WaitUntil([&] { return Packs("901").size() == 1; }, std::chrono::seconds(30))) << daemon_.Log();
    std::string pack = Packs("901").at(0);
    int status = 0;
    std::string listing = Run("unzip -t '" + pack + "' 2>&1", &status);
    EXPECT_EQ(status, 0) << listing;
    EXPECT_NE(listing.find("No errors detected"), std::string::npos) << listing;
    EXPECT_NE(listing.find("kernel log.txt"), std::string::npos) << listing;
    EXPECT_NE(listing.find("uname.txt"), std::string::npos) << listing;

    std::string answer = Run(ORVANE_BINARY_DIR "/orvanectl --workdir " + root_.File("work") + " pack-log", &status);
    EXPECT_EQ(status, 0);
    EXPECT_EQ(answer, "1 file(s) handed over for upload\n");
    EXPECT_TRUE(WaitUntil([&] { return Packs("901/uploading").size() == 1; }, std::chrono::seconds(10)));
    EXPECT_TRUE(Packs("901").empty());
}

}  // namespace
}  // namespace android::Orvane
