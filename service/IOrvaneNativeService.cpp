#include "service/IOrvaneNativeService.h"

namespace android {
namespace Orvane {

const String16& IOrvaneNativeService::descriptor() {
    static const String16 kName("android.Orvane.IOrvaneNativeService");
    return kName;
}

const String16& BnOrvaneNativeService::getInterfaceDescriptor() const {
    return descriptor();
}

status_t BnOrvaneNativeService::onTransact(uint32_t code, const Parcel& data, Parcel* reply, uint32_t flags) {
    if (code < TRANSACTION_notifyPackLog || code > TRANSACTION_notifyUserActivated) {
        return BBinder::onTransact(code, data, reply, flags);
    }
    if (!data.enforceInterface(descriptor())) {
        return BAD_TYPE;
    }
    status_t ret = OK;
    binder::Status status;
    switch (code) {
        case TRANSACTION_notifyPackLog: {
            int result = 0;
            status = notifyPackLog(&result);
            if ((ret = status.writeToParcel(reply)) == OK && status.isOk()) {
                ret = reply->writeInt32(result);
            }
            break;
        }
        case TRANSACTION_setRunMode: {
            String16 name;
            String16 file;
            if ((ret = data.readString16(&name)) != OK || (ret = data.readString16(&file)) != OK) {
                break;
            }
            ret = setRunMode(name, file).writeToParcel(reply);
            break;
        }
        case TRANSACTION_notifyUploadSwitch: {
            bool on = false;
            if ((ret = data.readBool(&on)) != OK) {
                break;
            }
            ret = notifyUploadSwitch(on).writeToParcel(reply);
            break;
        }
        case TRANSACTION_notifyConfigUpdate: {
            String16 folder;
            if ((ret = data.readString16(&folder)) != OK) {
                break;
            }
            ret = notifyConfigUpdate(folder).writeToParcel(reply);
            break;
        }
        case TRANSACTION_notifyUserActivated:
            ret = notifyUserActivated().writeToParcel(reply);
            break;
    }
    if (ret == UNEXPECTED_NULL) {
        reply->setDataSize(0);
        reply->setDataPosition(0);
        ret = binder::Status::fromExceptionCode(binder::Status::EX_NULL_POINTER).writeToParcel(reply);
    }
    return ret;
}

}  // namespace Orvane
}  // namespace android
