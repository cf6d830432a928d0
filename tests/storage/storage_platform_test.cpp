// The shipped plugin configuration, started by the real platform, with a test event source in
// front of its fault pipeline: events are counted, dropped and stored in "event.db".

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <algorithm>
#include <future>
#include <set>
#include <mutex>
#include <sstream>

#include "platform/plugin_factory.h"
#include "platform/plugin_platform.h"
#include "storage/event_database.h"
#include "storage/event_table.h"
#include "tests/common/log_capture.h"
#include "tests/storage/storage_test_util.h"
#include "utils/dev_info.h"
#include "utils/file_util.h"
#include "utils/time_util.h"

namespace android {
namespace Orvane {

// Publishes what the test hands it; the running instance is reachable once started.
class StorageTestSource : public EventSource {
public:
    void OnLoad() override { SetName("StorageTestSource"); }
    void StartEventSource() override {
        std::lock_guard<std::mutex> lock(mutex_);
        running_ = this;
    }
    static sp<StorageTestSource> Running() {
        std::lock_guard<std::mutex> lock(mutex_);
        return running_;
    }
    static void Forget() {
        std::lock_guard<std::mutex> lock(mutex_);
        running_.clear();
    }

private:
    static inline std::mutex mutex_;
    static inline sp<StorageTestSource> running_;
};

ORVANE_REGISTER_PLUGIN(StorageTestSource);

namespace {

std::string ReadFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream content;
    content << in.rdbuf();
    return content.str();
}

class StoragePlatformTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::string shipped = ReadFile(std::string(ORVANE_SOURCE_DIR) + "/etc/plugin_config");
        ASSERT_FALSE(shipped.empty());
        std::ofstream(root_.File("plugin_config"))
            << shipped << "\nplugins:1\nStorageTestSource[thread:test_source_loop]:0 static\n"
            << "pipelinetriggers:1\nStorageTestSource: dftFaultEvent\n";
        std::ofstream(root_.File("event_quota.xml"))
            << "<?xml version=\"1.0\"?>\n<EventQuota><" << DevInfo::GetQuorVersion() << ">"
            << "<Domain name=\"kernel\" eventMin=\"901000000\" eventMax=\"901999999\" dailyCnt=\"50\"/>"
            << "<Event eventId=\"901001001\" dailyCnt=\"3\"/><Event eventId=\"901003003\" dailyCnt=\"1000000\"/>"
            << "</" << DevInfo::GetQuorVersion() << "></EventQuota>\n";
    }
    void StartPlatform() {
        std::string configDir = root_.Path();
        std::string workDir = root_.File("work");
        std::string cloudDir = root_.File("cloud");
        const char* argv[] = {"orvane", "-configDir", configDir.c_str(), "-workDir", workDir.c_str(),
                              "-cloudCfgDir", cloudDir.c_str(), "-region", "CN"};
        platform_.reset(new PluginPlatform());
        ASSERT_EQ(platform_->ParseArgs(9, const_cast<char**>(argv)), 0);
        ASSERT_TRUE(platform_->StartPlatform());
        ASSERT_TRUE(WaitUntil([] { return StorageTestSource::Running() != nullptr; }));
        storageLoop_ = platform_->GetLooperByName("storage_loop");
    }
    void TearDown() override {
        StorageTestSource::Forget();
        platform_.reset();
        EventDatabase::getInstance()->Close();
    }
    sp<Event> FaultEvent(uint32_t id, uint64_t happenTime, const std::string& params) {
        sp<Event> event = new Event("StorageTestSource");
        event->eventType = 2;
        event->eventId = id;
        event->happenTime = happenTime;
        event->SetValue("param_list", params);
        return event;
    }

    sp<Event> Publish(uint32_t id, uint64_t happenTime, const std::string& params) {
        sp<Event> event = FaultEvent(id, happenTime, params);
        EXPECT_TRUE(StorageTestSource::Running()->PublishPipelineEvent(event));
        return event;
    }
    // Reads on the storage loop, after everything queued before it there.
    std::vector<SqlRow> Rows(const std::string& table, const std::vector<std::string>& columns) {
        std::promise<std::vector<SqlRow>> rows;
        storageLoop_->AddTask([&] {
            EventQuery query;
            query.Select(columns).Order(COL_ID, true);
            rows.set_value(EventDatabase::getInstance()->Query(table, query, -1));
        });
        return rows.get_future().get();
    }

    TempDir root_;
    std::unique_ptr<PluginPlatform> platform_;
    sp<EventLoop> storageLoop_;
};

