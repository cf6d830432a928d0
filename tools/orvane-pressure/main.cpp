// orvane-pressure: creates real CPU, memory or I/O pressure on this machine for a bounded time,
// so that the kernel's pressure stall triggers fire for a demonstration or a test, and tells
// whether such triggers can be armed here at all.
//
//   cpu     two spinning threads per online CPU at the lowest priority: every CPU always has
//           a runnable task waiting, while any other work still goes first.
//   memory  thrashes a file-backed working set: asks the kernel to reclaim its pages
//           (MADV_PAGEOUT) and touches them again, over and over. Every touch refaults
//           recently evicted working set, the memory stall of a phone short of memory, without
//           having to fill this machine's memory first.
//   io      writes 1 MiB blocks and waits for each to reach the disk (fdatasync).
//   probe   arms one trigger on each pressure file and says which could be armed.
#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <string>
#include <thread>
#include <vector>

#ifndef MADV_PAGEOUT
#define MADV_PAGEOUT 21
#endif

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kDefaultSeconds = 10;
constexpr int kMaxSeconds = 300;
constexpr size_t kDefaultMemoryMib = 256;
constexpr size_t kMaxMemoryMib = 4096;
constexpr size_t kMib = 1024 * 1024;
constexpr size_t kIoBlock = kMib;
constexpr size_t kIoSpan = 64 * kMib;
// The trigger the probe arms: a window of 2 s, which kernels accept without CAP_SYS_RESOURCE.
constexpr char kProbeTrigger[] = "some 1000000 2000000";
const char* const kResources[] = {"cpu", "memory", "io"};

int Usage() {
    fprintf(stderr,
            "usage: orvane-pressure cpu|memory|io [SECONDS] [--mib N] [--dir DIR]\n"
            "       orvane-pressure probe\n"
            "  SECONDS  how long to create pressure (default %d, at most %d)\n"
            "  --mib N  working set of the memory mode in MiB (default %zu, at most %zu)\n"
            "  --dir D  folder of the memory and io modes' scratch file, on a disk, not tmpfs\n"
            "           (default $TMPDIR or /var/tmp)\n",
            kDefaultSeconds, kMaxSeconds, kDefaultMemoryMib, kMaxMemoryMib);
    return 2;
}

// The total stall time of "some" in the resource's pressure file, in microseconds; -1 without.
long long SomeTotalUs(const char* resource) {
    std::string path = std::string("/proc/pressure/") + resource;
    FILE* file = fopen(path.c_str(), "re");
    if (file == nullptr) {
        return -1;
    }
    double avg = 0;
    long long total = -1;
    if (fscanf(file, "some avg10=%lf avg60=%lf avg300=%lf total=%lld", &avg, &avg, &avg, &total) != 4) {
        total = -1;
    }
    fclose(file);
    return total;
}

// A scratch file that is gone from the folder as soon as it is open.
int ScratchFile(const std::string& dir) {
    std::string path = dir + "/orvane-pressure-XXXXXX";
    int fd = mkostemp(&path[0], O_CLOEXEC);
    if (fd < 0) {
        fprintf(stderr, "orvane-pressure: cannot create a file in %s: %s\n", dir.c_str(), strerror(errno));
        return -1;
    }
    unlink(path.c_str());
    return fd;
}

int RunCpu(Clock::time_point deadline) {
    unsigned cpus = std::max(1u, std::thread::hardware_concurrency());
    std::vector<std::thread> spinners;
    std::atomic<unsigned long> spins{0};
    for (unsigned i = 0; i < 2 * cpus; ++i) {
        spinners.emplace_back([deadline, &spins] {
            setpriority(PRIO_PROCESS, static_cast<id_t>(syscall(SYS_gettid)), 19);
            unsigned long local = 0;
            while (Clock::now() < deadline) {
                for (int k = 0; k < 100000; ++k) {
                    local = local * 31 + 7;
                }
            }
            spins += local & 1;
        });
    }
    for (std::thread& spinner : spinners) {
        spinner.join();
    }
    printf("orvane-pressure: %u spinning threads on %u CPUs\n", 2 * cpus, cpus);
    return 0;
}

