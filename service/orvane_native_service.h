#ifndef ORVANE_SERVICE_ORVANE_NATIVE_SERVICE_H
#define ORVANE_SERVICE_ORVANE_NATIVE_SERVICE_H

#include <utils/String16.h>
#include <utils/Vector.h>

#include "service/IOrvaneNativeService.h"
#include "service/orvane_service.h"

namespace android {
namespace Orvane {

// The binder object "orvane": checks the caller, then forwards each call to OrvaneService.
// Threads: called on transport threads, several at once; its fields are fixed at creation.
class OrvaneNativeService : public BnOrvaneNativeService {
public:
    // With checkCaller on, only the companion application (uid 1000, process
    // "com.quor.orvaneservice") is served. Dumps are not for it to check: they are served to
    // callers with the platform's DUMP permission (see dump).
    OrvaneNativeService(const sp<OrvaneService>& service, bool checkCaller);

    binder::Status notifyPackLog(int* result) override;
    binder::Status setRunMode(const String16& name, const String16& file) override;
    binder::Status notifyUploadSwitch(bool on) override;
    binder::Status notifyConfigUpdate(const String16& folder) override;
    binder::Status notifyUserActivated() override;
    status_t dump(int fd, const Vector<String16>& args) override;

private:
    // False, with an info line, for a caller that is not served; such calls end OK at once.
    bool CanProcess();
    // The error of a method that finds no service.
    static binder::Status ServiceIsNull(const char* method, int line);
    // Adds one to the daemon's counter `name`.
    void Count(const char* name);

    const sp<OrvaneService> service_;
    const bool checkCaller_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_SERVICE_ORVANE_NATIVE_SERVICE_H
