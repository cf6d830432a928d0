#ifndef ORVANE_CONFIG_PERF_CONFIG_XML_PARSER_H
#define ORVANE_CONFIG_PERF_CONFIG_XML_PARSER_H

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "config/xml_parser.h"
#include "platform/plugin_context.h"
#include "utils/daemon_stats.h"
#include "utils/file_util.h"
#include "utils/thread_checker.h"

namespace android {
namespace Orvane {

// The watch settings of one resource of "perf_config.xml": the kernel's pressure stall trigger
// ("some" and/or "full" stall within one window), the least time between two events of the
// resource, and how many processes an event names.
struct PerfResourceConfig {
    static constexpr uint32_t kDefaultCoolDownSec = 600;
    static constexpr uint32_t kDefaultTopCount = 5;

    std::string name;          // "cpu", "memory" or "io": the file under /proc/pressure/
    uint32_t someStallUs = 0;  // 0: no "some" trigger
    uint32_t fullStallUs = 0;  // 0: no "full" trigger
    uint32_t windowUs = 0;
    uint32_t coolDownSec = kDefaultCoolDownSec;
    uint32_t topCount = kDefaultTopCount;
};

// The reader of "perf_config.xml". Root element "PerfConfig", one "Resource" element per watched
// resource. A resource with a bad or missing value is left out whole, with one warning line
// naming the attribute and the counter "config.perf_config.rejected": a half-understood trigger
// is worse than none. One reader object per read; reading holds the process-wide document lock.
class PerfConfigXmlParser : public XmlParser {
public:
    static constexpr const char* kFileName = "perf_config.xml";
    // The window and stall bounds the kernel accepts for a trigger.
    static constexpr uint32_t kMinWindowUs = 500000;
    static constexpr uint32_t kMaxWindowUs = 10000000;
    static constexpr uint32_t kMaxTopCount = 20;

    // The valid resources of the document at path, in document order; false (with one warning
    // line) when the document cannot be read or parsed, with whatever was valid before the error.
    static bool Read(const std::string& path, std::vector<PerfResourceConfig>& resources, DaemonStats* stats);

    bool IsMatch(const std::string& name) override REQUIRES(gXmlDocumentMutex);
    void OnStartElement(const std::string& name, const std::map<std::string, std::string>& attributes) override
            REQUIRES(gXmlDocumentMutex);

private:
    explicit PerfConfigXmlParser(DaemonStats* stats) : XmlParser(kFileName), stats_(stats) {}
    // The reason the element is refused, or empty when `out` holds a valid resource.
    std::string ReadResource(const std::map<std::string, std::string>& attributes, PerfResourceConfig& out) const;

    DaemonStats* const stats_;
    std::vector<PerfResourceConfig> resources_;
};

// Which performance settings are in force: the cloud copy of "perf_config.xml" first, else the
// system copy, read again whenever the chosen copy's stamp changes.
// Threads: one thread at a time (the owning plugin's load, then its loop); checked at run time.
class PerfConfigDocument {
public:
    // Chooses the copy and rereads it when it is another file or another version than the one
    // in force; true when it did (the first call always does).
    bool Refresh(PluginContext& context);

    const std::vector<PerfResourceConfig>& Resources() const { return resources_; }
    // The file in force; empty when neither copy exists.
    std::string Path() const { return stamp_.size < 0 ? "" : path_; }

private:
    ThreadChecker thread_;
    bool loaded_ = false;
    std::string path_;
    FileStamp stamp_;
    std::vector<PerfResourceConfig> resources_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_CONFIG_PERF_CONFIG_XML_PARSER_H
