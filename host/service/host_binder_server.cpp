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

#include <cerrno>
#include <chrono>
#include <cstring>

#include "utils/orvane_log.h"

namespace android {
namespace Orvane {

namespace HostBinderFrame {

DecodeResult DecodeRequest(const uint8_t* bytes, size_t length, RequestHeader* header) {
    if (length < kRequestHeaderSize) {
        return DecodeResult::kIncomplete;
    }
    memcpy(header, bytes, kRequestHeaderSize);
    if (header->size > kMaxDataSize || header->size % 4 != 0) {
        return DecodeResult::kMalformed;
    }
    return length - kRequestHeaderSize >= header->size ? DecodeResult::kComplete : DecodeResult::kIncomplete;
}

}  // namespace HostBinderFrame

namespace {

using Clock = std::chrono::steady_clock;
using HostBinderFrame::DecodeResult;

constexpr uint64_t kWakeId = 0;
constexpr uint64_t kServiceTag = 1ULL << 63;
constexpr int kListenBacklog = 128;

void CloseAll(std::vector<int>& fds) {
    for (int fd : fds) {
        close(fd);
    }
    fds.clear();
}

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

}  // namespace

struct HostBinderServer::Connection {
    int fd = -1;
    sp<BBinder> binder;
    uid_t uid = 0;
    pid_t pid = 0;
    bool busy = false;
    Clock::time_point lastActive;
    std::vector<uint8_t> buffer;
    std::vector<int> fds;  // received with the bytes of the request being read

    ~Connection() {
        CloseAll(fds);
        if (fd >= 0) {
            close(fd);
        }
    }
};

HostBinderServer::HostBinderServer() : HostBinderServer(Options()) {}

HostBinderServer::HostBinderServer(const Options& options)
    : options_(options), epollFd_(epoll_create1(EPOLL_CLOEXEC)), wakeFd_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
    if (epollFd_ < 0 || wakeFd_ < 0) {
        OLOGE("%s epoll or eventfd failed: %s", strerror(errno));
        return;
    }
    struct epoll_event ev = {};
    ev.events = EPOLLIN;
    ev.data.u64 = kWakeId;
    epoll_ctl(epollFd_, EPOLL_CTL_ADD, wakeFd_, &ev);
}

HostBinderServer::~HostBinderServer() {
    Stop();
    if (epollFd_ >= 0) {
        close(epollFd_);
    }
    if (wakeFd_ >= 0) {
        close(wakeFd_);
    }
}

bool HostBinderServer::AddService(const std::string& socketPath, const sp<BBinder>& service) {
    struct sockaddr_un addr = {};
    addr.sun_family = AF_UNIX;
    if (epollFd_ < 0 || service == nullptr || socketPath.size() >= sizeof(addr.sun_path)) {
        OLOGE("%s cannot serve on %s", socketPath.c_str());
        return false;
    }
    memcpy(addr.sun_path, socketPath.c_str(), socketPath.size());
    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        OLOGE("%s socket failed: %s", strerror(errno));
        return false;
    }
    unlink(socketPath.c_str());
    if (bind(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) != 0 ||
        chmod(socketPath.c_str(), 0660) != 0 || listen(fd, kListenBacklog) != 0) {
        OLOGE("%s listen on %s failed: %s", socketPath.c_str(), strerror(errno));
        close(fd);
        return false;
    }
    struct epoll_event ev = {};
    ev.events = EPOLLIN;
    ev.data.u64 = kServiceTag | services_.size();
    if (epoll_ctl(epollFd_, EPOLL_CTL_ADD, fd, &ev) != 0) {
        OLOGE("%s epoll_ctl failed: %s", strerror(errno));
        close(fd);
        unlink(socketPath.c_str());
        return false;
    }
    services_.push_back({fd, socketPath, service});
    return true;
}

void HostBinderServer::StartThreadPool(size_t threads) {
    std::lock_guard<std::mutex> lock(mutex_);
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
        std::lock_guard<std::mutex> lock(mutex_);
        ++runningLoops_;
    }
    ServeLoop();
}

void HostBinderServer::Stop() {
    if (stopping_.exchange(true)) {
        return;
    }
    if (wakeFd_ >= 0) {
        uint64_t one = 1;
        // Left unread, so that the level-triggered event wakes every serving thread.
        (void)!write(wakeFd_, &one, sizeof(one));
    }
    std::vector<std::thread> pool;
    {
        std::unique_lock<std::mutex> lock(mutex_);
        pool.swap(pool_);
    }
    for (auto& thread : pool) {
        thread.join();
    }
    std::unique_lock<std::mutex> lock(mutex_);
    loopsEnded_.wait(lock, [this] { return runningLoops_ == 0; });
    connections_.clear();
    for (auto& service : services_) {
        close(service.fd);
        unlink(service.path.c_str());
    }
    services_.clear();
}

