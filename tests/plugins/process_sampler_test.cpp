#include "plugins/process_sampler.h"

#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include <android-base/file.h>
#include <gtest/gtest.h>

namespace android::Orvane {
namespace {

// Pids above the kernel's limit (4194304), so that no real process answers for them.
constexpr int kPid = 5000000;

class ProcessSamplerTest : public ::testing::Test {
protected:
    std::string Folder(int pid) { return std::string(root_.path) + "/" + std::to_string(pid); }
    void Write(int pid, const std::string& file, const std::string& content) {
        std::filesystem::create_directories(Folder(pid));
        std::ofstream(Folder(pid) + "/" + file, std::ios::binary | std::ios::trunc) << content;
    }
    void Stat(int pid, const std::string& name, uint64_t utime, uint64_t stime) {
        Write(pid, "stat",
              std::to_string(pid) + " (" + name + ") S 1 1 1 0 -1 4194304 10 0 0 0 " + std::to_string(utime) + " " +
                      std::to_string(stime) + " 0 0 20 0 1 0 100 2990080 415 18446744073709551615 0 0\n");
    }
    std::vector<int> Pids(const std::vector<TopProcess>& top) {
        std::vector<int> pids;
        for (const TopProcess& process : top) {
            pids.push_back(process.pid - kPid);
        }
        return pids;
    }

