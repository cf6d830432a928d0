#include "host/service/host_binder_server.h"

#if !defined(__ANDROID__)

#include <fcntl.h>
#include <poll.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <iterator>

#include <android-base/cmsg.h>

#include "utils/orvane_log.h"

namespace android {
namespace Orvane {

namespace HostBinderFrame {

DecodeResult DecodeRequest(const uint8_t* bytes, size_t length, RequestHeader* header) {
    if (length < kRequestHeaderSize) {
        return DecodeResult::kIncomplete;
    }
    memcpy(header, bytes, kRequestHeaderSize);
    if (header->size > kMaxDataSize) {
        return DecodeResult::kOversized;
    }
    if (header->size % 4 != 0) {
        return DecodeResult::kMalformed;
    }
    return length - kRequestHeaderSize >= header->size ? DecodeResult::kComplete : DecodeResult::kIncomplete;
}

}  // namespace HostBinderFrame

namespace {

using android::base::ReceiveFileDescriptorVector;
using android::base::SendFileDescriptorVector;
using android::base::unique_fd;
using Clock = std::chrono::steady_clock;
using HostBinderFrame::DecodeResult;

constexpr uint64_t kWakeId = 0;
constexpr uint64_t kServiceTag = 1ULL << 63;
constexpr int kListenBacklog = 128;
constexpr mode_t kSocketMode = 0660;

// Writes everything or gives up after timeoutMs without progress.
bool WriteAll(int fd, const uint8_t* bytes, size_t length, int timeoutMs) {
    while (length > 0) {
        ssize_t n = send(fd, bytes, length, MSG_NOSIGNAL | MSG_DONTWAIT);
        if (n > 0) {
            bytes += n;
            length -= static_cast<size_t>(n);
            continue;
        }
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0 && errno != EAGAIN && errno != EWOULDBLOCK) {
            return false;
        }
        struct pollfd out = {fd, POLLOUT, 0};
        if (poll(&out, 1, timeoutMs) <= 0) {
            return false;
        }
    }
    return true;
}

// Makes room for a new socket at path: nothing there, or a socket left by an earlier run, which
// is removed. Anything else may belong to someone else and is neither followed nor removed.
bool ClearSocketPath(const std::string& path) {
    struct stat st = {};
    if (lstat(path.c_str(), &st) != 0) {
        if (errno == ENOENT) {
            return true;
        }
        OLOG_AS(ANDROID_LOG_ERROR, "AddService", "%s cannot check %s: %s", path.c_str(), strerror(errno));
        return false;
    }
    if (!S_ISSOCK(st.st_mode)) {
        OLOG_AS(ANDROID_LOG_ERROR, "AddService", "%s %s is not a socket, refusing to replace it", path.c_str());
        return false;
    }
    if (unlink(path.c_str()) != 0) {
        OLOG_AS(ANDROID_LOG_ERROR, "AddService", "%s cannot remove the old socket %s: %s", path.c_str(),
                strerror(errno));
        return false;
    }
    return true;
}

}  // namespace

struct HostBinderServer::Connection {
    unique_fd fd;
    sp<BBinder> binder;
    uid_t uid = 0;
    pid_t pid = 0;
    // Guarded by the server's mutex_.
    bool busy = false;
    Clock::time_point lastActive;
    // Only for the thread serving the connection: the bytes of the requests being read, and the
    // descriptors that came with them.
    std::vector<uint8_t> buffer;
    std::vector<unique_fd> fds;
};

HostBinderServer::HostBinderServer(DaemonStats& stats) : HostBinderServer(stats, Options()) {}

HostBinderServer::HostBinderServer(DaemonStats& stats, const Options& options)
    : options_(options),
      epollFd_(epoll_create1(EPOLL_CLOEXEC)),
      wakeFd_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)),
      badFrames_(stats.Get("service.host.bad_frames")),
      oversizedRequests_(stats.Get("service.host.oversized_requests")),
      idleTimeouts_(stats.Get("service.host.idle_timeouts")),
      pushedOut_(stats.Get("service.host.pushed_out")),
      refusedConnections_(stats.Get("service.host.refused_connections")),
      repliesNotTaken_(stats.Get("service.host.replies_not_taken")) {
    if (!epollFd_.ok() || !wakeFd_.ok()) {
        OLOGE("%s epoll or eventfd failed: %s", strerror(errno));
        return;
    }
    struct epoll_event ev = {};
    ev.events = EPOLLIN;
    ev.data.u64 = kWakeId;
    epoll_ctl(epollFd_.get(), EPOLL_CTL_ADD, wakeFd_.get(), &ev);
}

