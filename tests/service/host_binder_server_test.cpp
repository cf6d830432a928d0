#include "host/service/host_binder_server.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <tuple>
#include <vector>

#include <android-base/file.h>
#include <gtest/gtest.h>
#include <utils/Mutex.h>

#include "service/IOrvaneNativeService.h"
#include "tests/common/log_capture.h"

namespace android::Orvane {
namespace {

// Records the arguments that the shared transaction code hands to the methods.
class RecordingService : public BnOrvaneNativeService {
public:
    binder::Status notifyPackLog(int*) override { return binder::Status::ok(); }
    binder::Status setRunMode(const String16& name, const String16&) override { return Record(name); }
    binder::Status notifyUploadSwitch(bool on) override { return Record(String16(on ? "on" : "off")); }
    binder::Status notifyConfigUpdate(const String16& folder) override { return Record(folder); }
    binder::Status notifyUserActivated() override { return binder::Status::ok(); }
    binder::Status Record(const String16& arg) {
        Mutex::Autolock lock(mutex);
        calls.push_back(arg);
        return binder::Status::ok();
    }
    Mutex mutex;
    std::vector<String16> calls GUARDED_BY(mutex);
};

// A request frame: code, flags, byte count (which may lie), then that many zero bytes.
std::vector<uint8_t> Frame(uint32_t code, size_t dataBytes, uint32_t declaredSize) {
    std::vector<uint8_t> frame(12 + dataBytes, 0);
    uint32_t header[3] = {code, 0, declaredSize};
    memcpy(frame.data(), header, sizeof(header));
    return frame;
}

class HostBinderServerTest : public testing::Test {
protected:
    void TearDown() override {
        for (int fd : fds_)
            close(fd);
        server_->Stop();
    }

    void Start(size_t threads, int idleTimeoutMs = 5000, size_t maxConnections = 64) {
        server_ = new HostBinderServer(stats_, HostBinderServer::Options{maxConnections, idleTimeoutMs});
        ASSERT_TRUE(server_->AddService(Path(), service_));
        server_->StartThreadPool(threads);
    }

    std::string Path() const { return std::string(dir_.path) + "/orvane.sock"; }
    uint64_t Counted(const char* what) const { return stats_.Value(std::string("service.host.") + what); }

    // Connects and sends the bytes, the descriptors riding on them.
    int RawConnect(std::vector<uint8_t> bytes = {}, const std::vector<int>& fds = {}) {
        int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        struct sockaddr_un addr = {AF_UNIX, {}};
        strncpy(addr.sun_path, Path().c_str(), sizeof(addr.sun_path) - 1);
        EXPECT_EQ(connect(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)), 0);
        struct iovec iov = {bytes.data(), bytes.size()};
        alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof(int) * 8)] = {};
        struct msghdr msg = {nullptr, 0, &iov, 1, control, fds.empty() ? 0 : CMSG_SPACE(sizeof(int) * fds.size()), 0};
        if (!fds.empty()) {
            *CMSG_FIRSTHDR(&msg) = {CMSG_LEN(sizeof(int) * fds.size()), SOL_SOCKET, SCM_RIGHTS};
            memcpy(CMSG_DATA(CMSG_FIRSTHDR(&msg)), fds.data(), sizeof(int) * fds.size());
        }
        EXPECT_EQ(sendmsg(fd, &msg, MSG_NOSIGNAL), static_cast<ssize_t>(bytes.size()));
        fds_.push_back(fd);
        return fd;
    }

    // True when the server closed the connection (end of stream) within the bound.
    static bool ClosedByServer(int fd) {
        struct pollfd in = {fd, POLLIN, 0};
        char byte;
        return poll(&in, 1, 10000) == 1 && read(fd, &byte, 1) == 0;
    }

    // A request on a fresh connection gets its reply: the server still answers.
    bool Served() {
        struct pollfd in = {RawConnect(Frame(IBinder::INTERFACE_TRANSACTION, 0, 0)), POLLIN, 0};
        char reply[64];
        return poll(&in, 1, 10000) == 1 && read(in.fd, reply, sizeof(reply)) > 0;
    }

    TemporaryDir dir_;
    DaemonStats stats_;
    sp<RecordingService> service_ = new RecordingService();
    sp<HostBinderServer> server_;
    std::vector<int> fds_;
};

