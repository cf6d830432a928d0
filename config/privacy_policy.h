#ifndef ORVANE_CONFIG_PRIVACY_POLICY_H
#define ORVANE_CONFIG_PRIVACY_POLICY_H

#include <cstdint>
#include <memory>
#include <set>
#include <string>
#include <unordered_set>
#include <vector>

#include <utils/Mutex.h>

#include "config/config_document.h"
#include "config/event_xml_parser.h"
#include "platform/plugin_context.h"
#include "utils/daemon_stats.h"
#include "utils/file_util.h"
#include "utils/identifier_cipher.h"

namespace android {
namespace Orvane {

// What happens to parameters the rules cannot check: those of an event the catalogue does not
// know, and a "param_list" that is not a JSON object.
enum class UncheckedAction { kKeep, kStrip, kDrop };

// One version of the privacy policy document "privacy_policy.xml" (etc/README.md describes its
// vocabulary). Built once by PrivacyPolicyParser and never changed afterwards, so any thread may
// query it through the shared pointer it holds.
struct PrivacyPolicy {
    // The policy in force while no document could ever be read: no parameter above level 1, no
    // identifiers, unchecked parameters stripped, no log file collected. Events themselves are
    // kept whatever their level, stripped: a document that cannot be read must not cost them.
    static std::shared_ptr<const PrivacyPolicy> Safest();

    // Highest parameter (and event) privacy level kept; `consented` is the upload switch "on".
    uint32_t MaxLevel(bool consented) const { return consented ? levelConsented : levelOtherwise; }
    // Named in the identifier list, or marked with exactly the identifier level.
    bool IsIdentifier(const EventParamInfoCfg& param) const;
    // The process or package name is on the filter list (exactly, or by a shell pattern).
    bool IsFiltered(const std::string& name) const;
    // A resolved absolute path lies inside an allowed prefix and matches no forbidden pattern.
    bool AllowsPath(const std::string& resolvedPath) const;
    // One line for dumps; never the key.
    std::string Describe() const;

    std::string source;  // the document it was read from; empty for Safest
    uint32_t levelConsented = 1;
    uint32_t levelOtherwise = 1;
    UncheckedAction unchecked = UncheckedAction::kStrip;
    // False for a read document: an event above MaxLevel is dropped. True only for Safest.
    bool keepsEventsAboveLevel = false;
    // Identifiers: by name, and by privacy level (0: none by level). Without a cipher (no key
    // file, or one that is not an X25519 public key) they are withheld, never kept in the clear.
    std::set<std::string> identifierNames;
    uint32_t identifierLevel = 0;
    std::string keyFile;
    std::shared_ptr<const IdentifierCipher> cipher;
    // Filter list: the parameters that carry the name, exact names and shell patterns.
    std::vector<std::string> filterParams;
    std::unordered_set<std::string> filterNames;
    std::vector<std::string> filterPatterns;
    // Log collection: allowed folders (resolved when the policy was read) and forbidden patterns.
    std::vector<std::string> allowedPrefixes;
    std::vector<std::string> deniedPatterns;
};

// Reads the privacy policy and keeps the one in force, shared by every component that asks
// (the compliance plugin for each event, log collection for each file).
//
// The document is chosen by ConfigDocument::Choose (cloud copy first) and read again only when
// the chosen file's stamp (inode, size, modification time) changes. A document that is missing,
// too large, not well-formed or not a valid policy leaves the previous policy in force, or
// Safest when there is none, with one error line per version of the file and a count.
//
// Threads: any thread; `mutex_` guards the policy in force and the stamp it was read from, and
// is held while a changed document is read (taken before the document lock of XmlParser).
class PrivacyPolicyParser : public RefBase {
public:
    static constexpr char kFileName[] = "privacy_policy.xml";

    static sp<PrivacyPolicyParser> getInstance();
    // A parser of its own, for tests that need a fresh history.
    PrivacyPolicyParser() = default;

    // The policy in force for these folders (a PluginContext converts: the daemon's folders).
    std::shared_ptr<const PrivacyPolicy> GetPolicy(const DocumentFolders& folders);

    // One document read on its own: the policy, or null with `error` saying why. The key file
    // named by the document is looked up in `keyDir`.
    static std::shared_ptr<const PrivacyPolicy> ReadPolicy(const std::string& path, const std::string& keyDir,
                                                           std::string& error);

private:
    Mutex mutex_;
    std::shared_ptr<const PrivacyPolicy> current_ GUARDED_BY(mutex_);
    std::string loadedPath_ GUARDED_BY(mutex_);
    FileStamp loadedStamp_ GUARDED_BY(mutex_);
    bool tried_ GUARDED_BY(mutex_) = false;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_CONFIG_PRIVACY_POLICY_H
