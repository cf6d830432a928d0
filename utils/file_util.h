#ifndef ORVANE_UTILS_FILE_UTIL_H
#define ORVANE_UTILS_FILE_UTIL_H

#include <sys/stat.h>
#include <sys/types.h>

#include <cstdint>
#include <string>

namespace android {
namespace Orvane {

// What identifies one version of a file: a reader that keeps what it parsed rereads the file
// only when the stamp changes (a rename into place, a rewrite, a touch).
struct FileStamp {
    dev_t device = 0;
    ino_t inode = 0;
    off_t size = -1;
    int64_t mtimeNs = -1;

    bool operator==(const FileStamp& o) const {
        return device == o.device && inode == o.inode && size == o.size && mtimeNs == o.mtimeNs;
    }
    bool operator!=(const FileStamp& o) const { return !(*this == o); }
};

namespace FileUtil {

// Stateless helpers for files and folders, safe to call from any thread. Failures are reported
// by the result and logged; nothing throws.

// Creates the path and its missing parents; only the folders this call creates get `mode`.
bool CreateDirectory(const std::string& path, mode_t mode);
bool CreateDirectoryWithOwner(const std::string& path, uid_t uid, gid_t gid);
bool ChangeMode(const std::string& path, mode_t mode);
bool IsDirectory(const std::string& path);
bool FileExists(const std::string& path);
bool CheckFilePermission(const std::string& path, int accessMask);
int64_t GetFileSize(const std::string& path);
// Whole file into `content` (NULs trimmed at both ends); files over 32 MiB are refused and
// `content` is left untouched on every failure.
bool LoadStringFromFile(const std::string& path, std::string& content);
// Empty content succeeds without creating or touching the file; `truncate` false appends.
bool SaveStringToFile(const std::string& path, const std::string& content, bool truncate);
void DeleteFile(const std::string& path);
bool MoveFile(const std::string& oldPath, const std::string& newPath);
// True when A's modification time (whole seconds) is not older than B's.
bool IsFileLatest(const std::string& pathA, const std::string& pathB);
// Deletes a file or a folder tree; 0 on success, -1 at the first failure (what was removed
// before stays removed). For a plain file `total` is set to its size; for a folder the sizes of
// its files, of every subfolder and of the folder itself are added to `total`. With
// `removeSelf` false an emptied folder is kept.
int32_t DeleteDirectoryOrFile(const std::string& path, uint64_t& total, bool removeSelf);
// The stamp of the file at path, following links; the empty stamp (size -1) when it is missing.
FileStamp GetFileStamp(const std::string& path);
FileStamp StampOf(const struct stat& st);

}  // namespace FileUtil
}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_UTILS_FILE_UTIL_H