// The host Parcel keeps binder's bytes; every bad request gets its status on one connection,
// and only well-formed calls reach the methods.
TEST_F(HostBinderServerTest, WireFormatAndBadRequests) {
    Parcel token;
    token.writeInterfaceToken(String16("ab"));
    token.writeBool(true);
    const std::vector<uint8_t> expected = {0, 0, 0,   0, 0xff, 0xff, 0xff, 0xff, 'T', 'S', 'Y', 'S', 2, 0,
                                           0, 0, 'a', 0, 'b',  0,    0,    0,    0,   0,   1,   0,   0, 0};
    EXPECT_EQ(std::vector<uint8_t>(token.data(), token.data() + token.dataSize()), expected);
    token.setDataPosition(0);
    EXPECT_FALSE(token.enforceInterface(String16("abc")));

    Start(2);
    HostBinderClient client;
    ASSERT_TRUE(client.Connect(Path()));
    const uint32_t kUpload = IOrvaneNativeService::TRANSACTION_notifyUploadSwitch,
                   kConfig = IOrvaneNativeService::TRANSACTION_notifyConfigUpdate;
    // code, words after the interface token, transport status, exception of the reply's status
    const std::tuple<uint32_t, std::vector<int32_t>, status_t, int> cases[] = {
            {kUpload, {1}, BAD_TYPE, 0},  // another interface's token
            {kConfig, {}, NOT_ENOUGH_DATA, 0},
            {kConfig, {5000, 0x00410041}, BAD_VALUE, 0},  // longer than the data
            {kConfig, {0x7fffffff, 0}, BAD_VALUE, 0},     // would overflow a 32-bit size
            {kConfig, {-7, 0}, BAD_VALUE, 0},
            {kConfig, {1, 0x00620061}, BAD_VALUE, 0},  // no NUL after the unit
            {77, {}, UNKNOWN_TRANSACTION, 0},
            {kConfig, {-1}, OK, binder::Status::EX_NULL_POINTER},                    // the caller's null pointer
            {kConfig, {4, 0x0000dc00, static_cast<int32_t>(0xffffd800), 0}, OK, 0},  // odd UTF-16 passes as is
            {kUpload, {1}, OK, 0},
    };
    for (const auto& [code, words, result, exception] : cases) {
        SCOPED_TRACE(words.empty() ? code : words[0]);
        Parcel data, reply;
        data.writeInterfaceToken(result == BAD_TYPE ? String16("android.Other.IService")
                                                    : IOrvaneNativeService::descriptor());
        for (int32_t word : words)
            data.writeInt32(word);
        ASSERT_EQ(client.Transact(code, data, &reply), result);
        binder::Status status;
        EXPECT_EQ(status.readFromParcel(reply), result == OK ? OK : NOT_ENOUGH_DATA);  // empty after an error
        EXPECT_EQ(status.exceptionCode(), exception);
    }
    const char16_t odd[] = {0xdc00, 0, 0xd800, 0xffff};
    Mutex::Autolock lock(service_->mutex);
    EXPECT_EQ(service_->calls, (std::vector<String16>{String16(odd, 4), String16("on")}));
}

TEST_F(HostBinderServerTest, BrokenFramesCloseOnlyTheirConnection) {
    Start(1, 300);
    LogCapture log;
    int holder = RawConnect();  // an idle connection, open all along until the idle bound
    // Over 64 KiB announced; a byte count that is not a whole number of words.
    EXPECT_TRUE(ClosedByServer(RawConnect(Frame(1, 0, 64 * 1024 + 4))));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_WARN, "malformed frame, code 1, 65540 bytes"));
    EXPECT_EQ(Counted("oversized_requests"), 1u);
    EXPECT_TRUE(ClosedByServer(RawConnect(Frame(3, 6, 6))));
    EXPECT_EQ(Counted("bad_frames"), 1u);

    // The byte count promises more than comes before the client hangs up.
    std::vector<uint8_t> partial = Frame(2, 16, 24);
    int truncated = RawConnect(partial);
    shutdown(truncated, SHUT_WR);
    EXPECT_TRUE(ClosedByServer(truncated));
    EXPECT_TRUE(WaitUntil([this] { return Counted("bad_frames") == 2; }));
    EXPECT_TRUE(Served());

    // More descriptors than any request carries.
    EXPECT_TRUE(ClosedByServer(RawConnect(Frame(IBinder::DUMP_TRANSACTION, 8, 8), {0, 1, 2, 0, 1})));
    EXPECT_EQ(Counted("bad_frames"), 3u);

    // Half a header, then silence: closed at the idle bound, as is the holder (and the connection
    // that was served, idle since).
    EXPECT_TRUE(ClosedByServer(RawConnect(std::vector<uint8_t>(partial.begin(), partial.begin() + 6))));
    EXPECT_TRUE(ClosedByServer(holder));
    EXPECT_GE(Counted("idle_timeouts"), 2u);
    EXPECT_TRUE(Served());
    EXPECT_EQ(Counted("bad_frames"), 3u);
    EXPECT_EQ(Counted("pushed_out") + Counted("refused_connections") + Counted("replies_not_taken"), 0u);
}

// A flood of connections pushes out only the idlest; a client that never reads its replies is
// dropped once they are not taken within the bound. Others are served all along.
TEST_F(HostBinderServerTest, FloodsAndClientsThatNeverReadAreDropped) {
    Start(2, 5000, 16);
    for (int i = 0; i < 100; ++i)
        RawConnect();
    EXPECT_TRUE(ClosedByServer(fds_.front()));  // the oldest of the flood went first; the newest is still open
    struct pollfd newest = {fds_.back(), POLLIN, 0};
    EXPECT_EQ(poll(&newest, 1, 0), 0);
    EXPECT_TRUE(Served());
    // Every flood connection beyond the 16 and the served one pushed out one; the two serving
    // threads may finish admitting the last of the flood after the served one.
    EXPECT_TRUE(WaitUntil([this] { return Counted("pushed_out") == 100u - 16u + 1u; })) << Counted("pushed_out");

    int greedy = RawConnect();
    std::vector<uint8_t> request = Frame(IBinder::INTERFACE_TRANSACTION, 0, 0), burst;
    for (int i = 0; i < 1000; ++i)
        burst.insert(burst.end(), request.begin(), request.end());
    // Sends until the socket is full both ways: the server blocks writing replies nobody reads.
    ASSERT_TRUE(WaitUntil(
            [&] {
                send(greedy, burst.data(), burst.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
                return Counted("replies_not_taken") == 1;
            },
            std::chrono::seconds(30)));
    EXPECT_TRUE(Served());
    EXPECT_EQ(Counted("refused_connections"), 0u);
}

}  // namespace
}  // namespace android::Orvane