int RunMemory(Clock::time_point deadline, size_t mib, const std::string& dir) {
    int fd = ScratchFile(dir);
    if (fd < 0) {
        return 1;
    }
    size_t size = mib * kMib;
    std::vector<char> block(kMib);
    for (size_t offset = 0; offset < size; offset += kMib) {
        for (size_t i = 0; i < kMib; i += 4096) {
            block[i] = static_cast<char>(offset / kMib + i / 4096 + 1);  // no page is a hole
        }
        if (pwrite(fd, block.data(), kMib, static_cast<off_t>(offset)) != static_cast<ssize_t>(kMib)) {
            fprintf(stderr, "orvane-pressure: cannot write the working set: %s\n", strerror(errno));
            close(fd);
            return 1;
        }
    }
    fdatasync(fd);  // clean pages are the ones reclaim can take
    void* map = mmap(nullptr, size, PROT_READ, MAP_SHARED, fd, 0);
    close(fd);
    if (map == MAP_FAILED) {
        fprintf(stderr, "orvane-pressure: mmap failed: %s\n", strerror(errno));
        return 1;
    }
    const volatile char* pages = static_cast<const volatile char*>(map);
    unsigned long rounds = 0;
    unsigned long sum = 0;
    int status = 0;
    while (Clock::now() < deadline) {
        if (madvise(map, size, MADV_PAGEOUT) != 0) {
            fprintf(stderr, "orvane-pressure: MADV_PAGEOUT refused (kernel before 5.4?): %s\n", strerror(errno));
            status = 1;
            break;
        }
        for (size_t offset = 0; offset < size; offset += 4096) {
            sum += static_cast<unsigned char>(pages[offset]);
        }
        ++rounds;
    }
    munmap(map, size);
    printf("orvane-pressure: %lu rounds over a %zu MiB working set (checksum %lu)\n", rounds, mib, sum & 0xff);
    return status;
}

int RunIo(Clock::time_point deadline, const std::string& dir) {
    int fd = ScratchFile(dir);
    if (fd < 0) {
        return 1;
    }
    std::vector<char> block(kIoBlock, 'x');
    unsigned long writes = 0;
    int status = 0;
    while (Clock::now() < deadline) {
        block[writes % kIoBlock] = static_cast<char>(writes);
        off_t offset = static_cast<off_t>((writes * kIoBlock) % kIoSpan);
        if (pwrite(fd, block.data(), kIoBlock, offset) != static_cast<ssize_t>(kIoBlock) || fdatasync(fd) != 0) {
            fprintf(stderr, "orvane-pressure: write or fdatasync failed: %s\n", strerror(errno));
            status = 1;
            break;
        }
        ++writes;
    }
    close(fd);
    printf("orvane-pressure: %lu synchronous writes of 1 MiB\n", writes);
    return status;
}

int Probe() {
    int armed = 0;
    for (const char* resource : kResources) {
        std::string path = std::string("/proc/pressure/") + resource;
        int fd = open(path.c_str(), O_RDWR | O_NONBLOCK | O_CLOEXEC);
        bool ok = fd >= 0 &&
                  write(fd, kProbeTrigger, sizeof(kProbeTrigger)) == static_cast<ssize_t>(sizeof(kProbeTrigger));
        int error = errno;
        if (fd >= 0) {
            close(fd);
        }
        if (ok) {
            ++armed;
            printf("%s: trigger \"%s\" can be armed\n", resource, kProbeTrigger);
        } else {
            printf("%s: %s \"%s\": %s\n", resource, path.c_str(), kProbeTrigger, strerror(error));
        }
    }
    return armed == 3 ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc < 2) {
        return Usage();
    }
    std::string mode = argv[1];
    if (mode == "probe") {
        return Probe();
    }
    int seconds = kDefaultSeconds;
    size_t mib = kDefaultMemoryMib;
    const char* tmp = getenv("TMPDIR");
    std::string dir = tmp != nullptr && *tmp != '\0' ? tmp : "/var/tmp";
    for (int i = 2; i < argc; ++i) {
        std::string arg = argv[i];
        if (arg == "--mib" && i + 1 < argc) {
            mib = strtoul(argv[++i], nullptr, 10);
        } else if (arg == "--dir" && i + 1 < argc) {
            dir = argv[++i];
        } else if (i == 2 && !arg.empty() && arg.find_first_not_of("0123456789") == std::string::npos) {
            seconds = atoi(arg.c_str());
        } else {
            return Usage();
        }
    }
    if (seconds < 1 || seconds > kMaxSeconds || mib < 1 || mib > kMaxMemoryMib) {
        return Usage();
    }
    const char* resource = mode == "cpu" ? "cpu" : mode == "memory" ? "memory" : mode == "io" ? "io" : nullptr;
    if (resource == nullptr) {
        return Usage();
    }
    // Bounded whatever happens: a write stuck on a dying disk still ends with the alarm.
    alarm(static_cast<unsigned>(seconds + 30));
    Clock::time_point deadline = Clock::now() + std::chrono::seconds(seconds);
    long long before = SomeTotalUs(resource);
    int status = mode == "cpu"      ? RunCpu(deadline)
                 : mode == "memory" ? RunMemory(deadline, mib, dir)
                                    : RunIo(deadline, dir);
    long long after = SomeTotalUs(resource);
    if (before >= 0 && after >= 0) {
        printf("orvane-pressure: %s some stall grew by %lld us in %d s\n", resource, after - before, seconds);
    } else {
        printf("orvane-pressure: no /proc/pressure/%s to measure the stall\n", resource);
    }
    return status;
}
