// libFuzzer target: bytes as a client would send them on the service socket, decoded frame by
// frame and run through the service's transaction code (interface check, parcel reads, status
// replies, dump arguments).

#include <cstddef>
#include <cstdint>

#include <utils/String8.h>

#include "host/service/host_binder_server.h"
#include "service/IOrvaneNativeService.h"

using namespace android;
using namespace android::Orvane;

namespace {

// Does what the real methods do with their arguments short of posting events.
class StubService : public BnOrvaneNativeService {
public:
    binder::Status notifyPackLog(int* result) override {
        *result = 1;
        return binder::Status::ok();
    }
    binder::Status setRunMode(const String16& name, const String16& file) override {
        return Touch(String8(name).length() + String8(file).length());
    }
    binder::Status notifyUploadSwitch(bool on) override { return Touch(on ? 1 : 0); }
    binder::Status notifyConfigUpdate(const String16& folder) override { return Touch(String8(folder).length()); }
    binder::Status notifyUserActivated() override { return binder::Status::ok(); }
    status_t dump(int fd, const Vector<String16>& args) override {
        size_t total = fd < 0 ? 0 : 1;
        for (size_t i = 0; i < args.size(); ++i) {
            total += String8(args[i]).length();
        }
        return Touch(total).isOk() ? OK : UNKNOWN_ERROR;
    }

private:
    binder::Status Touch(size_t value) {
        sink_ += value;
        return binder::Status::ok();
    }
    size_t sink_ = 0;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static StubService* service = [] {
        StubService* created = new StubService();
        created->incStrong(created);
        return created;
    }();
    size_t offset = 0;
    HostBinderFrame::RequestHeader header = {};
    while (HostBinderFrame::DecodeRequest(data + offset, size - offset, &header) ==
           HostBinderFrame::DecodeResult::kComplete) {
        Parcel request;
        request.setData(data + offset + HostBinderFrame::kRequestHeaderSize, header.size);
        Parcel reply;
        service->transact(header.code, request, &reply, header.flags);
        binder::Status status;
        status.readFromParcel(reply);  // the client's side of the reply
        offset += HostBinderFrame::kRequestHeaderSize + header.size;
    }
    return 0;
}
