// Helpers of the platform tests that run plugins on loops. Include from one file per program:
// it defines the ThreadSanitizer suppressions of that program.
#ifndef ORVANE_TESTS_PLATFORM_PLATFORM_TEST_UTIL_H
#define ORVANE_TESTS_PLATFORM_PLATFORM_TEST_UTIL_H

#include <chrono>
#include <condition_variable>
#include <future>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/event_loop.h"
#include "tests/common/log_capture.h"

namespace android {
namespace Orvane {

// What ran, in order, on which thread and when. Safe from any thread.
class Journal {
public:
    struct Record {
        std::string what;
        std::thread::id thread;
        std::chrono::steady_clock::time_point when;
    };

    void Add(const std::string& what) {
        std::lock_guard<std::mutex> lock(mutex_);
        records_.push_back({what, std::this_thread::get_id(), std::chrono::steady_clock::now()});
    }
    void Clear() {
        std::lock_guard<std::mutex> lock(mutex_);
        records_.clear();
    }
    std::vector<Record> Records() {
        std::lock_guard<std::mutex> lock(mutex_);
        return records_;
    }
    std::vector<std::string> Entries() {
        std::vector<std::string> entries;
        for (const auto& record : Records()) {
            entries.push_back(record.what);
        }
        return entries;
    }
    size_t Count(const std::string& what) {
        size_t count = 0;
        for (const auto& record : Records()) {
            count += record.what == what;
        }
        return count;
    }
    // The first record of `what`; false when there is none.
    bool Find(const std::string& what, Record& out) {
        for (const auto& record : Records()) {
            if (record.what == what) {
                out = record;
                return true;
            }
        }
        return false;
    }
    std::thread::id ThreadOf(const std::string& what) {
        Record record;
        return Find(what, record) ? record.thread : std::thread::id();
    }
    bool WaitFor(const std::string& what) {
        return WaitUntil([&] { return Count(what) > 0; });
    }
    bool WaitForSize(size_t size) {
        return WaitUntil([&] { return Records().size() >= size; });
    }

private:
    std::mutex mutex_;
    std::vector<Record> records_;
};

// Holds whoever waits at it until the test opens it.
class Gate {
public:
    void Open() {
        std::lock_guard<std::mutex> lock(mutex_);
        open_ = true;
        cv_.notify_all();
    }
    void Wait() {
        std::unique_lock<std::mutex> lock(mutex_);
        cv_.wait(lock, [this] { return open_; });
    }

private:
    std::mutex mutex_;
    std::condition_variable cv_;
    bool open_ = false;
};

inline std::thread::id ThreadOfLoop(const sp<EventLoop>& loop) {
    std::promise<std::thread::id> id;
    loop->AddTask([&id] { id.set_value(std::this_thread::get_id()); }, 0, false);
    return id.get_future().get();
}

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_TESTS_PLATFORM_PLATFORM_TEST_UTIL_H
