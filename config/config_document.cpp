#include "config/config_document.h"

#include <cstring>
#include <map>

#include <utils/Mutex.h>

#include "config/xml_parser.h"
#include "utils/orvane_log.h"
#include "utils/string_util.h"
#include "utils/time_util.h"

namespace android {
namespace Orvane {
namespace {

constexpr char kArchiveSuffix[] = ".zip";

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

// Readers choose at every event, thousands of times a second under load, while documents change
// a few times a day; so a stamp is taken again only once it is a second old, or at once after
// Forget (an announced update). Paths are few (documents times folders), and the map is emptied
// should a caller bring ever new folders.
constexpr int64_t kStampLifeNs = 1000000000;
constexpr size_t kMaxStamps = 256;

struct TakenStamp {
    FileStamp stamp;
    int64_t takenNs = 0;
};

Mutex gStampMutex;
std::map<std::string, TakenStamp> gStamps GUARDED_BY(gStampMutex);
// Counts the Forget calls, so that a stamp taken across one is not kept.
uint64_t gForgotten GUARDED_BY(gStampMutex) = 0;

FileStamp RecentStamp(const std::string& path) {
    int64_t now = TimeUtil::GetNanoSecondSinceSystemStart();
    uint64_t forgotten = 0;
    {
        Mutex::Autolock lock(gStampMutex);
        auto found = gStamps.find(path);
        if (found != gStamps.end() && now - found->second.takenNs < kStampLifeNs) {
            return found->second.stamp;
        }
        forgotten = gForgotten;
    }
    FileStamp stamp = FileUtil::GetFileStamp(path);
    Mutex::Autolock lock(gStampMutex);
    if (forgotten != gForgotten) {
        return stamp;
    }
    if (gStamps.size() >= kMaxStamps) {
        gStamps.clear();
    }
    gStamps[path] = {stamp, now};
    return stamp;
}

// An archive "dir/x.zip" holds the document as its entry "x.xml"; "" for a plain document.
std::string ArchiveEntry(const std::string& path) {
    if (!StringUtil::EndsWith(path, kArchiveSuffix)) {
        return "";
    }
    size_t name = path.rfind('/') + 1;  // npos + 1 is 0
    return path.substr(name, path.size() - strlen(kArchiveSuffix) - name) + ".xml";
}

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
    std::string entry = ArchiveEntry(path);
    bool wellFormed = (entry.empty() ? check->ParserXmlFile(path, true) : check->ParserZipXmlFile(path, entry)) == 0;
    Mutex::Autolock lock(gVerdictMutex);
    gVerdicts[path] = {stamp, wellFormed};
    fresh = true;
    return wellFormed;
}

}  // namespace

DocumentFolders::DocumentFolders(PluginContext& context)
    : cloudDir(context.GetCloudConfigDir()), configDir(context.GetConfigDir()), stats(&context.GetStats()) {}

DocumentFolders::DocumentFolders(const std::string& directory) : cloudDir(directory), configDir(directory) {}

void DocumentFolders::Count(const char* what, const std::string& fileName) const {
    if (stats != nullptr) {
        stats->Add(std::string("config.") + what + "." + fileName);
    }
}

bool ConfigDocument::IsWellFormed(const std::string& path, const FileStamp& stamp) {
    bool fresh = false;
    return CheckWellFormed(path, stamp, fresh);
}

DocumentChoice ConfigDocument::Choose(const DocumentFolders& folders, const std::string& fileName) {
    const std::string& configDir = folders.configDir;
    if (folders.cloudDir != configDir) {
        DocumentChoice cloud{folders.cloudDir, folders.cloudDir + fileName, {}, true};
        cloud.stamp = RecentStamp(cloud.path);
        bool fresh = false;
        if (cloud.stamp.size >= 0 && CheckWellFormed(cloud.path, cloud.stamp, fresh)) {
            return cloud;
        }
        if (fresh) {  // once per version of the broken copy
            OLOGW("%s cloud copy %s does not parse, %s%s is used", cloud.path.c_str(), configDir.c_str(),
                  fileName.c_str());
            folders.Count("cloud_rejected", fileName);
        }
    }
    DocumentChoice system{configDir, configDir + fileName, {}, false};
    system.stamp = RecentStamp(system.path);
    return system;
}

void ConfigDocument::Forget() {
    Mutex::Autolock lock(gStampMutex);
    gStamps.clear();
    gForgotten++;
}

}  // namespace Orvane
}  // namespace android
