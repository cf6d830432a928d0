// The device emulator as a process: the character-device behaviour that the event sources
// rely on, seen through ordinary system calls on its files.
#include <poll.h>
#include <signal.h>

#include <algorithm>
#include <thread>

#include <gtest/gtest.h>

#include "tests/plugins/devsim_process.h"

namespace android::Orvane {
namespace {

class DevSimTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::string failure;
        if (!devsim_.Start(&failure)) {
            GTEST_SKIP() << "device emulator unavailable: " << failure;
        }
    }

    android::base::unique_fd Open(const std::string& node, int flags) {
        return android::base::unique_fd(open(devsim_.Path(node).c_str(), flags | O_CLOEXEC));
    }

    static std::string ReadRecord(int fd, size_t size = 4096) {
        std::string buffer(size, '\0');
        buffer.resize(std::max<ssize_t>(0, read(fd, &buffer[0], size)));
        return buffer;
    }

    // Readiness as poll reports it: POLLIN, POLLPRI or nothing within the time.
    static short Ready(int fd, int timeoutMs) {
        struct pollfd watch = {fd, POLLIN | POLLPRI, 0};
        return poll(&watch, 1, timeoutMs) == 1 ? watch.revents : 0;
    }

    DevSim devsim_;
};

TEST_F(DevSimTest, OneRecordPerReadAndAFullQueueLosesNothing) {
    android::base::unique_fd file = Open("qxev", O_RDONLY);
    ASSERT_TRUE(file.ok());
    int reader = file.get();
    EXPECT_EQ(0, Ready(reader, 0));
    ASSERT_TRUE(devsim_.Inject("qxev", "first record"));
    ASSERT_TRUE(devsim_.Inject("qxev", "second"));
    EXPECT_EQ(POLLIN, Ready(reader, 5000));  // the kernel event device never reports priority data
    EXPECT_EQ("first record", ReadRecord(reader));
    EXPECT_EQ("second", ReadRecord(reader));
    // A short read takes the head of a record and leaves the rest for the next read.
    ASSERT_TRUE(devsim_.Inject("qxev", "0123456789"));
    EXPECT_EQ("0123", ReadRecord(reader, 4));
    EXPECT_EQ("456789", ReadRecord(reader));
    EXPECT_EQ(0, Ready(reader, 0));
    // Well past the queue's capacity: the writer is held, not refused.
    constexpr int kRecords = 3000;
    std::thread writer([&] {
        for (int i = 0; i < kRecords; ++i)
            ASSERT_TRUE(devsim_.Inject("qxev", "record " + std::to_string(i)));
    });
    for (int i = 0; i < kRecords; ++i) {
        ASSERT_EQ("record " + std::to_string(i), ReadRecord(reader));
    }
    writer.join();
    EXPECT_EQ(0, Ready(reader, 0));
    // A held read that is interrupted fails with EINTR and takes no record with it.
    struct sigaction action = {};
    action.sa_handler = [](int) {};  // no SA_RESTART
    sigaction(SIGALRM, &action, nullptr);
    alarm(1);
    EXPECT_EQ("", ReadRecord(reader));
    EXPECT_EQ(EINTR, errno);
    ASSERT_TRUE(devsim_.Inject("qxev", "after the interrupt"));
    EXPECT_EQ("after the interrupt", ReadRecord(reader));
}

TEST(DevSimMountTest, UnmountableFolderIsReportedInOneLine) {
    DevSim devsim;
    std::string failure;
    ASSERT_FALSE(devsim.Start(&failure, "/nonexistent/orvane-devsim"));
    EXPECT_EQ(0u, failure.find("orvane-devsim: FUSE cannot be mounted at /nonexistent/orvane-devsim: ")) << failure;
    EXPECT_EQ(failure.size() - 1, failure.find('\n')) << failure;
}

}  // namespace
}  // namespace android::Orvane
