#include "config/privacy_policy.h"

#include <fnmatch.h>
#include <limits.h>
#include <stdlib.h>

#include "config/config_document.h"
#include "config/xml_parser.h"
#include "utils/orvane_log.h"

namespace android {
namespace Orvane {

namespace {

// A policy is a few kilobytes; the bounds refuse documents built to cost memory or time per event.
constexpr int64_t kMaxDocumentSize = 256 * 1024;
constexpr size_t kMaxListEntries = 1024;
// Shell patterns are matched one by one for every event or file; exact names cost one lookup.
constexpr size_t kMaxPatterns = 64;

constexpr char kRootElement[] = "PrivacyPolicy";

// "1".."5" or "L1".."L5"; 0 for anything else. Stricter than the catalogue's reading, where an
// unknown text means 5: in a policy a typo must not open everything.
uint32_t ParseLevel(const std::string& text) {
    std::string digits = text.size() == 2 && text[0] == 'L' ? text.substr(1) : text;
    if (digits.size() == 1 && digits[0] >= '1' && digits[0] <= '5') {
        return static_cast<uint32_t>(digits[0] - '0');
    }
    return 0;
}

std::vector<std::string> SplitNames(const std::string& text) {
    std::vector<std::string> names;
    size_t pos = 0;
    while ((pos = text.find_first_not_of(" \t\r\n,", pos)) != std::string::npos) {
        size_t end = text.find_first_of(" \t\r\n,", pos);
        names.push_back(text.substr(pos, end - pos));
        pos = end;
    }
    return names;
}

// A folder as the file system names it, so that a path resolved with realpath can be compared
// with it; as written when it does not exist (yet).
std::string ResolvePrefix(const std::string& prefix) {
    char resolved[PATH_MAX];
    std::string path = realpath(prefix.c_str(), resolved) != nullptr ? resolved : prefix;
    while (path.size() > 1 && path.back() == '/') {
        path.pop_back();
    }
    return path == "/" ? "" : path;
}

// Reads one document in element mode into a new policy. Lives for one reading only; the first
// error stops the reading and is kept.
class PolicyReader : public XmlParser {
public:
    PolicyReader() : XmlParser(PrivacyPolicyParser::kFileName), policy_(std::make_shared<PrivacyPolicy>()) {}

    std::shared_ptr<PrivacyPolicy> Read(const std::string& path, std::string& error) {
        int64_t size = FileUtil::GetFileStamp(path).size;
        if (size < 0) {
            error = "missing";
        } else if (size > kMaxDocumentSize) {
            error = "larger than " + std::to_string(kMaxDocumentSize) + " bytes";
        } else if (ParserXmlFile(path, true) != 0 && error_.empty()) {
            error = "not well-formed XML";
        } else if (!error_.empty()) {
            error = error_;
        } else if (!sawRoot_) {
            error = std::string("no ") + kRootElement + " element";
        } else if (!sawLevels_) {
            error = "no Levels element";
        }
        if (!error.empty()) {
            return nullptr;
        }
        policy_->source = path;
        return policy_;
    }

    bool IsMatch(const std::string& name) override REQUIRES(gXmlDocumentMutex) {
        if (name == kRootElement) {
            SetStart();
            sawRoot_ = true;
            return true;
        }
        Refuse("root element " + name + " is not " + kRootElement);
        return false;
    }

    void OnStartElement(const std::string& name, const std::map<std::string, std::string>& attributes) override
            REQUIRES(gXmlDocumentMutex) {
        if (!error_.empty()) {
            return;
        }
        if (name == kRootElement) {
            return;
        }
        if (name == "Levels") {
            policy_->levelConsented = ParseLevel(GetAttribute(attributes, "switchOn"));
            policy_->levelOtherwise = ParseLevel(GetAttribute(attributes, "switchOff"));
            sawLevels_ = true;
            Require(policy_->levelConsented != 0 && policy_->levelOtherwise != 0,
                    "Levels needs switchOn and switchOff of 1..5 or L1..L5");
        } else if (name == "UnknownEvent") {
            ReadAction(GetAttribute(attributes, "action"));
        } else if (name == "Identifiers") {
            ReadIdentifiers(attributes);
        } else if (name == "FilterList") {
            section_ = name;
            policy_->filterParams = SplitNames(GetAttribute(attributes, "params"));
            Require(!policy_->filterParams.empty(), "FilterList needs params");
        } else if (name == "LogPaths") {
            section_ = name;
        } else if (name == "Param") {
            std::string param = GetAttribute(attributes, "name");
            Require(InSection("Identifiers", name) && !param.empty(), "Param needs a name");
            policy_->identifierNames.insert(param);
            Count(policy_->identifierNames.size());
        } else if (name == "Name") {
            ReadFilterName(GetAttribute(attributes, "value"), GetAttribute(attributes, "pattern"));
        } else if (name == "Allow") {
            std::string prefix = GetAttribute(attributes, "prefix");
            Require(InSection("LogPaths", name) && !prefix.empty() && prefix[0] == '/' &&
                            prefix.find("/../") == std::string::npos,
                    "Allow needs an absolute prefix");
            policy_->allowedPrefixes.push_back(ResolvePrefix(prefix));
            Count(policy_->allowedPrefixes.size());
        } else if (name == "Deny") {
            std::string pattern = GetAttribute(attributes, "pattern");
            Require(InSection("LogPaths", name) && !pattern.empty(), "Deny needs a pattern");
            policy_->deniedPatterns.push_back(pattern);
            Count(policy_->deniedPatterns.size());
        }
        // Other elements are left to newer readers.
    }

