// The host's property store: a text file of key=value lines named by ORVANE_PROPERTY_FILE, shared
// with other processes, or the process's own memory without that variable. Host builds only;
// a device uses the property service (utils/sys_env.cpp).
#include "utils/sys_env.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <map>

#include <android-base/unique_fd.h>
#include <utils/Mutex.h>

#include "utils/file_util.h"
#include "utils/orvane_log.h"
#include "utils/string_util.h"

namespace android {
namespace Orvane {

namespace {

using android::base::unique_fd;

// One line of a property file: a key=value entry, a blank or comment line, or neither.
enum class LineKind { kEntry, kBlank, kMalformed };

LineKind ParseLine(std::string line, std::string& key, std::string& value) {
    if (!line.empty() && line.back() == '\r') {
        line.pop_back();
    }
    size_t start = line.find_first_not_of(" \t");
    if (start == std::string::npos || line[start] == '#') {
        return LineKind::kBlank;
    }
    size_t eq = line.find('=', start);
    if (eq == std::string::npos) {
        return LineKind::kMalformed;
    }
    key = line.substr(start, eq - start);
    key.erase(key.find_last_not_of(" \t") + 1);  // npos + 1 == 0 empties an all-blank key
    value = line.substr(eq + 1);
    return SysEnv::IsValidKey(key) ? LineKind::kEntry : LineKind::kMalformed;
}

// Whole content of an open file; false on a read error.
bool ReadAll(int fd, std::string& text) {
    char buffer[4096];
    ssize_t got;
    while ((got = read(fd, buffer, sizeof(buffer))) != 0) {
        if (got < 0) {
            if (errno == EINTR) {
                continue;
            }
            return false;
        }
        text.append(buffer, static_cast<size_t>(got));
    }
    return true;
}

bool WriteAll(int fd, const std::string& text) {
    size_t done = 0;
    while (done < text.size()) {
        ssize_t put = write(fd, text.data() + done, text.size() - done);
        if (put < 0 && errno != EINTR) {
            return false;
        }
        done += put > 0 ? static_cast<size_t>(put) : 0;
    }
    return true;
}

// The host's property service. With ORVANE_PROPERTY_FILE set, the properties live in that
// file (build.prop format) and are shared with other processes: a read reparses the file when
// its identity (inode, size, modification time) changed; a write rewrites it, keeping comments
// and foreign lines, through a temporary file renamed over it while holding an flock on a
// side lock file, so concurrent writers never lose each other's keys. Without the variable the
// properties live in this process only.
// Threads: any thread may call; `mutex_` guards every member but the path, fixed at creation.
class HostPropertyStore {
public:
    static HostPropertyStore& Get() {
        static HostPropertyStore store;
        return store;
    }

    std::string Read(const std::string& key, const std::string& defaultValue) {
        Mutex::Autolock lock(mutex_);
        if (!path_.empty()) {
            RefreshLocked();
        }
        auto it = values_.find(key);
        // An empty value reads as unset, as on the device.
        return it == values_.end() || it->second.empty() ? defaultValue : it->second;
    }

    bool Write(const std::string& key, const std::string& value) {
        Mutex::Autolock lock(mutex_);
        if (path_.empty()) {
            values_[key] = value;
            return true;
        }
        // The lock file is never replaced, unlike the property file, so all writers lock one inode.
        const std::string lockPath = path_ + ".lock";
        unique_fd lockFd(open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0660));
        if (!lockFd.ok()) {
            OLOG_AS(ANDROID_LOG_ERROR, "SetSysProperity", "%s open %s failed, err:%s", lockPath.c_str(),
                    strerror(errno));
            return false;
        }
        while (flock(lockFd.get(), LOCK_EX) != 0 && errno == EINTR) {
        }
        return WriteLocked(key, value);  // closing lockFd then releases the file lock
    }

private:
    HostPropertyStore() : path_(getenv("ORVANE_PROPERTY_FILE") != nullptr ? getenv("ORVANE_PROPERTY_FILE") : "") {}

    // Reads the file when it changed since the last parse. A missing file holds no properties;
    // an unreadable one is reported once and read as empty; neither stops the caller.
    void RefreshLocked() REQUIRES(mutex_) {
        struct stat st;
        if (stat(path_.c_str(), &st) == 0 && FileUtil::StampOf(st) == stamp_) {
            return;
        }
        std::string text;
        FileStamp stamp;
        int err = ReadFile(text, stamp, nullptr);
        if (err != 0 && err != ENOENT) {
            if (err != lastReadErrno_) {
                OLOG_AS(ANDROID_LOG_WARN, "GetSysProperity", "%s cannot read %s, err:%s", path_.c_str(), strerror(err));
            }
            lastReadErrno_ = err;
            stamp = {};
        } else {
            lastReadErrno_ = 0;
        }
        if (stamp == stamp_) {
            return;
        }
        stamp_ = stamp;
        Parse(text);
    }

