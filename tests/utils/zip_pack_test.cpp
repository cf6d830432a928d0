#include "utils/zip_pack.h"

#include <cstdlib>
#include <fstream>
#include <iterator>
#include <memory>
#include <thread>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/log_capture.h"
#include "utils/file_util.h"

namespace android::Orvane {

// Entry names in order, read with plain minizip rather than the reader under test.
std::vector<std::string> ListEntries(const std::string& zipPath) {
    std::vector<std::string> names;
    unzFile unz = unzOpen(zipPath.c_str());
    for (int ret = unzGoToFirstFile(unz); ret == UNZ_OK; ret = unzGoToNextFile(unz)) {
        char name[1024] = {};
        unz_file_info info = {};
        unzGetCurrentFileInfo(unz, &info, name, sizeof(name) - 1, nullptr, 0, nullptr, 0);
        names.emplace_back(name);
    }
    unzClose(unz);  // both calls refuse a null handle
    return names;
}

class ZipPackTest : public testing::Test {
protected:
    void SetUp() override {}
    // count files "f<i>.log" whose content names them.
    std::vector<std::string> MakeFiles(int count) {
        std::vector<std::string> paths;
        for (int i = 0; i < count; ++i) {
            paths.push_back(dir_ + "/f" + std::to_string(i) + ".log");
            EXPECT_TRUE(FileUtil::SaveStringToFile(paths.back(), "line of file " + std::to_string(i) + "\n", true));
        }
        return paths;
    }
    // Streams one entry through the reader into content_, counting the consumer's calls, which asks
    // to stop at call number `stopAt` (0: never); false also when the consumer saw a read error.
    bool Extract(const std::string& entry, int stopAt = 0) {
        char buffer[64];
        bool readError = false;
        content_.clear();
        calls_ = 0;
        return reader_.ExtractFile(entry, buffer, sizeof(buffer), [&](const char* data, uint32_t, int32_t n) {
            readError = readError || n < 0;
            content_.append(data, n > 0 ? n : 0);
            return static_cast<int>(++calls_ == stopAt);
        }) && !readError;
    }
    // Writes `bytes` as an archive and opens it with the reader.
    bool Reopen(const std::string& bytes) {
        std::ofstream(dir_ + "/other.zip", std::ios::binary | std::ios::trunc) << bytes;
        return reader_.Open(dir_ + "/other.zip");
    }

