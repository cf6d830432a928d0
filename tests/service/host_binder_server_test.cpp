#include "service/host_binder_server.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <condition_variable>
#include <cstring>
#include <mutex>
#include <thread>
#include <vector>

#include "service/IOrvaneNativeService.h"
#include "tests/common/log_capture.h"
#include "utils/file_util.h"

namespace android {
namespace Orvane {
namespace {

// Records what the shared transaction code hands to the methods. notifyPackLog blocks while
// the gate is closed, to occupy serving threads.
class RecordingService : public BnOrvaneNativeService {
public:
    binder::Status notifyPackLog(int* result) override {
        std::unique_lock<std::mutex> lock(mutex_);
        ++blocked_;
        changed_.notify_all();
        changed_.wait(lock, [this] { return gateOpen_ || releases_ > 0; });
        if (!gateOpen_) {
            --releases_;
        }
        --blocked_;
        *result = 42;
        return binder::Status::ok();
    }
    binder::Status setRunMode(const String16& name, const String16& file) override {
        std::lock_guard<std::mutex> lock(mutex_);
        strings_.push_back(name);
        strings_.push_back(file);
        return binder::Status::ok();
    }
    binder::Status notifyUploadSwitch(bool on) override {
        std::lock_guard<std::mutex> lock(mutex_);
        switches_.push_back(on);
        return binder::Status::ok();
    }
    binder::Status notifyConfigUpdate(const String16& folder) override {
        std::lock_guard<std::mutex> lock(mutex_);
        strings_.push_back(folder);
        return binder::Status::ok();
    }
    binder::Status notifyUserActivated() override { return binder::Status::ok(); }

    void CloseGate() {
        std::lock_guard<std::mutex> lock(mutex_);
        gateOpen_ = false;
    }
    void ReleaseOne() {
        std::lock_guard<std::mutex> lock(mutex_);
        ++releases_;
        changed_.notify_all();
    }
    void OpenGate() {
        std::lock_guard<std::mutex> lock(mutex_);
        gateOpen_ = true;
        changed_.notify_all();
    }
    int Blocked() {
        std::lock_guard<std::mutex> lock(mutex_);
        return blocked_;
    }
    std::vector<String16> Strings() {
        std::lock_guard<std::mutex> lock(mutex_);
        return strings_;
    }
    std::vector<bool> Switches() {
        std::lock_guard<std::mutex> lock(mutex_);
        return switches_;
    }

private:
    std::mutex mutex_;
    std::condition_variable changed_;
    bool gateOpen_ = true;
    int releases_ = 0;
    int blocked_ = 0;
    std::vector<String16> strings_;
    std::vector<bool> switches_;
};

std::vector<uint8_t> Bytes(const Parcel& parcel) { return std::vector<uint8_t>(parcel.data(), parcel.data() + parcel.dataSize()); }

std::vector<uint8_t> Frame(uint32_t code, const std::vector<uint8_t>& data, uint32_t declaredSize) {
    std::vector<uint8_t> frame(12 + data.size());
    uint32_t header[3] = {code, 0, declaredSize};
    memcpy(frame.data(), header, sizeof(header));
    if (!data.empty()) {
        memcpy(frame.data() + 12, data.data(), data.size());
    }
    return frame;
}

class HostBinderServerTest : public testing::Test {
protected:
    void SetUp() override {
        char pattern[] = "/tmp/host_binder_testXXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir_ = pattern;
        service_ = new RecordingService();
    }
    void TearDown() override {
        service_->OpenGate();
        if (server_ != nullptr) {
            server_->Stop();
        }
        uint64_t freed = 0;
        FileUtil::DeleteDirectoryOrFile(dir_, freed, true);
    }

    void Start(size_t threads, int idleTimeoutMs = 5000, size_t maxConnections = 64) {
        HostBinderServer::Options options;
        options.idleTimeoutMs = idleTimeoutMs;
        options.maxConnections = maxConnections;
        server_ = new HostBinderServer(options);
        ASSERT_TRUE(server_->AddService(Path(), service_));
        server_->StartThreadPool(threads);
    }

    std::string Path() const { return dir_ + "/orvane.sock"; }

    int RawConnect() {
        int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        struct sockaddr_un addr = {};
        addr.sun_family = AF_UNIX;
        strncpy(addr.sun_path, Path().c_str(), sizeof(addr.sun_path) - 1);
        EXPECT_EQ(connect(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)), 0);
        return fd;
    }

    // True when the server closed the connection (end of stream) within the bound.
    static bool ClosedByServer(int fd, int boundMs = 10000) {
        struct pollfd in = {fd, POLLIN, 0};
        if (poll(&in, 1, boundMs) != 1) {
            return false;
        }
        char byte;
        return read(fd, &byte, 1) == 0;
    }

