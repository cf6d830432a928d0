#ifndef ORVANE_PLUGINS_PARAM_FILTER_H
#define ORVANE_PLUGINS_PARAM_FILTER_H

#include <array>
#include <cstdint>
#include <functional>
#include <memory>
#include <sstream>
#include <string>

#include <json/json.h>

#include "config/event_xml_parser.h"
#include "config/privacy_policy.h"
#include "utils/daemon_stats.h"

namespace android {
namespace Orvane {

// The privacy counters, one per outcome and reason, kept in the daemon's statistics under the
// names of kNames ("privacy.removed.level", ...). Any thread may count and read.
class PrivacyCounters {
public:
    enum Reason : size_t {
        kDroppedEventLevel,
        kDroppedFilterList,
        kDroppedUnknownEvent,
        kDroppedBadParamList,
        kStrippedUnknownEvent,
        kStrippedBadParamList,
        kRemovedUnknownName,
        kRemovedLevel,
        kReplacedLevel,
        kRemovedType,
        kReplacedType,
        kRemovedIdentifier,
        kReplacedIdentifier,
        kRemovedTooDeep,
        kRemovedUnknownClass,
        kCutString,
        kCutArray,
        kEncrypted,
        kReasonCount
    };
    static const std::array<const char*, kReasonCount> kNames;

    explicit PrivacyCounters(DaemonStats& stats);
    void Add(Reason reason) { counters_[reason]->fetch_add(1, std::memory_order_relaxed); }
    uint64_t Value(Reason reason) const { return counters_[reason]->load(std::memory_order_relaxed); }

private:
    std::array<DaemonStats::Counter*, kReasonCount> counters_;
};

// Applies the privacy policy to the parameters of one event ("param_list", a JSON object)
// against the event's catalogue entry: drops the event, or removes, replaces, cuts and encrypts
// members, or leaves the text untouched byte for byte. Every step is counted by its reason.
//
// The text is parsed once; its nesting is measured first in one pass, so a deeply nested text is
// refused without recursion. The cost is linear in the text plus one catalogue lookup per nested
// class value (at most 4 levels of objects, the parameter object included).
//
// Threads: one instance belongs to one thread (the compliance plugin's loop); it reuses its JSON
// reader and writer between events.
class ParamFilter {
public:
    enum class Verdict { kUntouched, kRewritten, kDropped };
    // The catalogue entry of a class id, or null.
    using ClassLookup = std::function<sp<EventInfoConfig>(uint32_t classId)>;

    static constexpr int kMaxObjectDepth = 4;
    // Bracket nesting beyond which a text is not parsed at all.
    static constexpr size_t kMaxNesting = 32;

    ParamFilter(PrivacyCounters& counters, ClassLookup lookup);

    // `entry` is the event's catalogue entry, null when the catalogue does not know the event.
    // `params` is the "param_list" text; on kRewritten it holds the new text. On kDropped,
    // `dropReason` names the rule ("privacy.filter_list", ...).
    Verdict Apply(const PrivacyPolicy& policy, bool consented, const EventInfoConfig* entry, std::string& params,
                  std::string& dropReason);

private:
    enum class Check { kOk, kWrongType, kTooDeep, kUnknownClass };

    // Parses `text` into `root`; false when it is not a JSON object within kMaxNesting, or holds
    // a comment.
    bool ParseObject(const std::string& text, Json::Value& root);
    bool IsFilteredProcess(const PrivacyPolicy& policy, const Json::Value& root) const;
    void FilterObject(const EventInfoConfig& entry, Json::Value& object, int depth);
    // False when the member is to be removed.
    bool FilterMember(const EventParamInfoCfg* param, Json::Value& value, int depth);
    Check CheckValue(const EventParamInfoCfg& param, Json::Value& value, int depth);
    bool FilterArray(const EventParamInfoCfg& param, Json::Value& value, int depth);
    // defVal, or removal when there is none; false when the member is to be removed.
    bool Withhold(const EventParamInfoCfg& param, Json::Value& value, PrivacyCounters::Reason removed,
                  PrivacyCounters::Reason replaced);
    bool Seal(Json::Value& value);
    void Count(PrivacyCounters::Reason reason);

    PrivacyCounters& counters_;
    ClassLookup lookup_;
    std::unique_ptr<Json::CharReader> reader_;
    std::unique_ptr<Json::StreamWriter> writer_;
    std::ostringstream written_;
    // Of the event being filtered.
    const PrivacyPolicy* policy_ = nullptr;
    bool consented_ = false;
    uint32_t maxLevel_ = 0;
    bool changed_ = false;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLUGINS_PARAM_FILTER_H
