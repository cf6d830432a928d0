#ifndef ORVANE_CONFIG_CONFIG_DOCUMENT_H
#define ORVANE_CONFIG_CONFIG_DOCUMENT_H

#include <string>

#include "platform/plugin_context.h"
#include "utils/file_util.h"

namespace android {
namespace Orvane {

// Which copy of a configuration document is in force: the one place every document reader asks.
// The cloud copy (pushed by "config-update") wins when it exists and is well-formed XML; else the
// system copy is read. A cloud copy that does not parse is passed over with one warning line per
// version of the file, and counted. Well-formedness is checked once per version (FileStamp), so
// the common call costs one stat per candidate. Readers that keep what they parsed compare the
// stamp of the choice with the one they loaded and reload when it changed; that is how a
// configuration update reaches them on their next use.
//
// Threads: any thread; the verdicts are kept under one lock, the checks run outside it.
struct DocumentChoice {
    std::string directory;  // ends in "/"
    std::string path;       // directory + file name
    FileStamp stamp;        // of the chosen copy; the empty stamp when neither copy exists
    bool fromCloud = false;
};

namespace ConfigDocument {

DocumentChoice Choose(const std::string& cloudDir, const std::string& configDir, const std::string& fileName,
                      DaemonStats* stats = nullptr);
// Choose with the context's folders and statistics.
DocumentChoice Choose(PluginContext& context, const std::string& fileName);
// True when the whole file parses as XML (no entities, no network), checked once per version.
bool IsWellFormed(const std::string& path, const FileStamp& stamp);

}  // namespace ConfigDocument
}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_CONFIG_CONFIG_DOCUMENT_H