    // A served notifyUploadSwitch through a fresh connection: the server still answers.
    bool Served() {
        HostBinderClient client;
        if (!client.Connect(Path())) {
            return false;
        }
        Parcel data;
        data.writeInterfaceToken(IOrvaneNativeService::descriptor());
        data.writeBool(true);
        Parcel reply;
        binder::Status status;
        return client.Transact(IOrvaneNativeService::TRANSACTION_notifyUploadSwitch, data, &reply) == OK &&
               status.readFromParcel(reply) == OK && status.isOk();
    }

    std::string dir_;
    sp<RecordingService> service_;
    sp<HostBinderServer> server_;
};

TEST_F(HostBinderServerTest, ParcelKeepsBindersLayoutAndRefusesLyingStrings) {
    Parcel token;
    token.writeInterfaceToken(String16("ab"));
    token.writeBool(true);
    const uint8_t expected[] = {0, 0, 0, 0,  0xff, 0xff, 0xff, 0xff,  'T', 'S', 'Y', 'S',  2, 0, 0, 0,
                                'a', 0, 'b', 0,  0, 0, 0, 0,  1, 0, 0, 0};
    EXPECT_EQ(Bytes(token), std::vector<uint8_t>(expected, expected + sizeof(expected)));
    token.setDataPosition(0);
    EXPECT_TRUE(token.enforceInterface(String16("ab")));
    token.setDataPosition(0);
    EXPECT_FALSE(token.enforceInterface(String16("abc")));

    auto parse = [](std::vector<int32_t> words, String16* out) {
        Parcel parcel;
        parcel.setData(reinterpret_cast<const uint8_t*>(words.data()), words.size() * 4);
        return parcel.readString16(out);
    };
    String16 out;
    EXPECT_EQ(parse({-1}, &out), UNEXPECTED_NULL);
    EXPECT_EQ(parse({3, 0x00620061}, &out), BAD_VALUE);            // longer than the data
    EXPECT_EQ(parse({0x7fffffff, 0}, &out), BAD_VALUE);            // would overflow a 32-bit size
    EXPECT_EQ(parse({-7, 0}, &out), BAD_VALUE);
    EXPECT_EQ(parse({1, 0x00620061}, &out), BAD_VALUE);            // no NUL after the unit
    EXPECT_EQ(parse({}, &out), NOT_ENOUGH_DATA);
    ASSERT_EQ(parse({2, 0x0000d800, 0}, &out), OK);                // a lone surrogate and a NUL unit
    EXPECT_EQ(out.size(), 2u);
    EXPECT_EQ(out.string()[0], 0xd800);

    Parcel twoStrings;
    twoStrings.writeString16(String16("xyz"));
    twoStrings.writeString16(String16(""));
    twoStrings.setDataPosition(0);
    EXPECT_EQ(twoStrings.readString16(), String16("xyz"));
    EXPECT_EQ(twoStrings.readString16(&out), OK);
    EXPECT_EQ(out.size(), 0u);
    EXPECT_EQ(twoStrings.dataAvail(), 0u);
}

TEST_F(HostBinderServerTest, BadRequestsGetTheirStatusAndTheConnectionGoesOn) {
    Start(2);
    HostBinderClient client;
    ASSERT_TRUE(client.Connect(Path()));
    Parcel reply;

    Parcel wrongToken;
    wrongToken.writeInterfaceToken(String16("android.Other.IService"));
    wrongToken.writeBool(true);
    EXPECT_EQ(client.Transact(IOrvaneNativeService::TRANSACTION_notifyUploadSwitch, wrongToken, &reply), BAD_TYPE);
    EXPECT_EQ(reply.dataSize(), 0u);

    Parcel noArgument;
    noArgument.writeInterfaceToken(IOrvaneNativeService::descriptor());
    EXPECT_EQ(client.Transact(IOrvaneNativeService::TRANSACTION_notifyUploadSwitch, noArgument, &reply), NOT_ENOUGH_DATA);
    EXPECT_EQ(client.Transact(IOrvaneNativeService::TRANSACTION_notifyConfigUpdate, noArgument, &reply), NOT_ENOUGH_DATA);

    Parcel lying;
    lying.writeInterfaceToken(IOrvaneNativeService::descriptor());
    lying.writeInt32(5000);
    lying.writeInt32(0x00410041);
    EXPECT_EQ(client.Transact(IOrvaneNativeService::TRANSACTION_notifyConfigUpdate, lying, &reply), BAD_VALUE);

    // A null string is the caller's null pointer: an OK transport and a null-pointer status.
    Parcel nullName;
    nullName.writeInterfaceToken(IOrvaneNativeService::descriptor());
    nullName.writeNullString16();
    nullName.writeString16(String16("file"));
    ASSERT_EQ(client.Transact(IOrvaneNativeService::TRANSACTION_setRunMode, nullName, &reply), OK);
    binder::Status status;
    ASSERT_EQ(status.readFromParcel(reply), OK);
    EXPECT_EQ(status.exceptionCode(), binder::Status::EX_NULL_POINTER);
    EXPECT_EQ(reply.dataAvail(), 0u);

    Parcel oddUtf16;
    oddUtf16.writeInterfaceToken(IOrvaneNativeService::descriptor());
    const char16_t odd[] = {0xdc00, 'a', 0xd800, 0xffff};
    oddUtf16.writeString16(String16(odd, 4));
    ASSERT_EQ(client.Transact(IOrvaneNativeService::TRANSACTION_notifyConfigUpdate, oddUtf16, &reply), OK);
    EXPECT_TRUE(status.readFromParcel(reply) == OK && status.isOk());

    EXPECT_EQ(client.Transact(77, noArgument, &reply), UNKNOWN_TRANSACTION);
    ASSERT_EQ(client.Transact(IBinder::INTERFACE_TRANSACTION, Parcel(), &reply), OK);
    EXPECT_EQ(reply.readString16(), IOrvaneNativeService::descriptor());

    // Only the well-formed calls reached the methods, on the same connection throughout.
    std::vector<String16> strings = service_->Strings();
    ASSERT_EQ(strings.size(), 1u);
    EXPECT_EQ(strings[0], String16(odd, 4));
    EXPECT_TRUE(service_->Switches().empty());
    Parcel upload;
    upload.writeInterfaceToken(IOrvaneNativeService::descriptor());
    upload.writeBool(false);
    EXPECT_EQ(client.Transact(IOrvaneNativeService::TRANSACTION_notifyUploadSwitch, upload, &reply), OK);
    EXPECT_EQ(service_->Switches(), std::vector<bool>{false});
}

TEST_F(HostBinderServerTest, BrokenFramesCloseOnlyTheirConnection) {
    Start(1, 300);
    LogCapture log;
    Parcel token;
    token.writeInterfaceToken(IOrvaneNativeService::descriptor());

    int holder = RawConnect();  // an idle connection, open all along until the idle bound
    int oversize = RawConnect();
    std::vector<uint8_t> big = Frame(1, std::vector<uint8_t>(64 * 1024 + 4, 0), 64 * 1024 + 4);
    send(oversize, big.data(), 12, MSG_NOSIGNAL);
    EXPECT_TRUE(ClosedByServer(oversize));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_WARN, "malformed frame, code 1, 65540 bytes"));
    EXPECT_TRUE(Served());

