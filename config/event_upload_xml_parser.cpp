#include "config/event_upload_xml_parser.h"

#include <limits.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <algorithm>

#include "config/config_document.h"
#include "config/xml_parser.h"
#include "utils/orvane_log.h"

namespace android {
namespace Orvane {

namespace {

// The rules of a phone are a few kilobytes; the bounds refuse documents built to cost memory.
constexpr int64_t kMaxDocumentSize = 256 * 1024;
constexpr size_t kMaxRuleSets = 1024;
constexpr size_t kMaxLogsPerRuleSet = 64;
constexpr size_t kMaxCommandLength = 1024;
constexpr size_t kMaxFileNameLength = 64;

constexpr char kRootElement[] = "EventUpload";
constexpr char kRuleSetElement[] = "LogRule";
constexpr char kSubscriptionElement[] = "Subscribe";
constexpr size_t kMaxSubscriptions = 1024;
// Only records of these ids are handed over for upload ("eventinfo.9xx" files).
constexpr uint32_t kSubscribableMin = 900000000;
constexpr uint32_t kSubscribableMax = 999999999;
constexpr char kRejectedCounter[] = "config.event_upload.rejected";

// Decimal digits only, at most `max`; false for anything else (signs, blanks, units).
bool ParseNumber(const std::string& text, uint64_t max, uint32_t& value) {
    if (text.empty() || text.size() > 10 || text.find_first_not_of("0123456789") != std::string::npos) {
        return false;
    }
    uint64_t number = strtoull(text.c_str(), nullptr, 10);
    if (number > max) {
        return false;
    }
    value = static_cast<uint32_t>(number);
    return true;
}

bool IsAbsolutePath(const std::string& path) {
    return !path.empty() && path[0] == '/' && path.size() < PATH_MAX && path.find('\0') == std::string::npos;
}

// A name for an entry of the pack: letters, digits, ".", "_" and "-", not starting with ".".
bool IsPlainFileName(const std::string& name) {
    return !name.empty() && name.size() <= kMaxFileNameLength && name[0] != '.' &&
           name.find_first_not_of("ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789._-") ==
                   std::string::npos;
}

// Words separated by single blanks, as the command runner splits them (no shell, no quoting).
bool IsCommandLine(const std::string& command) {
    return !command.empty() && command.size() <= kMaxCommandLength && command.front() != ' ' && command.back() != ' ' &&
           command.find("  ") == std::string::npos && std::none_of(command.begin(), command.end(), [](char c) {
               return static_cast<unsigned char>(c) < 0x20 || c == 0x7f;
           });
}

// The entry of the smallest range that holds id; the first among equal ones.
template <typename Entry>
const Entry* FindSmallestRange(const std::vector<Entry>& entries, uint32_t id) {
    const Entry* best = nullptr;
    for (const Entry& entry : entries) {
        if (entry.eventMin <= id && id <= entry.eventMax &&
            (best == nullptr || entry.eventMax - entry.eventMin < best->eventMax - best->eventMin)) {
            best = &entry;
        }
    }
    return best;
}

// Reads one document in element mode into new rules. Lives for one reading only.
class UploadRulesReader : public XmlParser {
public:
    explicit UploadRulesReader(const std::string& path)
        : XmlParser(EventUploadXmlParser::kFileName), path_(path), rules_(std::make_shared<UploadRules>()) {}

    // The rules, or null with `error` saying why the document gives none.
    std::shared_ptr<UploadRules> Read(std::string& error) {
        int64_t size = FileUtil::GetFileStamp(path_).size;
        if (size < 0) {
            error = "missing";
        } else if (size > kMaxDocumentSize) {
            error = "larger than " + std::to_string(kMaxDocumentSize) + " bytes";
        } else if (ParserXmlFile(path_, true) != 0) {
            error = "not well-formed XML";
        } else if (!rootError_.empty()) {
            error = rootError_;
        } else if (!rootSeen_) {
            error = std::string("no ") + kRootElement + " element";
        }
        if (!error.empty()) {
            return nullptr;
        }
        rules_->source = path_;
        return rules_;
    }

