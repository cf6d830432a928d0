// libFuzzer target: bytes as the plugin configuration file, parsed as the platform parses it at
// start-up; whatever the parser accepted must hold together.

#include <sys/mman.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <set>
#include <string>

#include "fuzz/fuzz_documents.h"
#include "platform/config.h"

using namespace android::Orvane;
using FuzzDocuments::Check;

namespace {

// Plugins are unique and their loop settings valid; pipelines name plugins defined before; a
// source feeds pipelines that exist.
void CheckAccepted(const Config& config) {
    std::set<std::string> plugins, pipelines;
    for (const Config::PluginInfo& plugin : config.GetPluginInfoList()) {
        Check(!plugin.name.empty() && plugins.insert(plugin.name).second);
        Check(plugin.threadType.empty() ? plugin.threadName.empty()
                                        : plugin.threadType == "thread" && !plugin.threadName.empty());
        Check(plugin.delay >= 0);
    }
    for (const Config::PipelineInfo& pipeline : config.GetPipelineInfoList()) {
        pipelines.insert(pipeline.name);
        for (const std::string& plugin : pipeline.plugins) {
            Check(plugins.count(plugin) == 1);
        }
    }
    for (const Config::PluginInfo& plugin : config.GetPluginInfoList()) {
        Check(plugin.isEventSource || plugin.pipelines.empty());
        for (const std::string& pipeline : plugin.pipelines) {
            Check(pipelines.count(pipeline) == 1);
        }
    }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    FuzzDocuments::QuietLogs();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    // One file in memory for the whole run, read through its path like any file.
    static const int fd = memfd_create("plugin_config", MFD_CLOEXEC);
    static const std::string path = "/proc/self/fd/" + std::to_string(fd);
    if (fd < 0 || ftruncate(fd, 0) != 0 || pwrite(fd, data, size, 0) != static_cast<ssize_t>(size)) {
        abort();
    }
    Config config(path);
    config.Parse();
    CheckAccepted(config);
    return 0;
}
