// The pressure tool as a process: each mode ends by itself and makes the kernel count a stall of
// its resource; bad arguments are refused before anything runs.
#include <stdio.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include <gtest/gtest.h>

namespace {

const std::string kTool = std::string(ORVANE_BINARY_DIR) + "/orvane-pressure";

// The tool's standard output; `status` gets its exit status.
std::string RunTool(const std::string& args, int& status) {
    FILE* pipe = popen((kTool + " " + args + " 2>/dev/null").c_str(), "r");
    std::string out;
    char buffer[256];
    while (pipe != nullptr && fgets(buffer, sizeof(buffer), pipe) != nullptr) {
        out += buffer;
    }
    int raw = pipe != nullptr ? pclose(pipe) : -1;
    status = WIFEXITED(raw) ? WEXITSTATUS(raw) : -1;
    return out;
}

TEST(OrvanePressureTest, EachModeStallsItsResourceAndEnds) {
    bool psi = access("/proc/pressure/cpu", R_OK) == 0;
    for (const char* args : {"memory 2 --mib 64", "io 2", "cpu 2"}) {
        SCOPED_TRACE(args);
        int status = -1;
        std::string out = RunTool(args, status);
        ASSERT_EQ(0, status) << out;
        if (!psi) {
            EXPECT_NE(std::string::npos, out.find("no /proc/pressure/")) << out;
            continue;
        }
        long long grew = -1;
        size_t at = out.find("stall grew by ");
        ASSERT_NE(std::string::npos, at) << out;
        ASSERT_EQ(1, sscanf(out.c_str() + at, "stall grew by %lld us", &grew)) << out;
        EXPECT_GT(grew, 0) << out;
    }
    for (const char* args : {"", "cpu 0", "cpu 301", "cpu 5 extra", "memory 1 --mib 0", "disk 1", "cpu -1"}) {
        int status = -1;
        RunTool(args, status);
        EXPECT_EQ(2, status) << args;
    }
}

}  // namespace