void HostBinderServer::ServeLoop() {
    const int sweepMs = options_.idleTimeoutMs / 5 > 10 ? options_.idleTimeoutMs / 5 : 10;
    while (!stopping_) {
        struct epoll_event ev = {};
        int n = epoll_wait(epollFd_, &ev, 1, sweepMs);
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
    std::lock_guard<std::mutex> lock(mutex_);
    if (--runningLoops_ == 0) {
        loopsEnded_.notify_all();
    }
}

void HostBinderServer::Accept(size_t serviceIndex) {
    const Service& service = services_[serviceIndex];
    int fd = accept4(service.fd, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
    if (fd < 0) {
        return;  // another thread took it
    }
    auto conn = std::make_shared<Connection>();
    conn->fd = fd;
    conn->binder = service.binder;
    conn->lastActive = Clock::now();
    struct ucred cred = {};
    socklen_t credLength = sizeof(cred);
    if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &credLength) != 0) {
        OLOGW("%s no peer credentials on %s: %s", service.path.c_str(), strerror(errno));
        return;  // conn closes the socket
    }
    conn->uid = cred.uid;
    conn->pid = cred.pid;

    std::lock_guard<std::mutex> lock(mutex_);
    if (connections_.size() >= options_.maxConnections && !EvictIdlestConnection()) {
        OLOGW("%s refuse pid %d uid %d: %zu connections busy", conn->pid, conn->uid, connections_.size());
        return;
    }
    uint64_t id = nextId_++;
    struct epoll_event ev = {};
    ev.events = EPOLLIN | EPOLLRDHUP | EPOLLONESHOT;
    ev.data.u64 = id;
    if (epoll_ctl(epollFd_, EPOLL_CTL_ADD, fd, &ev) != 0) {
        OLOGW("%s epoll_ctl failed: %s", strerror(errno));
        return;
    }
    connections_[id] = conn;
}

void HostBinderServer::HandleConnection(uint64_t id) {
    std::shared_ptr<Connection> conn;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        auto it = connections_.find(id);
        if (it == connections_.end()) {
            return;  // closed meanwhile
        }
        conn = it->second;
        conn->busy = true;
    }
    bool keep = ReadAndServe(*conn);
    std::lock_guard<std::mutex> lock(mutex_);
    conn->busy = false;
    conn->lastActive = Clock::now();
    if (!keep) {
        CloseConnection(id);
        return;
    }
    struct epoll_event ev = {};
    ev.events = EPOLLIN | EPOLLRDHUP | EPOLLONESHOT;
    ev.data.u64 = id;
    epoll_ctl(epollFd_, EPOLL_CTL_MOD, conn->fd, &ev);
}

