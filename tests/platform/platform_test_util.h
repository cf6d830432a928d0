// Helpers of the platform tests that run plugins on loops.
#pragma once

#include <algorithm>
#include <future>
#include <thread>

#include <gtest/gtest.h>
#include <utils/Mutex.h>

#include "platform/event_loop.h"
#include "tests/common/log_capture.h"

namespace android::Orvane {

// What ran, in order, on which thread and when. Safe from any thread.
class Journal {
public:
    struct Record {
        std::string what;
        std::thread::id thread;
        std::chrono::steady_clock::time_point when;
    };
    void Add(const std::string& what) {
        Mutex::Autolock lock(mutex_);
        records_.push_back({what, std::this_thread::get_id(), std::chrono::steady_clock::now()});
    }
    std::vector<Record> Records() {
        Mutex::Autolock lock(mutex_);
        return records_;
    }
    std::vector<std::string> Entries() {
        std::vector<std::string> entries;
        for (const auto& record : Records())
            entries.push_back(record.what);
        return entries;
    }
    // The first record of `what`; one with an empty `what` when there is none.
    Record Find(const std::string& what) {
        auto records = Records();
        auto it = std::find_if(records.begin(), records.end(), [&](const Record& r) { return r.what == what; });
        return it == records.end() ? Record() : *it;
    }
    bool WaitFor(const std::string& what) {
        return WaitUntil([&] { return !Find(what).what.empty(); });
    }
    bool WaitForSize(size_t size) {
        return WaitUntil([&] { return Records().size() >= size; });
    }

private:
    Mutex mutex_;
    std::vector<Record> records_ GUARDED_BY(mutex_);
};

// Holds whoever waits at it until the test opens it.
class Gate {
public:
    void Open() { opened_.set_value(); }
    void Wait() { waiting_.wait(); }

private:
    std::promise<void> opened_;
    std::shared_future<void> waiting_ = opened_.get_future().share();
};

inline std::thread::id ThreadOfLoop(const sp<EventLoop>& loop) {
    std::promise<std::thread::id> id;
    loop->AddTask([&id] { id.set_value(std::this_thread::get_id()); }, 0, false);
    return id.get_future().get();
}

}  // namespace android::Orvane
