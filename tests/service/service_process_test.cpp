// The daemon and orvanectl as processes: callers that misbehave with their dump descriptors, bad
// things in the way of the service socket, and who the socket lets in.
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sqlite3.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include <android-base/file.h>
#include <android-base/unique_fd.h>
#include <gtest/gtest.h>

#include "tests/common/log_capture.h"
#include "utils/file_util.h"

extern char** environ;

namespace android::Orvane {
namespace {

using android::base::unique_fd;

// The last start-up line for the test configuration.
constexpr const char* kStarted = "LoadPlugin plugin EventStorageManager isEventSource=0";
// Who runs orvanectl: a uid and a gid; {-1, -1} for the test's own.
struct Identity {
    int uid;
    int gid;
};
constexpr Identity kSelf = {-1, -1};

class ServiceProcessTest : public testing::Test {
protected:
    void SetUp() override {
        ASSERT_EQ(access(ORVANE_BINARY_DIR "/orvane", X_OK), 0) << "the daemon is not built";
        ASSERT_EQ(chmod(root_.path, 0755), 0);  // reachable for the unprivileged callers
        ASSERT_TRUE(FileUtil::CreateDirectory(Root() + "/etc/", 0755));
        ASSERT_TRUE(FileUtil::SaveStringToFile(Root() + "/etc/plugin_config",
                                               "plugins:1\nEventStorageManager[thread:storage_loop]:0 static\n", true));
    }
    void TearDown() override {
        if (daemon_ > 0 && kill(daemon_, SIGKILL) == 0)
            waitpid(daemon_, nullptr, 0);
    }

    std::string Root() const { return root_.path; }
    std::string Work() const { return workDir_; }
    std::string Log() const {
        std::string text;
        FileUtil::LoadStringFromFile(Root() + "/orvane.log", text);
        return text;
    }

    // Starts the daemon on workDir under the given umask.
    void StartDaemon(const std::string& workDir, const char* mask = "022") {
        workDir_ = workDir;
        const std::string command = std::string("umask ") + mask + " && exec setpriv --pdeathsig KILL " +
                                    ORVANE_BINARY_DIR "/orvane -configDir " + Root() + "/etc -workDir " + workDir +
                                    " -cloudCfgDir " + Root() + "/cloud 2>" + Root() + "/orvane.log";
        const char* argv[] = {"sh", "-c", command.c_str(), nullptr};
        ASSERT_EQ(posix_spawn(&daemon_, "/bin/sh", nullptr, nullptr, const_cast<char**>(argv), environ), 0);
    }
    // Starts the daemon on "work" under the given umask and waits until it serves.
    void StartServing(const char* mask = "022") {
        StartDaemon(Root() + "/work/", mask);
        ASSERT_TRUE(WaitUntil([this] { return Log().find(kStarted) != std::string::npos && Connect().ok(); },
                              std::chrono::seconds(30)))
                << Log();
    }
    std::string Socket() const { return Work() + "orvane.sock"; }
    unique_fd Connect() const {
        unique_fd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        struct sockaddr_un addr = {AF_UNIX, {}};
        strncpy(addr.sun_path, Socket().c_str(), sizeof(addr.sun_path) - 1);
        if (connect(fd.get(), reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)) != 0)
            fd.reset();
        return fd;
    }

    // The daemon's exit status; -1 when it still runs after 30 s or ended by a signal.
    int DaemonExit() {
        int status = 0;
        bool ended = WaitUntil([&] { return waitpid(daemon_, &status, WNOHANG) == daemon_; }, std::chrono::seconds(30));
        if (ended)
            daemon_ = -1;
        return ended && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    }
    bool DaemonRuns() const { return waitpid(daemon_, nullptr, WNOHANG) == 0; }

