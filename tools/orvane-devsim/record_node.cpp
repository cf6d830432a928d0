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
    std::lock_guard<std::mutex> guard(lock);
    if (fuse_req_interrupted(req)) {
        fuse_reply_err(req, EINTR);
        return;
    }
    if (records.empty()) {
        heldReads.push_back({req, size});
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
    std::lock_guard<std::mutex> guard(lock);
    if (fuse_req_interrupted(req)) {
        fuse_reply_err(req, EINTR);
        return;
    }
    // Held writes keep their order: a new record never overtakes one that is waiting for room.
    heldWrites.push_back({req, std::string(data, size)});
    Settle();
}

void RecordNode::Poll(fuse_req_t req, fuse_pollhandle* ph) {
    std::lock_guard<std::mutex> guard(lock);
    unsigned events = ReadyEvents();
    if (ph != nullptr) {
        // A poller that is answered ready now needs no later wake-up; one that waits for a
        // record or for room is woken by the next change of the queue.
        if (records.empty() || records.size() >= capacity) {
            pollers.push_back(ph);
        } else {
            fuse_pollhandle_destroy(ph);
        }
    }
    fuse_reply_poll(req, events);
}

void RecordNode::Shutdown() {
    std::lock_guard<std::mutex> guard(lock);
    for (const HeldRead& held : heldReads) {
        fuse_reply_err(held.req, ENODEV);
    }
    for (const HeldWrite& held : heldWrites) {
        fuse_reply_err(held.req, ENODEV);
    }
    heldReads.clear();
    heldWrites.clear();
    NotifyPollers();
}

void RecordNode::OnInterrupt(fuse_req_t req, void* node) {
    static_cast<RecordNode*>(node)->Interrupt(req);
}

void RecordNode::Interrupt(fuse_req_t req) {
    std::lock_guard<std::mutex> guard(lock);
    auto read =
            std::find_if(heldReads.begin(), heldReads.end(), [req](const HeldRead& held) { return held.req == req; });
    if (read != heldReads.end()) {
        heldReads.erase(read);
        fuse_reply_err(req, EINTR);
        return;
    }
    auto write = std::find_if(heldWrites.begin(), heldWrites.end(),
                              [req](const HeldWrite& held) { return held.req == req; });
    if (write != heldWrites.end()) {
        heldWrites.erase(write);
        fuse_reply_err(req, EINTR);
    }
    // Not found: the request was answered already, or is not queued yet and its handler
    // will see the interrupted flag.
}

void RecordNode::ReplyWithHead(fuse_req_t req, size_t size) {
    const std::string& head = records.front();
    size_t length = std::min(size, head.size() - headOffset);
    fuse_reply_buf(req, head.data() + headOffset, length);
    headOffset += length;
    if (headOffset == head.size()) {
        records.pop_front();
        headOffset = 0;
    }
}

// Moves the queue forward as far as it goes: held writers fill free room, held readers take
// records; then pollers learn about the new state.
void RecordNode::Settle() {
    for (;;) {
        if (!heldReads.empty() && !records.empty()) {
            HeldRead held = heldReads.front();
            heldReads.pop_front();
            ReplyWithHead(held.req, held.size);
        } else if (!heldWrites.empty() && records.size() < capacity) {
            HeldWrite held = std::move(heldWrites.front());
            heldWrites.pop_front();
            size_t size = held.record.size();
            records.push_back(std::move(held.record));
            fuse_reply_write(held.req, size);
        } else {
            break;
        }
    }
    NotifyPollers();
}

void RecordNode::NotifyPollers() {
    for (fuse_pollhandle* ph : pollers) {
        fuse_lowlevel_notify_poll(ph);
        fuse_pollhandle_destroy(ph);
    }
    pollers.clear();
}

unsigned RecordNode::ReadyEvents() const {
    unsigned events = 0;
    if (!records.empty()) {
        events |= POLLIN | POLLRDNORM;
        if (priority) {
            events |= POLLPRI;
        }
    }
    if (records.size() < capacity) {
        events |= POLLOUT | POLLWRNORM;
    }
    return events;
}
