#include "utils/file_util.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include <android-base/file.h>
#include <android-base/unique_fd.h>

#include "utils/orvane_log.h"
#include "utils/string_util.h"

namespace android {
namespace Orvane {
namespace FileUtil {
namespace {

constexpr int64_t kMaxLoadBytes = 32 * 1024 * 1024;

// Size of a file through stat; 0, with the size query's info line, when stat fails.
int64_t StatSize(const std::string& path) {
    struct stat st;
    if (stat(path.c_str(), &st) != 0) {
        OLOG_LIMITED_AS(ANDROID_LOG_INFO, "GetFileSize", "%s errno %d,err %s", errno, strerror(errno));
        return 0;
    }
    return st.st_size;
}

int64_t ModifiedSeconds(const std::string& path) {
    struct stat st;
    return stat(path.c_str(), &st) == 0 ? st.st_mtime : 0;
}

// Unlinks the entries of an open directory one by one, deepest first; stops at the first failure.
int32_t DeleteEntries(DIR* dir, const std::string& path, uint64_t& total) {
    while (struct dirent* entry = readdir(dir)) {
        if (strcmp(entry->d_name, ".") == 0 || strcmp(entry->d_name, "..") == 0) {
            continue;
        }
        std::string entryPath = path + "/" + entry->d_name;
        // lstat: a link to a folder elsewhere is removed as a link, never followed into.
        struct stat st;
        if (lstat(entryPath.c_str(), &st) != 0) {
            OLOG_LIMITED_AS(ANDROID_LOG_ERROR, "DeleteDirectoryOrFile", "%s stat %s failed, errno:%d, err:%s",
                            entryPath.c_str(), errno, strerror(errno));
            return -1;
        }
        if (S_ISDIR(st.st_mode)) {
            uint64_t subTotal = 0;
            int32_t ret = DeleteDirectoryOrFile(entryPath, subTotal, true);
            total += subTotal;
            if (ret != 0) {
                return ret;
            }
            continue;
        }
        total += st.st_size;
        if (unlink(entryPath.c_str()) != 0) {
            OLOG_LIMITED_AS(ANDROID_LOG_ERROR, "DeleteDirectoryOrFile", "%s unlink %s failed, errno:%d, err:%s",
                            entryPath.c_str(), errno, strerror(errno));
            return -1;
        }
    }
    return 0;
}

}  // namespace

bool CreateDirectory(const std::string& path, mode_t mode) {
    if (path.empty()) {
        OLOGE("%s empty path");
        return false;
    }
    if (FileExists(path)) {
        return true;
    }
    const std::string work = "/" + StringUtil::TrimStr(path, '/') + "/";
    size_t firstCreated = 0;  // length of the first prefix this call created; 0 for none
    for (size_t slash = work.find('/', 1); slash != std::string::npos; slash = work.find('/', slash + 1)) {
        const std::string prefix = work.substr(0, slash);
        if (FileExists(prefix)) {
            continue;
        }
        if (mkdir(prefix.c_str(), 0777) != 0) {
            if (errno == EEXIST) {  // another thread or process was first; not ours to change
                continue;
            }
            OLOGE_LIMITED("%s mkdir %s failed, %s, err:%s", prefix.c_str(), path.c_str(), strerror(errno));
            return false;
        }
        if (firstCreated == 0) {
            firstCreated = slash;
        }
    }
    if (firstCreated == 0) {
        return true;
    }
    // Deepest first, up to the first folder created here; folders that existed keep their mode.
    for (size_t end = work.size() - 1; end >= firstCreated; end = work.rfind('/', end - 1)) {
        const std::string dir = work.substr(0, end);
        if (!FileExists(dir) || chmod(dir.c_str(), mode) != 0) {
            OLOGE_LIMITED("%s change mode %s failed", dir.c_str());
            return false;
        }
    }
    return true;
}

bool CreateDirectoryWithOwner(const std::string& path, uid_t uid, gid_t gid) {
    if (!CreateDirectory(path, 0775)) {
        return false;
    }
    // The owner is a courtesy to the readers of the folder; the folder is usable without it.
    if (chown(path.c_str(), uid, gid) != 0) {
        OLOGD("%s chown %s to %u:%u failed, err:%s", path.c_str(), uid, gid, strerror(errno));
    }
    return true;
}

bool ChangeMode(const std::string& path, mode_t mode) {
    return FileExists(path) && chmod(path.c_str(), mode) == 0;
}

bool IsDirectory(const std::string& path) {
    struct stat st;
    return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

bool FileExists(const std::string& path) {
    return access(path.c_str(), F_OK) == 0;
}

bool CheckFilePermission(const std::string& path, int accessMask) {
    return access(path.c_str(), accessMask) == 0;
}

int64_t GetFileSize(const std::string& path) {
    return StatSize(path);
}

bool LoadStringFromFile(const std::string& path, std::string& content) {
    // Close-on-exec, as every descriptor of the daemon: the command runner's children must not
    // inherit it.
    android::base::unique_fd fd(TEMP_FAILURE_RETRY(open(path.c_str(), O_RDONLY | O_CLOEXEC)));
    if (fd < 0) {
        OLOGE_LIMITED("%s open %s failed, errno:%d, err:%s", path.c_str(), errno, strerror(errno));
        return false;
    }
    // Measured with fstat: files of /proc (seq files) refuse a seek to their end.
    struct stat st;
    if (fstat(fd, &st) != 0 || st.st_size > kMaxLoadBytes) {
        OLOGE_LIMITED("%s %s is over %lld bytes or cannot be measured", path.c_str(),
                      static_cast<long long>(kMaxLoadBytes));
        return false;
    }
    // Read to the end rather than to the measured size: files of /proc measure 0 bytes, and a
    // file may grow while it is read. The limit holds for what is actually read.
    std::string text;
    char buffer[16 * 1024];
    ssize_t got;
    while ((got = TEMP_FAILURE_RETRY(read(fd, buffer, sizeof(buffer)))) > 0 &&
           text.size() + got <= static_cast<size_t>(kMaxLoadBytes)) {
        text.append(buffer, got);
    }
    if (got != 0) {
        OLOGE_LIMITED("%s read %s failed or it grew over %lld bytes", path.c_str(),
                      static_cast<long long>(kMaxLoadBytes));
        return false;
    }
    content = StringUtil::TrimStr(text, '\0');
    return true;
}

bool SaveStringToFile(const std::string& path, const std::string& content, bool truncate) {
    if (content.empty()) {
        return true;
    }
    int flags = O_WRONLY | O_CREAT | O_CLOEXEC | (truncate ? O_TRUNC : O_APPEND);
    android::base::unique_fd fd(TEMP_FAILURE_RETRY(open(path.c_str(), flags, 0666)));
    if (fd < 0) {
        OLOGE_LIMITED("%s open %s failed, errno:%d, err:%s", path.c_str(), errno, strerror(errno));
        return false;
    }
    // A failed close can be the first report of a failed write.
    if (!android::base::WriteStringToFd(content, fd) || close(fd.release()) != 0) {
        OLOGE_LIMITED("%s write %s failed, errno:%d, err:%s", path.c_str(), errno, strerror(errno));
        return false;
    }
    return true;
}

void DeleteFile(const std::string& path) {
    if (!FileExists(path)) {
        OLOGE_LIMITED("%s  file not exist %s", path.c_str());
        return;
    }
    if (remove(path.c_str()) != 0) {
        OLOGE_LIMITED("%s remove file %s errno:%d, err:%s", path.c_str(), errno, strerror(errno));
    }
}

bool MoveFile(const std::string& oldPath, const std::string& newPath) {
    if (rename(oldPath.c_str(), newPath.c_str()) != 0) {
        OLOGE_LIMITED("%s move file %s to %s failed, err:%d, %s", oldPath.c_str(), newPath.c_str(), errno,
                      strerror(errno));
        return false;
    }
    return true;
}

bool IsFileLatest(const std::string& pathA, const std::string& pathB) {
    return ModifiedSeconds(pathA) >= ModifiedSeconds(pathB);
}

int32_t DeleteDirectoryOrFile(const std::string& path, uint64_t& total, bool removeSelf) {
    DIR* dir = opendir(path.c_str());
    if (dir == nullptr) {
        if (errno != ENOTDIR) {
            OLOGE_LIMITED("%s open %s failed, errno:%d, err:%s", path.c_str(), errno, strerror(errno));
            return -1;
        }
        total = static_cast<uint64_t>(StatSize(path));
        if (unlink(path.c_str()) != 0) {
            OLOGE_LIMITED("%s unlink %s failed, errno:%d, err:%s", path.c_str(), errno, strerror(errno));
            return -1;
        }
        return 0;
    }
    int32_t ret = DeleteEntries(dir, path, total);
    closedir(dir);
    if (ret != 0) {
        return ret;
    }
    struct stat st;
    if (stat(path.c_str(), &st) == 0) {
        total += st.st_size;
    }
    if (removeSelf && rmdir(path.c_str()) != 0) {
        OLOGE_LIMITED("%s rmdir %s failed, errno:%d, err:%s", path.c_str(), errno, strerror(errno));
        return -1;
    }
    return 0;
}

FileStamp StampOf(const struct stat& st) {
    return {st.st_dev, st.st_ino, st.st_size,
            static_cast<int64_t>(st.st_mtim.tv_sec) * 1000000000 + st.st_mtim.tv_nsec};
}

FileStamp GetFileStamp(const std::string& path) {
    struct stat st;
    return stat(path.c_str(), &st) == 0 ? StampOf(st) : FileStamp();
}

}  // namespace FileUtil
}  // namespace Orvane
}  // namespace android
