#include "utils/zip_pack.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdlib>
#include <ctime>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "tests/common/log_capture.h"
#include "utils/file_util.h"

namespace android {
namespace Orvane {
namespace {

struct EntryInfo {
    std::string name;
    uLong dosDate;
    uInt month;  // as minizip decodes it, 0-based
};

// Everything in the archive, in order, read with plain minizip rather than the reader under test.
std::vector<EntryInfo> ListEntries(const std::string& zipPath) {
    std::vector<EntryInfo> entries;
    unzFile unz = unzOpen(zipPath.c_str());
    if (unz == nullptr) {
        return entries;
    }
    for (int ret = unzGoToFirstFile(unz); ret == UNZ_OK; ret = unzGoToNextFile(unz)) {
        char name[1024] = {};
        unz_file_info info = {};
        unzGetCurrentFileInfo(unz, &info, name, sizeof(name) - 1, nullptr, 0, nullptr, 0);
        entries.push_back({name, info.dosDate, info.tmu_date.tm_mon});
    }
    unzClose(unz);
    return entries;
}

// Archives end in NUL bytes, which the text helpers of FileUtil trim.
std::string ReadBinary(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

void WriteBinary(const std::string& path, const std::string& data) {
    std::ofstream(path, std::ios::binary | std::ios::trunc) << data;
}

// Streams one entry through the reader, collecting its text.
bool Extract(ZipReader& reader, const std::string& entry, std::string& content, int* calls = nullptr) {
    char buffer[64];
    content.clear();
    return reader.ExtractFile(entry, buffer, sizeof(buffer), [&](const char* data, uint32_t, int32_t n) {
        if (calls != nullptr) {
            ++*calls;
        }
        if (n > 0) {
            content.append(data, n);
        }
        return 0;
    });
}

class ZipPackTest : public ::testing::Test {
protected:
    void SetUp() override {
        char pattern[] = "/tmp/zip_pack_test.XXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir_ = pattern;
        zip_ = dir_ + "/out.zip";
    }
    void TearDown() override {
        ASSERT_EQ(chdir("/"), 0);
        uint64_t freed = 0;
        FileUtil::DeleteDirectoryOrFile(dir_, freed, true);
    }

    // count files "f<i>.log" whose content names them.
    std::vector<std::string> MakeFiles(int count, const std::string& sub = "files") {
        std::vector<std::string> paths;
        FileUtil::CreateDirectory(dir_ + "/" + sub, 0775);
        for (int i = 0; i < count; ++i) {
            std::string path = dir_ + "/" + sub + "/f" + std::to_string(i) + ".log";
            EXPECT_TRUE(FileUtil::SaveStringToFile(path, "line of file " + std::to_string(i) + "\n", true));
            paths.push_back(path);
        }
        return paths;
    }

    size_t EntriesAfterDestroy(const std::vector<std::vector<std::string>>& calls) {
        {
            ZipPack pack;
            EXPECT_TRUE(pack.CreateZip(zip_));
            for (const auto& paths : calls) {
                EXPECT_TRUE(pack.AddFiles(paths));
            }
        }  // destroyed without Close
        return ListEntries(zip_).size();
    }

    std::string dir_;
    std::string zip_;
};

TEST_F(ZipPackTest, WritesWholeBatchesAndTheRestOnlyOnClose) {
    std::vector<std::string> files = MakeFiles(120);
    std::vector<std::string> first49(files.begin(), files.begin() + 49);
    std::vector<std::string> first50(files.begin(), files.begin() + 50);

    EXPECT_EQ(EntriesAfterDestroy({first49}), 0u);
    EXPECT_EQ(EntriesAfterDestroy({first50}), 50u);
    EXPECT_EQ(EntriesAfterDestroy({files}), 100u);
    // A batch fills up across calls.
    EXPECT_EQ(EntriesAfterDestroy({first49, {files[49]}}), 50u);

    ZipPack pack;
    ASSERT_TRUE(pack.CreateZip(zip_));
    ASSERT_TRUE(pack.AddFiles(files));
    pack.Close();
    std::vector<EntryInfo> entries = ListEntries(zip_);
    ASSERT_EQ(entries.size(), 120u);
    for (size_t i = 0; i < entries.size(); ++i) {
        EXPECT_EQ(entries[i].name, files[i].substr(1)) << "entries keep the order and lose one leading slash";
    }
    EXPECT_EQ(system(("unzip -tqq " + zip_).c_str()), 0);

    // A second CreateZip forces out what the first archive still had pending.
    std::string other = dir_ + "/other.zip";
    ASSERT_TRUE(pack.CreateZip(zip_));
    ASSERT_TRUE(pack.AddFiles(first49));
    ASSERT_TRUE(pack.CreateZip(other));
    pack.Close();
    EXPECT_EQ(ListEntries(zip_).size(), 49u);
    EXPECT_EQ(ListEntries(other).size(), 0u);
}

TEST_F(ZipPackTest, ArchiveReadsBackWithDirectoriesRelativeNamesAndShiftedMonth) {
    std::vector<std::string> files = MakeFiles(3);
    std::string big = dir_ + "/files/big.txt";
    std::string bigContent;
    for (int i = 0; i < 5000; ++i) {
        bigContent += "12-01 10:00:00.000 1000 1000 I tag: message number " + std::to_string(i) + "\n";
    }
    ASSERT_TRUE(FileUtil::SaveStringToFile(big, bigContent, true));
    ASSERT_TRUE(FileUtil::CreateDirectory(dir_ + "/a/b", 0775));
    ASSERT_EQ(chdir(dir_.c_str()), 0);

    time_t before = time(nullptr);
    ZipPack pack;
    ASSERT_TRUE(pack.CreateZip(zip_));
    ASSERT_TRUE(pack.AddFiles({dir_ + "/a/b", files[0], "files/f1.log", big}));
    ASSERT_TRUE(pack.AddDirectoryEntryToZip("extra/"));
    pack.Close();
    time_t after = time(nullptr);
    EXPECT_EQ(system(("unzip -tqq " + zip_).c_str()), 0);

    std::vector<EntryInfo> entries = ListEntries(zip_);
    ASSERT_EQ(entries.size(), 5u);
    EXPECT_EQ(entries[0].name, "extra/");  // written at once, the files only on Close
    EXPECT_EQ(entries[1].name, dir_.substr(1) + "/a/b/");
    EXPECT_EQ(entries[2].name, files[0].substr(1));
    EXPECT_EQ(entries[3].name, "files/f1.log");  // relative paths stay as given

    // Entries carry the month one above the real one, whatever minizip's 0-based convention.
    struct tm localBefore = {};
    struct tm localAfter = {};
    localtime_r(&before, &localBefore);
    localtime_r(&after, &localAfter);
    for (const EntryInfo& entry : entries) {
        uInt dosMonth = (entry.dosDate >> 21) & 0xF;
        EXPECT_TRUE(dosMonth == static_cast<uInt>(localBefore.tm_mon) + 2 ||
                    dosMonth == static_cast<uInt>(localAfter.tm_mon) + 2)
            << entry.name << " month " << dosMonth;
        EXPECT_TRUE(entry.month == static_cast<uInt>(localBefore.tm_mon) + 1 ||
                    entry.month == static_cast<uInt>(localAfter.tm_mon) + 1);
    }

    ZipReader reader;
    ASSERT_TRUE(reader.Open(zip_));
    std::string content;
    ASSERT_TRUE(Extract(reader, big.substr(1), content));
    EXPECT_EQ(content, bigContent);
    // After standing at a later entry the next search rewinds.
    ASSERT_TRUE(Extract(reader, files[0].substr(1), content));
    EXPECT_EQ(content, "line of file 0\n");
    ASSERT_TRUE(Extract(reader, dir_.substr(1) + "/a/b/", content));
    EXPECT_EQ(content, "");
}

TEST_F(ZipPackTest, FailedPathsLeaveEmptyEntriesAndFailOnlyWhenAllFail) {
    std::vector<std::string> files = MakeFiles(1);
    std::string missing = dir_ + "/missing.log";
    // A socket exists but cannot be opened as a file.
    std::string socketPath = dir_ + "/sock";
    int fd = socket(AF_UNIX, SOCK_STREAM, 0);
    ASSERT_GE(fd, 0);
    struct sockaddr_un addr = {};
    addr.sun_family = AF_UNIX;
    snprintf(addr.sun_path, sizeof(addr.sun_path), "%s", socketPath.c_str());
    ASSERT_EQ(bind(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)), 0);

    LogCapture logs;
    {
        ZipPack pack;
        ASSERT_TRUE(pack.CreateZip(zip_));
        std::vector<std::string> allFail(50, missing);
        EXPECT_FALSE(pack.AddFiles(allFail));
        // One good file among failures is success; a read error (this file opens but cannot be
        // read) ends the copy instead of spinning.
        EXPECT_TRUE(pack.AddFiles({missing, socketPath, "/proc/self/mem", files[0]}));
        EXPECT_TRUE(pack.FlushFilesIfNeeded(true));
        EXPECT_TRUE(pack.AddFiles({missing}));
        pack.Close();
    }
    close(fd);
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_INFO, "AddFileContentToZip open file " + socketPath + " failed"));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "Close force flush files failed"));
    EXPECT_EQ(system(("unzip -tqq " + zip_ + " >/dev/null").c_str()), 0);

    std::vector<EntryInfo> entries = ListEntries(zip_);
    ASSERT_EQ(entries.size(), 55u);
    EXPECT_EQ(entries[0].name, missing.substr(1));
    EXPECT_EQ(entries[51].name, socketPath.substr(1));
    EXPECT_EQ(entries[52].name, "proc/self/mem");
    ZipReader reader;
    ASSERT_TRUE(reader.Open(zip_));
    std::string content;
    ASSERT_TRUE(Extract(reader, missing.substr(1), content));
    EXPECT_EQ(content, "");
    ASSERT_TRUE(Extract(reader, files[0].substr(1), content));
    EXPECT_EQ(content, "line of file 0\n");
}

