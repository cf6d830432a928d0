#ifndef ORVANE_PLATFORM_CONFIG_H
#define ORVANE_PLATFORM_CONFIG_H

#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <vector>

namespace android {
namespace Orvane {

// The plugin configuration file: which plugins exist, on which loops they run, how they are
// chained into pipelines and which event source feeds which pipelines. A value object, parsed
// once by the platform at start-up on the main thread; not shared between threads while parsing.
class Config {
public:
    struct PluginInfo {
        bool isStatic = false;
        bool isEventSource = false;
        int32_t delay = 0;
        std::string name;
        std::string threadName;
        std::string threadType;
        std::vector<std::string> pipelines;
    };

    struct PipelineInfo {
        std::string name;
        std::vector<std::string> plugins;
    };

    // Lines longer than this are refused before they reach the regular expressions, whose
    // backtracking recursion would otherwise exhaust the stack on huge input.
    static constexpr size_t kMaxLineLength = 1024;

    explicit Config(const std::string& path) : path_(path) {}

    // False, with one log line naming the reason, when the file cannot be read or any line is
    // rejected; the lists then keep what was accepted before that line.
    bool Parse();
    bool ParsePlugin(const std::string& line);
    bool ParsePipeline(const std::string& line);
    bool ParsePipelineTrigger(const std::string& line);

    const std::string& GetPath() const { return path_; }
    const std::vector<PluginInfo>& GetPluginInfoList() const { return pluginInfoList_; }
    const std::vector<PipelineInfo>& GetPipelineInfoList() const { return pipelineInfoList_; }

private:
    PluginInfo* FindPlugin(const std::string& name);
    bool HasPipeline(const std::string& name) const;

    std::string path_;
    std::vector<PluginInfo> pluginInfoList_;
    std::vector<PipelineInfo> pipelineInfoList_;
    // Lookups by name, so that a long file parses in linear time.
    std::map<std::string, size_t> pluginIndex_;
    std::set<std::string> pipelineNames_;
};

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_PLATFORM_CONFIG_H