    // Runs orvanectl with its standard output on outFd; its exit status, or -1 when it was still
    // running after 30 s (it is killed then) or ended by a signal.
    int Ctl(const std::vector<std::string>& args, int outFd, Identity who = kSelf) {
        std::vector<std::string> words;
        if (who.uid >= 0)
            words = {"/usr/bin/setpriv", "--reuid=" + std::to_string(who.uid), "--regid=" + std::to_string(who.gid),
                     "--clear-groups"};
        words.insert(words.end(), {ORVANE_BINARY_DIR "/orvanectl", "--workdir", Work()});
        words.insert(words.end(), args.begin(), args.end());
        std::vector<char*> argv;
        for (std::string& word : words)
            argv.push_back(word.data());
        argv.push_back(nullptr);
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_adddup2(&actions, outFd, STDOUT_FILENO);
        posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, (Root() + "/ctl.err").c_str(),
                                         O_WRONLY | O_CREAT | O_TRUNC, 0644);
        pid_t pid = -1;
        int spawned = posix_spawn(&pid, argv[0], &actions, nullptr, argv.data(), environ);
        posix_spawn_file_actions_destroy(&actions);
        if (spawned != 0)
            return -1;
        int status = 0;
        if (!WaitUntil([&] { return waitpid(pid, &status, WNOHANG) == pid; }, std::chrono::seconds(30))) {
            kill(pid, SIGKILL);
            waitpid(pid, nullptr, 0);
            return -1;
        }
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    }
    // orvanectl's standard output, through a file; empty when it did not exit 0.
    std::string CtlOutput(const std::vector<std::string>& args, Identity who = kSelf) {
        TemporaryFile out;
        if (Ctl(args, out.fd, who) != 0)
            return "";
        std::string text;
        FileUtil::LoadStringFromFile(out.path, text);
        return text;
    }
    std::string CtlErrors() const {
        std::string text;
        FileUtil::LoadStringFromFile(Root() + "/ctl.err", text);
        return text;
    }
    uint64_t Counter(const std::string& name) {
        std::string stats = "\n" + CtlOutput({"dump", "stats"});
        size_t at = stats.find("\n" + name + " ");
        return at == std::string::npos ? 0 : std::stoull(stats.substr(at + name.size() + 2));
    }

    TemporaryDir root_;
    std::string workDir_;
    pid_t daemon_ = -1;
};