    TemporaryDir root_;
    ProcessSampler sampler_{std::string(root_.path) + "/"};
    const uint64_t msPerTick_ = 1000 / static_cast<uint64_t>(sysconf(_SC_CLK_TCK));
};

// CPU time ranks by what grew between the two samples; equal growth keeps pid order; processes
// that are new, reused their pid, ended or have damaged rows never make the list.
TEST_F(ProcessSamplerTest, GrowthRankingSkipsWhatCannotBeMeasured) {
    Stat(kPid + 1, "one", 100, 0);
    Stat(kPid + 2, "two", 10, 10);
    Stat(kPid + 3, "we) ird (x", 0, 0);
    Stat(kPid + 4, "reused", 500, 500);
    Stat(kPid + 6, "ends", 1, 1);
    Stat(kPid + 7, "idle", 9, 9);
    Write(kPid + 8, "stat", "garbage");
    std::filesystem::create_directories(std::string(root_.path) + "/self");
    std::filesystem::create_directories(std::string(root_.path) + "/12a");
    std::vector<ProcessValue> before = sampler_.Sample(PerfResource::kCpu);
    ASSERT_EQ(6u, before.size());

    Stat(kPid + 1, "one", 120, 30);        // +50
    Stat(kPid + 2, "two", 40, 30);         // +50, a tie with the one before
    Stat(kPid + 3, "we) ird (x", 70, 10);  // +80
    Stat(kPid + 4, "reused", 1, 0);        // went down: another process took the pid
    Stat(kPid + 5, "new", 900, 900);       // not in the first sample
    std::filesystem::remove_all(Folder(kPid + 6));
    std::vector<ProcessValue> after = sampler_.Sample(PerfResource::kCpu);

    std::vector<TopProcess> top = sampler_.Top(PerfResource::kCpu, before, after, 10);
    EXPECT_EQ((std::vector<int>{3, 1, 2}), Pids(top));
    ASSERT_EQ(3u, top.size());
    EXPECT_EQ(80 * msPerTick_, top[0].value);
    EXPECT_EQ(50 * msPerTick_, top[1].value);
    // No command line: the command name, bracketed like a kernel thread's.
    EXPECT_EQ("[we) ird (x]", top[0].name);
    EXPECT_EQ(getuid(), top[0].uid);
    EXPECT_EQ((std::vector<int>{3, 1}), Pids(sampler_.Top(PerfResource::kCpu, before, after, 2)));
    EXPECT_TRUE(sampler_.Top(PerfResource::kCpu, before, after, 0).empty());
    // A process that ends between the sample and the list gives its place to the next one.
    std::filesystem::remove_all(Folder(kPid + 3));
    EXPECT_EQ((std::vector<int>{1, 2}), Pids(sampler_.Top(PerfResource::kCpu, before, after, 2)));
}

// Memory ranks by the level at the end; I/O by growth, where the row can be read at all.
TEST_F(ProcessSamplerTest, LevelsAndIoAndNamesChosenByProcesses) {
    Write(kPid + 1, "statm", "1152 544 413 193 0 171 0\n");
    Write(kPid + 2, "statm", "1152 544 413 193 0 171 0\n");
    Write(kPid + 3, "statm", "99999 9000 0 0 0 0 0\n");
    Write(kPid + 4, "statm", "0 0 0 0 0 0 0\n");  // a kernel thread holds no memory
    Write(kPid + 5, "statm", "1 x\n");
    Stat(kPid + 3, std::string("bad\x01name\xff"), 0, 0);
    std::vector<ProcessValue> memory = sampler_.Sample(PerfResource::kMemory);
    std::vector<TopProcess> top = sampler_.Top(PerfResource::kMemory, {}, memory, 5);
    EXPECT_EQ((std::vector<int>{3, 1, 2}), Pids(top));
    ASSERT_FALSE(top.empty());
    EXPECT_EQ(9000 * (static_cast<uint64_t>(sysconf(_SC_PAGESIZE)) / 1024), top[0].value);
    EXPECT_EQ("[bad?name?]", top[0].name);  // only printable text goes into an event

    Write(kPid + 1, "io", "rchar: 1\nwchar: 1\nsyscr: 1\nsyscw: 1\nread_bytes: 4096\nwrite_bytes: 0\n");
    Write(kPid + 2, "io", "rchar: 1\nwchar: 1\nsyscr: 1\nsyscw: 1\nread_bytes: 0\nwrite_bytes: 0\n");
    std::vector<ProcessValue> before = sampler_.Sample(PerfResource::kIo);
    Write(kPid + 1, "io", "rchar: 1\nwchar: 1\nsyscr: 1\nsyscw: 1\nread_bytes: 8192\nwrite_bytes: 100\n");
    Write(kPid + 2, "io", "rchar: 1\nwchar: 1\nsyscr: 1\nsyscw: 1\nread_bytes: 0\nwrite_bytes: 1048576\n");
    ASSERT_EQ(0, chmod((Folder(kPid + 2) + "/io").c_str(), 0));  // unreadable unless privileged
    std::vector<ProcessValue> after = sampler_.Sample(PerfResource::kIo);
    top = sampler_.Top(PerfResource::kIo, before, after, 5);
    if (access((Folder(kPid + 2) + "/io").c_str(), R_OK) == 0) {  // root reads it anyway
        ASSERT_EQ((std::vector<int>{2, 1}), Pids(top));
        EXPECT_EQ(1048576u, top[0].value);
    } else {
        ASSERT_EQ((std::vector<int>{1}), Pids(top));
    }
    EXPECT_EQ(4196u, top.back().value);

    EXPECT_TRUE(ProcessSampler("/nonexistent/").Sample(PerfResource::kCpu).empty());
}

// The real /proc: this process is found with its uid and the name its command line gives.
TEST_F(ProcessSamplerTest, RealProcFindsThisProcess) {
    ProcessSampler real;
    std::vector<ProcessValue> memory = real.Sample(PerfResource::kMemory);
    std::vector<TopProcess> top = real.Top(PerfResource::kMemory, {}, memory, memory.size());
    std::string cmdline;
    ASSERT_TRUE(android::base::ReadFileToString("/proc/self/cmdline", &cmdline));
    auto self = std::find_if(top.begin(), top.end(), [](const TopProcess& p) { return p.pid == getpid(); });
    ASSERT_NE(top.end(), self);
    EXPECT_EQ(getuid(), self->uid);
    EXPECT_EQ(std::string(cmdline.c_str()).substr(0, 127), self->name);
    EXPECT_GT(self->value, 0u);
    for (size_t i = 1; i < top.size(); ++i) {
        EXPECT_GE(top[i - 1].value, top[i].value);
    }
}

}  // namespace
}  // namespace android::Orvane
