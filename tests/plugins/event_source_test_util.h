#ifndef ORVANE_TESTS_PLUGINS_EVENT_SOURCE_TEST_UTIL_H
#define ORVANE_TESTS_PLUGINS_EVENT_SOURCE_TEST_UTIL_H

// Helpers for the tests of the kernel event sources: a plugin that records what reaches it, a
// FIFO standing in for a device node and a runner for a source's blocking loop.

#include <pthread.h>
#include <signal.h>
#include <sys/stat.h>

#include <atomic>
#include <thread>

#include <android-base/file.h>
#include <android-base/unique_fd.h>
#include <utils/Mutex.h>

#include "platform/pipeline.h"
#include "platform/plugin.h"
#include "tests/common/fake_plugin_context.h"
#include "tests/common/log_capture.h"
#include "tests/plugins/devsim_process.h"

namespace android::Orvane {

// The first step of the test pipeline: keeps every event, in arrival order.
class RecordingPlugin : public Plugin {
public:
    EVENT_RET OnEvent(sp<Event>& event) override {
        Mutex::Autolock guard(lock_);
        events_.push_back(event);
        return 0;
    }
    std::vector<sp<Event>> Events() const {
        Mutex::Autolock guard(lock_);
        return events_;
    }
    size_t Count() const { return Events().size(); }

private:
    mutable Mutex lock_;
    std::vector<sp<Event>> events_ GUARDED_BY(lock_);
};

// Connects a source to a pipeline holding only a new recorder; with a context the pipeline
// counts into its statistics.
inline sp<RecordingPlugin> AttachRecorder(const sp<EventSource>& source, PluginContext* context = nullptr) {
    sp<RecordingPlugin> recorder = new RecordingPlugin();
    recorder->SetPluginContext(context);
    source->AddPipeline("dftFaultEvent", new Pipeline("dftFaultEvent", {recorder}));
    return recorder;
}

// A FIFO standing in for a device node: written in packet mode, one write is one read, and a
// write longer than 4096 bytes arrives as several reads of at most 4096 bytes.
struct PacketFifo {
    PacketFifo() { mkfifo(path.c_str(), 0600); }
    // The first write opens the writer end, waiting for a reader; O_DIRECT is refused at open.
    bool Write(const std::string& record) {
        if (!writer.ok()) {
            writer.reset(open(path.c_str(), O_WRONLY | O_CLOEXEC));
            fcntl(writer.get(), F_SETFL, fcntl(writer.get(), F_GETFL) | O_DIRECT);
        }
        return write(writer.get(), record.data(), record.size()) == static_cast<ssize_t>(record.size());
    }

    TemporaryDir folder;
    const std::string path = std::string(folder.path) + "/qxev";
    android::base::unique_fd writer;
};

// Runs a source's StartEventSource on a thread of its own, as the platform does. The sources
// look at their stop flag only when a blocking call fails, so stopping interrupts the thread
// with a signal (installed without SA_RESTART) until it has returned.
class SourceRunner {
public:
    explicit SourceRunner(sp<EventSource> source) : source_(source) {
        struct sigaction action = {};
        action.sa_handler = [](int) {};
        sigaction(SIGUSR1, &action, nullptr);
        thread_ = std::thread([this] {
            this->source_->StartEventSource();
            finished_ = true;
        });
    }
    ~SourceRunner() { Stop(); }

    bool Finished() const { return finished_; }

    // Unloads the source and knocks it out of its blocking call; true when it returned.
    bool Stop() {
        if (!thread_.joinable()) {
            return finished_;
        }
        source_->OnUnload();
        bool done = WaitUntil([this] {
            pthread_kill(thread_.native_handle(), SIGUSR1);
            return WaitUntil([this] { return finished_.load(); }, std::chrono::milliseconds(20));
        });
        done ? thread_.join() : thread_.detach();  // still blocked: leaking it beats hanging the binary
        return done;
    }

private:
    sp<EventSource> source_;
    std::atomic<bool> finished_{false};
    std::thread thread_;
};

}  // namespace android::Orvane

#endif  // ORVANE_TESTS_PLUGINS_EVENT_SOURCE_TEST_UTIL_H