TEST_F(StoragePlatformTest, FaultEventsAreCountedDroppedAndStored) {
    StartPlatform();
    LogCapture log;
    uint64_t day = static_cast<uint64_t>(TimeUtil::GetZeroTimestampSec(TimeUtil::GetTimestampSecond()));
    // Each an hour period apart, so only the daily quota of 3 decides.
    std::vector<sp<Event>> events;
    for (int i = 0; i < 5; i++) {
        events.push_back(Publish(901001001, day + 60 + 4000 * i, "{\"reason\":\"it's 100%\"}"));
    }
    Publish(901002002, day + 70, "other");
    Publish(700000000, day + 80, "not a fault id");

    // The over-quota report comes back through the same pipeline and is stored too.
    ASSERT_TRUE(WaitUntil([&] { return Rows(TBL_EVENT_INFO, {COL_EVENT_ID}).size() == 3; })) << log.Dump();
    auto infos = Rows(TBL_EVENT_INFO, {COL_EVENT_ID, COL_OCCURED_CNT, COL_PARAM_LIST, COL_FIRST_TIME});
    EXPECT_EQ(infos[0], (SqlRow{{COL_EVENT_ID, "901001001"}, {COL_OCCURED_CNT, "3"},
                                {COL_PARAM_LIST, "{\"reason\":\"it's 100%\"}"},
                                {COL_FIRST_TIME, std::to_string(day + 60 + 8000)}}));
    EXPECT_EQ(infos[1][COL_EVENT_ID], "901002002");
    EXPECT_EQ(infos[2][COL_EVENT_ID], "908001001");
    EXPECT_EQ(infos[2][COL_PARAM_LIST], "{\"EventId\":901001001,\"DailyCnt\":3,\"MaxCnt\":3}");

    auto daily = Rows(TBL_EVENT_DAILY, {COL_EVENT_ID, COL_DAILY_CNT, COL_OVER_CNT});
    ASSERT_GE(daily.size(), 1u);
    EXPECT_EQ(daily[0], (SqlRow{{COL_EVENT_ID, "901001001"}, {COL_DAILY_CNT, "5"}, {COL_OVER_CNT, "2"}}));
    EXPECT_EQ(events[2]->GetValue("dropReason"), "");
    EXPECT_EQ(events[3]->GetValue("dropReason"), "over daily quota");
    EXPECT_EQ(events[4]->GetValue("dropReason"), "over daily quota");
    EXPECT_TRUE(FileUtil::FileExists(root_.File("work/event.db")));
}

// Tells the parent of a forked daemon which events the pipeline has finished storing.
class AckListener : public Plugin {
public:
    explicit AckListener(int fd) : fd_(fd) {}
    EVENT_RET OnEvent(sp<Event>& event) override {
        std::string line = event->GetValue("param_list") + "\n";
        return write(fd_, line.data(), line.size()) == static_cast<ssize_t>(line.size()) ? 0 : -1;
    }

private:
    int fd_;
};

TEST_F(StoragePlatformTest, KillDuringAStreamKeepsEveryStoredRow) {
    int acks[2];
    ASSERT_EQ(pipe(acks), 0);
    uint64_t day = static_cast<uint64_t>(TimeUtil::GetZeroTimestampSec(TimeUtil::GetTimestampSecond()));
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        // The daemon: stores a stream of events as fast as it can until it is killed.
        close(acks[0]);
        StartPlatform();
        platform_->RegisterPipelineListener("dftFaultEvent", new AckListener(acks[1]));
        for (int i = 0; i < 100000; i++) {
            StorageTestSource::Running()->PublishPipelineEvent(
                FaultEvent(901003003, day + 60 + i % 3600, std::to_string(i)));
            if (i % 100 == 99) {
                usleep(10000);  // keeps the queue from growing without bound
            }
        }
        sleep(60);  // waits for the kill, bounded in case the parent is gone
        _exit(0);
    }
    close(acks[1]);
    std::string acked;
    size_t lines = 0;
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    while (lines < 100 && std::chrono::steady_clock::now() < deadline) {
        struct pollfd waiting = {acks[0], POLLIN, 0};
        if (poll(&waiting, 1, 1000) <= 0) {
            continue;
        }
        char buffer[4096];
        ssize_t size = read(acks[0], buffer, sizeof(buffer));
        if (size <= 0) {
            break;
        }
        acked.append(buffer, size);
        lines = std::count(acked.begin(), acked.end(), '\n');
    }
    kill(child, SIGKILL);
    int status = 0;
    waitpid(child, &status, 0);
    // Acknowledgements that were on their way when the daemon died.
    for (char buffer[4096]; ;) {
        ssize_t size = read(acks[0], buffer, sizeof(buffer));
        if (size <= 0) {
            break;
        }
        acked.append(buffer, size);
    }
    close(acks[0]);
    ASSERT_TRUE(WIFSIGNALED(status)) << "status " << status << ", " << lines << " acknowledged";
    ASSERT_GE(lines, 100u) << "the stream never got going";

    sp<SqlDatabase> db = new SqlDatabase(root_.File("work/event.db"));
    ASSERT_TRUE(db->Open());
    auto integrity = db->QueryRecord("PRAGMA integrity_check", {"result"});
    ASSERT_EQ(integrity.size(), 1u);
    EXPECT_EQ(integrity[0]["result"], "ok");
    std::set<std::string> stored;
    for (auto& row : db->QueryRecord("select param_list from event_info", {"p"})) {
        stored.insert(row["p"]);
    }
    db->Close();
    std::stringstream ackLines(acked);
    size_t checked = 0;
    for (std::string n; std::getline(ackLines, n); checked++) {
        EXPECT_EQ(stored.count(n), 1u) << "acknowledged event " << n << " lost";
    }
    EXPECT_GE(checked, 100u);
    EXPECT_GE(stored.size(), checked);
}

}  // namespace
}  // namespace Orvane
}  // namespace android
