#include "utils/trace.h"

#include <cutils/trace.h>

// libcutils declares these only inside its inline helpers.
extern "C" void atrace_begin_body(const char* name);
extern "C" void atrace_end_body();

namespace android {
namespace Orvane {

bool ScopedTrace::IsTraceEnabled() {
    return (atrace_get_enabled_tags() & ATRACE_TAG_ALWAYS) != 0;
}

ScopedTrace::ScopedTrace(const char* name) : open_(IsTraceEnabled()) {
    if (open_) {
        atrace_begin_body(name);
    }
}

ScopedTrace::~ScopedTrace() {
    if (open_) {
        atrace_end_body();
    }
}

}  // namespace Orvane
}  // namespace android
