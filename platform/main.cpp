#include <signal.h>

#include "platform/plugin_platform.h"
#include "service/orvane_service.h"
#include "utils/orvane_log.h"

using android::sp;
using android::Orvane::OrvaneService;
using android::Orvane::PluginPlatform;

#if defined(__SANITIZE_THREAD__)
// libutils is not built for ThreadSanitizer, so it cannot see that RefBase's reference count
// orders every access before the delete: an event freed by the last decStrong on another thread
// than its last user would be reported as a race.
extern "C" const char* __tsan_default_suppressions() {
    return "race:android::RefBase::decStrong\n";
}
#endif

namespace {

// A write to a pipe whose reader is gone (a dump caller that left) then fails with EPIPE instead
// of ending the daemon. A handler rather than SIG_IGN, so that the commands it runs start with
// the default action, as they expect.
void IgnoreBrokenPipe(int) {}

}  // namespace

int main(int argc, char** argv) {
    // Every thread inherits this mask, so the command runner alone collects its children.
    sigset_t childSignal;
    sigemptyset(&childSignal);
    sigaddset(&childSignal, SIGCHLD);
    pthread_sigmask(SIG_BLOCK, &childSignal, nullptr);
    struct sigaction brokenPipe = {};
    brokenPipe.sa_handler = IgnoreBrokenPipe;
    sigaction(SIGPIPE, &brokenPipe, nullptr);

    PluginPlatform& platform = PluginPlatform::GetInstance();
    if (platform.ParseArgs(argc, argv) != 0) {
        OLOGE("%s parse args failed");
        return -1;
    }
    if (!platform.StartPlatform()) {
        OLOGE("%s start platform failed");
        return -1;
    }
    // Serves the companion application on this thread for the rest of the process's life.
    sp<OrvaneService> service = new OrvaneService(&platform);
    if (!service->StartService()) {
        OLOGE("%s start service failed");
        return -1;
    }
    return 0;
}