    bool IsMatch(const std::string& name) override REQUIRES(gXmlDocumentMutex) {
        if (name == kRootElement) {
            rootSeen_ = true;
            SetStart();
            return true;
        }
        rootError_ = "root element " + name + " is not " + kRootElement;
        SetFinish();
        return false;
    }

    void OnStartElement(const std::string& name, const std::map<std::string, std::string>& attributes) override
            REQUIRES(gXmlDocumentMutex) {
        if (name == kRuleSetElement) {
            OpenRuleSet(attributes);
        } else if (name == "Static" || name == "Dynamic" || name == "Command") {
            AddLog(name, attributes);
        } else if (name == kSubscriptionElement) {
            AddSubscription(attributes);
        }
        // The root and other elements are left to newer readers.
    }

    void OnEndElement(const std::string& name) override REQUIRES(gXmlDocumentMutex) {
        if (name == kRuleSetElement && depth_ > 0 && --depth_ == 0) {
            current_ = nullptr;
            skipping_ = false;
        }
    }

private:
    void Reject(const std::string& element, const std::string& why) {
        rules_->rejected++;
        OLOG_LIMITED_AS(ANDROID_LOG_WARN, "ReadRules", "%s %s: %s left out, %s", path_.c_str(), element.c_str(),
                        why.c_str());
    }

    void OpenRuleSet(const std::map<std::string, std::string>& attributes) {
        if (depth_++ > 0) {
            if (!skipping_) {
                Reject(kRuleSetElement, "a LogRule inside a LogRule (it is left out with its sources)");
            }
            return;
        }
        UploadRules::RuleSet ruleSet;
        std::string why = ReadIdRange(attributes, ruleSet.eventMin, ruleSet.eventMax);
        if (why.empty() && rules_->ruleSets.size() >= kMaxRuleSets) {
            why = "more than " + std::to_string(kMaxRuleSets) + " rule sets";
        }
        if (!why.empty()) {
            skipping_ = true;
            Reject(kRuleSetElement, why);
            return;
        }
        rules_->ruleSets.push_back(std::move(ruleSet));
        current_ = &rules_->ruleSets.back();
    }

    void AddLog(const std::string& element, const std::map<std::string, std::string>& attributes) {
        if (skipping_ || depth_ > 1) {
            return;  // left out with its rule set
        }
        if (current_ == nullptr) {
            Reject(element, "it stands outside a LogRule");
            return;
        }
        if (current_->logs.size() >= kMaxLogsPerRuleSet) {
            Reject(element, "more than " + std::to_string(kMaxLogsPerRuleSet) + " sources in one LogRule");
            return;
        }
        LogCollectInfo log;
        std::string why = element == "Static"    ? ReadStatic(attributes, log)
                          : element == "Dynamic" ? ReadDynamic(attributes, log)
                                                 : ReadCommand(attributes, log);
        if (why.empty() && log.kind != LogCollectInfo::Kind::kCommand) {
            why = ReadDelete(attributes, log);
        }
        if (!why.empty()) {
            Reject(element, why);
            return;
        }
        current_->logs.push_back(std::move(log));
    }

    // "eventId", or "eventMin" <= "eventMax"; empty when valid, else why not.
    static std::string ReadIdRange(const std::map<std::string, std::string>& attributes, uint32_t& min, uint32_t& max) {
        std::string id = GetAttribute(attributes, "eventId");
        bool ranged = attributes.count("eventMin") != 0 || attributes.count("eventMax") != 0;
        bool valid = id.empty()
                             ? ranged && ParseNumber(GetAttribute(attributes, "eventMin"), UINT32_MAX, min) &&
                                       ParseNumber(GetAttribute(attributes, "eventMax"), UINT32_MAX, max) && min <= max
                             : !ranged && ParseNumber(id, UINT32_MAX, min);
        if (!id.empty()) {
            max = min;
        }
        return valid ? "" : "it needs eventId, or eventMin <= eventMax, as decimal ids";
    }

