#ifndef ORVANE_PLUGINS_EVENT_PRIVACY_COMPLIANCE_H
#define ORVANE_PLUGINS_EVENT_PRIVACY_COMPLIANCE_H

#include <memory>
#include <string>
#include <vector>

#include "platform/plugin.h"
#include "plugins/param_filter.h"
#include "utils/thread_checker.h"

namespace android {
namespace Orvane {

// The first plugin of the fault pipeline: no event parameter goes on to storage unless the
// catalogue and the privacy policy allow it. For each event with a fault or statistics id it
// looks up the event's catalogue entry, reads the consent state (the upload switch) and applies
// the policy in force to "param_list" (ParamFilter): a dropped event gets its "dropReason" and
// ends the pipeline (-1); a changed parameter list is written back as compact JSON; an event the
// rules did not touch goes on exactly as it came. Everything is counted by reason.
//
// Threads: OnEvent runs on the plugin's loop, which owns the filter (checked at run time). Dump,
// from a binder thread, reads only the policy in force and the counters, both safe anywhere.
class EventPrivacyCompliance : public Plugin {
public:
    void OnLoad() override;
    EVENT_RET OnEvent(sp<Event>& event) override;
    void Dump(int fd, const std::vector<std::string>& args) override;

private:
    std::unique_ptr<PrivacyCounters> counters_;
    std::unique_ptr<ParamFilter> filter_;
    // The catalogue folder of the event being filtered, for the lookups of nested classes.
    std::string catalogueDir_;
    ThreadChecker loopThread_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_EVENT_PRIVACY_COMPLIANCE_H