HostBinderServer::~HostBinderServer() {
    Stop();
}

bool HostBinderServer::AddService(const std::string& socketPath, const sp<BBinder>& service) {
    struct sockaddr_un addr = {};
    addr.sun_family = AF_UNIX;
    if (!epollFd_.ok() || service == nullptr) {
        OLOGE("%s cannot serve on %s", socketPath.c_str());
        return false;
    }
    if (socketPath.size() >= sizeof(addr.sun_path)) {
        OLOGE("%s socket path %s is longer than %zu bytes", socketPath.c_str(), sizeof(addr.sun_path) - 1);
        return false;
    }
    if (!ClearSocketPath(socketPath)) {
        return false;
    }
    memcpy(addr.sun_path, socketPath.c_str(), socketPath.size());
    unique_fd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
    // The mode given to the socket before bind is the file's from its first moment (less the
    // umask), so no caller outside the group can connect in between; the chmod after undoes a
    // narrower umask without following a link that may have taken the socket's place.
    if (!fd.ok() || fchmod(fd.get(), kSocketMode) != 0 ||
        bind(fd.get(), reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) != 0) {
        OLOGE("%s listen on %s failed: %s", socketPath.c_str(), strerror(errno));
        return false;
    }
    if (fchmodat(AT_FDCWD, socketPath.c_str(), kSocketMode, AT_SYMLINK_NOFOLLOW) != 0 ||
        listen(fd.get(), kListenBacklog) != 0) {
        OLOGE("%s listen on %s failed: %s", socketPath.c_str(), strerror(errno));
        unlink(socketPath.c_str());
        return false;
    }
    Mutex::Autolock lock(mutex_);
    // In the table before epoll can report it, as serving threads may already be waiting.
    services_.push_back({socketPath, service, std::move(fd)});
    struct epoll_event ev = {};
    ev.events = EPOLLIN;
    ev.data.u64 = kServiceTag | (services_.size() - 1);
    if (epoll_ctl(epollFd_.get(), EPOLL_CTL_ADD, services_.back().fd.get(), &ev) != 0) {
        OLOGE("%s epoll_ctl failed: %s", strerror(errno));
        unlink(socketPath.c_str());
        services_.pop_back();
        return false;
    }
    return true;
}

void HostBinderServer::StartThreadPool(size_t threads) {
    Mutex::Autolock lock(mutex_);
    for (size_t i = 0; i < threads; ++i) {
        ++runningLoops_;
        pool_.emplace_back([this] {
            pthread_setname_np(pthread_self(), "binder_host");
            ServeLoop();
        });
    }
}

void HostBinderServer::JoinThreadPool() {
    {
        Mutex::Autolock lock(mutex_);
        ++runningLoops_;
    }
    ServeLoop();
}

void HostBinderServer::Stop() {
    if (stopping_.exchange(true)) {
        return;
    }
    if (wakeFd_.ok()) {
        uint64_t one = 1;
        // Left unread, so that the level-triggered event wakes every serving thread.
        (void)!write(wakeFd_.get(), &one, sizeof(one));
    }
    std::vector<std::thread> pool;
    {
        Mutex::Autolock lock(mutex_);
        pool.swap(pool_);
    }
    for (auto& thread : pool) {
        thread.join();
    }
    Mutex::Autolock lock(mutex_);
    while (runningLoops_ > 0) {
        loopsEnded_.wait(mutex_);
    }
    connections_.clear();
    for (const auto& service : services_) {
        unlink(service.path.c_str());
    }
    services_.clear();
}

