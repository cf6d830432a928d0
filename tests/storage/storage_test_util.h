#ifndef ORVANE_TESTS_STORAGE_STORAGE_TEST_UTIL_H
#define ORVANE_TESTS_STORAGE_STORAGE_TEST_UTIL_H

#include <gtest/gtest.h>
#include <stdlib.h>

#include <string>

#include "utils/file_util.h"

namespace android {
namespace Orvane {

// A fresh folder for one test, removed with everything in it afterwards.
class TempDir {
public:
    TempDir() {
        char pattern[] = "/tmp/orvane_storage_XXXXXX";
        const char* made = mkdtemp(pattern);
        EXPECT_NE(made, nullptr);
        path_ = std::string(made != nullptr ? made : "/tmp") + "/";
    }
    ~TempDir() {
        uint64_t freed = 0;
        FileUtil::DeleteDirectoryOrFile(path_, freed, true);
    }
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;

    const std::string& Path() const { return path_; }
    std::string File(const std::string& name) const { return path_ + name; }

private:
    std::string path_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_TESTS_STORAGE_STORAGE_TEST_UTIL_H
