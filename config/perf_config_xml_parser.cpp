#include "config/perf_config_xml_parser.h"

#include <android-base/parseint.h>

#include "config/config_document.h"
#include "utils/orvane_log.h"

namespace android {
namespace Orvane {
namespace {

constexpr char kRootElement[] = "PerfConfig";
constexpr char kResourceElement[] = "Resource";
constexpr char kRejectedCounter[] = "config.perf_config.rejected";
const char* const kResourceNames[] = {"cpu", "memory", "io"};

bool IsResourceName(const std::string& name) {
    for (const char* known : kResourceNames) {
        if (name == known) {
            return true;
        }
    }
    return false;
}

// An absent attribute keeps `value`; a present one must be a whole number within [min, max].
bool ReadNumber(const std::map<std::string, std::string>& attributes, const char* key, uint32_t min, uint32_t max,
                uint32_t& value) {
    auto found = attributes.find(key);
    if (found == attributes.end()) {
        return true;
    }
    uint32_t parsed = 0;
    if (!android::base::ParseUint(found->second, &parsed, max) || parsed < min) {
        return false;
    }
    value = parsed;
    return true;
}

}  // namespace

bool PerfConfigXmlParser::Read(const std::string& path, std::vector<PerfResourceConfig>& resources,
                               DaemonStats* stats) {
    sp<PerfConfigXmlParser> parser = new PerfConfigXmlParser(stats);
    bool ok = parser->ParserXmlFile(path, true) == 0;
    if (!ok) {
        OLOG_AS(ANDROID_LOG_WARN, "Read", "%s %s cannot be read as a performance configuration", path.c_str());
    }
    resources = std::move(parser->resources_);
    return ok;
}

bool PerfConfigXmlParser::IsMatch(const std::string& name) {
    if (name != kRootElement) {
        return false;
    }
    SetStart();
    return true;
}

void PerfConfigXmlParser::OnStartElement(const std::string& name,
                                         const std::map<std::string, std::string>& attributes) {
    if (name != kResourceElement) {
        return;
    }
    PerfResourceConfig resource;
    std::string reason = ReadResource(attributes, resource);
    if (reason.empty()) {
        resources_.push_back(resource);
        return;
    }
    OLOGW("%s resource \"%s\" left out: %s", GetAttribute(attributes, "name").c_str(), reason.c_str());
    if (stats_ != nullptr) {
        stats_->Add(kRejectedCounter);
    }
}

std::string PerfConfigXmlParser::ReadResource(const std::map<std::string, std::string>& attributes,
                                              PerfResourceConfig& out) const {
    out.name = GetAttribute(attributes, "name");
    if (!IsResourceName(out.name)) {
        return "name is not cpu, memory or io";
    }
    for (const PerfResourceConfig& earlier : resources_) {
        if (earlier.name == out.name) {
            return "defined twice, the first stays";
        }
    }
    if (attributes.count("windowUs") == 0 ||
        !ReadNumber(attributes, "windowUs", kMinWindowUs, kMaxWindowUs, out.windowUs)) {
        return "windowUs must lie in [500000, 10000000]";
    }
    // A stall can take the whole window but no more.
    if (!ReadNumber(attributes, "someStallUs", 0, out.windowUs, out.someStallUs)) {
        return "someStallUs must lie in [0, windowUs]";
    }
    if (!ReadNumber(attributes, "fullStallUs", 0, out.windowUs, out.fullStallUs)) {
        return "fullStallUs must lie in [0, windowUs]";
    }
    if (out.someStallUs == 0 && out.fullStallUs == 0) {
        return "neither someStallUs nor fullStallUs is set";
    }
    if (!ReadNumber(attributes, "coolDownSec", 1, UINT32_MAX, out.coolDownSec)) {
        return "coolDownSec must be a whole number of 1 or more";
    }
    if (!ReadNumber(attributes, "topCount", 0, kMaxTopCount, out.topCount)) {
        return "topCount must lie in [0, 20]";
    }
    return "";
}

bool PerfConfigDocument::Refresh(PluginContext& context) {
    thread_.Check(__func__);
    DocumentChoice choice = ConfigDocument::Choose(context, PerfConfigXmlParser::kFileName);
    if (loaded_ && choice.path == path_ && choice.stamp == stamp_) {
        return false;
    }
    loaded_ = true;
    path_ = choice.path;
    stamp_ = choice.stamp;
    resources_.clear();
    if (stamp_.size >= 0) {
        PerfConfigXmlParser::Read(path_, resources_, &context.GetStats());
    }
    return true;
}

}  // namespace Orvane
}  // namespace android
