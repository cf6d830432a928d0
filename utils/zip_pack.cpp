#include "utils/zip_pack.h"

#include <fcntl.h>
#include <unistd.h>
#include <zlib.h>

#include <algorithm>
#include <cstring>
#include <ctime>

#include <android-base/unique_fd.h>

#include "utils/file_util.h"
#include "utils/orvane_log.h"

namespace android {
namespace Orvane {

namespace {
constexpr uLong kUtf8NameFlag = 0x800;
constexpr int kMemLevel = 8;
constexpr size_t kCopyBufferSize = 8192;
}  // namespace

zipFile ZipBase::OpenZip(const std::string& path, int appendMode) {
    return zipOpen2(path.c_str(), appendMode, nullptr, nullptr);
}

unzFile ZipBase::OpenForUnzip(const std::string& path) {
    return unzOpen2(path.c_str(), nullptr);
}

bool ZipBase::OpenNewFileInZip(zipFile zipHandle, const std::string& entryName) {
    zip_fileinfo info = {};
    time_t now = time(nullptr);
    struct tm local = {};
    localtime_r(&now, &local);
    info.tmz_date.tm_sec = local.tm_sec;
    info.tmz_date.tm_min = local.tm_min;
    info.tmz_date.tm_hour = local.tm_hour;
    info.tmz_date.tm_mday = local.tm_mday;
    // Handed over as the calendar month although minizip counts from 0: the packs' consumers
    // expect the stored month to be one higher.
    info.tmz_date.tm_mon = local.tm_mon + 1;
    info.tmz_date.tm_year = local.tm_year + 1900;
    int ret = zipOpenNewFileInZip4(zipHandle, entryName.c_str(), &info, nullptr, 0, nullptr, 0, nullptr, Z_DEFLATED,
                                   Z_DEFAULT_COMPRESSION, 0, -MAX_WBITS, kMemLevel, Z_DEFAULT_STRATEGY, nullptr, 0, 0,
                                   kUtf8NameFlag);
    if (ret != ZIP_OK) {
        OLOGE_LIMITED("%s zipOpenNewFileInZip4 failed");
        return false;
    }
    return true;
}

bool ZipBase::CloseNewFileEntry(zipFile zipHandle) {
    return zipCloseFileInZip(zipHandle) == ZIP_OK;
}

ZipPack::~ZipPack() {
    pending_.clear();
    Close();
}

bool ZipPack::CreateZip(const std::string& path) {
    Close();
    owner_.Check(__func__);
    zipHandle_ = OpenZip(path, APPEND_STATUS_CREATE);
    if (zipHandle_ == nullptr) {
        OLOGE_LIMITED("%s Couldn't create ZIP file at path %s %p", path.c_str(), zipHandle_);
        return false;
    }
    return true;
}

bool ZipPack::AddFiles(const std::vector<std::string>& paths) {
    owner_.Check(__func__);
    if (zipHandle_ == nullptr) {
        return false;
    }
    pending_.insert(pending_.end(), paths.begin(), paths.end());
    return FlushFilesIfNeeded(false);
}

bool ZipPack::FlushFilesIfNeeded(bool force) {
    owner_.Check(__func__);
    if (pending_.size() < kBatchSize && !force) {
        return true;
    }
    size_t processed = 0;
    size_t failed = 0;
    while (pending_.size() >= kBatchSize || (force && !pending_.empty())) {
        size_t batch = std::min(kBatchSize, pending_.size());
        for (size_t i = 0; i < batch; ++i) {
            std::string path = std::move(pending_.front());
            pending_.pop_front();
            ++processed;
            std::string entryName = path[0] == '/' ? path.substr(1) : path;
            if (FileUtil::IsDirectory(path)) {
                failed += AddDirectoryEntryToZip(entryName) ? 0 : 1;
                continue;
            }
            if (!OpenNewFileInZip(zipHandle_, entryName)) {
                ++failed;
                continue;
            }
            // The entry is closed even when copying failed, leaving it empty.
            bool copied = AddFileContentToZip(path);
            bool closed = CloseNewFileEntry(zipHandle_);
            failed += (copied && closed) ? 0 : 1;
        }
    }
    return failed == 0 || failed < processed;
}

bool ZipPack::AddDirectoryEntryToZip(const std::string& entryName) {
    std::string name = entryName;
    if (name.empty() || name.back() != '/') {
        name += '/';
    }
    if (!OpenNewFileInZip(zipHandle_, name)) {
        return false;
    }
    return CloseNewFileEntry(zipHandle_);
}

bool ZipPack::AddFileContentToZip(const std::string& path) {
    if (!FileUtil::FileExists(path)) {
        return false;
    }
    android::base::unique_fd fd(TEMP_FAILURE_RETRY(open(path.c_str(), O_RDONLY | O_CLOEXEC)));
    if (fd < 0) {
        OLOGI_LIMITED("%s open file %s failed", path.c_str());
        return false;
    }
    return CopyToEntry(fd.get(), path);
}

bool ZipPack::AddFileFromFd(int fd, const std::string& entryName, uint64_t maxBytes) {
    owner_.Check(__func__);
    if (zipHandle_ == nullptr || fd < 0 || !OpenNewFileInZip(zipHandle_, entryName)) {
        return false;
    }
    // The entry is closed even when copying failed, leaving what was copied.
    bool copied = CopyToEntry(fd, entryName, maxBytes);
    return CloseNewFileEntry(zipHandle_) && copied;
}

bool ZipPack::CopyToEntry(int fd, const std::string& what, uint64_t maxBytes) {
    char buffer[kCopyBufferSize];
    while (maxBytes > 0) {
        ssize_t n = TEMP_FAILURE_RETRY(read(fd, buffer, std::min<uint64_t>(sizeof(buffer), maxBytes)));
        if (n == 0) {
            return true;
        }
        if (n < 0) {
            // A read error never turns into end of file; keep what was copied so far.
            OLOG_LIMITED_AS(ANDROID_LOG_INFO, "AddFileContentToZip", "%s read file %s failed", what.c_str());
            return false;
        }
        if (zipWriteInFileInZip(zipHandle_, buffer, static_cast<unsigned>(n)) != ZIP_OK) {
            OLOG_LIMITED_AS(ANDROID_LOG_INFO, "AddFileContentToZip", "%s Could not write data to zip for path:%s ",
                            what.c_str());
            return false;
        }
        maxBytes -= static_cast<uint64_t>(n);
    }
    return true;
}

void ZipPack::Close() {
    owner_.Check(__func__);
    if (zipHandle_ == nullptr) {
        owner_.Detach();
        return;
    }
    if (!FlushFilesIfNeeded(true)) {
        OLOGE_LIMITED("%s force flush files failed");
    }
    if (zipClose(zipHandle_, nullptr) != ZIP_OK) {
        OLOGE_LIMITED("%s close zip file failed");
    }
    zipHandle_ = nullptr;
    owner_.Detach();
}

ZipReader::~ZipReader() {
    Close();
}

bool ZipReader::Open(const std::string& path) {
    owner_.Check(__func__);
    if (unzHandle_ != nullptr) {
        OLOGD("%s unzip file already exist %s", path.c_str());
        return false;
    }
    unzHandle_ = OpenForUnzip(path);
    if (unzHandle_ == nullptr) {
        OLOGI_LIMITED("%s unzip file failed %s", path.c_str());
        return false;
    }
    unz_global_info globalInfo = {};
    if (unzGetGlobalInfo(unzHandle_, &globalInfo) != UNZ_OK) {
        OLOG_LIMITED_AS(ANDROID_LOG_INFO, "OpenInternal", "%s open unzip internal file get Global info failed");
        return false;
    }
    entryCount_ = static_cast<int32_t>(globalInfo.number_entry);
    if (entryCount_ < 0) {
        return false;
    }
    atFirstEntry_ = true;
    return true;
}

bool ZipReader::ExtractFile(const std::string& entryName, char* buffer, uint32_t bufferSize, const Consumer& consumer) {
    owner_.Check(__func__);
    if (unzHandle_ == nullptr) {
        return false;
    }
    if (!atFirstEntry_) {
        if (unzGoToFirstFile(unzHandle_) != UNZ_OK) {
            OLOGI_LIMITED("%s unzip file goto first failed %s", entryName.c_str());
            return false;
        }
        atFirstEntry_ = true;
    }
    if (entryCount_ < 1) {
        return true;
    }
    for (int32_t i = 0; i < entryCount_; ++i) {
        char name[kNameBufferSize + 1] = {};  // one spare byte keeps a full-length name terminated
        unz_file_info info = {};
        if (unzGetCurrentFileInfo(unzHandle_, &info, name, kNameBufferSize, nullptr, 0, nullptr, 0) != UNZ_OK) {
            OLOGI_LIMITED("%s get zip file info failed %s", entryName.c_str());
            return false;
        }
        if (info.size_filename < kNameBufferSize && info.size_filename == entryName.size() &&
            memcmp(name, entryName.data(), entryName.size()) == 0) {
            return ReadFileContent(buffer, bufferSize, consumer);
        }
        if (i < entryCount_ - 1) {
            if (unzGoToNextFile(unzHandle_) != UNZ_OK) {
                OLOGI_LIMITED("%s goto next file info failed %s", name);
            }
            atFirstEntry_ = false;
        }
    }
    return true;
}

bool ZipReader::ReadFileContent(char* buffer, uint32_t bufferSize, const Consumer& consumer) {
    owner_.Check(__func__);
    if (unzHandle_ == nullptr) {
        return false;
    }
    if (unzOpenCurrentFile(unzHandle_) != UNZ_OK) {
        OLOGI_LIMITED("%s open current unzip file info failed");
        return false;
    }
    while (true) {
        memset(buffer, 0, bufferSize);
        int n = unzReadCurrentFile(unzHandle_, buffer, bufferSize);
        if (consumer(buffer, bufferSize, n) != 0) {
            break;
        }
        if (n < 0) {
            OLOGI_LIMITED("%s read unzip file info failed %d", n);
            break;
        }
        if (n == 0) {
            break;
        }
    }
    if (unzCloseCurrentFile(unzHandle_) != UNZ_OK) {
        OLOGI_LIMITED("%s close current unzip file failed");
        return false;
    }
    return true;
}

void ZipReader::Close() {
    owner_.Check(__func__);
    if (unzHandle_ == nullptr) {
        owner_.Detach();
        return;
    }
    if (unzClose(unzHandle_) != UNZ_OK) {
        if (unzGoToFirstFile(unzHandle_) != UNZ_OK) {
            OLOGI_LIMITED("%s unzip file goto first failed ");
            return;
        }
        if (unzClose(unzHandle_) != UNZ_OK) {
            OLOGI_LIMITED("%s unzip file close failed");
        }
    }
    unzHandle_ = nullptr;
    entryCount_ = 0;
    atFirstEntry_ = true;
    owner_.Detach();
}

}  // namespace Orvane
}  // namespace android
