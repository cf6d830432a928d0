// The device emulator as a process: the character-device behaviour that the event sources
// rely on, seen through ordinary system calls on its files.
#include <gtest/gtest.h>

#include <poll.h>
#include <sys/epoll.h>

#include <algorithm>
#include <atomic>
#include <thread>

#include "tests/plugins/devsim_process.h"

namespace android {
namespace Orvane {
namespace {

class DevSimTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::string failure;
        if (!devsim.Start(&failure)) {
            GTEST_SKIP() << "device emulator unavailable: " << failure;
        }
    }

    int Open(const std::string& node, int flags) { return open(devsim.Path(node).c_str(), flags | O_CLOEXEC); }

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

    DevSim devsim;
};

TEST_F(DevSimTest, OneRecordPerReadAndAFullQueueLosesNothing) {
    int reader = Open("qxev", O_RDONLY);
    ASSERT_GE(reader, 0);
    EXPECT_EQ(0, Ready(reader, 0));
    ASSERT_TRUE(devsim.Inject("qxev", "first record"));
    ASSERT_TRUE(devsim.Inject("qxev", "second"));
    EXPECT_EQ(POLLIN, Ready(reader, 5000));  // the kernel event device never reports priority data
    EXPECT_EQ("first record", ReadRecord(reader));
    EXPECT_EQ("second", ReadRecord(reader));
    // A short read takes the head of a record and leaves the rest for the next read.
    ASSERT_TRUE(devsim.Inject("qxev", "0123456789"));
    EXPECT_EQ("0123", ReadRecord(reader, 4));
    EXPECT_EQ("456789", ReadRecord(reader));
    EXPECT_EQ(0, Ready(reader, 0));
    // Well past the queue's capacity: the writer is held, not refused.
    constexpr int kRecords = 3000;
    std::thread writer([&] {
        for (int i = 0; i < kRecords; ++i) ASSERT_TRUE(devsim.Inject("qxev", "record " + std::to_string(i)));
    });
    for (int i = 0; i < kRecords; ++i) {
        ASSERT_EQ("record " + std::to_string(i), ReadRecord(reader));
    }
    writer.join();
    EXPECT_EQ(0, Ready(reader, 0));
    close(reader);
}

TEST_F(DevSimTest, HeldReadWakesOnWriteAndOnSignal) {
    int fd = Open("qxev", O_RDWR);
    ASSERT_GE(fd, 0);
    // A reader and a writer on one descriptor do not block each other.
    std::string received;
    std::atomic<pid_t> readerTid{0};
    std::thread reader([&] {
        readerTid = gettid();
        received = ReadRecord(fd);
    });
    ASSERT_TRUE(WaitUntil([&] {  // the reader sleeps in the kernel: its read is held
        int stat = open(("/proc/self/task/" + std::to_string(readerTid) + "/stat").c_str(), O_RDONLY | O_CLOEXEC);
        bool sleeping = readerTid != 0 && ReadRecord(stat, 64).find(") S ") != std::string::npos;
        return close(stat) == 0 && sleeping;
    }));
    const std::string record = "written on the reader's own descriptor";
    ASSERT_EQ(static_cast<ssize_t>(record.size()), write(fd, record.data(), record.size()));
    reader.join();
    EXPECT_EQ(record, received);
    // An interrupted read fails with EINTR and takes no record with it.
    struct sigaction action = {};
    action.sa_handler = [](int) {};  // no SA_RESTART
    sigaction(SIGALRM, &action, nullptr);
    alarm(1);
    EXPECT_EQ("", ReadRecord(fd));
    EXPECT_EQ(EINTR, errno);
    ASSERT_TRUE(devsim.Inject("qxev", "after the interrupt"));
    EXPECT_EQ("after the interrupt", ReadRecord(fd));
    close(fd);
}

TEST_F(DevSimTest, ExceptionLogSignalsPriorityDataUntilTheRecordIsRead) {
    int fd = Open("qx_exception_log", O_RDONLY);
    ASSERT_GE(fd, 0);
    int epfd = epoll_create(64);
    struct epoll_event watch = {}, ready[4];
    watch.events = EPOLLPRI;
    ASSERT_EQ(0, epoll_ctl(epfd, EPOLL_CTL_ADD, fd, &watch));
    EXPECT_EQ(0, epoll_wait(epfd, ready, 4, 0));
    std::thread writer([&] { devsim.Inject("qx_exception_log", std::string(1500, 'e')); });
    ASSERT_EQ(1, epoll_wait(epfd, ready, 4, 10000));  // wakes a waiter already blocked
    EXPECT_TRUE(ready[0].events & EPOLLPRI);
    writer.join();
    EXPECT_EQ(1023u, ReadRecord(fd, 1023).size());
    ASSERT_EQ(1, epoll_wait(epfd, ready, 4, 10000));  // still pending: the rest of the record
    EXPECT_EQ(477u, ReadRecord(fd, 1023).size());
    EXPECT_EQ(0, epoll_wait(epfd, ready, 4, 0));
    close(epfd);
    close(fd);
}

TEST(DevSimMountTest, UnmountableFolderIsReportedInOneLine) {
    DevSim devsim;
    std::string failure;
    ASSERT_FALSE(devsim.Start(&failure, "/nonexistent/orvane-devsim"));
    EXPECT_EQ(0u, failure.find("orvane-devsim: FUSE cannot be mounted at /nonexistent/orvane-devsim: ")) << failure;
    EXPECT_EQ(failure.size() - 1, failure.find('\n')) << failure;
}

}  // namespace
}  // namespace Orvane
}  // namespace android