    TemporaryDir tmp_;
    const std::string dir_ = tmp_.path, zip_ = dir_ + "/out.zip";
    std::string content_;
    int calls_ = 0;
    ZipReader reader_;
};

TEST_F(ZipPackTest, WritesWholeBatchesAndTheRestOnlyOnClose) {
    std::vector<std::string> files = MakeFiles(120);
    auto first = [&](int n) { return std::vector<std::string>(files.begin(), files.begin() + n); };
    // Destroyed without Close, a pack keeps only its full batches of 50; the rest is discarded.
    struct {
        std::vector<std::vector<std::string>> calls;
        bool close;
        size_t entries;
    } cases[] = {{{first(49)}, false, 0},
                 {{first(50)}, false, 50},
                 {{files}, false, 100},
                 {{first(49), {files[49]}}, false, 50},
                 {{files}, true, 120}};
    for (const auto& c : cases) {
        auto pack = std::make_unique<ZipPack>();
        ASSERT_TRUE(pack->CreateZip(zip_));
        for (const auto& paths : c.calls)
            EXPECT_TRUE(pack->AddFiles(paths));
        if (c.close)
            pack->Close();
        pack.reset();
        EXPECT_EQ(ListEntries(zip_).size(), c.entries) << c.calls.size() << " calls, first " << c.calls[0].size();
    }
    std::vector<std::string> entries = ListEntries(zip_);
    for (size_t i = 0; i < entries.size(); ++i)
        EXPECT_EQ(entries[i], files[i].substr(1)) << "in order, no leading slash";
    EXPECT_EQ(0, system(("unzip -tqq " + zip_ + " >/dev/null").c_str()));
}

TEST_F(ZipPackTest, FailedFilesDirectoriesAndReadBack) {
    std::vector<std::string> files = MakeFiles(2);
    std::string big, missing = dir_ + "/missing.log", longDir = dir_ + "/" + std::string(200, 'd');
    std::string longName = longDir + "/" + std::string(100, 'n');  // longer than the reader's name buffer
    for (int i = 0; i < 5000; ++i) {
        big += "12-01 10:00:00.000 1000 1000 I tag: message number " + std::to_string(i) + "\n";
    }
    ASSERT_TRUE(FileUtil::SaveStringToFile(files[1], big, true));
    ASSERT_TRUE(FileUtil::CreateDirectory(longDir, 0775) && FileUtil::SaveStringToFile(longName, "long", true));
    LogCapture logs;
    ZipPack pack;
    EXPECT_FALSE(pack.CreateZip(dir_ + "/no/such/x.zip"));
    EXPECT_FALSE(pack.AddFiles(files));  // nothing open
    ASSERT_TRUE(pack.CreateZip(zip_));
    EXPECT_FALSE(pack.AddFiles(std::vector<std::string>(50, missing)));  // every path failed
    // A read error (/proc/self/mem opens but cannot be read) ends the copy instead of spinning.
    EXPECT_TRUE(pack.AddFiles({longDir, files[0], "/proc/self/mem", files[1], longName}));
    ASSERT_TRUE(pack.AddDirectoryEntryToZip("extra/"));
    pack.Close();
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "CreateZip Couldn't create ZIP file at path " + dir_ + "/no/such/x"));
    EXPECT_EQ(0, system(("unzip -tqq " + zip_ + " >/dev/null").c_str()));
    auto entries = ListEntries(zip_);
    ASSERT_EQ(entries.size(), 56u);
    EXPECT_EQ(entries[0], missing.substr(1));  // failed files still leave an (empty) entry
    EXPECT_EQ(entries[50], "extra/");          // written at once, the other files only on Close
    EXPECT_EQ(entries[51], longDir.substr(1) + "/");

    ASSERT_TRUE(reader_.Open(zip_));
    EXPECT_TRUE(Extract(files[1].substr(1)) && content_ == big) << content_.size();
    // Names missing, only a suffix, or longer than the name buffer: true, consumer never called.
    for (const std::string& name : {std::string("no/such/entry"), files[0].substr(2), longName.substr(1)}) {
        EXPECT_TRUE(Extract(name) && calls_ == 0) << name;
    }
    // After standing at a later entry the search rewinds; the final empty read is seen too.
    EXPECT_TRUE(Extract(files[0].substr(1)) && content_ == "line of file 0\n" && calls_ == 2) << content_ << calls_;
    EXPECT_TRUE(Extract(files[1].substr(1), 1) && calls_ == 1) << "asked to stop: " << calls_;
    reader_.Close();
    EXPECT_FALSE(Extract(files[0].substr(1)));  // closed

    // Archives end in NUL bytes, which the text helpers of FileUtil trim.
    std::ifstream in(zip_, std::ios::binary);
    std::string archive{std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
    EXPECT_FALSE(Reopen(archive.substr(0, archive.size() / 2)) || Reopen(std::string(3000, 'Z')));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_INFO, "Open unzip file failed " + dir_ + "/other.zip"));
    // Damaged compressed data (behind the big entry's local name): the reader reports it, goes on.
    const size_t data = archive.find(files[1].substr(1)) + files[1].size() - 1;
    for (size_t i = data + 10; i < data + 60; ++i) {
        archive[i] ^= 0xA5;
    }
    ASSERT_TRUE(Reopen(archive));
    EXPECT_FALSE(Extract(files[1].substr(1)));  // inflate or checksum fails
    EXPECT_TRUE(Extract(files[0].substr(1)) && content_ == "line of file 0\n") << content_;
}

// minizip's handles are not thread-safe: a second thread using a pack or reader before its owner
// closed it dies; after Close another thread may take it over.
TEST_F(ZipPackTest, PacksAndReadersBelongToOneThreadUntilClosed) {
    std::vector<std::string> files = MakeFiles(1);
    ZipPack pack;
    ASSERT_TRUE(pack.CreateZip(zip_));
    EXPECT_DEATH(std::thread([&] { pack.AddFiles(files); }).join(), "AddFiles called on thread [0-9]+, owned by");
    pack.Close();
    std::thread([&] {
        ASSERT_TRUE(pack.CreateZip(zip_) && pack.AddFiles(files));
        pack.Close();
    }).join();
    ASSERT_TRUE(reader_.Open(zip_));
    EXPECT_DEATH(std::thread([&] { Extract(files[0].substr(1)); }).join(), "ExtractFile called on thread");
    reader_.Close();
    std::thread([&] {
        EXPECT_TRUE(reader_.Open(zip_) && Extract(files[0].substr(1)) && content_ == "line of file 0\n");
        reader_.Close();
    }).join();
}

}  // namespace android::Orvane