    void OnEndElement(const std::string& name) override REQUIRES(gXmlDocumentMutex) {
        if (name == section_) {
            section_.clear();
        }
    }

private:
    void Refuse(const std::string& why) REQUIRES(gXmlDocumentMutex) {
        if (error_.empty()) {
            error_ = why;
        }
        SetFinish();
    }
    void Require(bool condition, const std::string& why) REQUIRES(gXmlDocumentMutex) {
        if (!condition) {
            Refuse(why);
        }
    }
    bool InSection(const char* section, const std::string& element) REQUIRES(gXmlDocumentMutex) {
        Require(section_ == section, element + " outside " + section);
        return section_ == section;
    }
    void Count(size_t entries) REQUIRES(gXmlDocumentMutex) {
        Require(entries <= kMaxListEntries, "a list longer than 1024 entries");
    }

    void ReadAction(const std::string& action) REQUIRES(gXmlDocumentMutex) {
        if (action == "keep") {
            policy_->unchecked = UncheckedAction::kKeep;
        } else if (action == "strip") {
            policy_->unchecked = UncheckedAction::kStrip;
        } else if (action == "drop") {
            policy_->unchecked = UncheckedAction::kDrop;
        } else {
            Refuse("UnknownEvent action must be keep, strip or drop");
        }
    }

    void ReadIdentifiers(const std::map<std::string, std::string>& attributes) REQUIRES(gXmlDocumentMutex) {
        section_ = "Identifiers";
        policy_->keyFile = GetAttribute(attributes, "key");
        Require(policy_->keyFile.find('/') == std::string::npos, "the key names a file of the configuration folder");
        std::string level = GetAttribute(attributes, "level");
        if (!level.empty()) {
            policy_->identifierLevel = ParseLevel(level);
            Require(policy_->identifierLevel != 0, "Identifiers level must be 1..5 or L1..L5");
        }
    }

    void ReadFilterName(const std::string& value, const std::string& pattern) REQUIRES(gXmlDocumentMutex) {
        if (!InSection("FilterList", "Name") || value.empty() == pattern.empty()) {
            Refuse("Name needs one of value and pattern");
        } else if (!value.empty()) {
            policy_->filterNames.insert(value);
            Count(policy_->filterNames.size());
        } else {
            policy_->filterPatterns.push_back(pattern);
            Require(policy_->filterPatterns.size() <= kMaxPatterns, "more than 64 filter patterns");
        }
    }

