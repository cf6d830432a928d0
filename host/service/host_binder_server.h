#ifndef ORVANE_HOST_SERVICE_HOST_BINDER_SERVER_H
#define ORVANE_HOST_SERVICE_HOST_BINDER_SERVER_H

// The host's binder transport: binder objects served over Unix stream sockets.
//
// A request is a frame: 32-bit transaction code, 32-bit flags, 32-bit byte count, then the
// parcel's bytes; descriptors a parcel carries (the dump request's output) travel with the
// frame as SCM_RIGHTS. The reply is a 32-bit transport status, a 32-bit byte count and the
// reply parcel's bytes (none when the status is not OK). The caller's uid and pid come from
// SO_PEERCRED and are what IPCThreadState reports while the transaction runs.
#if !defined(__ANDROID__)

#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include <android-base/unique_fd.h>
#include <utils/Condition.h>
#include <utils/Mutex.h>
#include <utils/RefBase.h>

#include "host/service/host_binder.h"
#include "utils/daemon_stats.h"

namespace android {
namespace Orvane {

namespace HostBinderFrame {

constexpr size_t kRequestHeaderSize = 12;
constexpr size_t kReplyHeaderSize = 8;
constexpr size_t kMaxDataSize = 64 * 1024;
constexpr size_t kMaxDescriptors = 4;

struct RequestHeader {
    uint32_t code;
    uint32_t flags;
    uint32_t size;
};

enum class DecodeResult { kIncomplete, kComplete, kOversized, kMalformed };

// Looks at the bytes received so far on a connection: kComplete when a whole request is
// there (its bytes follow the header), kOversized for a byte count over kMaxDataSize,
// kMalformed for one that is not a multiple of 4 (parcels are made of 32-bit words).
DecodeResult DecodeRequest(const uint8_t* bytes, size_t length, RequestHeader* header);

}  // namespace HostBinderFrame

// Serves binder objects, one listening socket each.
// Threads: the pool threads and every thread inside JoinThreadPool take turns waiting on one
// epoll set. A connection is armed one-shot, so one thread at a time reads it, runs its
// transaction and writes the reply; a slow transaction holds only its own thread. The services,
// the connection table and each connection's busy mark and activity time are guarded by mutex_;
// a connection's bytes and descriptors belong to the thread serving it.
// Every rejection is counted in the statistics given at construction, under "service.host.".
class HostBinderServer : public RefBase {
public:
    struct Options {
        // Beyond this, a new connection pushes out the one idle for longest.
        size_t maxConnections = 64;
        // A connection that sends nothing for this long is closed, and so is one that does
        // not take its reply within it.
        int idleTimeoutMs = 5000;
    };

    explicit HostBinderServer(DaemonStats& stats);
    HostBinderServer(DaemonStats& stats, const Options& options);
    ~HostBinderServer() override;

    // Listens on socketPath with mode 0660. A socket left there by an earlier run is replaced;
    // anything else there (a symbolic link, a file, a folder) is left alone and refused. False
    // with an error line that says why.
    bool AddService(const std::string& socketPath, const sp<BBinder>& service);
    // Adds threads to the pool; may be called before or after AddService.
    void StartThreadPool(size_t threads);
    // Serves on the calling thread until Stop().
    void JoinThreadPool();
    // Ends every serving thread, closes every connection and removes the sockets.
    void Stop();

private:
    struct Connection;
    struct Service {
        std::string path;
        sp<BBinder> binder;
        android::base::unique_fd fd;
    };

    void ServeLoop();
    void Accept(size_t serviceIndex);
    void HandleConnection(uint64_t id);
    // False when the connection is to be closed.
    bool ReadAndServe(Connection& conn);
    bool Serve(Connection& conn, const HostBinderFrame::RequestHeader& header, const uint8_t* bytes);
    void CloseIdleConnections();
    bool EvictIdlestConnection() REQUIRES(mutex_);
    void CloseConnection(uint64_t id) REQUIRES(mutex_);

    const Options options_;
    const android::base::unique_fd epollFd_;
    const android::base::unique_fd wakeFd_;
    std::atomic<bool> stopping_{false};
    DaemonStats::Counter& badFrames_;
    DaemonStats::Counter& oversizedRequests_;
    DaemonStats::Counter& idleTimeouts_;
    DaemonStats::Counter& pushedOut_;
    DaemonStats::Counter& refusedConnections_;
    DaemonStats::Counter& repliesNotTaken_;

    Mutex mutex_;
    Condition loopsEnded_;
    std::vector<Service> services_ GUARDED_BY(mutex_);
    std::vector<std::thread> pool_ GUARDED_BY(mutex_);
    int runningLoops_ GUARDED_BY(mutex_) = 0;
    uint64_t nextId_ GUARDED_BY(mutex_) = 1;
    std::map<uint64_t, std::shared_ptr<Connection>> connections_ GUARDED_BY(mutex_);
};

// One client connection (orvanectl, tests). Not thread safe.
class HostBinderClient {
public:
    // False with errno set when nothing listens there.
    bool Connect(const std::string& socketPath);
    // The transport status of the reply, or DEAD_OBJECT when the connection failed.
    status_t Transact(uint32_t code, const Parcel& data, Parcel* reply, uint32_t flags = 0);

private:
    android::base::unique_fd fd_;
};

}  // namespace Orvane
}  // namespace android

#endif  // !__ANDROID__
#endif  // ORVANE_HOST_SERVICE_HOST_BINDER_SERVER_H