TEST_F(ZipPackTest, CreateFailureLeavesNoArchiveOpen) {
    LogCapture logs;
    ZipPack pack;
    std::string bad = dir_ + "/no/such/folder/x.zip";
    EXPECT_FALSE(pack.CreateZip(bad));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "CreateZip Couldn't create ZIP file at path " + bad));
    EXPECT_FALSE(pack.AddFiles(MakeFiles(1)));
    pack.Close();
    EXPECT_FALSE(FileUtil::FileExists(bad));
}

TEST_F(ZipPackTest, ReaderFindsOnlyExactNamesAndStopsWhenAsked) {
    std::vector<std::string> files = MakeFiles(3);
    std::string longDir = dir_ + "/" + std::string(200, 'd');
    ASSERT_TRUE(FileUtil::CreateDirectory(longDir, 0775));
    std::string longName = longDir + "/" + std::string(100, 'n');
    ASSERT_TRUE(FileUtil::SaveStringToFile(longName, "long", true));
    ZipPack pack;
    ASSERT_TRUE(pack.CreateZip(zip_));
    ASSERT_TRUE(pack.AddFiles({files[0], files[1], longName, files[2]}));
    pack.Close();

    LogCapture logs;
    ZipReader reader;
    ASSERT_TRUE(reader.Open(zip_));
    EXPECT_FALSE(reader.Open(zip_));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_DEBUG, "Open unzip file already exist " + zip_));

    std::string content;
    int calls = 0;
    EXPECT_TRUE(Extract(reader, "no/such/entry", content, &calls));
    EXPECT_EQ(calls, 0);
    EXPECT_TRUE(Extract(reader, files[1].substr(2), content, &calls));  // a suffix is not the name
    EXPECT_EQ(calls, 0);
    EXPECT_TRUE(Extract(reader, longName.substr(1), content, &calls));  // longer than the name buffer
    EXPECT_EQ(calls, 0);

    // The consumer sees every read, the final empty one included.
    ASSERT_TRUE(Extract(reader, files[2].substr(1), content, &calls));
    EXPECT_EQ(content, "line of file 2\n");
    EXPECT_EQ(calls, 2);

    // A consumer that asks to stop gets no further reads.
    char buffer[4];
    calls = 0;
    EXPECT_TRUE(reader.ExtractFile(files[0].substr(1), buffer, sizeof(buffer), [&](const char*, uint32_t, int32_t) {
        ++calls;
        return 1;
    }));
    EXPECT_EQ(calls, 1);

    reader.Close();
    EXPECT_FALSE(Extract(reader, files[0].substr(1), content));  // closed
    ASSERT_TRUE(reader.Open(zip_));
    EXPECT_TRUE(Extract(reader, files[0].substr(1), content));
    EXPECT_EQ(content, "line of file 0\n");
}