    int unaligned = RawConnect();
    std::vector<uint8_t> odd = Frame(3, std::vector<uint8_t>(6, 0), 6);
    send(unaligned, odd.data(), odd.size(), MSG_NOSIGNAL);
    EXPECT_TRUE(ClosedByServer(unaligned));
    EXPECT_TRUE(Served());

    // The byte count promises more than comes before the client hangs up.
    int truncated = RawConnect();
    std::vector<uint8_t> partial = Frame(2, Bytes(token), static_cast<uint32_t>(token.dataSize()) + 8);
    send(truncated, partial.data(), partial.size(), MSG_NOSIGNAL);
    shutdown(truncated, SHUT_WR);
    EXPECT_TRUE(ClosedByServer(truncated));
    EXPECT_TRUE(log.WaitFor(ANDROID_LOG_WARN, "connection ended inside a frame"));
    EXPECT_TRUE(Served());

    // More descriptors than any request carries.
    int fdFlood = RawConnect();
    int fds[5] = {0, 1, 2, 0, 1};
    std::vector<uint8_t> frame = Frame(IBinder::DUMP_TRANSACTION, {0, 0, 0, 0, 0, 0, 0, 0}, 8);
    struct iovec iov = {frame.data(), frame.size()};
    alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof(fds))] = {};
    struct msghdr msg = {};
    msg.msg_iov = &iov;
    msg.msg_iovlen = 1;
    msg.msg_control = control;
    msg.msg_controllen = sizeof(control);
    struct cmsghdr* c = CMSG_FIRSTHDR(&msg);
    c->cmsg_level = SOL_SOCKET;
    c->cmsg_type = SCM_RIGHTS;
    c->cmsg_len = CMSG_LEN(sizeof(fds));
    memcpy(CMSG_DATA(c), fds, sizeof(fds));
    ASSERT_GT(sendmsg(fdFlood, &msg, MSG_NOSIGNAL), 0);
    EXPECT_TRUE(ClosedByServer(fdFlood));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_WARN, "more than 4 descriptors"));

    // Half a header, then silence: closed at the idle bound, as is the holder.
    int silent = RawConnect();
    send(silent, partial.data(), 6, MSG_NOSIGNAL);
    EXPECT_TRUE(ClosedByServer(silent));
    EXPECT_TRUE(ClosedByServer(holder));
    EXPECT_TRUE(log.Contains(ANDROID_LOG_WARN, "sent nothing for 300 ms, closing"));
    EXPECT_TRUE(Served());
    for (int fd : {holder, oversize, unaligned, truncated, fdFlood, silent}) {
        close(fd);
    }
}

