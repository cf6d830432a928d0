#ifndef ORVANE_UTILS_ZIP_PACK_H
#define ORVANE_UTILS_ZIP_PACK_H

#include <unzip.h>
#include <zip.h>

#include <cstdint>
#include <deque>
#include <functional>
#include <string>
#include <vector>

#include "utils/thread_checker.h"

namespace android {
namespace Orvane {

// The few minizip calls shared by the writer and the reader.
class ZipBase {
public:
    ZipBase() = default;
    virtual ~ZipBase() = default;
    ZipBase(const ZipBase&) = delete;
    ZipBase& operator=(const ZipBase&) = delete;

protected:
    // appendMode is one of minizip's APPEND_STATUS_* values; null on failure.
    zipFile OpenZip(const std::string& path, int appendMode);
    unzFile OpenForUnzip(const std::string& path);
    // Starts a deflated, unencrypted entry stamped with the current local time.
    bool OpenNewFileInZip(zipFile zipHandle, const std::string& entryName);
    bool CloseNewFileEntry(zipFile zipHandle);
};

// Writes a zip archive from lists of files and folders: CreateZip, AddFiles (any number of
// times), Close. Files are written in batches of 50; the remainder only on Close, so a pack
// destroyed without Close leaves its pending paths out of the archive.
// Not thread-safe: one owner thread drives an instance from creation to Close (checked), after
// which another may take it over.
class ZipPack : public ZipBase {
public:
    ZipPack() = default;
    ~ZipPack() override;

    bool CreateZip(const std::string& path);
    // Queues paths (files or folders; absolute paths keep their folders inside the archive,
    // without the leading "/") and writes every full batch. False when no archive is open or
    // every path written now failed.
    bool AddFiles(const std::vector<std::string>& paths);
    // Writes whole batches, and with force also the remainder. False only when every path
    // processed failed; a missing or unreadable file still leaves an empty entry.
    bool FlushFilesIfNeeded(bool force);
    // An empty entry whose name ends in "/".
    bool AddDirectoryEntryToZip(const std::string& entryName);
    // Copies the file's bytes into the entry that is currently open.
    bool AddFileContentToZip(const std::string& path);
    // Writes the entry entryName at once from an open descriptor (read from its current offset,
    // at most maxBytes), so that what is packed is the file that was opened and checked, whatever
    // its path names now, and a file that grows while it is read costs no more than was granted.
    bool AddFileFromFd(int fd, const std::string& entryName, uint64_t maxBytes = UINT64_MAX);
    // Writes every pending path and finishes the archive; nothing when none is open.
    void Close();

private:
    static constexpr size_t kBatchSize = 50;

    // Copies what is readable from fd, at most maxBytes, into the open entry; `what` names it in
    // log lines.
    bool CopyToEntry(int fd, const std::string& what, uint64_t maxBytes = UINT64_MAX);

    ThreadChecker owner_;
    zipFile zipHandle_ = nullptr;
    std::deque<std::string> pending_;
};

// Finds one entry of an existing archive and streams it to a caller's function: Open, any
// number of ExtractFile, Close. Not thread-safe: one owner thread from Open to Close (checked).
class ZipReader : public ZipBase {
public:
    // Called for every read of an entry with (buffer, buffer size, bytes read); bytes read is 0
    // at the end and negative on a read error. A non-zero result stops the streaming.
    using Consumer = std::function<int(const char* data, uint32_t bufferSize, int32_t bytesRead)>;

    ZipReader() = default;
    ~ZipReader() override;

    bool Open(const std::string& path);
    // Streams the entry named exactly entryName. True also when the archive holds no such
    // entry: the consumer is then never called.
    bool ExtractFile(const std::string& entryName, char* buffer, uint32_t bufferSize, const Consumer& consumer);
    // Streams the entry the reader stands at.
    bool ReadFileContent(char* buffer, uint32_t bufferSize, const Consumer& consumer);
    void Close();

private:
    static constexpr size_t kNameBufferSize = 256;

    ThreadChecker owner_;
    unzFile unzHandle_ = nullptr;
    int32_t entryCount_ = 0;
    bool atFirstEntry_ = true;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_UTILS_ZIP_PACK_H
