#include "utils/daemon_stats.h"

#include <cinttypes>
#include <cstdio>

namespace android {
namespace Orvane {

DaemonStats::Counter& DaemonStats::Get(const std::string& name) {
    Mutex::Autolock lock(mutex_);
    std::unique_ptr<Counter>& counter = counters_[name];
    if (counter == nullptr) {
        counter = std::make_unique<Counter>(0);
    }
    return *counter;
}

void DaemonStats::RaiseTo(Counter& mark, uint64_t value) {
    uint64_t seen = mark.load(std::memory_order_relaxed);
    while (seen < value && !mark.compare_exchange_weak(seen, value, std::memory_order_relaxed)) {
    }
}

uint64_t DaemonStats::Value(const std::string& name) const {
    Mutex::Autolock lock(mutex_);
    auto found = counters_.find(name);
    return found == counters_.end() ? 0 : found->second->load(std::memory_order_relaxed);
}

std::string DaemonStats::Format() const {
    Mutex::Autolock lock(mutex_);
    std::string text;
    char value[24];
    for (const auto& [name, counter] : counters_) {
        snprintf(value, sizeof(value), " %" PRIu64 "\n", counter->load(std::memory_order_relaxed));
        text += name + value;
    }
    return text;
}

}  // namespace Orvane
}  // namespace android
