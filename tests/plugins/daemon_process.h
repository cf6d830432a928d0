#ifndef ORVANE_TESTS_PLUGINS_DAEMON_PROCESS_H
#define ORVANE_TESTS_PLUGINS_DAEMON_PROCESS_H

#include <signal.h>
#include <spawn.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include "utils/file_util.h"

extern char** environ;

namespace android::Orvane {

// The built daemon as a child process on the shipped configuration, for as long as the object
// lives (or until Stop). Everything it touches lies in `folder`: the property file "properties",
// the work folder "work", the cloud folder "cloud", and its log, appended to "orvane.log".
class DaemonProcess {
public:
    explicit DaemonProcess(std::string folder) : folder_(std::move(folder)) {}
    ~DaemonProcess() { Stop(); }

    static bool Built() { return access(ORVANE_BINARY_DIR "/orvane", X_OK) == 0; }

    // `devList` as the daemon's -devList takes it ("qxev=PATH,qx_exception_log=PATH").
    bool Start(const std::string& devList) {
        std::string command = "ORVANE_PROPERTY_FILE=" + folder_ + "/properties exec setpriv --pdeathsig KILL " +
                              ORVANE_BINARY_DIR "/orvane -configDir " ORVANE_SOURCE_DIR "/etc -workDir " + folder_ +
                              "/work -cloudCfgDir " + folder_ + "/cloud -devList " + devList + " >>" + folder_ +
                              "/orvane.log 2>&1";
        const char* argv[] = {"sh", "-c", command.c_str(), nullptr};
        return posix_spawn(&pid_, "/bin/sh", nullptr, nullptr, const_cast<char**>(argv), environ) == 0;
    }
    // Sends `signal` and reaps the daemon; false when it was not running.
    bool Stop(int signal = SIGTERM) {
        bool signalled = pid_ > 0 && kill(pid_, signal) == 0;
        if (signalled)
            waitpid(pid_, nullptr, 0);
        pid_ = -1;
        return signalled;
    }

    std::string Log() const {
        std::string text;
        FileUtil::LoadStringFromFile(folder_ + "/orvane.log", text);
        return text;
    }

    // The first column of each row `sql` gives on a copy of event.db, one line each. A copy, as
    // the daemon's writes take no busy time-out; with the write-ahead log, which holds the latest
    // commits until they are checkpointed into the file.
    std::string Snapshot(const std::string& sql) const {
        std::string copy = folder_ + "/snapshot.db", work = folder_ + "/work/event.db", rows;
        auto append = [](void* out, int, char** values, char**) {
            *static_cast<std::string*>(out) += std::string(values[0] != nullptr ? values[0] : "NULL") + "\n";
            return 0;
        };
        sqlite3* db = nullptr;
        if (system(("cp " + work + " " + copy + " 2>/dev/null && rm -f " + copy + "-wal " + copy + "-shm && { cp " +
                    work + "-wal " + copy + "-wal 2>/dev/null; true; }")
                           .c_str()) == 0 &&
            sqlite3_open_v2(copy.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK)
            sqlite3_exec(db, sql.c_str(), append, &rows, nullptr);
        sqlite3_close(db);
        return rows;
    }

private:
    const std::string folder_;
    pid_t pid_ = -1;
};

}  // namespace android::Orvane

#endif  // ORVANE_TESTS_PLUGINS_DAEMON_PROCESS_H
