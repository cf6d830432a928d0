#ifndef ORVANE_SERVICE_IORVANENATIVESERVICE_H
#define ORVANE_SERVICE_IORVANENATIVESERVICE_H

#include <cstdint>
#include <limits>
#include <memory>

#include <utils/String16.h>

#if defined(__ANDROID__)
#include <binder/Binder.h>
#include <binder/Parcel.h>
#include <binder/Status.h>
#else
#include "host/service/host_binder.h"
#endif

namespace android {
namespace Orvane {

// The interface the companion application calls. Method names and codes are its wire contract.
class IOrvaneNativeService : public virtual RefBase {
public:
    enum {
        TRANSACTION_notifyPackLog = IBinder::FIRST_CALL_TRANSACTION,
        TRANSACTION_setRunMode,
        TRANSACTION_notifyUploadSwitch,
        TRANSACTION_notifyConfigUpdate,
        TRANSACTION_notifyUserActivated,
    };

    // "android.Orvane.IOrvaneNativeService"
    static const String16& descriptor();

    virtual binder::Status notifyPackLog(int* result) = 0;
    virtual binder::Status setRunMode(const String16& name, const String16& file) = 0;
    virtual binder::Status notifyUploadSwitch(bool on) = 0;
    virtual binder::Status notifyConfigUpdate(const String16& folder) = 0;
    virtual binder::Status notifyUserActivated() = 0;
};

// Unpacks a transaction into a method call and packs its reply. Codes it does not know, the
// dump request included, go to the binder's default handling. Called on transport threads.
class BnOrvaneNativeService : public BBinder, public IOrvaneNativeService {
public:
    const String16& getInterfaceDescriptor() const override;

protected:
    status_t onTransact(uint32_t code, const Parcel& data, Parcel* reply, uint32_t flags) override;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_SERVICE_IORVANENATIVESERVICE_H