    void AddSubscription(const std::map<std::string, std::string>& attributes) {
        if (depth_ > 0) {
            Reject(kSubscriptionElement, "it stands inside a LogRule");
            return;
        }
        if (rules_->subscriptions.size() >= kMaxSubscriptions) {
            Reject(kSubscriptionElement, "more than " + std::to_string(kMaxSubscriptions) + " subscriptions");
            return;
        }
        UploadRules::Subscription subscription;
        std::string why = ReadIdRange(attributes, subscription.eventMin, subscription.eventMax);
        if (why.empty() && (subscription.eventMin < kSubscribableMin || subscription.eventMax > kSubscribableMax)) {
            why = "ids must lie in " + std::to_string(kSubscribableMin) + ".." + std::to_string(kSubscribableMax);
        }
        if (why.empty() && (!ParseNumber(GetAttribute(attributes, "expire"), UploadRules::Subscription::kMaxExpireDays,
                                         subscription.expireDays) ||
                            subscription.expireDays == 0)) {
            why = "expire must be 1.." + std::to_string(UploadRules::Subscription::kMaxExpireDays) + " days";
        }
        std::string visible = GetAttribute(attributes, "visible");
        if (why.empty() && visible != "true" && visible != "false") {
            why = "visible must be true or false";
        }
        if (!why.empty()) {
            Reject(kSubscriptionElement, why);
            return;
        }
        subscription.visible = visible == "true";
        rules_->subscriptions.push_back(subscription);
    }

    static std::string ReadStatic(const std::map<std::string, std::string>& attributes, LogCollectInfo& log) {
        log.kind = LogCollectInfo::Kind::kStatic;
        log.path = GetAttribute(attributes, "path");
        return IsAbsolutePath(log.path) ? "" : "path must be an absolute path";
    }

    static std::string ReadDynamic(const std::map<std::string, std::string>& attributes, LogCollectInfo& log) {
        log.kind = LogCollectInfo::Kind::kDynamic;
        log.path = GetAttribute(attributes, "dir");
        if (!IsAbsolutePath(log.path)) {
            return "dir must be an absolute path";
        }
        std::string error;
        log.pattern = FilePattern::Compile(GetAttribute(attributes, "pattern"), &error);
        if (log.pattern == nullptr) {
            return "pattern: " + error;
        }
        if (attributes.count("count") != 0 &&
            (!ParseNumber(GetAttribute(attributes, "count"), LogCollectInfo::kMaxCount, log.count) || log.count == 0)) {
            return "count must be 1.." + std::to_string(LogCollectInfo::kMaxCount);
        }
        if (attributes.count("maxAgeSec") != 0 &&
            !ParseNumber(GetAttribute(attributes, "maxAgeSec"), UINT32_MAX, log.maxAgeSec)) {
            return "maxAgeSec must be a number of seconds";
        }
        return "";
    }

    std::string ReadCommand(const std::map<std::string, std::string>& attributes, LogCollectInfo& log) const {
        log.kind = LogCollectInfo::Kind::kCommand;
        log.command = GetAttribute(attributes, "cmd");
        log.fileName = GetAttribute(attributes, "file");
        if (!IsCommandLine(log.command)) {
            return "cmd must be words separated by single blanks, at most " + std::to_string(kMaxCommandLength) +
                   " characters";
        }
        if (attributes.count("timeoutSec") != 0 &&
            (!ParseNumber(GetAttribute(attributes, "timeoutSec"), LogCollectInfo::kMaxTimeoutSec, log.timeoutSec) ||
             log.timeoutSec == 0)) {
            return "timeoutSec must be 1.." + std::to_string(LogCollectInfo::kMaxTimeoutSec);
        }
        if (!IsPlainFileName(log.fileName)) {
            return "file must be a plain name (letters, digits, '.', '_', '-'; no leading '.')";
        }
        for (const LogCollectInfo& other : current_->logs) {
            if (other.kind == LogCollectInfo::Kind::kCommand && other.fileName == log.fileName) {
                return "file " + log.fileName + " is already the output of another command";
            }
        }
        return "";
    }

    static std::string ReadDelete(const std::map<std::string, std::string>& attributes, LogCollectInfo& log) {
        std::string value = GetAttribute(attributes, "delete");
        if (!value.empty() && value != "true" && value != "false") {
            return "delete must be true or false";
        }
        log.deleteLog = value == "true";
        return "";
    }

