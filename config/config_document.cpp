#include "config/config_document.h"

#include <map>

#include <utils/Mutex.h>

#include "config/xml_parser.h"
#include "utils/orvane_log.h"

namespace android {
namespace Orvane {
namespace {

// Accepts no element, so the reader feeds the whole document and reports only whether it parsed.
class WellFormedCheck : public XmlParser {
public:
    WellFormedCheck() : XmlParser("") {}
    bool IsMatch(const std::string&) override { return false; }
};

struct Verdict {
    FileStamp stamp;
    bool wellFormed = false;
};

Mutex gVerdictMutex;
std::map<std::string, Verdict> gVerdicts GUARDED_BY(gVerdictMutex);

// The verdict for this version of the file; `fresh` tells whether it was found just now.
bool CheckWellFormed(const std::string& path, const FileStamp& stamp, bool& fresh) {
    {
        Mutex::Autolock lock(gVerdictMutex);
        auto found = gVerdicts.find(path);
        if (found != gVerdicts.end() && found->second.stamp == stamp) {
            fresh = false;
            return found->second.wellFormed;
        }
    }
    sp<WellFormedCheck> check = new WellFormedCheck();
    bool wellFormed = check->ParserXmlFile(path, true) == 0;
    Mutex::Autolock lock(gVerdictMutex);
    gVerdicts[path] = {stamp, wellFormed};
    fresh = true;
    return wellFormed;
}

}  // namespace

bool ConfigDocument::IsWellFormed(const std::string& path, const FileStamp& stamp) {
    bool fresh = false;
    return CheckWellFormed(path, stamp, fresh);
}

DocumentChoice ConfigDocument::Choose(const std::string& cloudDir, const std::string& configDir,
                                      const std::string& fileName, DaemonStats* stats) {
    DocumentChoice cloud{cloudDir, cloudDir + fileName, FileUtil::GetFileStamp(cloudDir + fileName), true};
    if (cloud.stamp.size >= 0 && cloudDir != configDir) {
        bool fresh = false;
        if (CheckWellFormed(cloud.path, cloud.stamp, fresh)) {
            return cloud;
        }
        if (fresh) {  // once per version of the broken copy
            OLOGW("%s cloud copy %s does not parse, %s%s is used", cloud.path.c_str(), configDir.c_str(),
                  fileName.c_str());
            if (stats != nullptr) {
                stats->Add("config.cloud_rejected." + fileName);
            }
        }
    }
    return {configDir, configDir + fileName, FileUtil::GetFileStamp(configDir + fileName), false};
}

DocumentChoice ConfigDocument::Choose(PluginContext& context, const std::string& fileName) {
    return Choose(context.GetCloudConfigDir(), context.GetConfigDir(), fileName, &context.GetStats());
}

}  // namespace Orvane
}  // namespace android
