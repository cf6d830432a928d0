#include "service/orvane_native_service.h"

#include <chrono>
#include <cstring>

#include <android-base/stringprintf.h>
#include <utils/String8.h>

#if defined(__ANDROID__)
#include <binder/IPCThreadState.h>
#include <binder/IServiceManager.h>
#include <private/android_filesystem_config.h>
#endif

#include "plugins/cmd_processor.h"
#include "service/caller_writer.h"
#include "utils/orvane_log.h"

namespace android {
namespace Orvane {
namespace {

constexpr uid_t kSystemUid = 1000;
const char* const kCompanionProcess = "com.quor.orvaneservice";
constexpr int32_t kServiceIsNullError = 1;

std::string ToUtf8(const String16& str) {
    return String8(str).string();
}

// Dumps show much of the device, so they go, as platform services' do, to callers that hold the
// DUMP permission; while the permission service is not up (checking then would wait for it),
// to root, system and shell, whom it would grant the permission. On the host the socket's mode
// (0660) lets in only the daemon's user and group, so whoever gets here may dump.
bool CallerMayDump() {
#if defined(__ANDROID__)
    if (defaultServiceManager()->checkService(String16("permission")) != nullptr) {
        return checkCallingPermission(String16("android.permission.DUMP"));
    }
    uid_t uid = IPCThreadState::self()->getCallingUid();
    return uid == AID_ROOT || uid == AID_SYSTEM || uid == AID_SHELL;
#else
    return true;
#endif
}

}  // namespace

OrvaneNativeService::OrvaneNativeService(const sp<OrvaneService>& service, bool checkCaller)
    : service_(service), checkCaller_(checkCaller) {}

bool OrvaneNativeService::CanProcess() {
    if (!checkCaller_) {
        return true;
    }
    uid_t uid = IPCThreadState::self()->getCallingUid();
    if (uid != kSystemUid) {
        Count("service.refused.uid");
        OLOGI_LIMITED("%s not suport calling_uid %d", static_cast<int>(uid));
        return false;
    }
    pid_t pid = IPCThreadState::self()->getCallingPid();
    // The command line's first argument is the process name.
    if (strcmp(CmdProcessor::GetProcNameByPid(pid).c_str(), kCompanionProcess) != 0) {
        Count("service.refused.process");
        OLOGI_LIMITED("%s not suport process %d", pid);
        return false;
    }
    return true;
}

void OrvaneNativeService::Count(const char* name) {
    if (service_ != nullptr) {
        service_->GetStats().Add(name);
    }
}

binder::Status OrvaneNativeService::ServiceIsNull(const char* method, int line) {
    OLOG_AS(ANDROID_LOG_ERROR, method, "%s service is null");
    return binder::Status::fromServiceSpecificError(kServiceIsNullError,
                                                    String8::format("%s:%d: %s", method, line, "service is null"));
}

binder::Status OrvaneNativeService::notifyPackLog(int* result) {
    if (!CanProcess()) {
        return binder::Status::ok();
    }
    if (service_ == nullptr) {
        return ServiceIsNull(__func__, __LINE__);
    }
    OLOGI("%s notify pack log start");
    *result = service_->NotifyPackLog();
    return binder::Status::ok();
}

binder::Status OrvaneNativeService::setRunMode(const String16& name, const String16& file) {
    if (!CanProcess()) {
        return binder::Status::ok();
    }
    if (service_ == nullptr) {
        return ServiceIsNull(__func__, __LINE__);
    }
    std::string nameUtf8 = ToUtf8(name);
    std::string fileUtf8 = ToUtf8(file);
    OLOGI("%s set run mode name=%s, file=%s", nameUtf8.c_str(), fileUtf8.c_str());
    service_->SetRunMode(nameUtf8, fileUtf8);
    return binder::Status::ok();
}

binder::Status OrvaneNativeService::notifyUploadSwitch(bool on) {
    if (!CanProcess()) {
        return binder::Status::ok();
    }
    if (service_ == nullptr) {
        return ServiceIsNull(__func__, __LINE__);
    }
    OLOGI("%s notify update switch start %d", on ? 1 : 0);
    service_->NotifyUploadSwitch(on);
    return binder::Status::ok();
}

binder::Status OrvaneNativeService::notifyConfigUpdate(const String16& folder) {
    if (!CanProcess()) {
        return binder::Status::ok();
    }
    if (service_ == nullptr) {
        return ServiceIsNull(__func__, __LINE__);
    }
    std::string folderUtf8 = ToUtf8(folder);
    OLOGI("%s notify config update start %s", folderUtf8.c_str());
    service_->NotifyConfigUpdate(folderUtf8);
    return binder::Status::ok();
}

binder::Status OrvaneNativeService::notifyUserActivated() {
    if (!CanProcess()) {
        return binder::Status::ok();
    }
    if (service_ == nullptr) {
        return ServiceIsNull(__func__, __LINE__);
    }
    OLOGI("%s notify user activate");
    service_->NotifyUserActivated();
    return binder::Status::ok();
}

status_t OrvaneNativeService::dump(int fd, const Vector<String16>& args) {
    if (service_ == nullptr) {
        return OK;
    }
    if (fd < 0) {
        return BAD_VALUE;
    }
    if (!CallerMayDump()) {
        Count("service.dump.refused");
        pid_t pid = IPCThreadState::self()->getCallingPid();
        int uid = static_cast<int>(IPCThreadState::self()->getCallingUid());
        OLOGW_LIMITED("%s dump refused to pid %d, uid %d", pid, uid);
        std::string denial =
                android::base::StringPrintf("Permission Denial: can't dump orvane from pid=%d, uid=%d\n", pid, uid);
        CallerWriter::Write(fd, denial.data(), denial.size(),
                            std::chrono::steady_clock::now() + OrvaneService::kDumpDeliveryBound);
        return OK;
    }
    std::vector<std::string> utf8Args;
    for (size_t i = 0; i < args.size(); ++i) {
        utf8Args.push_back(ToUtf8(args[i]));
    }
    service_->Dump(fd, utf8Args);
    return OK;
}

}  // namespace Orvane
}  // namespace android
