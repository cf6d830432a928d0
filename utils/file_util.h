#ifndef ORVANE_UTILS_FILE_UTIL_H
#define ORVANE_UTILS_FILE_UTIL_H

#include <sys/types.h>

#include <cstdint>
#include <string>

namespace android {
namespace Orvane {
namespace FileUtil {

// Creates the path and its missing parents; only the folders this call creates get `mode`.
bool CreateDirectory(const std::string& path, mode_t mode);
bool CreateDirectoryWithOwner(const std::string& path, uid_t uid, gid_t gid);
bool ChangeMode(const std::string& path, mode_t mode);
bool IsDirectory(const std::string& path);
bool FileExists(const std::string& path);
bool CheckFilePermission(const std::string& path, int accessMask);
int64_t GetFileSize(const std::string& path);
// Whole file into `content` (NULs trimmed at both ends); files over 32 MiB are refused.
bool LoadStringFromFile(const std::string& path, std::string& content);
bool SaveStringToFile(const std::string& path, const std::string& content, bool truncate);
void DeleteFile(const std::string& path);
bool MoveFile(const std::string& oldPath, const std::string& newPath);
// True when A's modification time (whole seconds) is not older than B's.
bool IsFileLatest(const std::string& pathA, const std::string& pathB);
// Deletes a file or a folder tree, adding the freed bytes to `total`; 0 on success.
int32_t DeleteDirectoryOrFile(const std::string& path, uint64_t& total, bool removeSelf);

}  // namespace FileUtil
}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_UTILS_FILE_UTIL_H
