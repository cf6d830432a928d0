// The shipped plugin configuration, started by the real platform, with a test event source in
// front of its fault pipeline: events are counted, dropped and stored in "event.db".

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>

#include <android-base/unique_fd.h>
#include <gtest/gtest.h>

#include "platform/plugin_factory.h"
#include "platform/plugin_platform.h"
#include "storage/event_database.h"
#include "tests/common/log_capture.h"
#include "tests/common/test_data.h"
#include "tests/storage/storage_test_util.h"
#include "utils/dev_info.h"
#include "utils/time_util.h"

namespace android::Orvane {

// Publishes what the test hands it; the running instance is reachable once started. As a listener of
// the pipeline it counts the events the pipeline has finished, and after each writes to `ackFd_` how
// many events the storage has reported committed so far.
class StorageTestSource : public EventSource {
public:
    void OnLoad() override { SetName("StorageTestSource"); }
    void StartEventSource() override { running_ = this; }
    EVENT_RET OnEvent(sp<Event>&) override {
        std::string line = std::to_string(GetPluginContext()->GetStats().Value("storage.events.committed")) + "\n";
        acked_++;
        return ackFd_ < 0 || write(ackFd_, line.data(), line.size()) == static_cast<ssize_t>(line.size()) ? 0 : -1;
    }
    static inline std::atomic<StorageTestSource*> running_{nullptr};
    static inline std::atomic<int> acked_{0};
    static inline int ackFd_ = -1;
};
ORVANE_REGISTER_PLUGIN(StorageTestSource);

class StoragePlatformTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::string shipped = ReadFile(TestDataDir() + "/etc/plugin_config");
        const std::string source = "\nplugins:1\nStorageTestSource[thread:source_loop]:0 static\npipelinetriggers:1\n";
        WriteFile(root_.File("plugin_config"), shipped + source + "StorageTestSource: dftFaultEvent\n");
        const std::string os = DevInfo::GetQuorVersion(),
                          domain = "<Domain eventMin=\"901000000\" eventMax=\"901999999\"";
        WriteFile(root_.File("event_quota.xml"), "<EventQuota><" + os + ">" + domain + " dailyCnt=\"1000000\"/>" +
                                                         "<Event eventId=\"901001001\" dailyCnt=\"3\"/></" + os +
                                                         "></EventQuota>");
        std::string configDir = root_.path_, workDir = root_.File("work"), cloudDir = root_.File("cloud");
        const char* argv[] = {"orvane",       "-configDir",     configDir.c_str(), "-workDir", workDir.c_str(),
                              "-cloudCfgDir", cloudDir.c_str(), "-region",         "CN"};
        ASSERT_EQ(platform_->ParseArgs(9, const_cast<char**>(argv)), 0);
    }
    void StartPlatform() {
        ASSERT_TRUE(platform_->StartPlatform());
        ASSERT_TRUE(WaitUntil([] { return StorageTestSource::running_ != nullptr; }));
        platform_->RegisterPipelineListener("dftFaultEvent", StorageTestSource::running_.load());
    }
    void TearDown() override {
        StorageTestSource::running_ = nullptr, platform_.reset(), EventDatabase::getInstance()->Close();
    }
    void Publish(uint32_t id, uint64_t happenTime, const std::string& params) {
        StorageTestSource::running_.load()->PublishPipelineEvent(MakeEvent(2, id, happenTime, params));
    }

    TempDir root_;
    std::string db_ = root_.File("work/event.db");
    std::unique_ptr<PluginPlatform> platform_ = std::make_unique<PluginPlatform>();
    uint64_t day_ = static_cast<uint64_t>(TimeUtil::GetZeroTimestampSec(TimeUtil::GetTimestampSecond()));
};

TEST_F(StoragePlatformTest, FaultEventsAreCountedDroppedAndStored) {
    StartPlatform();
    for (int i = 0; i < 5; i++)  // an hour period apart, so only the daily quota of 3 decides
        Publish(901001001, day_ + 60 + 4000 * i, "{\"reason\":\"it's 100%\"}");
    Publish(901002002, day_ + 70, "other");
    Publish(700000000, day_ + 80, "not a fault id");
    // The over-quota report comes back through the same pipeline and is stored too, once; the event
    // that is not a fault id ends its pipeline unseen.
    ASSERT_TRUE(WaitUntil([] { return StorageTestSource::acked_ == 7; }));
    EXPECT_EQ(Column(db_, "select event_id||' '||occured_cnt||' '||first_time||' '||param_list from event_info"),
              (Texts{"901001001 3 " + std::to_string(day_ + 8060) + " {\"reason\":\"it's 100%\"}",
                     "901002002 1 " + std::to_string(day_ + 70) + " other",
                     "908001001 1 " + std::to_string(day_ + 12060) +
                             " {\"EventId\":901001001,\"DailyCnt\":3,\"MaxCnt\":3}"}));
    EXPECT_EQ(Column(db_, "select event_id||' '||daily_cnt||' '||over_cnt from event_daily"),
              (Texts{"901001001 5 2", "901002002 1 0", "908001001 1 0"}));
}

// Events share transactions while the stream runs; every event whose commit was reported before the
// kill is in the file, which is intact.
TEST_F(StoragePlatformTest, KillDuringAStreamKeepsEveryCommittedEvent) {
    base::unique_fd ackRead, ackWrite;
    ASSERT_TRUE(base::Pipe(&ackRead, &ackWrite));
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {  // the daemon: stores a stream of events as fast as it can until it is killed
        ackRead.reset();
        StorageTestSource::ackFd_ = ackWrite.get();
        StartPlatform();
        for (int i = 0; i < 100000; i++) {
            Publish(901003003, day_ + 60 + i % 3600, std::to_string(i));
            if (i % 100 == 99)
                usleep(10000);  // keeps the queue from growing without bound
        }
        sleep(60);  // waits for the kill, bounded in case the parent is gone
        _exit(0);
    }
    ackWrite.reset();
    // Kills the daemon once 1000 events are reported committed, then reads what was on its way.
    std::string acked;
    char buffer[4096];
    bool killed = false;
    uint64_t committed = 0;
    for (ssize_t size; (size = read(ackRead.get(), buffer, sizeof(buffer))) > 0;) {
        acked.append(buffer, static_cast<size_t>(size));
        size_t end = acked.rfind('\n');
        size_t start = end == std::string::npos || end == 0 ? 0 : acked.rfind('\n', end - 1) + 1;
        if (end != std::string::npos)
            committed = std::max<uint64_t>(committed, std::stoull(acked.substr(start, end - start)));
        acked.erase(0, end == std::string::npos ? 0 : end + 1);
        if (!killed && committed >= 1000)
            killed = kill(child, SIGKILL) == 0;
    }
    ackRead.reset();
    kill(child, SIGKILL);
    int status = 0;
    waitpid(child, &status, 0);
    ASSERT_TRUE(killed && WIFSIGNALED(status)) << "status " << status << ", committed: " << committed;
    EXPECT_EQ(Column(db_, "PRAGMA integrity_check"), Texts{"ok"});
    // The stream is stored in order, so the committed events are the first ones.
    Texts rows = Column(db_, "select param_list from event_info where event_id = 901003003 order by id");
    ASSERT_GE(rows.size(), committed);
    for (uint64_t n = 0; n < committed; n++)
        ASSERT_EQ(rows[n], std::to_string(n)) << "committed event " << n << " lost";
}

}  // namespace android::Orvane
