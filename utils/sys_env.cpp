#include "utils/sys_env.h"

#include "utils/orvane_log.h"

#if defined(__ANDROID__)
#include <cutils/properties.h>
#else
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <map>
#include <mutex>
#include <sstream>
#endif

namespace android {
namespace Orvane {
namespace {

bool IsValidKey(const std::string& key) {
    if (key.empty()) {
        return false;
    }
    for (char c : key) {
        if (c == '=' || c == '#' || c == '\n' || c == '\r' || c == ' ' || c == '\t' || c == '\0') {
            return false;
        }
    }
    return true;
}

bool CheckProperty(const char* op, const std::string& key, const std::string& value) {
    if (!IsValidKey(key)) {
        OLOG_AS(ANDROID_LOG_ERROR, op, "%s invalid property key \"%s\"", key.c_str());
        return false;
    }
    if (value.size() > SysEnv::kMaxValueLength || value.find_first_of("\n\r", 0) != std::string::npos ||
        value.find('\0') != std::string::npos) {
        OLOG_AS(ANDROID_LOG_ERROR, op, "%s value of %s refused: %zu bytes or a line break, at most %zu bytes",
                key.c_str(), value.size(), SysEnv::kMaxValueLength);
        return false;
    }
    return true;
}

}  // namespace

#if defined(__ANDROID__)

std::string SysEnv::GetSysProperity(const std::string& key, const std::string& defaultValue) {
    char value[PROPERTY_VALUE_MAX] = {0};
    property_get(key.c_str(), value, defaultValue.c_str());
    return value;
}

bool SysEnv::SetSysProperity(const std::string& key, const std::string& value) {
    if (!CheckProperty(__func__, key, value)) {
        return false;
    }
    int ret = property_set(key.c_str(), value.c_str());
    if (ret != 0) {
        OLOGE("%s property_set %s failed, ret=%d", key.c_str(), ret);
        return false;
    }
    return true;
}

#else  // host

namespace {

// The host store: the parsed file and the identity of the version that was parsed, so that a
// read only reparses when another writer has replaced or changed the file.
class HostPropertyStore {
public:
    static HostPropertyStore& Get() {
        static HostPropertyStore store;
        return store;
    }

    std::string Read(const std::string& key, const std::string& defaultValue) {
        std::lock_guard<std::mutex> lock(mutex_);
        if (!path_.empty()) {
            RefreshLocked();
        }
        auto it = values_.find(key);
        return it == values_.end() ? defaultValue : it->second;
    }

    bool Write(const std::string& key, const std::string& value) {
        std::lock_guard<std::mutex> lock(mutex_);
        if (path_.empty()) {
            values_[key] = value;
            return true;
        }
        // The lock file is never replaced, unlike the property file, so every writer locks the
        // same inode.
        int lockFd = open((path_ + ".lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0660);
        if (lockFd < 0 || flock(lockFd, LOCK_EX) != 0) {
            OLOG_AS(ANDROID_LOG_ERROR, "SetSysProperity", "%s lock %s.lock failed, errno %d", path_.c_str(),
                    errno);
            if (lockFd >= 0) {
                close(lockFd);
            }
            return false;
        }
        RefreshLocked(true);  // reread under the lock so that no other writer's change is lost
        values_[key] = value;
        bool ok = SaveLocked();
        close(lockFd);
        return ok;
    }

private:
    struct Stamp {
        ino_t inode = 0;
        off_t size = -1;
        int64_t mtimeNs = -1;
        bool operator==(const Stamp& o) const { return inode == o.inode && size == o.size && mtimeNs == o.mtimeNs; }
    };

    HostPropertyStore() {
        const char* path = getenv("ORVANE_PROPERTY_FILE");
        if (path != nullptr) {
            path_ = path;
        }
    }

    void RefreshLocked(bool force = false) {
        struct stat st;
        Stamp now;
        if (stat(path_.c_str(), &st) == 0) {
            now = {st.st_ino, st.st_size, static_cast<int64_t>(st.st_mtim.tv_sec) * 1000000000 + st.st_mtim.tv_nsec};
        }
        if (!force && now == stamp_) {
            return;
        }
        stamp_ = now;
        values_.clear();
        std::ifstream in(path_);
        std::string line;
        size_t malformed = 0;
        while (std::getline(in, line)) {
            if (!line.empty() && line.back() == '\r') {
                line.pop_back();
            }
            size_t start = line.find_first_not_of(" \t");
            if (start == std::string::npos || line[start] == '#') {
                continue;
            }
            size_t eq = line.find('=', start);
            std::string key = eq == std::string::npos ? "" : line.substr(start, eq - start);
            while (!key.empty() && (key.back() == ' ' || key.back() == '\t')) {
                key.pop_back();
            }
            if (!IsValidKey(key)) {
                ++malformed;
                continue;
            }
            values_[key] = line.substr(eq + 1);
        }
        if (malformed > 0) {
            OLOG_AS(ANDROID_LOG_WARN, "GetSysProperity", "%s skipped %zu malformed lines in %s", malformed,
                    path_.c_str());
        }
    }

    bool SaveLocked() {
        std::ostringstream out;
        for (const auto& kv : values_) {
            out << kv.first << '=' << kv.second << '\n';
        }
        std::string text = out.str();
        std::string tmp = path_ + ".tmp." + std::to_string(getpid());
        int fd = open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        bool ok = fd >= 0 && write(fd, text.data(), text.size()) == static_cast<ssize_t>(text.size());
        if (fd >= 0) {
            ok = fsync(fd) == 0 && ok;
            close(fd);
        }
        if (!ok || rename(tmp.c_str(), path_.c_str()) != 0) {
            OLOG_AS(ANDROID_LOG_ERROR, "SetSysProperity", "%s write %s failed, errno %d", path_.c_str(), errno);
            unlink(tmp.c_str());
            stamp_ = {};
            return false;
        }
        return true;
    }

    std::mutex mutex_;
    std::string path_;
    Stamp stamp_;
    std::map<std::string, std::string> values_;
};

}  // namespace

std::string SysEnv::GetSysProperity(const std::string& key, const std::string& defaultValue) {
    return HostPropertyStore::Get().Read(key, defaultValue);
}

bool SysEnv::SetSysProperity(const std::string& key, const std::string& value) {
    return CheckProperty(__func__, key, value) && HostPropertyStore::Get().Write(key, value);
}

#endif

}  // namespace Orvane
}  // namespace android