void HostBinderServer::ServeLoop() {
    const int sweepMs = options_.idleTimeoutMs / 5 > 10 ? options_.idleTimeoutMs / 5 : 10;
    while (!stopping_) {
        struct epoll_event ev = {};
        int n = epoll_wait(epollFd_.get(), &ev, 1, sweepMs);
        if (n < 0 && errno != EINTR) {
            OLOGE("%s epoll_wait failed: %s", strerror(errno));
            break;
        }
        CloseIdleConnections();
        if (n <= 0 || ev.data.u64 == kWakeId) {
            continue;
        }
        if (ev.data.u64 & kServiceTag) {
            Accept(ev.data.u64 & ~kServiceTag);
        } else {
            HandleConnection(ev.data.u64);
        }
    }
    Mutex::Autolock lock(mutex_);
    if (--runningLoops_ == 0) {
        loopsEnded_.broadcast();
    }
}

void HostBinderServer::Accept(size_t serviceIndex) {
    int listenFd;
    std::string path;
    auto conn = std::make_shared<Connection>();
    {
        Mutex::Autolock lock(mutex_);
        const Service& service = services_[serviceIndex];
        listenFd = service.fd.get();
        path = service.path;
        conn->binder = service.binder;
    }
    conn->fd.reset(accept4(listenFd, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
    if (!conn->fd.ok()) {
        return;  // another thread took it
    }
    conn->lastActive = Clock::now();
    struct ucred cred = {};
    socklen_t credLength = sizeof(cred);
    if (getsockopt(conn->fd.get(), SOL_SOCKET, SO_PEERCRED, &cred, &credLength) != 0) {
        OLOGW("%s no peer credentials on %s: %s", path.c_str(), strerror(errno));
        return;  // conn closes the socket
    }
    conn->uid = cred.uid;
    conn->pid = cred.pid;

    Mutex::Autolock lock(mutex_);
    if (connections_.size() >= options_.maxConnections && !EvictIdlestConnection()) {
        refusedConnections_.fetch_add(1, std::memory_order_relaxed);
        OLOGW_LIMITED("%s refuse pid %d uid %d: %zu connections busy", conn->pid, conn->uid, connections_.size());
        return;
    }
    uint64_t id = nextId_++;
    struct epoll_event ev = {};
    ev.events = EPOLLIN | EPOLLRDHUP | EPOLLONESHOT;
    ev.data.u64 = id;
    if (epoll_ctl(epollFd_.get(), EPOLL_CTL_ADD, conn->fd.get(), &ev) != 0) {
        OLOGW("%s epoll_ctl failed: %s", strerror(errno));
        return;
    }
    connections_[id] = conn;
}

void HostBinderServer::HandleConnection(uint64_t id) {
    std::shared_ptr<Connection> conn;
    {
        Mutex::Autolock lock(mutex_);
        auto it = connections_.find(id);
        if (it == connections_.end()) {
            return;  // closed meanwhile
        }
        conn = it->second;
        conn->busy = true;
    }
    bool keep = ReadAndServe(*conn);
    Mutex::Autolock lock(mutex_);
    conn->busy = false;
    conn->lastActive = Clock::now();
    if (!keep) {
        CloseConnection(id);
        return;
    }
    struct epoll_event ev = {};
    ev.events = EPOLLIN | EPOLLRDHUP | EPOLLONESHOT;
    ev.data.u64 = id;
    epoll_ctl(epollFd_.get(), EPOLL_CTL_MOD, conn->fd.get(), &ev);
}

bool HostBinderServer::ReadAndServe(Connection& conn) {
    uint8_t chunk[16 * 1024];
    std::vector<unique_fd> received;
    ssize_t n = ReceiveFileDescriptorVector(conn.fd, chunk, sizeof(chunk), HostBinderFrame::kMaxDescriptors, &received);
    if (n < 0 && errno == EMSGSIZE) {
        badFrames_.fetch_add(1, std::memory_order_relaxed);
        OLOGW_LIMITED("%s pid %d: more than %zu descriptors, closing", conn.pid, HostBinderFrame::kMaxDescriptors);
        return false;
    }
    if (n < 0) {
        if (errno == EAGAIN || errno == EWOULDBLOCK) {
            return true;
        }
        OLOGW_LIMITED("%s pid %d: read failed: %s", conn.pid, strerror(errno));
        return false;
    }
    std::move(received.begin(), received.end(), std::back_inserter(conn.fds));
    if (conn.fds.size() > HostBinderFrame::kMaxDescriptors) {
        badFrames_.fetch_add(1, std::memory_order_relaxed);
        OLOGW_LIMITED("%s pid %d: more than %zu descriptors, closing", conn.pid, HostBinderFrame::kMaxDescriptors);
        return false;
    }
    if (n == 0) {
        if (!conn.buffer.empty()) {
            badFrames_.fetch_add(1, std::memory_order_relaxed);
            OLOGW_LIMITED("%s pid %d: connection ended inside a frame (%zu bytes)", conn.pid, conn.buffer.size());
        }
        return false;
    }
    conn.buffer.insert(conn.buffer.end(), chunk, chunk + n);

    while (true) {
        HostBinderFrame::RequestHeader header = {};
        DecodeResult result = HostBinderFrame::DecodeRequest(conn.buffer.data(), conn.buffer.size(), &header);
        if (result == DecodeResult::kIncomplete) {
            return true;
        }
        if (result != DecodeResult::kComplete) {
            (result == DecodeResult::kOversized ? oversizedRequests_ : badFrames_)
                    .fetch_add(1, std::memory_order_relaxed);
            OLOGW_LIMITED("%s pid %d: malformed frame, code %u, %u bytes, closing", conn.pid, header.code, header.size);
            return false;
        }
        if (!Serve(conn, header, conn.buffer.data() + HostBinderFrame::kRequestHeaderSize)) {
            return false;
        }
        conn.buffer.erase(conn.buffer.begin(), conn.buffer.begin() + HostBinderFrame::kRequestHeaderSize + header.size);
    }
}

bool HostBinderServer::Serve(Connection& conn, const HostBinderFrame::RequestHeader& header, const uint8_t* bytes) {
    Parcel data;
    data.setData(bytes, header.size);
    data.adoptFileDescriptors(std::move(conn.fds));
    conn.fds.clear();
    Parcel reply;
    IPCThreadState::self()->setCallingIdentity(conn.uid, conn.pid);
    status_t status = conn.binder->transact(header.code, data, &reply, header.flags);
    IPCThreadState::self()->clearCallingIdentity();
    if (header.flags & IBinder::FLAG_ONEWAY) {
        return true;
    }
    uint32_t size = status == OK ? static_cast<uint32_t>(reply.dataSize()) : 0;
    std::vector<uint8_t> frame(HostBinderFrame::kReplyHeaderSize + size);
    int32_t wireStatus = status;
    memcpy(&frame[0], &wireStatus, sizeof(wireStatus));
    memcpy(&frame[4], &size, sizeof(size));
    if (size > 0) {
        memcpy(&frame[HostBinderFrame::kReplyHeaderSize], reply.data(), size);
    }
    if (!WriteAll(conn.fd.get(), frame.data(), frame.size(), options_.idleTimeoutMs)) {
        repliesNotTaken_.fetch_add(1, std::memory_order_relaxed);
        OLOGW_LIMITED("%s pid %d: reply to code %u not taken, closing", conn.pid, header.code);
        return false;
    }
    return true;
}

void HostBinderServer::CloseIdleConnections() {
    const auto now = Clock::now();
    const auto bound = std::chrono::milliseconds(options_.idleTimeoutMs);
    Mutex::Autolock lock(mutex_);
    for (auto it = connections_.begin(); it != connections_.end();) {
        Connection& conn = *it->second;
        auto next = std::next(it);
        if (!conn.busy && now - conn.lastActive > bound) {
            idleTimeouts_.fetch_add(1, std::memory_order_relaxed);
            OLOGW_LIMITED("%s pid %d sent nothing for %d ms, closing", conn.pid, options_.idleTimeoutMs);
            CloseConnection(it->first);
        }
        it = next;
    }
}

// A flood of connections only pushes out the idlest ones, so a new client always gets in while
// a connection is not in a transaction.
bool HostBinderServer::EvictIdlestConnection() {
    auto idlest = connections_.end();
    for (auto it = connections_.begin(); it != connections_.end(); ++it) {
        if (!it->second->busy &&
            (idlest == connections_.end() || it->second->lastActive < idlest->second->lastActive)) {
            idlest = it;
        }
    }
    if (idlest == connections_.end()) {
        return false;
    }
    pushedOut_.fetch_add(1, std::memory_order_relaxed);
    OLOGW_LIMITED("%s %zu connections open, closing the idlest, of pid %d", connections_.size(), idlest->second->pid);
    CloseConnection(idlest->first);
    return true;
}

void HostBinderServer::CloseConnection(uint64_t id) {
    auto it = connections_.find(id);
    if (it == connections_.end()) {
        return;
    }
    epoll_ctl(epollFd_.get(), EPOLL_CTL_DEL, it->second->fd.get(), nullptr);
    connections_.erase(it);
}

bool HostBinderClient::Connect(const std::string& socketPath) {
    struct sockaddr_un addr = {};
    addr.sun_family = AF_UNIX;
    if (socketPath.size() >= sizeof(addr.sun_path)) {
        errno = ENAMETOOLONG;
        return false;
    }
    memcpy(addr.sun_path, socketPath.c_str(), socketPath.size());
    fd_.reset(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!fd_.ok()) {
        return false;
    }
    if (connect(fd_.get(), reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) != 0) {
        int err = errno;
        fd_.reset();
        errno = err;
        return false;
    }
    return true;
}

status_t HostBinderClient::Transact(uint32_t code, const Parcel& data, Parcel* reply, uint32_t flags) {
    if (!fd_.ok() || data.fileDescriptors().size() > HostBinderFrame::kMaxDescriptors) {
        return DEAD_OBJECT;
    }
    // The descriptors ride on the header; the rest of the bytes follow as plain writes.
    uint32_t header[3] = {code, flags, static_cast<uint32_t>(data.dataSize())};
    if (SendFileDescriptorVector(fd_, header, sizeof(header), data.fileDescriptors()) !=
                static_cast<ssize_t>(sizeof(header)) ||
        !WriteAll(fd_.get(), data.data(), data.dataSize(), -1)) {
        return DEAD_OBJECT;
    }
    if (flags & IBinder::FLAG_ONEWAY) {
        return OK;
    }
    auto readAll = [this](void* out, size_t length) {
        auto* bytes = static_cast<uint8_t*>(out);
        while (length > 0) {
            ssize_t n = read(fd_.get(), bytes, length);
            if (n < 0 && errno == EINTR) {
                continue;
            }
            if (n <= 0) {
                return false;
            }
            bytes += n;
            length -= static_cast<size_t>(n);
        }
        return true;
    };
    int32_t replyHeader[2] = {0, 0};
    if (!readAll(replyHeader, sizeof(replyHeader))) {
        return DEAD_OBJECT;
    }
    uint32_t size = static_cast<uint32_t>(replyHeader[1]);
    if (size > HostBinderFrame::kMaxDataSize) {
        return BAD_VALUE;
    }
    std::vector<uint8_t> bytes(size);
    if (!readAll(bytes.data(), size)) {
        return DEAD_OBJECT;
    }
    if (reply != nullptr) {
        reply->setData(bytes.data(), bytes.size());
    }
    return replyHeader[0];
}

}  // namespace Orvane
}  // namespace android

#endif  // !__ANDROID__
