#ifndef ORVANE_TESTS_STORAGE_STORAGE_TEST_UTIL_H
#define ORVANE_TESTS_STORAGE_STORAGE_TEST_UTIL_H

#include <stdio.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <sstream>

#include <gtest/gtest.h>

#include "platform/event.h"
#include "storage/sql_database.h"

namespace android::Orvane {

using Texts = std::vector<std::string>;

// A fresh folder for one test, removed with everything in it afterwards.
struct TempDir {
    ~TempDir() { std::filesystem::remove_all(path_); }
    std::string File(const std::string& name) const { return path_ + name; }
    std::string path_ = mkdtemp(std::string("/tmp/orvane_storage_XXXXXX").data()) + std::string("/");
};

inline std::string ReadFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), {}};
}

inline void WriteFile(const std::string& path, const std::string& content) {
    std::ofstream(path, std::ios::binary) << content;
}

inline sp<Event> MakeEvent(uint32_t type, uint32_t id, uint64_t happenTime, const std::string& params = "p") {
    sp<Event> event = new Event("test");
    event->eventType = type, event->eventId = id, event->happenTime = happenTime;
    event->SetValue("param_list", params);
    return event;
}

// What a dump command writes to its descriptor.
inline std::string DumpOf(const std::function<void(int)>& dump) {
    FILE* file = tmpfile();
    dump(fileno(file));
    std::string out = ReadFile("/proc/self/fd/" + std::to_string(fileno(file)));
    fclose(file);
    return out;
}

// Runs SQL on a connection of its own, outside the code under test: the values of the first column.
inline Texts Column(const std::string& path, const std::string& sql) {
    sp<SqlDatabase> db = new SqlDatabase(path);
    EXPECT_TRUE(db->Open());
    Texts values;
    for (auto& row : db->QueryRecord(sql, {"v"}))
        values.push_back(row["v"]);
    EXPECT_EQ(db->GetLastError(), "") << sql;
    db->Close();
    return values;
}

}  // namespace android::Orvane

#endif  // ORVANE_TESTS_STORAGE_STORAGE_TEST_UTIL_H