    std::shared_ptr<PrivacyPolicy> policy_;
    std::string section_;
    std::string error_;
    bool sawRoot_ = false;  // read after the reading, when the document lock is no longer held
    bool sawLevels_ = false;
};

const char* ActionName(UncheckedAction action) {
    switch (action) {
        case UncheckedAction::kKeep:
            return "keep";
        case UncheckedAction::kDrop:
            return "drop";
        default:
            return "strip";
    }
}

}  // namespace

std::shared_ptr<const PrivacyPolicy> PrivacyPolicy::Safest() {
    static const std::shared_ptr<const PrivacyPolicy> kSafest = [] {
        auto safest = std::make_shared<PrivacyPolicy>();
        safest->keepsEventsAboveLevel = true;
        return safest;
    }();
    return kSafest;
}

bool PrivacyPolicy::IsIdentifier(const EventParamInfoCfg& param) const {
    return (identifierLevel != 0 && param.privacyLevel == identifierLevel) || identifierNames.count(param.name) != 0;
}

bool PrivacyPolicy::IsFiltered(const std::string& name) const {
    if (filterNames.count(name) != 0) {
        return true;
    }
    for (const std::string& pattern : filterPatterns) {
        if (fnmatch(pattern.c_str(), name.c_str(), 0) == 0) {
            return true;
        }
    }
    return false;
}

bool PrivacyPolicy::AllowsPath(const std::string& resolvedPath) const {
    bool inside = false;
    for (const std::string& prefix : allowedPrefixes) {
        if (resolvedPath.compare(0, prefix.size(), prefix) == 0 &&
            (resolvedPath.size() == prefix.size() || resolvedPath[prefix.size()] == '/')) {
            inside = true;
            break;
        }
    }
    if (!inside) {
        return false;
    }
    for (const std::string& pattern : deniedPatterns) {
        if (fnmatch(pattern.c_str(), resolvedPath.c_str(), 0) == 0) {
            return false;
        }
    }
    return true;
}

std::string PrivacyPolicy::Describe() const {
    std::string identifiers = std::to_string(identifierNames.size()) + " names";
    if (identifierLevel != 0) {
        identifiers += " and level " + std::to_string(identifierLevel);
    }
    return (source.empty() ? std::string("none read, safest in force") : source) +
           ": levels switchOn=" + std::to_string(levelConsented) + " switchOff=" + std::to_string(levelOtherwise) +
           ", unknown events " + ActionName(unchecked) + ", identifiers " + identifiers + " (" +
           (cipher != nullptr ? "key " + keyFile : std::string("no key, withheld")) + "), filter list " +
           std::to_string(filterNames.size()) + " names " + std::to_string(filterPatterns.size()) +
           " patterns, log paths " + std::to_string(allowedPrefixes.size()) + " allowed " +
           std::to_string(deniedPatterns.size()) + " denied";
}

sp<PrivacyPolicyParser> PrivacyPolicyParser::getInstance() {
    static sp<PrivacyPolicyParser> instance(new PrivacyPolicyParser());
    return instance;
}

std::shared_ptr<const PrivacyPolicy> PrivacyPolicyParser::ReadPolicy(const std::string& path, const std::string& keyDir,
                                                                     std::string& error) {
    sp<PolicyReader> reader = new PolicyReader();
    std::shared_ptr<PrivacyPolicy> policy = reader->Read(path, error);
    if (policy == nullptr) {
        return nullptr;
    }
    bool wantsKey = !policy->identifierNames.empty() || policy->identifierLevel != 0;
    if (wantsKey) {
        policy->cipher = policy->keyFile.empty() ? nullptr : IdentifierCipher::FromPemFile(keyDir + policy->keyFile);
        if (policy->cipher == nullptr) {
            OLOG_AS(ANDROID_LOG_WARN, "ReadPolicy", "%s %s has no usable server key '%s': identifiers are removed",
                    path.c_str(), policy->keyFile.c_str());
        }
    }
    return policy;
}

std::shared_ptr<const PrivacyPolicy> PrivacyPolicyParser::GetPolicy(const DocumentFolders& folders) {
    DocumentChoice choice = ConfigDocument::Choose(folders, kFileName);
    DaemonStats* stats = folders.stats;
    Mutex::Autolock lock(mutex_);
    if (tried_ && choice.path == loadedPath_ && choice.stamp == loadedStamp_) {
        return current_ != nullptr ? current_ : PrivacyPolicy::Safest();
    }
    // Remembered before reading, so that a document that fails is tried once per version.
    tried_ = true;
    loadedPath_ = choice.path;
    loadedStamp_ = choice.stamp;
    std::string error;
    std::shared_ptr<const PrivacyPolicy> policy = ReadPolicy(choice.path, choice.directory, error);
    if (policy != nullptr) {
        current_ = policy;
        OLOGI("%s privacy policy %s", current_->Describe().c_str());
        if (stats != nullptr) {
            stats->Add("privacy.policy.loaded");
        }
    } else {
        OLOGE("%s privacy policy %s refused (%s), %s stays in force", choice.path.c_str(), error.c_str(),
              current_ != nullptr ? "the policy read before" : "the safest policy");
        if (stats != nullptr) {
            stats->Add("privacy.policy.refused");
        }
    }
    return current_ != nullptr ? current_ : PrivacyPolicy::Safest();
}

}  // namespace Orvane
}  // namespace android