// Rows of `bytes` each in raw_events, written beside the running daemon, which is idle once its
// storage loop has made the table.
void FillRawEvents(const std::string& database, int rows, size_t bytes) {
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open(database.c_str(), &db), SQLITE_OK);
    sqlite3_busy_timeout(db, 10000);
    EXPECT_TRUE(WaitUntil([&] {
        return sqlite3_exec(db, "select count(*) from raw_events", nullptr, nullptr, nullptr) == SQLITE_OK;
    }));
    std::string sql = "begin;";
    for (int i = 0; i < rows; ++i)
        sql += "insert into raw_events(event_id, param_list, timestamp) values(100001, '" + std::string(bytes, 'p') +
               "', 1700000000);";
    EXPECT_EQ(sqlite3_exec(db, (sql + "commit;").c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << sqlite3_errmsg(db);
    sqlite3_close(db);
}

// A caller that is gone before the text comes, or that never reads it, costs the daemon neither
// its life nor its storage loop; text beyond the cap is cut with a note, and the failures count.
TEST_F(ServiceProcessTest, DumpReadersThatLeaveOrNeverReadHarmNothing) {
    StartServing();
    FillRawEvents(Work() + "event.db", 3000, 1000);  // about 3 MB of dump text, over the cap
    const std::vector<std::string> query = {"dump", "plugin", "EventStorageManager", "query", "raw_events", "5000"};

    int gone[2];
    ASSERT_EQ(pipe2(gone, O_CLOEXEC), 0);
    close(gone[0]);
    Ctl(query, gone[1]);
    close(gone[1]);
    EXPECT_TRUE(DaemonRuns()) << Log();

    int never[2];
    ASSERT_EQ(pipe2(never, O_CLOEXEC), 0);
    unique_fd neverRead(never[0]), neverWrite(never[1]);
    fcntl(never[1], F_SETPIPE_SZ, 4096);
    EXPECT_EQ(Ctl(query, never[1]), 0) << "the daemon must give up on a reader that never reads";
    ASSERT_TRUE(DaemonRuns()) << Log();

    // The storage loop is free: the whole dump comes, cut at the cap.
    std::string text = CtlOutput(query);
    EXPECT_EQ(text.rfind("id | event_id | ", 0), 0u) << text.substr(0, 200);
    const std::string note = "\n[dump cut at 2097152 bytes]\n";
    ASSERT_GT(text.size(), note.size());
    EXPECT_EQ(text.size(), 2097152 + note.size());
    EXPECT_EQ(text.substr(text.size() - note.size()), note);
    EXPECT_EQ(Counter("service.dump.write_failures"), 2u);
    EXPECT_EQ(Counter("service.dump.cut"), 3u);
}

// Anything but a socket at "orvane.sock", or a work path too long for a socket, stops start-up
// with a non-zero status and one line that says why; what was in the way is left as it was. A
// socket left by an earlier run is replaced.
TEST_F(ServiceProcessTest, BadSocketPathsStopStartUp) {
    const std::string target = Root() + "/target";
    ASSERT_TRUE(FileUtil::SaveStringToFile(target, "keep", true));
    struct Case {
        const char* what;
        std::function<void(const std::string& path)> place;
        const char* reason;
    };
    const Case cases[] = {
            {"directory", [](const std::string& path) { mkdir(path.c_str(), 0755); }, "is not a socket"},
            {"file", [](const std::string& path) { FileUtil::SaveStringToFile(path, "keep", true); },
             "is not a socket"},
            {"link", [&](const std::string& path) { symlink(target.c_str(), path.c_str()); }, "is not a socket"},
            {"long path", nullptr, "longer than"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        std::string workDir = Root() + "/" + c.what + "/";
        if (c.place == nullptr)
            workDir = Root() + "/" + std::string(100, 'w') + "/";
        ASSERT_TRUE(FileUtil::CreateDirectory(workDir, 0775));
        if (c.place != nullptr)
            c.place(workDir + "orvane.sock");
        struct stat before = {};
        lstat((workDir + "orvane.sock").c_str(), &before);
        StartDaemon(workDir);
        EXPECT_EQ(DaemonExit(), 255) << Log();
        EXPECT_NE(Log().find(c.reason), std::string::npos) << Log();
        EXPECT_NE(Log().find("main start service failed"), std::string::npos) << Log();
        struct stat after = {};
        lstat((workDir + "orvane.sock").c_str(), &after);
        EXPECT_EQ(after.st_ino, before.st_ino);
        EXPECT_EQ(after.st_mode, before.st_mode);
    }
    std::string kept;
    EXPECT_TRUE(FileUtil::LoadStringFromFile(target, kept));
    EXPECT_EQ(kept, "keep");

    // A socket nobody listens on any more is the last run's: replaced.
    unique_fd stale(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    ASSERT_TRUE(FileUtil::CreateDirectory(Root() + "/work/", 0775));
    struct sockaddr_un addr = {AF_UNIX, {}};
    const std::string stalePath = Root() + "/work/orvane.sock";
    strncpy(addr.sun_path, stalePath.c_str(), sizeof(addr.sun_path) - 1);
    ASSERT_EQ(bind(stale.get(), reinterpret_cast<struct sockaddr*>(&addr), sizeof(addr)), 0);
    stale.reset();
    StartServing();
    EXPECT_NE(CtlOutput({"dump"}).find("PluginName:EventStorageManager"), std::string::npos) << CtlErrors();
}

// On the host the socket's mode stands in for the dump permission: 0660 whatever the umask, so
// only the daemon's user and group get in. Refused callers and broken requests are counted.
TEST_F(ServiceProcessTest, TheSocketAdmitsOnlyItsGroupAndRefusalsAreCounted) {
    StartDaemon(Root() + "/work/", "000");
    ASSERT_TRUE(WaitUntil(
            [this] { return Log().find(kStarted) != std::string::npos && access(Socket().c_str(), F_OK) == 0; },
            std::chrono::seconds(30)));
    struct stat socketStat = {};
    ASSERT_EQ(lstat(Socket().c_str(), &socketStat), 0);
    EXPECT_EQ(socketStat.st_mode & 07777, 0660u);

    const Identity stranger = {4321, 4321}, groupMember = {4321, static_cast<int>(socketStat.st_gid)};
    TemporaryFile out;
    EXPECT_EQ(Ctl({"dump"}, out.fd, stranger), 1);
    EXPECT_NE(CtlErrors().find("Permission denied"), std::string::npos) << CtlErrors();
    EXPECT_NE(CtlOutput({"dump"}, groupMember).find("Load plugin 1:"), std::string::npos) << CtlErrors();
    EXPECT_EQ(CtlOutput({"dump", "plugin", "EventStorageManager", "update", "raw_events", "param_list", "x", "id", "1"},
                        groupMember),
              "not support cmd\n");

    // The service's own check: uid 1000 only, and then only the companion's process.
    EXPECT_EQ(Ctl({"upload-switch", "on"}, out.fd, groupMember), 0);
    EXPECT_EQ(Ctl({"user-activated"}, out.fd, {1000, groupMember.gid}), 0);
    // A frame whose size is no whole number of words, and one over the size limit.
    for (uint32_t size : {6u, 64u * 1024u + 4u}) {
        unique_fd raw = Connect();
        ASSERT_TRUE(raw.ok());
        uint32_t header[3] = {1, 0, size};
        ASSERT_EQ(write(raw.get(), header, sizeof(header)), static_cast<ssize_t>(sizeof(header)));
        char byte;
        EXPECT_EQ(read(raw.get(), &byte, 1), 0);  // closed by the daemon
    }
    EXPECT_EQ(Counter("service.refused.uid"), 1u);
    EXPECT_EQ(Counter("service.refused.process"), 1u);
    EXPECT_EQ(Counter("service.host.bad_frames"), 1u);
    EXPECT_EQ(Counter("service.host.oversized_requests"), 1u);
}

}  // namespace
}  // namespace android::Orvane
