#ifndef ORVANE_UTILS_TRACE_H
#define ORVANE_UTILS_TRACE_H

#include <cstdint>
#include <string>

namespace android {
namespace Orvane {

// A system trace section open for the lifetime of the object, under the always-on tag, so
// that every way out of a scope closes it. Callers that build the name only when tracing is
// on ask IsTraceEnabled() first.
class ScopedTrace {
public:
    explicit ScopedTrace(const char* name);
    explicit ScopedTrace(const std::string& name) : ScopedTrace(name.c_str()) {}
    ~ScopedTrace();
    ScopedTrace(const ScopedTrace&) = delete;
    ScopedTrace& operator=(const ScopedTrace&) = delete;

    static bool IsTraceEnabled();

private:
    bool open_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_UTILS_TRACE_H
