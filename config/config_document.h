#ifndef ORVANE_CONFIG_CONFIG_DOCUMENT_H
#define ORVANE_CONFIG_CONFIG_DOCUMENT_H

#include <string>

#include "platform/plugin_context.h"
#include "utils/daemon_stats.h"
#include "utils/file_util.h"

namespace android {
namespace Orvane {

// Where the copies of a document are looked for: the cloud folder first, then the system folder,
// and the statistics that count what went wrong with them.
struct DocumentFolders {
    // The daemon's folders, taken at each call, so that a "config-update" is seen at the next use.
    DocumentFolders(PluginContext& context);
    // One folder and no cloud copy: tools, tests and fuzzers that read a folder of their own.
    DocumentFolders(const std::string& directory);
    DocumentFolders(const std::string& cloud, const std::string& config, DaemonStats* statistics)
        : cloudDir(cloud), configDir(config), stats(statistics) {}

    // Counts "config.<what>.<fileName>" where there are statistics.
    void Count(const char* what, const std::string& fileName) const;

    std::string cloudDir;  // both end in "/"
    std::string configDir;
    DaemonStats* stats = nullptr;
};

// Which copy of a document is in force.
struct DocumentChoice {
    // True when other is the same version of the same copy: nothing to read again.
    bool SameVersion(const DocumentChoice& other) const { return path == other.path && stamp == other.stamp; }

    std::string directory;  // ends in "/"
    std::string path;       // directory + file name
    FileStamp stamp;        // of the chosen copy; the empty stamp when neither copy exists
    bool fromCloud = false;
};

// The one place every document reader asks which copy to read. The cloud copy (pushed by
// "config-update") wins when it exists and is well-formed XML (for an archive "x.zip": its entry
// "x.xml"); else the system copy is read. A cloud copy that does not parse is passed over with one
// warning line per version of the file, and counted ("config.cloud_rejected.<file>"). Each
// version is judged once (FileStamp), and a file's stamp is taken at most once a second, so the
// common call costs no system call.
//
// How a reader uses it, at every query: choose, compare the choice with the one it holds
// (SameVersion), and read the chosen copy again when it differs; that is how a pushed
// configuration reaches every reader without a restart: at its next use after an announced update
// (Forget), within a second after a copy changed unannounced. A failed read is logged as the
// reader's own line and counted as "config.read_failed.<file>".
//
// Threads: any thread; the verdicts are kept under one lock, the checks run outside it.
namespace ConfigDocument {

DocumentChoice Choose(const DocumentFolders& folders, const std::string& fileName);
// Makes the next choices look at the files again: new copies have been announced.
void Forget();
// True when the whole file parses as XML (no entities, no network), checked once per version.
bool IsWellFormed(const std::string& path, const FileStamp& stamp);

}  // namespace ConfigDocument
}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_CONFIG_CONFIG_DOCUMENT_H
