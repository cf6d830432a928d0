#ifndef ORVANE_TOOLS_DEVSIM_RECORD_NODE_H
#define ORVANE_TOOLS_DEVSIM_RECORD_NODE_H

#define FUSE_USE_VERSION 312
#include <fuse_lowlevel.h>

#include <deque>
#include <string>
#include <vector>

#include <utils/Mutex.h>

// One emulated kernel character device: a queue of records with the semantics of a driver's
// record buffer. Each write is one record; each read returns at most one record (a short read
// takes the head of the record and leaves the rest for the next read); a read of an empty queue
// is held until a record arrives or the reader is interrupted; a write to a full queue is held
// until a reader makes room. Readiness is reported to poll/select/epoll as readable, and for a
// priority node also as POLLPRI.
//
// Threads: every operation runs on one of the FUSE session's worker threads (or on the thread
// that delivers an interrupt); all state is guarded by `lock_`. Replies to held requests are sent
// under `lock_`, which libfuse allows because replying never takes a request's own lock.
class RecordNode {
public:
    RecordNode(const char* name, fuse_ino_t ino, bool priority, size_t capacity)
        : name(name), ino(ino), priority_(priority), capacity_(capacity) {}
    RecordNode(const RecordNode&) = delete;
    RecordNode& operator=(const RecordNode&) = delete;

    const char* const name;
    const fuse_ino_t ino;

    void Read(fuse_req_t req, size_t size);
    void Write(fuse_req_t req, const char* data, size_t size);
    void Poll(fuse_req_t req, fuse_pollhandle* ph);
    // Fails every held request; called once the session has stopped serving.
    void Shutdown();

private:
    struct HeldWrite {
        fuse_req_t req;
        std::string record;
    };
    struct HeldRead {
        fuse_req_t req;
        size_t size;
    };

    static void OnInterrupt(fuse_req_t req, void* node);
    void Interrupt(fuse_req_t req);
    void ReplyWithHead(fuse_req_t req, size_t size) REQUIRES(lock_);
    void Settle() REQUIRES(lock_);
    void NotifyPollers() REQUIRES(lock_);
    unsigned ReadyEvents() const REQUIRES(lock_);

    const bool priority_;
    const size_t capacity_;
    android::Mutex lock_;
    std::deque<std::string> records_ GUARDED_BY(lock_);
    size_t headOffset_ GUARDED_BY(lock_) = 0;  // bytes of the head record already read
    std::deque<HeldRead> heldReads_ GUARDED_BY(lock_);
    std::deque<HeldWrite> heldWrites_ GUARDED_BY(lock_);
    std::vector<fuse_pollhandle*> pollers_ GUARDED_BY(lock_);
};

#endif  // ORVANE_TOOLS_DEVSIM_RECORD_NODE_H