TEST_F(ZipPackTest, ReaderSurvivesBrokenArchives) {
    std::string text;
    uint32_t seed = 12345;
    for (int i = 0; i < 2000; ++i) {
        seed = seed * 1103515245u + 12345u;
        text += "log line " + std::to_string(seed) + "\n";
    }
    std::string file = dir_ + "/log.txt";
    ASSERT_TRUE(FileUtil::SaveStringToFile(file, text, true));
    ZipPack pack;
    ASSERT_TRUE(pack.CreateZip(zip_));
    ASSERT_TRUE(pack.AddFiles({file}));
    pack.Close();
    std::string archive = ReadBinary(zip_);

    LogCapture logs;
    ZipReader reader;
    std::string truncated = dir_ + "/truncated.zip";
    WriteBinary(truncated, archive.substr(0, archive.size() / 2));
    EXPECT_FALSE(reader.Open(truncated));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_INFO, "Open unzip file failed " + truncated));
    std::string garbage = dir_ + "/garbage.zip";
    ASSERT_TRUE(FileUtil::SaveStringToFile(garbage, std::string(3000, '\x5a'), true));
    EXPECT_FALSE(reader.Open(garbage));
    EXPECT_FALSE(reader.Open(dir_ + "/absent.zip"));

    // Damaged compressed data: the consumer sees the failed read and the reader goes on working.
    std::string damaged = archive;
    size_t dataStart = 30 + file.size() - 1;  // local header plus the entry name
    for (size_t i = dataStart + 10; i < dataStart + 60; ++i) {
        damaged[i] = static_cast<char>(damaged[i] ^ 0xA5);
    }
    std::string corrupt = dir_ + "/corrupt.zip";
    WriteBinary(corrupt, damaged);
    ASSERT_TRUE(reader.Open(corrupt));
    bool sawError = false;
    char buffer[512];
    bool ok = reader.ExtractFile(file.substr(1), buffer, sizeof(buffer), [&](const char*, uint32_t, int32_t n) {
        sawError = sawError || n < 0;
        return 0;
    });
    // Either inflating fails on the way or the checksum does at the end.
    EXPECT_TRUE(sawError || !ok);
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_INFO, "ReadFileContent read unzip file info failed") ||
                logs.Contains(ANDROID_LOG_INFO, "ReadFileContent close current unzip file failed"));
    reader.Close();
    ASSERT_TRUE(reader.Open(zip_));
    std::string content;
    ASSERT_TRUE(Extract(reader, file.substr(1), content));
    EXPECT_EQ(content, text);
}

}  // namespace
}  // namespace Orvane
}  // namespace android
