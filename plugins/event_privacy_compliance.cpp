#include "plugins/event_privacy_compliance.h"

#include <stdio.h>

#include <cinttypes>

#include "config/config_document.h"
#include "config/event_xml_parser.h"
#include "config/privacy_policy.h"
#include "platform/plugin_context.h"
#include "platform/plugin_factory.h"
#include "utils/dev_info.h"
#include "utils/orvane_log.h"

namespace android {
namespace Orvane {

ORVANE_REGISTER_PLUGIN(EventPrivacyCompliance);

namespace {

constexpr char kCatalogueFile[] = "event.xml";

}  // namespace

void EventPrivacyCompliance::OnLoad() {
    SetVersion("EventPrivacyCompliance-1.0");
    SetName("EventPrivacyCompliance");
    PluginContext* context = GetPluginContext();
    if (context == nullptr) {
        OLOGE("%s no plugin context: every event is dropped");
        return;
    }
    counters_ = std::make_unique<PrivacyCounters>(context->GetStats());
    filter_ = std::make_unique<ParamFilter>(*counters_, [this](uint32_t classId) {
        return EventXmlParser::getInstance()->GetEventInfoConfig(catalogueDir_, classId);
    });
    PrivacyPolicyParser::getInstance()->GetPolicy(*context);  // logs the policy in force at start
}

EVENT_RET EventPrivacyCompliance::OnEvent(sp<Event>& event) {
    loopThread_.Check("OnEvent");
    if (event == nullptr || !IsFaultEventId(event->eventId)) {
        return 0;
    }
    PluginContext* context = GetPluginContext();
    if (filter_ == nullptr || context == nullptr) {
        event->SetValue(kKeyDropReason, "privacy.not_loaded");
        return -1;
    }
    RefreshDocuments(*context);
    sp<EventInfoConfig> entry = EventXmlParser::getInstance()->GetEventInfoConfig(catalogueDir_, event->eventId);
    bool consented = DevInfo::GetUploadSwitch() == "on";
    std::string params = event->GetValue(kKeyParamList);
    std::string dropReason;
    switch (filter_->Apply(*policy_, consented, entry.get(), params, dropReason)) {
        case ParamFilter::Verdict::kDropped:
            OLOGI_LIMITED("%s event %u dropped by %s", event->eventId, dropReason.c_str());
            event->SetValue(kKeyDropReason, dropReason);
            return -1;
        case ParamFilter::Verdict::kRewritten:
            event->SetValue(kKeyParamList, params);
            return 0;
        case ParamFilter::Verdict::kUntouched:
            return 0;
    }
    return 0;
}

void EventPrivacyCompliance::RefreshDocuments(PluginContext& context) {
    auto now = std::chrono::steady_clock::now();
    if (policy_ != nullptr && now - documentsCheckedAt_ < kDocumentRecheck) {
        return;
    }
    documentsCheckedAt_ = now;
    policy_ = PrivacyPolicyParser::getInstance()->GetPolicy(context);
    catalogueDir_ = ConfigDocument::Choose(context, kCatalogueFile).directory;
}

void EventPrivacyCompliance::Dump(int fd, const std::vector<std::string>&) {
    PluginContext* context = GetPluginContext();
    if (context == nullptr || counters_ == nullptr) {
        dprintf(fd, "%s not loaded\n", GetName().c_str());
        return;
    }
    dprintf(fd, "%s\npolicy %s\nupload switch %s\n", GetVersion().c_str(),
            PrivacyPolicyParser::getInstance()->GetPolicy(*context)->Describe().c_str(),
            DevInfo::GetUploadSwitch().c_str());
    for (size_t i = 0; i < PrivacyCounters::kReasonCount; ++i) {
        dprintf(fd, "%s %" PRIu64 "\n", PrivacyCounters::kNames[i],
                counters_->Value(static_cast<PrivacyCounters::Reason>(i)));
    }
}

}  // namespace Orvane
}  // namespace android
