#include "plugins/privacy_path_check.h"

#include <fcntl.h>
#include <limits.h>
#include <unistd.h>

#include "config/privacy_policy.h"
#include "utils/orvane_log.h"

namespace android {
namespace Orvane {

PrivacyPathCheck::PrivacyPathCheck(PluginContext& context)
    : context_(context), refused_(context.GetStats().Get("privacy.path.refused")) {}

bool PrivacyPathCheck::Judge(const std::string& resolved, const struct stat& st) {
    const char* why = nullptr;
    if (!S_ISREG(st.st_mode)) {
        why = "not a regular file";
    } else if (st.st_nlink != 1) {
        // Another name may lie in a forbidden folder; none at all means the file was deleted
        // after the open and the kernel's name of it is no path any more.
        why = "a file with no or several names";
    } else if (!PrivacyPolicyParser::getInstance()->GetPolicy(context_)->AllowsPath(resolved)) {
        why = "outside the allowed log paths";
    }
    if (why == nullptr) {
        return true;
    }
    refused_.fetch_add(1, std::memory_order_relaxed);
    OLOGI_LIMITED("%s a log file was refused: %s", why);  // never its name, which may be private
    return false;
}

bool PrivacyPathCheck::Resolve(const std::string& path, android::base::unique_fd& handle, std::string& resolved,
                               struct stat& st) {
    // O_PATH: a handle to the file that reads nothing and opens no device, so judging a path
    // that names a device node or a FIFO has no side effect.
    handle.reset(path.empty() ? -1 : open(path.c_str(), O_PATH | O_CLOEXEC));
    char name[PATH_MAX];
    ssize_t size = -1;
    if (handle >= 0 && fstat(handle.get(), &st) == 0) {
        // The kernel's name of the file behind the handle: links, ".." and relative parts resolved.
        size = readlink(("/proc/self/fd/" + std::to_string(handle.get())).c_str(), name, sizeof(name) - 1);
    }
    if (size <= 0 || static_cast<size_t>(size) >= sizeof(name) - 1 || name[0] != '/') {
        refused_.fetch_add(1, std::memory_order_relaxed);
        return false;
    }
    resolved.assign(name, static_cast<size_t>(size));
    return true;
}

bool PrivacyPathCheck::IsPrivacycompliance(const std::string& path) {
    android::base::unique_fd handle;
    std::string resolved;
    struct stat st;
    return Resolve(path, handle, resolved, st) && Judge(resolved, st);
}

android::base::unique_fd PrivacyPathCheck::OpenCompliantFile(const std::string& path) {
    android::base::unique_fd handle;
    std::string resolved;
    struct stat st;
    if (!Resolve(path, handle, resolved, st) || !Judge(resolved, st)) {
        return android::base::unique_fd();
    }
    // Opened through the handle, which reaches the judged file itself whatever the path names by
    // now; the identity is compared once more all the same.
    android::base::unique_fd fd(
            open(("/proc/self/fd/" + std::to_string(handle.get())).c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY));
    struct stat opened;
    if (fd < 0 || fstat(fd.get(), &opened) != 0 || opened.st_dev != st.st_dev || opened.st_ino != st.st_ino) {
        refused_.fetch_add(1, std::memory_order_relaxed);
        return android::base::unique_fd();
    }
    return fd;
}

}  // namespace Orvane
}  // namespace android
