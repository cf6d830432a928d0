// orvane-devsim: emulates the kernel's event device nodes ("qxev", "qx_exception_log") on a
// host through FUSE, with character-device semantics, so that the event sources run unchanged
// against files in a folder. See Usage() for the command line.
#include <errno.h>
#include <fcntl.h>
#include <linux/fuse.h>
#include <stdarg.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <unistd.h>

#include <iostream>
#include <string>
#include <unordered_set>

#include <android-base/unique_fd.h>
#include <utils/Mutex.h>

#include "record_node.h"

namespace {

// Records a kernel driver buffers before writers have to wait.
constexpr size_t kNodeCapacity = 1024;
constexpr double kAttrTimeout = 3600.0;
constexpr int kExitUsage = 2;
constexpr int kExitNoFuse = 3;

RecordNode gQxev("qxev", 2, false, kNodeCapacity);
RecordNode gExceptionLog("qx_exception_log", 3, true, kNodeCapacity);
RecordNode* const kNodes[] = {&gQxev, &gExceptionLog};

RecordNode* NodeByIno(fuse_ino_t ino) {
    for (RecordNode* node : kNodes) {
        if (node->ino == ino) {
            return node;
        }
    }
    return nullptr;
}

void FillAttr(fuse_ino_t ino, struct stat* st) {
    *st = {};
    st->st_ino = ino;
    st->st_uid = getuid();
    st->st_gid = getgid();
    if (ino == FUSE_ROOT_ID) {
        st->st_mode = S_IFDIR | 0755;
        st->st_nlink = 2;
    } else {
        // Regular files: a FUSE character device would be served by the kernel's own driver
        // table, not by this process.
        st->st_mode = S_IFREG | 0666;
        st->st_nlink = 1;
    }
}

void DoInit(void*, fuse_conn_info* conn) {
    // Requests must pass through WireRead/WireWritev, which splicing would bypass.
    conn->want &= ~(FUSE_CAP_SPLICE_READ | FUSE_CAP_SPLICE_WRITE | FUSE_CAP_SPLICE_MOVE);
}

void DoLookup(fuse_req_t req, fuse_ino_t parent, const char* name) {
    for (RecordNode* node : kNodes) {
        if (parent == FUSE_ROOT_ID && strcmp(name, node->name) == 0) {
            fuse_entry_param entry = {};
            entry.ino = node->ino;
            entry.attr_timeout = kAttrTimeout;
            entry.entry_timeout = kAttrTimeout;
            FillAttr(node->ino, &entry.attr);
            fuse_reply_entry(req, &entry);
            return;
        }
    }
    fuse_reply_err(req, ENOENT);
}

void DoGetattr(fuse_req_t req, fuse_ino_t ino, fuse_file_info*) {
    if (ino != FUSE_ROOT_ID && NodeByIno(ino) == nullptr) {
        fuse_reply_err(req, ENOENT);
        return;
    }
    struct stat st;
    FillAttr(ino, &st);
    fuse_reply_attr(req, &st, kAttrTimeout);
}

// Opening with O_TRUNC (a shell's ">") arrives as a size change; a device has no size to change.
void DoSetattr(fuse_req_t req, fuse_ino_t ino, struct stat*, int, fuse_file_info* fi) {
    DoGetattr(req, ino, fi);
}

void DoReaddir(fuse_req_t req, fuse_ino_t ino, size_t size, off_t offset, fuse_file_info*) {
    if (ino != FUSE_ROOT_ID) {
        fuse_reply_err(req, ENOTDIR);
        return;
    }
    struct Entry {
        const char* name;
        fuse_ino_t ino;
    };
    const Entry entries[] = {{".", FUSE_ROOT_ID},
                             {"..", FUSE_ROOT_ID},
                             {gQxev.name, gQxev.ino},
                             {gExceptionLog.name, gExceptionLog.ino}};
    constexpr off_t kEntryCount = sizeof(entries) / sizeof(entries[0]);
    std::string buffer;
    for (off_t index = offset; index < kEntryCount; ++index) {
        struct stat st;
        FillAttr(entries[index].ino, &st);
        size_t used = buffer.size();
        size_t need = fuse_add_direntry(req, nullptr, 0, entries[index].name, nullptr, 0);
        if (used + need > size) {
            break;
        }
        buffer.resize(used + need);
        fuse_add_direntry(req, &buffer[used], need, entries[index].name, &st, index + 1);
    }
    fuse_reply_buf(req, buffer.data(), buffer.size());
}

void DoOpen(fuse_req_t req, fuse_ino_t ino, fuse_file_info* fi) {
    if (NodeByIno(ino) == nullptr) {
        fuse_reply_err(req, EISDIR);
        return;
    }
    // Without direct I/O reads would go through the page cache and see a file of size 0.
    fi->direct_io = 1;
    fi->nonseekable = 1;
    fuse_reply_open(req, fi);
}

void DoRead(fuse_req_t req, fuse_ino_t ino, size_t size, off_t, fuse_file_info*) {
    NodeByIno(ino)->Read(req, size);
}

void DoWrite(fuse_req_t req, fuse_ino_t ino, const char* data, size_t size, off_t, fuse_file_info*) {
    NodeByIno(ino)->Write(req, data, size);
}

void DoPoll(fuse_req_t req, fuse_ino_t ino, fuse_file_info*, fuse_pollhandle* ph) {
    NodeByIno(ino)->Poll(req, ph);
}

// The low-level API has no field for FOPEN_STREAM, so open replies get it on the wire. Without
// it the kernel serialises reads and writes on one shared descriptor through the file position
// lock, and a held read would block a writer using the same descriptor.
android::Mutex gOpenLock;
std::unordered_set<uint64_t> gPendingOpens GUARDED_BY(gOpenLock);  // unique ids of open requests not answered yet

ssize_t WireRead(int fd, void* buffer, size_t length, void*) {
    ssize_t received = read(fd, buffer, length);
    if (received >= static_cast<ssize_t>(sizeof(fuse_in_header))) {
        fuse_in_header header;
        memcpy(&header, buffer, sizeof(header));
        if (header.opcode == FUSE_OPEN) {
            android::Mutex::Autolock guard(gOpenLock);
            gPendingOpens.insert(header.unique);
        }
    }
    return received;
}

ssize_t WireWritev(int fd, iovec* iov, int count, void*) {
    fuse_out_header header;
    memcpy(&header, iov[0].iov_base, sizeof(header));
    bool pendingOpen;
    {
        android::Mutex::Autolock guard(gOpenLock);
        pendingOpen = gPendingOpens.erase(header.unique) > 0;
    }
    if (pendingOpen && header.error == 0 && count > 1 && iov[1].iov_len == sizeof(fuse_open_out)) {
        static_cast<fuse_open_out*>(iov[1].iov_base)->open_flags |= FOPEN_STREAM;
    }
    return writev(fd, iov, count);
}

std::string gFuseMessage;  // libfuse's last complaint, for the one-line mount failure

void CaptureFuseLog(fuse_log_level, const char* fmt, va_list ap) {
    char line[512];
    vsnprintf(line, sizeof(line), fmt, ap);
    gFuseMessage = line;
    while (!gFuseMessage.empty() && gFuseMessage.back() == '\n') {
        gFuseMessage.pop_back();
    }
}

int CannotMount(const std::string& folder, const std::string& reason) {
    fprintf(stderr, "orvane-devsim: FUSE cannot be mounted at %s: %s\n", folder.c_str(), reason.c_str());
    return kExitNoFuse;
}

int Serve(const char* program, const std::string& folder) {
    if (access("/dev/fuse", R_OK | W_OK) != 0) {
        return CannotMount(folder, std::string("/dev/fuse: ") + strerror(errno));
    }
    fuse_lowlevel_ops ops = {};
    ops.init = DoInit;
    ops.lookup = DoLookup;
    ops.getattr = DoGetattr;
    ops.setattr = DoSetattr;
    ops.readdir = DoReaddir;
    ops.open = DoOpen;
    ops.read = DoRead;
    ops.write = DoWrite;
    ops.poll = DoPoll;

    // A daemon of another user opens the nodes too; only root may grant that without fuse.conf.
    std::string options = geteuid() == 0 ? "fsname=orvane-devsim,allow_other" : "fsname=orvane-devsim";
    const char* argv[] = {program, "-o", options.c_str()};
    fuse_args args = FUSE_ARGS_INIT(3, const_cast<char**>(argv));
    fuse_set_log_func(CaptureFuseLog);
    fuse_session* session = fuse_session_new(&args, &ops, sizeof(ops), nullptr);
    fuse_opt_free_args(&args);
    if (session == nullptr) {
        return CannotMount(folder, gFuseMessage.empty() ? "session set-up failed" : gFuseMessage);
    }
    if (fuse_session_mount(session, folder.c_str()) != 0) {
        fuse_session_destroy(session);
        return CannotMount(folder, gFuseMessage.empty() ? "mount refused" : gFuseMessage);
    }
    fuse_custom_io io = {};
    io.read = WireRead;
    io.writev = WireWritev;
    bool failed = false;
    if (fuse_session_custom_io(session, &io, fuse_session_fd(session)) == 0 && fuse_set_signal_handlers(session) == 0) {
        fprintf(stderr, "orvane-devsim: serving %s/%s and %s/%s\n", folder.c_str(), gQxev.name, folder.c_str(),
                gExceptionLog.name);
        fuse_loop_config* config = fuse_loop_cfg_create();
        fuse_loop_cfg_set_clone_fd(config, 0);
        // Negative on failure; the signal's number when one ended the loop, which is the way out.
        failed = fuse_session_loop_mt(session, config) < 0;
        fuse_loop_cfg_destroy(config);
        fuse_remove_signal_handlers(session);
    } else {
        fprintf(stderr, "orvane-devsim: cannot serve %s: %s\n", folder.c_str(), gFuseMessage.c_str());
        failed = true;
    }
    for (RecordNode* node : kNodes) {
        node->Shutdown();
    }
    fuse_session_unmount(session);
    fuse_session_destroy(session);
    return failed ? 1 : 0;
}

bool WriteRecord(int fd, const std::string& record) {
    ssize_t written;
    do {
        written = write(fd, record.data(), record.size());
    } while (written < 0 && errno == EINTR);
    return written == static_cast<ssize_t>(record.size());
}

// Each record is one write, as a driver hands one record to its buffer. "-" stands for the
// lines of standard input, one record each (without the line feed).
int Inject(const std::string& folder, const std::string& node, char** records, int count) {
    std::string path = folder + "/" + node;
    android::base::unique_fd fd(open(path.c_str(), O_WRONLY | O_CLOEXEC));
    if (!fd.ok()) {
        fprintf(stderr, "orvane-devsim: cannot open %s: %s\n", path.c_str(), strerror(errno));
        return 1;
    }
    int rc = 0;
    for (int index = 0; index < count && rc == 0; ++index) {
        std::string record = records[index];
        if (record != "-") {
            rc = WriteRecord(fd.get(), record) ? 0 : 1;
            continue;
        }
        while (rc == 0 && std::getline(std::cin, record)) {
            rc = WriteRecord(fd.get(), record) ? 0 : 1;
        }
    }
    if (rc != 0) {
        fprintf(stderr, "orvane-devsim: write to %s failed: %s\n", path.c_str(), strerror(errno));
    }
    return rc;
}

int Usage() {
    fprintf(stderr,
            "usage: orvane-devsim MOUNTDIR\n"
            "           serve MOUNTDIR/qxev and MOUNTDIR/qx_exception_log until SIGINT/SIGTERM\n"
            "       orvane-devsim inject MOUNTDIR NODE RECORD...\n"
            "           write each RECORD as one record to MOUNTDIR/NODE (\"-\": one per stdin line)\n");
    return kExitUsage;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc == 2 && argv[1][0] != '-') {
        return Serve(argv[0], argv[1]);
    }
    if (argc >= 5 && strcmp(argv[1], "inject") == 0) {
        return Inject(argv[2], argv[3], argv + 4, argc - 4);
    }
    return Usage();
}
