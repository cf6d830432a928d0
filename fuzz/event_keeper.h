#ifndef ORVANE_FUZZ_EVENT_KEEPER_H
#define ORVANE_FUZZ_EVENT_KEEPER_H

// The pipeline end of the event source fuzzers: it keeps the last event a source publishes, so
// that the fuzzer can compare it with the input.

#include "platform/pipeline.h"

namespace android {
namespace Orvane {
namespace FuzzEvents {

struct KeepLast : Plugin {
    EVENT_RET OnEvent(sp<Event>& event) override {
        last = event;
        return 0;
    }
    sp<Event> last;
};

// A reference-counted object that lives for the whole run, as the fuzzer's statics do.
template <typename T>
T* HeldForRun(T* object) {
    object->incStrong(object);
    return object;
}

}  // namespace FuzzEvents
}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_FUZZ_EVENT_KEEPER_H
