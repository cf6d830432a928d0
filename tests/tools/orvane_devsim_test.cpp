// The device emulator as a process: the character-device behaviour that the event sources
// rely on, seen through ordinary system calls on its files.
#include <gtest/gtest.h>

#include <errno.h>
#include <poll.h>
#include <pthread.h>
#include <signal.h>
#include <stdio.h>
#include <sys/epoll.h>
#include <sys/select.h>

#include <atomic>
#include <string>
#include <thread>

#include "tests/common/log_capture.h"
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
        ssize_t length = read(fd, &buffer[0], size);
        buffer.resize(length > 0 ? static_cast<size_t>(length) : 0);
        return buffer;
    }

    // True once the thread sleeps in the kernel, that is, its read is held.
    static bool Sleeping(pid_t tid) {
        FILE* stat = fopen(("/proc/self/task/" + std::to_string(tid) + "/stat").c_str(), "r");
        char state = '?';
        if (stat != nullptr) {
            fscanf(stat, "%*d (%*[^)]) %c", &state);
            fclose(stat);
        }
        return state == 'S';
    }

    static bool Readable(int fd, int timeoutMs) {
        fd_set readable;
        FD_ZERO(&readable);
        FD_SET(fd, &readable);
        struct timeval timeout = {0, timeoutMs * 1000};
        return select(fd + 1, &readable, nullptr, nullptr, &timeout) == 1 && FD_ISSET(fd, &readable);
    }

    DevSim devsim;
};

TEST_F(DevSimTest, OneRecordPerReadWithSelectReadiness) {
    int reader = Open("qxev", O_RDWR);
    ASSERT_GE(reader, 0);
    EXPECT_FALSE(Readable(reader, 0));
    ASSERT_TRUE(devsim.Inject("qxev", "first record"));
    ASSERT_TRUE(devsim.Inject("qxev", "second"));
    EXPECT_TRUE(Readable(reader, 5000));
    EXPECT_EQ("first record", ReadRecord(reader));
    EXPECT_EQ("second", ReadRecord(reader));
    EXPECT_FALSE(Readable(reader, 0));
    // A short read takes the head of a record and leaves the rest for the next read.
    ASSERT_TRUE(devsim.Inject("qxev", "0123456789"));
    EXPECT_EQ("0123", ReadRecord(reader, 4));
    EXPECT_EQ("456789", ReadRecord(reader));
    // The kernel event device never reports priority data.
    ASSERT_TRUE(devsim.Inject("qxev", "x"));
    struct pollfd watch = {reader, POLLIN | POLLPRI, 0};
    ASSERT_EQ(1, poll(&watch, 1, 5000));
    EXPECT_EQ(POLLIN, watch.revents & (POLLIN | POLLPRI));
    close(reader);
}

TEST_F(DevSimTest, HeldReadWakesOnWriteAndOnSignal) {
    struct sigaction action = {};
    action.sa_handler = [](int) {};
    sigaction(SIGUSR2, &action, nullptr);
    int fd = Open("qxev", O_RDWR);
    ASSERT_GE(fd, 0);

    // A reader and a writer on one descriptor do not block each other.
    std::string received;
    std::atomic<pid_t> readerTid{0};
    std::thread reader([&] {
        readerTid = gettid();
        received = ReadRecord(fd);
    });
    ASSERT_TRUE(WaitUntil([&] { return readerTid != 0 && Sleeping(readerTid); }));
    const std::string record = "written on the reader's own descriptor";
    ASSERT_EQ(static_cast<ssize_t>(record.size()), write(fd, record.data(), record.size()));
    reader.join();
    EXPECT_EQ(record, received);

    // An interrupted read fails with EINTR and takes no record with it.
    std::atomic<bool> done{false};
    int readErrno = 0;
    std::thread interrupted([&] {
        char buffer[64];
        if (read(fd, buffer, sizeof(buffer)) < 0) {
            readErrno = errno;
        }
        done = true;
    });
    EXPECT_TRUE(WaitUntil([&] {
        pthread_kill(interrupted.native_handle(), SIGUSR2);
        return done.load();
    }));
    interrupted.join();
    EXPECT_EQ(EINTR, readErrno);
    ASSERT_TRUE(devsim.Inject("qxev", "after the interrupt"));
    EXPECT_EQ("after the interrupt", ReadRecord(fd));
    close(fd);
}

