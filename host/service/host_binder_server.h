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
#include <condition_variable>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <utils/RefBase.h>

#include "host/service/host_binder.h"

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

enum class DecodeResult { kIncomplete, kComplete, kMalformed };

// Looks at the bytes received so far on a connection: kComplete when a whole request is
// there (its bytes follow the header), kMalformed for a byte count over kMaxDataSize or not a
// multiple of 4 (parcels are made of 32-bit words).
DecodeResult DecodeRequest(const uint8_t* bytes, size_t length, RequestHeader* header);

}  // namespace HostBinderFrame

// Serves binder objects, one listening socket each.
// Threads: the pool threads and every thread inside JoinThreadPool take turns waiting on one
// epoll set. A connection is armed one-shot, so one thread at a time reads it, runs its
// transaction and writes the reply; a slow transaction holds only its own thread. The
// connection table is guarded by mutex_; everything else is set up before the pool starts.
class HostBinderServer : public RefBase {
public:
    struct Options {
        // Beyond this, a new connection pushes out the one idle for longest.
        size_t maxConnections = 64;
        // A connection that sends nothing for this long is closed, and so is one that does
        // not take its reply within it.
        int idleTimeoutMs = 5000;
    };

    HostBinderServer();
    explicit HostBinderServer(const Options& options);
    ~HostBinderServer() override;

    // Listens on socketPath (mode 0660, a stale socket replaced). False with an error line.
    bool AddService(const std::string& socketPath, const sp<BBinder>& service);
    // Adds threads to the pool; may be called before or after AddService.
    void StartThreadPool(size_t threads);
    // Serves on the calling thread until Stop().
    void JoinThreadPool();
    // Ends every serving thread, closes every connection and removes the sockets.
    void Stop();

private:
    struct Connection;

    void ServeLoop();
    void Accept(size_t serviceIndex);
    void HandleConnection(uint64_t id);
    // False when the connection is to be closed.
    bool ReadAndServe(Connection& conn);
    bool Serve(Connection& conn, const HostBinderFrame::RequestHeader& header, const uint8_t* bytes);
    void CloseIdleConnections();
    bool EvictIdlestConnection();
    void CloseConnection(uint64_t id);

    struct Service {
        int fd;
        std::string path;
        sp<BBinder> binder;
    };

    const Options options_;
    int epollFd_;
    int wakeFd_;
    std::vector<Service> services_;
    std::vector<std::thread> pool_;
    std::atomic<bool> stopping_{false};

    std::mutex mutex_;
    std::condition_variable loopsEnded_;
    int runningLoops_ = 0;
    uint64_t nextId_ = 1;
    std::map<uint64_t, std::shared_ptr<Connection>> connections_;
};

// One client connection (orvanectl, tests). Not thread safe.
class HostBinderClient {
public:
    HostBinderClient() = default;
    ~HostBinderClient();
    HostBinderClient(const HostBinderClient&) = delete;
    HostBinderClient& operator=(const HostBinderClient&) = delete;

    // False with errno set when nothing listens there.
    bool Connect(const std::string& socketPath);
    // The transport status of the reply, or DEAD_OBJECT when the connection failed.
    status_t Transact(uint32_t code, const Parcel& data, Parcel* reply, uint32_t flags = 0);

private:
    int fd_ = -1;
};

}  // namespace Orvane
}  // namespace android

#endif  // !__ANDROID__
#endif  // ORVANE_HOST_SERVICE_HOST_BINDER_SERVER_H
