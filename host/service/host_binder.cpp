#include "host/service/host_binder.h"

#if !defined(__ANDROID__)

#include <unistd.h>

#include <cstring>

namespace android {
namespace Orvane {
namespace {

static_assert(__BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__, "the parcel copies little-endian words as they are");

constexpr int32_t kUnsetWorkSource = -1;
constexpr int32_t kSystemHeader = ('S' << 24) | ('Y' << 16) | ('S' << 8) | 'T';

size_t PadSize(size_t size) {
    return (size + 3) & ~static_cast<size_t>(3);
}

}  // namespace

void Parcel::setDataPosition(size_t position) const {
    position_ = position > data_.size() ? data_.size() : position;
}

status_t Parcel::setDataSize(size_t size) {
    data_.resize(size);
    if (position_ > size) {
        position_ = size;
    }
    return OK;
}

status_t Parcel::setData(const uint8_t* buffer, size_t length) {
    data_.assign(buffer, buffer + length);
    position_ = 0;
    return OK;
}

void Parcel::adoptFileDescriptors(std::vector<android::base::unique_fd> fds) {
    ownedFds_ = std::move(fds);
    fds_.clear();
    for (const auto& fd : ownedFds_) {
        fds_.push_back(fd.get());
    }
}

status_t Parcel::Append(const void* bytes, size_t length) {
    // Writes overwrite from the current position, as binder's do after setDataPosition.
    size_t padded = PadSize(length);
    if (position_ + padded > data_.size()) {
        data_.resize(position_ + padded);
    }
    memcpy(&data_[position_], bytes, length);
    memset(&data_[position_ + length], 0, padded - length);
    position_ += padded;
    return OK;
}

status_t Parcel::writeInt32(int32_t value) {
    return Append(&value, sizeof(value));
}

status_t Parcel::writeString16(const String16& str) {
    size_t units = str.size();
    writeInt32(static_cast<int32_t>(units));
    std::vector<char16_t> withNul(str.string(), str.string() + units);
    withNul.push_back(0);
    return Append(withNul.data(), withNul.size() * sizeof(char16_t));
}

status_t Parcel::writeInterfaceToken(const String16& interface) {
    writeInt32(0);
    writeInt32(kUnsetWorkSource);
    writeInt32(kSystemHeader);
    return writeString16(interface);
}

status_t Parcel::writeFileDescriptor(int fd) {
    fds_.push_back(fd);
    return writeInt32(static_cast<int32_t>(fds_.size() - 1));
}

status_t Parcel::readInt32(int32_t* value) const {
    if (dataAvail() < sizeof(int32_t)) {
        return NOT_ENOUGH_DATA;
    }
    memcpy(value, &data_[position_], sizeof(int32_t));
    position_ += sizeof(int32_t);
    return OK;
}

int32_t Parcel::readInt32() const {
    int32_t value = 0;
    readInt32(&value);
    return value;
}

status_t Parcel::readBool(bool* value) const {
    int32_t word = 0;
    status_t ret = readInt32(&word);
    if (ret == OK) {
        *value = word != 0;
    }
    return ret;
}

status_t Parcel::readString16(String16* str) const {
    size_t start = position_;
    int32_t units = 0;
    status_t ret = readInt32(&units);
    if (ret != OK) {
        return ret;
    }
    if (units == -1) {
        return UNEXPECTED_NULL;
    }
    // Compared as 64-bit numbers so that a length near INT32_MAX cannot wrap.
    uint64_t bytes = (static_cast<uint64_t>(units) + 1) * sizeof(char16_t);
    if (units < 0 || bytes > dataAvail()) {
        position_ = start;
        return BAD_VALUE;
    }
    std::vector<char16_t> text(units + 1);
    memcpy(text.data(), &data_[position_], bytes);
    if (text[units] != 0) {
        position_ = start;
        return BAD_VALUE;
    }
    position_ += PadSize(bytes) <= dataAvail() ? PadSize(bytes) : bytes;
    *str = String16(text.data(), units);
    return OK;
}

String16 Parcel::readString16() const {
    String16 str;
    readString16(&str);
    return str;
}

bool Parcel::enforceInterface(const String16& interface) const {
    int32_t strictModePolicy = 0;
    int32_t workSource = 0;
    int32_t header = 0;
    String16 name;
    if (readInt32(&strictModePolicy) != OK || readInt32(&workSource) != OK || readInt32(&header) != OK ||
        header != kSystemHeader || readString16(&name) != OK) {
        return false;
    }
    return name == interface;
}

int Parcel::readFileDescriptor() const {
    int32_t index = -1;
    if (readInt32(&index) != OK || index < 0 || static_cast<size_t>(index) >= fds_.size()) {
        return -1;
    }
    return fds_[index];
}

namespace binder {

Status Status::fromExceptionCode(int32_t exceptionCode) {
    Status status;
    status.exception_ = exceptionCode;
    return status;
}

Status Status::fromServiceSpecificError(int32_t errorCode, const String8& message) {
    Status status;
    status.exception_ = EX_SERVICE_SPECIFIC;
    status.errorCode_ = errorCode;
    status.message_ = message;
    return status;
}

status_t Status::writeToParcel(Parcel* parcel) const {
    status_t ret = parcel->writeInt32(exception_);
    if (exception_ == EX_NONE) {
        return ret;
    }
    parcel->writeString16(String16(message_));
    ret = parcel->writeInt32(0);  // no remote stack trace
    if (exception_ == EX_SERVICE_SPECIFIC) {
        ret = parcel->writeInt32(errorCode_);
    }
    return ret;
}

status_t Status::readFromParcel(const Parcel& parcel) {
    *this = Status();
    int32_t exception = EX_NONE;
    status_t ret = parcel.readInt32(&exception);
    if (ret != OK || exception == EX_NONE) {
        return ret;
    }
    String16 message;
    int32_t traceSize = 0;
    if ((ret = parcel.readString16(&message)) != OK || (ret = parcel.readInt32(&traceSize)) != OK) {
        return ret;
    }
    exception_ = exception;
    message_ = String8(message);
    if (exception == EX_SERVICE_SPECIFIC) {
        ret = parcel.readInt32(&errorCode_);
    }
    return ret;
}

}  // namespace binder

const String16& BBinder::getInterfaceDescriptor() const {
    static const String16 kEmpty;
    return kEmpty;
}

status_t BBinder::dump(int, const Vector<String16>&) {
    return OK;
}

status_t BBinder::transact(uint32_t code, const Parcel& data, Parcel* reply, uint32_t flags) {
    data.setDataPosition(0);
    status_t ret = onTransact(code, data, reply, flags);
    if (reply != nullptr) {
        reply->setDataPosition(0);
    }
    return ret;
}

status_t BBinder::onTransact(uint32_t code, const Parcel& data, Parcel* reply, uint32_t) {
    switch (code) {
        case INTERFACE_TRANSACTION:
            return reply->writeString16(getInterfaceDescriptor());
        case DUMP_TRANSACTION: {
            int fd = data.readFileDescriptor();
            int32_t argc = data.readInt32();
            Vector<String16> args;
            String16 arg;
            for (int32_t i = 0; i < argc && data.readString16(&arg) == OK; ++i) {
                args.add(arg);
            }
            return dump(fd, args);
        }
        default:
            return UNKNOWN_TRANSACTION;
    }
}

IPCThreadState::IPCThreadState() : uid_(getuid()), pid_(getpid()) {}

IPCThreadState* IPCThreadState::self() {
    static thread_local IPCThreadState state;
    return &state;
}

void IPCThreadState::setCallingIdentity(uid_t uid, pid_t pid) {
    uid_ = uid;
    pid_ = pid;
}

void IPCThreadState::clearCallingIdentity() {
    uid_ = getuid();
    pid_ = getpid();
}

}  // namespace Orvane
}  // namespace android

#endif  // !__ANDROID__