TEST_F(DevSimTest, ExceptionLogSignalsPriorityData) {
    int fd = Open("qx_exception_log", O_RDONLY);
    ASSERT_GE(fd, 0);
    int epfd = epoll_create(64);
    struct epoll_event watch = {};
    watch.events = EPOLLPRI;
    ASSERT_EQ(0, epoll_ctl(epfd, EPOLL_CTL_ADD, fd, &watch));
    struct epoll_event ready[4];
    EXPECT_EQ(0, epoll_wait(epfd, ready, 4, 0));
    std::thread writer([&] { devsim.Inject("qx_exception_log", std::string(1500, 'e')); });
    ASSERT_EQ(1, epoll_wait(epfd, ready, 4, 10000));
    EXPECT_TRUE(ready[0].events & EPOLLPRI);
    writer.join();
    EXPECT_EQ(1023u, ReadRecord(fd, 1023).size());
    // Still pending: the rest of the record.
    ASSERT_EQ(1, epoll_wait(epfd, ready, 4, 10000));
    EXPECT_EQ(477u, ReadRecord(fd, 1023).size());
    EXPECT_EQ(0, epoll_wait(epfd, ready, 4, 0));
    close(epfd);
    close(fd);
}

TEST_F(DevSimTest, FullQueueHoldsTheWriterAndLosesNothing) {
    constexpr int kRecords = 3000;  // well past the queue's capacity
    std::atomic<bool> written{false};
    std::thread writer([&] {
        int fd = Open("qxev", O_WRONLY);
        for (int i = 0; i < kRecords; ++i) {
            std::string record = "record " + std::to_string(i);
            if (write(fd, record.data(), record.size()) != static_cast<ssize_t>(record.size())) {
                break;
            }
        }
        close(fd);
        written = true;
    });
    int reader = Open("qxev", O_RDONLY);
    ASSERT_GE(reader, 0);
    for (int i = 0; i < kRecords; ++i) {
        ASSERT_EQ("record " + std::to_string(i), ReadRecord(reader));
    }
    writer.join();
    EXPECT_TRUE(written);
    EXPECT_FALSE(Readable(reader, 0));
    close(reader);
}

TEST_F(DevSimTest, InjectCommandWritesOneRecordPerArgumentOrLine) {
    std::string program = std::string(ORVANE_BINARY_DIR) + "/orvane-devsim";
    std::string folder = devsim.Path("");
    std::string command = "printf 'line one\\nline two\\n' | " + program + " inject " + folder + " qxev 'arg one' - 'arg two'";
    ASSERT_EQ(0, system(command.c_str()));
    int reader = Open("qxev", O_RDONLY);
    for (const char* expected : {"arg one", "line one", "line two", "arg two"}) {
        EXPECT_EQ(expected, ReadRecord(reader));
    }
    close(reader);
    EXPECT_NE(0, system((program + " inject " + folder + " nosuchnode rec 2>/dev/null").c_str()));
}

TEST(DevSimMountTest, UnmountableFolderIsReportedInOneLine) {
    std::string command = std::string(ORVANE_BINARY_DIR) + "/orvane-devsim /nonexistent/orvane-devsim 2>&1";
    FILE* output = popen(command.c_str(), "r");
    ASSERT_NE(nullptr, output);
    std::string text;
    char buffer[256];
    while (fgets(buffer, sizeof(buffer), output) != nullptr) {
        text += buffer;
    }
    int status = pclose(output);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) != 0);
    EXPECT_EQ(0u, text.find("orvane-devsim: FUSE cannot be mounted at /nonexistent/orvane-devsim: ")) << text;
    EXPECT_EQ(text.size() - 1, text.find('\n')) << text;
}

}  // namespace
}  // namespace Orvane
}  // namespace android
