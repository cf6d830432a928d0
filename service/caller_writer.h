#ifndef ORVANE_SERVICE_CALLER_WRITER_H
#define ORVANE_SERVICE_CALLER_WRITER_H

#include <chrono>
#include <cstddef>

namespace android {
namespace Orvane {

// Writes to a descriptor that a caller handed over (a dump's output) so that a caller who reads
// slowly, never reads or has gone can neither stall nor end the daemon: no write waits for the
// reader beyond the deadline, and a reader that is gone is an error, not a signal.
// Stateless; any thread.
namespace CallerWriter {

// True when the caller took all of the bytes before the deadline. The file description stays as
// the caller made it (its flags are shared with the caller and never changed): a socket gets
// non-blocking sends; anything else gets at most one pipe buffer's worth (PIPE_BUF) per write,
// and only once poll says there is room, so a write cannot block unless another writer fills
// the same pipe in between.
bool Write(int fd, const char* bytes, size_t length, std::chrono::steady_clock::time_point deadline);

}  // namespace CallerWriter
}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_SERVICE_CALLER_WRITER_H
