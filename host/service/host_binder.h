#ifndef ORVANE_HOST_SERVICE_HOST_BINDER_H
#define ORVANE_HOST_SERVICE_HOST_BINDER_H

// The few libbinder classes the service uses, for hosts without libbinder. They keep
// libbinder's names and behaviour so that the service's code is the same on both platforms;
// the bytes of a Parcel are those of binder's (little-endian 32-bit words, String16 as length,
// UTF-16 units, a 16-bit NUL, padded to 4 bytes). A device build uses libbinder instead.
#if !defined(__ANDROID__)

#include <sys/types.h>

#include <cstdint>
#include <string>
#include <vector>

#include <android-base/unique_fd.h>
#include <utils/Errors.h>
#include <utils/RefBase.h>
#include <utils/String16.h>
#include <utils/String8.h>
#include <utils/Vector.h>

namespace android {
namespace Orvane {

// A transaction's data or reply. Not thread safe; a parcel belongs to the transaction that
// uses it. Descriptors handed over with adoptFileDescriptors are closed with the parcel.
class Parcel {
public:
    Parcel() = default;
    Parcel(const Parcel&) = delete;
    Parcel& operator=(const Parcel&) = delete;

    const uint8_t* data() const { return data_.data(); }
    size_t dataSize() const { return data_.size(); }
    size_t dataAvail() const { return data_.size() - position_; }
    size_t dataPosition() const { return position_; }
    void setDataPosition(size_t position) const;
    status_t setDataSize(size_t size);
    status_t setData(const uint8_t* buffer, size_t length);
    void adoptFileDescriptors(std::vector<android::base::unique_fd> fds);
    // Descriptors written with writeFileDescriptor, to be sent alongside the bytes.
    const std::vector<int>& fileDescriptors() const { return fds_; }

    status_t writeInt32(int32_t value);
    status_t writeBool(bool value) { return writeInt32(value ? 1 : 0); }
    status_t writeString16(const String16& str);
    // A null string: binder's length -1 and nothing else.
    status_t writeNullString16() { return writeInt32(-1); }
    // Strict-mode policy, work source, the system header, then the descriptor.
    status_t writeInterfaceToken(const String16& interface);
    // The descriptor is not owned; it travels as its index among the parcel's descriptors.
    status_t writeFileDescriptor(int fd);

    status_t readInt32(int32_t* value) const;
    int32_t readInt32() const;
    status_t readBool(bool* value) const;
    // UNEXPECTED_NULL for a null string, BAD_VALUE for a length that lies or a missing NUL.
    status_t readString16(String16* str) const;
    String16 readString16() const;
    bool enforceInterface(const String16& interface) const;
    // -1 when the index read does not name a received descriptor.
    int readFileDescriptor() const;

private:
    status_t Append(const void* bytes, size_t length);

    std::vector<uint8_t> data_;
    mutable size_t position_ = 0;
    std::vector<int> fds_;
    std::vector<android::base::unique_fd> ownedFds_;
};

namespace binder {

// The result of a service method, written at the head of its reply.
class Status {
public:
    enum Exception {
        EX_NONE = 0,
        EX_SECURITY = -1,
        EX_NULL_POINTER = -4,
        EX_SERVICE_SPECIFIC = -8,
        EX_TRANSACTION_FAILED = -129,
    };

    static Status ok() { return Status(); }
    static Status fromExceptionCode(int32_t exceptionCode);
    static Status fromServiceSpecificError(int32_t errorCode, const String8& message);

    bool isOk() const { return exception_ == EX_NONE; }
    int32_t exceptionCode() const { return exception_; }
    int32_t serviceSpecificErrorCode() const { return exception_ == EX_SERVICE_SPECIFIC ? errorCode_ : 0; }
    const String8& exceptionMessage() const { return message_; }

    status_t writeToParcel(Parcel* parcel) const;
    status_t readFromParcel(const Parcel& parcel);

private:
    int32_t exception_ = EX_NONE;
    int32_t errorCode_ = 0;
    String8 message_;
};

}  // namespace binder

class IBinder : public virtual RefBase {
public:
    enum {
        FIRST_CALL_TRANSACTION = 0x00000001,
        LAST_CALL_TRANSACTION = 0x00ffffff,
        DUMP_TRANSACTION = ('_' << 24) | ('D' << 16) | ('M' << 8) | 'P',
        INTERFACE_TRANSACTION = ('_' << 24) | ('N' << 16) | ('T' << 8) | 'F',
    };
    enum { FLAG_ONEWAY = 0x00000001 };
};

// A local binder object. transact() may be called from several threads at once.
class BBinder : public IBinder {
public:
    virtual const String16& getInterfaceDescriptor() const;
    virtual status_t dump(int fd, const Vector<String16>& args);
    status_t transact(uint32_t code, const Parcel& data, Parcel* reply, uint32_t flags = 0);

protected:
    // The default handling: the interface query and the dump request; other codes are unknown.
    virtual status_t onTransact(uint32_t code, const Parcel& data, Parcel* reply, uint32_t flags = 0);
};

// The identity of the peer of the transaction that the calling thread serves; outside a
// transaction, this process. One per thread.
class IPCThreadState {
public:
    static IPCThreadState* self();
    uid_t getCallingUid() const { return uid_; }
    pid_t getCallingPid() const { return pid_; }
    // Set by the host transport around each transaction it serves.
    void setCallingIdentity(uid_t uid, pid_t pid);
    void clearCallingIdentity();

private:
    IPCThreadState();
    uid_t uid_;
    pid_t pid_;
};

}  // namespace Orvane
}  // namespace android

#endif  // !__ANDROID__
#endif  // ORVANE_HOST_SERVICE_HOST_BINDER_H