bool HostBinderServer::ReadAndServe(Connection& conn) {
    uint8_t chunk[16 * 1024];
    alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof(int) * HostBinderFrame::kMaxDescriptors)];
    struct iovec iov = {chunk, sizeof(chunk)};
    struct msghdr msg = {};
    msg.msg_iov = &iov;
    msg.msg_iovlen = 1;
    msg.msg_control = control;
    msg.msg_controllen = sizeof(control);
    ssize_t n;
    do {
        n = recvmsg(conn.fd, &msg, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
    } while (n < 0 && errno == EINTR);
    if (n < 0) {
        if (errno == EAGAIN || errno == EWOULDBLOCK) {
            return true;
        }
        OLOGW("%s pid %d: read failed: %s", conn.pid, strerror(errno));
        return false;
    }
    for (struct cmsghdr* c = CMSG_FIRSTHDR(&msg); c != nullptr; c = CMSG_NXTHDR(&msg, c)) {
        if (c->cmsg_level == SOL_SOCKET && c->cmsg_type == SCM_RIGHTS) {
            size_t count = (c->cmsg_len - CMSG_LEN(0)) / sizeof(int);
            for (size_t i = 0; i < count; ++i) {
                int fd;
                memcpy(&fd, CMSG_DATA(c) + i * sizeof(int), sizeof(int));
                conn.fds.push_back(fd);
            }
        }
    }
    if ((msg.msg_flags & MSG_CTRUNC) || conn.fds.size() > HostBinderFrame::kMaxDescriptors) {
        OLOGW("%s pid %d: more than %zu descriptors, closing", conn.pid, HostBinderFrame::kMaxDescriptors);
        return false;
    }
    if (n == 0) {
        if (!conn.buffer.empty()) {
            OLOGW("%s pid %d: connection ended inside a frame (%zu bytes)", conn.pid, conn.buffer.size());
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
        if (result == DecodeResult::kMalformed) {
            OLOGW("%s pid %d: malformed frame, code %u, %u bytes, closing", conn.pid, header.code, header.size);
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
    if (!WriteAll(conn.fd, frame.data(), frame.size(), options_.idleTimeoutMs)) {
        OLOGW("%s pid %d: reply to code %u not taken, closing", conn.pid, header.code);
        return false;
    }
    return true;
}

void HostBinderServer::CloseIdleConnections() {
    const auto now = Clock::now();
    const auto bound = std::chrono::milliseconds(options_.idleTimeoutMs);
    std::lock_guard<std::mutex> lock(mutex_);
    for (auto it = connections_.begin(); it != connections_.end();) {
        Connection& conn = *it->second;
        auto next = std::next(it);
        if (!conn.busy && now - conn.lastActive > bound) {
            OLOGW("%s pid %d sent nothing for %d ms, closing", conn.pid, options_.idleTimeoutMs);
            CloseConnection(it->first);
        }
        it = next;
    }
}

// Called with mutex_ held. A flood of connections then only pushes out the idlest ones, so
// a new client always gets in while a connection is not in a transaction.
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
    OLOGW("%s %zu connections open, closing the idlest, of pid %d", connections_.size(), idlest->second->pid);
    CloseConnection(idlest->first);
    return true;
}

// Called with mutex_ held.
void HostBinderServer::CloseConnection(uint64_t id) {
    auto it = connections_.find(id);
    if (it == connections_.end()) {
        return;
    }
    epoll_ctl(epollFd_, EPOLL_CTL_DEL, it->second->fd, nullptr);
    connections_.erase(it);
}

HostBinderClient::~HostBinderClient() {
    if (fd_ >= 0) {
        close(fd_);
    }
}

bool HostBinderClient::Connect(const std::string& socketPath) {
    struct sockaddr_un addr = {};
    addr.sun_family = AF_UNIX;
    if (socketPath.size() >= sizeof(addr.sun_path)) {
        errno = ENAMETOOLONG;
        return false;
    }
    memcpy(addr.sun_path, socketPath.c_str(), socketPath.size());
    if (fd_ >= 0) {
        close(fd_);
    }
    fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd_ < 0) {
        return false;
    }
    if (connect(fd_, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) != 0) {
        int err = errno;
        close(fd_);
        fd_ = -1;
        errno = err;
        return false;
    }
    return true;
}

status_t HostBinderClient::Transact(uint32_t code, const Parcel& data, Parcel* reply, uint32_t flags) {
    if (fd_ < 0 || data.fileDescriptors().size() > HostBinderFrame::kMaxDescriptors) {
        return DEAD_OBJECT;
    }
    uint32_t header[3] = {code, flags, static_cast<uint32_t>(data.dataSize())};
    // The descriptors ride on the header; the rest of the bytes follow as plain writes.
    struct iovec iov = {header, sizeof(header)};
    struct msghdr msg = {};
    msg.msg_iov = &iov;
    msg.msg_iovlen = 1;
    alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof(int) * HostBinderFrame::kMaxDescriptors)] = {};
    const std::vector<int>& fds = data.fileDescriptors();
    if (!fds.empty()) {
        msg.msg_control = control;
        msg.msg_controllen = CMSG_SPACE(sizeof(int) * fds.size());
        struct cmsghdr* c = CMSG_FIRSTHDR(&msg);
        c->cmsg_level = SOL_SOCKET;
        c->cmsg_type = SCM_RIGHTS;
        c->cmsg_len = CMSG_LEN(sizeof(int) * fds.size());
        memcpy(CMSG_DATA(c), fds.data(), sizeof(int) * fds.size());
    }
    ssize_t sent;
    do {
        sent = sendmsg(fd_, &msg, MSG_NOSIGNAL);
    } while (sent < 0 && errno == EINTR);
    if (sent != static_cast<ssize_t>(sizeof(header)) || !WriteAll(fd_, data.data(), data.dataSize(), -1)) {
        return DEAD_OBJECT;
    }
    if (flags & IBinder::FLAG_ONEWAY) {
        return OK;
    }
    auto readAll = [this](void* out, size_t length) {
        auto* bytes = static_cast<uint8_t*>(out);
        while (length > 0) {
            ssize_t n = read(fd_, bytes, length);
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
