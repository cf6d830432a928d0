#ifndef ORVANE_PLUGINS_EVENT_PRIVACY_COMPLIANCE_H
#define ORVANE_PLUGINS_EVENT_PRIVACY_COMPLIANCE_H

#include <chrono>
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
// Threads: OnEvent runs on the plugin's loop, which owns the filter and the documents in use
// (checked at run time). Dump,
// from a binder thread, reads only the policy in force and the counters, both safe anywhere.
class EventPrivacyCompliance : public Plugin {
public:
    void OnLoad() override;
    EVENT_RET OnEvent(sp<Event>& event) override;
    void Dump(int fd, const std::vector<std::string>& args) override;

    // How long the policy and the catalogue folder in use are kept before their files are
    // looked at again (a few stats): a changed document reaches events within this time.
    static constexpr std::chrono::milliseconds kDocumentRecheck{1000};

private:
    void RefreshDocuments(PluginContext& context);

    std::unique_ptr<PrivacyCounters> counters_;
    std::unique_ptr<ParamFilter> filter_;
    // Loop-owned: the documents in use, and when they were last looked at.
    std::shared_ptr<const PrivacyPolicy> policy_;
    std::string catalogueDir_;
    std::chrono::steady_clock::time_point documentsCheckedAt_;
    ThreadChecker loopThread_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_EVENT_PRIVACY_COMPLIANCE_H
