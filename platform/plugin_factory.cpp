#include "platform/plugin_factory.h"

#include <map>

#include <utils/Mutex.h>

#include "utils/orvane_log.h"

namespace android {
namespace Orvane {
namespace {

// Registrations come from static initialisers of other files: the map is created on first use.
struct Registry {
    Mutex mutex;
    std::map<std::string, PluginFactory::RegisterBase*> constructors GUARDED_BY(mutex);
};

Registry& GetRegistry() {
    static Registry registry;
    return registry;
}

}  // namespace

bool PluginFactory::RegisterPlugin(const std::string& name, RegisterBase* registration) {
    Registry& registry = GetRegistry();
    Mutex::Autolock lock(registry.mutex);
    if (name.empty() || registration == nullptr || !registry.constructors.emplace(name, registration).second) {
        OLOGW("%s plugin %s not registered: empty or already registered", name.c_str());
        return false;
    }
    return true;
}

sp<Plugin> PluginFactory::CreatePlugin(const std::string& name) {
    RegisterBase* registration = nullptr;
    {
        Registry& registry = GetRegistry();
        Mutex::Autolock lock(registry.mutex);
        auto it = registry.constructors.find(name);
        if (it == registry.constructors.end()) {
            return nullptr;
        }
        registration = it->second;
    }
    return registration->ConstructPlugin();
}

std::vector<std::string> PluginFactory::GetRegisteredNames() {
    Registry& registry = GetRegistry();
    Mutex::Autolock lock(registry.mutex);
    std::vector<std::string> names;
    for (const auto& entry : registry.constructors) {
        names.push_back(entry.first);
    }
    return names;
}

}  // namespace Orvane
}  // namespace android
