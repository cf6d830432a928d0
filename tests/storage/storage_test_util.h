#ifndef ORVANE_TESTS_STORAGE_STORAGE_TEST_UTIL_H
#define ORVANE_TESTS_STORAGE_STORAGE_TEST_UTIL_H

#include <sqlite3.h>
#include <unistd.h>

#include <functional>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "platform/event.h"
#include "storage/sql_database.h"

namespace android::Orvane {

using Texts = std::vector<std::string>;

// A fresh folder for one test, removed with everything in it afterwards.
struct TempDir {
    std::string File(const std::string& name) const { return path_ + name; }
    TemporaryDir dir_;
    std::string path_ = std::string(dir_.path) + "/";
};

inline std::string ReadFile(const std::string& path) {
    std::string content;
    base::ReadFileToString(path, &content);
    return content;
}

inline void WriteFile(const std::string& path, const std::string& content) {
    ASSERT_TRUE(base::WriteStringToFile(content, path)) << path;
}

inline sp<Event> MakeEvent(uint32_t type, uint32_t id, uint64_t happenTime, const std::string& params = "p") {
    sp<Event> event = new Event("test");
    event->eventType = type, event->eventId = id, event->happenTime = happenTime;
    event->SetValue("param_list", params);
    return event;
}

// What a dump command writes to its descriptor.
inline std::string DumpOf(const std::function<void(int)>& dump) {
    TemporaryFile file;
    dump(file.fd);
    std::string out;
    lseek(file.fd, 0, SEEK_SET);
    base::ReadFdToString(file.fd, &out);
    return out;
}

// Runs SQL on a connection of its own, outside the code under test: the values of one column
// (the first by default). It waits for the locks of other connections like any reader that means no harm.
inline Texts Column(const std::string& path, const std::string& sql, int column = 0) {
    sqlite3* db = nullptr;
    std::pair<Texts, int> values{{}, column};
    EXPECT_EQ(sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE, nullptr), SQLITE_OK) << path;
    sqlite3_busy_timeout(db, 20000);
    auto append = [](void* out, int, char** row, char**) {
        auto& [texts, at] = *static_cast<std::pair<Texts, int>*>(out);
        texts.push_back(row[at] != nullptr ? row[at] : "");
        return 0;
    };
    char* error = nullptr;
    EXPECT_EQ(sqlite3_exec(db, sql.c_str(), append, &values, &error), SQLITE_OK) << sql << ": " << error;
    sqlite3_free(error);
    sqlite3_close(db);
    return values.first;
}

// Bytes of the pages that hold data, as a vacuum would leave them.
inline int64_t LiveSize(const std::string& path) {
    return std::stoll(Column(path,
                             "select (page_count - freelist_count) * page_size from pragma_page_count, "
                             "pragma_freelist_count, pragma_page_size")[0]);
}

}  // namespace android::Orvane

#endif  // ORVANE_TESTS_STORAGE_STORAGE_TEST_UTIL_H