TEST_F(HostBinderServerTest, FloodOfConnectionsPushesOutIdleOnes) {
    Start(2, 5000, 16);
    LogCapture log;
    std::vector<int> flood;
    for (int i = 0; i < 100; ++i) {
        flood.push_back(RawConnect());
    }
    EXPECT_TRUE(Served());
    EXPECT_TRUE(log.WaitFor(ANDROID_LOG_WARN, "16 connections open, closing the idlest"));
    // The oldest of the flood went first; the newest are still open.
    EXPECT_TRUE(ClosedByServer(flood.front()));
    struct pollfd newest = {flood.back(), POLLIN, 0};
    EXPECT_EQ(poll(&newest, 1, 0), 0);
    for (int fd : flood) {
        close(fd);
    }
    EXPECT_TRUE(Served());
}

TEST_F(HostBinderServerTest, ClientThatNeverReadsItsRepliesIsDropped) {
    Start(2, 300);
    LogCapture log;
    int greedy = RawConnect();
    std::vector<uint8_t> request = Frame(IBinder::INTERFACE_TRANSACTION, {}, 0);
    std::vector<uint8_t> burst;
    for (int i = 0; i < 1000; ++i) {
        burst.insert(burst.end(), request.begin(), request.end());
    }
    // Sends until the socket is full both ways: the server blocks writing replies nobody reads.
    ASSERT_TRUE(WaitUntil([&] {
        send(greedy, burst.data(), burst.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
        return log.Contains(ANDROID_LOG_WARN, "not taken, closing");
    }, std::chrono::seconds(20))) << log.Dump();
    EXPECT_TRUE(Served());
    close(greedy);
}

// Four serving threads all inside blocking calls: a fifth client connects, but its request
// waits until one of them returns, exactly as a fifth binder caller waits for a pool thread.
TEST_F(HostBinderServerTest, FifthClientWaitsForAFreeThread) {
    Start(4);
    service_->CloseGate();
    std::vector<std::thread> callers;
    std::atomic<int> answered{0};
    for (int i = 0; i < 4; ++i) {
        callers.emplace_back([this, &answered] {
            HostBinderClient client;
            ASSERT_TRUE(client.Connect(Path()));
            Parcel data;
            data.writeInterfaceToken(IOrvaneNativeService::descriptor());
            Parcel reply;
            binder::Status status;
            EXPECT_EQ(client.Transact(IOrvaneNativeService::TRANSACTION_notifyPackLog, data, &reply), OK);
            EXPECT_EQ(status.readFromParcel(reply), OK);
            EXPECT_EQ(reply.readInt32(), 42);
            ++answered;
        });
    }
    ASSERT_TRUE(WaitUntil([this] { return service_->Blocked() == 4; }));

    int fifth = RawConnect();
    Parcel data;
    data.writeInterfaceToken(IOrvaneNativeService::descriptor());
    data.writeBool(true);
    std::vector<uint8_t> frame = Frame(IOrvaneNativeService::TRANSACTION_notifyUploadSwitch, Bytes(data),
                                       static_cast<uint32_t>(data.dataSize()));
    ASSERT_EQ(send(fifth, frame.data(), frame.size(), MSG_NOSIGNAL), static_cast<ssize_t>(frame.size()));
    struct pollfd in = {fifth, POLLIN, 0};
    EXPECT_EQ(poll(&in, 1, 300), 0);  // nobody free to answer
    EXPECT_TRUE(service_->Switches().empty());

    service_->ReleaseOne();
    ASSERT_EQ(poll(&in, 1, 10000), 1);
    int32_t header[2] = {-1, -1};
    EXPECT_EQ(read(fifth, header, sizeof(header)), static_cast<ssize_t>(sizeof(header)));
    EXPECT_EQ(header[0], OK);
    EXPECT_EQ(service_->Switches(), std::vector<bool>{true});
    EXPECT_TRUE(WaitUntil([&] { return answered == 1; }));

    service_->OpenGate();
    for (auto& caller : callers) {
        caller.join();
    }
    EXPECT_EQ(answered, 4);
    close(fifth);
}

}  // namespace
}  // namespace Orvane
}  // namespace android
