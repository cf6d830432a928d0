#include "record_node.h"

#include <errno.h>
#include <poll.h>

#include <algorithm>

void RecordNode::Read(fuse_req_t req, size_t size) {
    if (size == 0) {
        fuse_reply_buf(req, nullptr, 0);
        return;
    }
    // Registered before taking the lock: libfuse may run the callback at once, and it takes
    // the lock itself. A request interrupted before it was queued is caught just below.
    fuse_req_interrupt_func(req, OnInterrupt, this);
    android::Mutex::Autolock guard(lock_);
    if (fuse_req_interrupted(req)) {
        fuse_reply_err(req, EINTR);
        return;
    }
    if (records_.empty()) {
        heldReads_.push_back({req, size});
        return;
    }
    ReplyWithHead(req, size);
    Settle();
}

void RecordNode::Write(fuse_req_t req, const char* data, size_t size) {
    if (size == 0) {
        fuse_reply_write(req, 0);
        return;
    }
    fuse_req_interrupt_func(req, OnInterrupt, this);
    android::Mutex::Autolock guard(lock_);
    if (fuse_req_interrupted(req)) {
        fuse_reply_err(req, EINTR);
        return;
    }
    // Held writes keep their order: a new record never overtakes one that is waiting for room.
    heldWrites_.push_back({req, std::string(data, size)});
    Settle();
}

void RecordNode::Poll(fuse_req_t req, fuse_pollhandle* ph) {
    android::Mutex::Autolock guard(lock_);
    unsigned events = ReadyEvents();
    if (ph != nullptr) {
        // A poller that is answered ready now needs no later wake-up; one that waits for a
        // record or for room is woken by the next change of the queue.
        if (records_.empty() || records_.size() >= capacity_) {
            pollers_.push_back(ph);
        } else {
            fuse_pollhandle_destroy(ph);
        }
    }
    fuse_reply_poll(req, events);
}

void RecordNode::Shutdown() {
    android::Mutex::Autolock guard(lock_);
    for (const HeldRead& held : heldReads_) {
        fuse_reply_err(held.req, ENODEV);
    }
    for (const HeldWrite& held : heldWrites_) {
        fuse_reply_err(held.req, ENODEV);
    }
    heldReads_.clear();
    heldWrites_.clear();
    NotifyPollers();
}

void RecordNode::OnInterrupt(fuse_req_t req, void* node) {
    static_cast<RecordNode*>(node)->Interrupt(req);
}

void RecordNode::Interrupt(fuse_req_t req) {
    android::Mutex::Autolock guard(lock_);
    auto read =
            std::find_if(heldReads_.begin(), heldReads_.end(), [req](const HeldRead& held) { return held.req == req; });
    if (read != heldReads_.end()) {
        heldReads_.erase(read);
        fuse_reply_err(req, EINTR);
        return;
    }
    auto write = std::find_if(heldWrites_.begin(), heldWrites_.end(),
                              [req](const HeldWrite& held) { return held.req == req; });
    if (write != heldWrites_.end()) {
        heldWrites_.erase(write);
        fuse_reply_err(req, EINTR);
    }
    // Not found: the request was answered already, or is not queued yet and its handler
    // will see the interrupted flag.
}

void RecordNode::ReplyWithHead(fuse_req_t req, size_t size) {
    const std::string& head = records_.front();
    size_t length = std::min(size, head.size() - headOffset_);
    fuse_reply_buf(req, head.data() + headOffset_, length);
    headOffset_ += length;
    if (headOffset_ == head.size()) {
        records_.pop_front();
        headOffset_ = 0;
    }
}

// Moves the queue forward as far as it goes: held writers fill free room, held readers take
// records_; then pollers_ learn about the new state.
void RecordNode::Settle() {
    for (;;) {
        if (!heldReads_.empty() && !records_.empty()) {
            HeldRead held = heldReads_.front();
            heldReads_.pop_front();
            ReplyWithHead(held.req, held.size);
        } else if (!heldWrites_.empty() && records_.size() < capacity_) {
            HeldWrite held = std::move(heldWrites_.front());
            heldWrites_.pop_front();
            size_t size = held.record.size();
            records_.push_back(std::move(held.record));
            fuse_reply_write(held.req, size);
        } else {
            break;
        }
    }
    NotifyPollers();
}

void RecordNode::NotifyPollers() {
    for (fuse_pollhandle* ph : pollers_) {
        fuse_lowlevel_notify_poll(ph);
        fuse_pollhandle_destroy(ph);
    }
    pollers_.clear();
}

unsigned RecordNode::ReadyEvents() const {
    unsigned events = 0;
    if (!records_.empty()) {
        events |= POLLIN | POLLRDNORM;
        if (priority_) {
            events |= POLLPRI;
        }
    }
    if (records_.size() < capacity_) {
        events |= POLLOUT | POLLWRNORM;
    }
    return events;
}