    // Opens and reads the property file; 0 or the error number. `stamp` (and `mode` when
    // asked) describe the version read; a missing file gives an empty text.
    int ReadFile(std::string& text, FileStamp& stamp, mode_t* mode) {
        unique_fd fd(open(path_.c_str(), O_RDONLY | O_CLOEXEC));
        if (!fd.ok()) {
            return errno;
        }
        struct stat st;
        if (fstat(fd.get(), &st) != 0 || !ReadAll(fd.get(), text)) {
            return errno;
        }
        stamp = FileUtil::StampOf(st);
        if (mode != nullptr) {
            *mode = st.st_mode & 07777;
        }
        return 0;
    }

    // Replaces `values_` with the entries of `text`; a later line for a key wins. Malformed
    // lines are skipped with one warning for the lot, and only when they differ from the lines
    // already warned about, so a bad line does not warn again at every reload.
    void Parse(const std::string& text) REQUIRES(mutex_) {
        values_.clear();
        std::string malformed;
        size_t count = 0;
        for (const std::string& line : StringUtil::SplitStr(text, '\n')) {
            std::string key;
            std::string value;
            switch (ParseLine(line, key, value)) {
                case LineKind::kEntry:
                    values_[key] = value;
                    break;
                case LineKind::kMalformed:
                    malformed += line + '\n';
                    ++count;
                    break;
                case LineKind::kBlank:
                    break;
            }
        }
        if (count > 0 && malformed != warnedMalformed_) {
            OLOG_AS(ANDROID_LOG_WARN, "GetSysProperity", "%s skipped %zu malformed lines in %s", count, path_.c_str());
        }
        warnedMalformed_ = malformed;
    }

    // Called with the file lock held: rereads the file so that no other writer's change is lost,
    // sets the key on its own line (in place, or appended), and renames the new text over it.
    bool WriteLocked(const std::string& key, const std::string& value) REQUIRES(mutex_) {
        std::string text;
        FileStamp stamp;
        mode_t mode = 0644;
        int err = ReadFile(text, stamp, &mode);
        if (err != 0 && err != ENOENT) {
            // Rewriting a file that could not be read would drop every other property in it.
            OLOG_AS(ANDROID_LOG_ERROR, "SetSysProperity", "%s cannot read %s, err:%s", path_.c_str(), strerror(err));
            return false;
        }
        std::string updated;
        bool placed = false;
        for (std::string line : StringUtil::SplitStr(text, '\n')) {
            std::string lineKey;
            std::string lineValue;
            if (ParseLine(line, lineKey, lineValue) == LineKind::kEntry && lineKey == key) {
                if (placed) {
                    continue;  // duplicates of the key go; its first line holds the value now
                }
                line = key + "=" + value;
                placed = true;
            }
            updated += line + '\n';
        }
        if (!placed) {
            updated += key + "=" + value + '\n';
        }

        const std::string tmp = path_ + ".tmp." + std::to_string(getpid());
        unique_fd fd(open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode));
        struct stat st;
        bool ok = fd.ok() && fchmod(fd.get(), mode) == 0 && WriteAll(fd.get(), updated) && fsync(fd.get()) == 0 &&
                  fstat(fd.get(), &st) == 0;
        err = errno;
        fd.reset();
        if (!ok || rename(tmp.c_str(), path_.c_str()) != 0) {
            err = ok ? errno : err;
            OLOG_AS(ANDROID_LOG_ERROR, "SetSysProperity", "%s write %s failed, err:%s", path_.c_str(), strerror(err));
            unlink(tmp.c_str());
            return false;
        }
        stamp_ = FileUtil::StampOf(st);
        Parse(updated);
        return true;
    }

    Mutex mutex_;
    const std::string path_;
    FileStamp stamp_ GUARDED_BY(mutex_);
    int lastReadErrno_ GUARDED_BY(mutex_) = 0;
    std::string warnedMalformed_ GUARDED_BY(mutex_);
    std::map<std::string, std::string> values_ GUARDED_BY(mutex_);
};

}  // namespace

std::string SysEnv::GetSysProperity(const std::string& key, const std::string& defaultValue) {
    return HostPropertyStore::Get().Read(key, defaultValue);
}

bool SysEnv::SetSysProperity(const std::string& key, const std::string& value) {
    return SysEnv::CheckProperty(key, value) && HostPropertyStore::Get().Write(key, value);
}

}  // namespace Orvane
}  // namespace android