    const std::string path_;
    std::shared_ptr<UploadRules> rules_;
    std::string rootError_;
    bool rootSeen_ = false;                    // set while reading, looked at once the reading is over
    UploadRules::RuleSet* current_ = nullptr;  // the open rule set, into rules_->ruleSets
    int depth_ = 0;                            // LogRule elements open
    bool skipping_ = false;                    // the open rule set was rejected
};

}  // namespace

void LogCollectInfo::DeleteLogFile() const {
    for (const CollectedFile& file : collected) {
        struct stat st;
        if (lstat(file.path.c_str(), &st) != 0 || !S_ISREG(st.st_mode) || st.st_dev != file.device ||
            st.st_ino != file.inode) {
            OLOGW_LIMITED("%s %s is not the file that was packed, not deleted", file.path.c_str());
            continue;
        }
        FileUtil::DeleteFile(file.path);
    }
}

const UploadRules::RuleSet* UploadRules::Find(uint32_t id) const {
    return FindSmallestRange(ruleSets, id);
}

const UploadRules::Subscription* UploadRules::FindSubscription(uint32_t id) const {
    return FindSmallestRange(subscriptions, id);
}

sp<EventUploadXmlParser> EventUploadXmlParser::getInstance() {
    static sp<EventUploadXmlParser> instance(new EventUploadXmlParser());
    return instance;
}

std::shared_ptr<const UploadRules> EventUploadXmlParser::ReadRules(const std::string& path, DaemonStats* stats) {
    sp<UploadRulesReader> reader = new UploadRulesReader(path);
    std::string error;
    std::shared_ptr<const UploadRules> rules = reader->Read(error);
    if (rules == nullptr) {
        OLOGE("%s log rules %s refused (%s): no logs are collected", path.c_str(), error.c_str());
        if (stats != nullptr) {
            stats->Add(std::string("config.read_failed.") + kFileName);
        }
        auto none = std::make_shared<UploadRules>();
        none->source = path;
        return none;
    }
    if (stats != nullptr && rules->rejected > 0) {
        stats->Add(kRejectedCounter, rules->rejected);
    }
    OLOGI("%s log rules %s: %zu rule sets, %zu subscriptions, %zu elements left out", path.c_str(),
          rules->ruleSets.size(), rules->subscriptions.size(), rules->rejected);
    return rules;
}

std::shared_ptr<const UploadRules> EventUploadXmlParser::GetRules(const std::string& cloudDir,
                                                                  const std::string& configDir, DaemonStats* stats) {
    Mutex::Autolock lock(mutex_);
    auto now = std::chrono::steady_clock::now();
    std::string folders = cloudDir + "\n" + configDir;
    if (current_ != nullptr && folders == checkedFolders_ && now - checkedAt_ < kRecheck) {
        return current_;
    }
    checkedAt_ = now;
    checkedFolders_ = folders;
    DocumentChoice choice = ConfigDocument::Choose(DocumentFolders(cloudDir, configDir, stats), kFileName);
    if (current_ != nullptr && choice.path == loadedPath_ && choice.stamp == loadedStamp_) {
        return current_;
    }
    loadedPath_ = choice.path;
    loadedStamp_ = choice.stamp;
    if (choice.stamp.size < 0) {
        OLOGI("%s no %s: no logs are collected", choice.path.c_str());
        current_ = std::make_shared<UploadRules>();
    } else {
        current_ = ReadRules(choice.path, stats);
    }
    return current_;
}

std::vector<LogCollectInfo> EventUploadXmlParser::GetEventLogCollectInfo(PluginContext& context, uint32_t id) {
    std::shared_ptr<const UploadRules> rules =
            GetRules(context.GetCloudConfigDir(), context.GetConfigDir(), &context.GetStats());
    const UploadRules::RuleSet* ruleSet = rules->Find(id);
    return ruleSet != nullptr ? ruleSet->logs : std::vector<LogCollectInfo>();
}

bool EventUploadXmlParser::HasLogRules(PluginContext& context, uint32_t id) {
    std::shared_ptr<const UploadRules> rules =
            GetRules(context.GetCloudConfigDir(), context.GetConfigDir(), &context.GetStats());
    const UploadRules::RuleSet* ruleSet = rules->Find(id);
    return ruleSet != nullptr && !ruleSet->logs.empty();
}

}  // namespace Orvane
}  // namespace android
