#ifndef ORVANE_PLATFORM_PLUGIN_FACTORY_H
#define ORVANE_PLATFORM_PLUGIN_FACTORY_H

#include <string>
#include <vector>

#include <utils/StrongPointer.h>

#include "platform/plugin.h"

namespace android {
namespace Orvane {

// The process-wide map from plugin name to constructor. Plugin classes register themselves
// from static initialisers (ORVANE_REGISTER_PLUGIN); the platform creates them by the names of
// its configuration. Safe to use from any thread.
class PluginFactory {
public:
    class RegisterBase {
    public:
        virtual ~RegisterBase() {}
        virtual sp<Plugin> ConstructPlugin() = 0;
    };

    // Registers T under `name` for the life of the object; the first registration of a name wins.
    template <typename T>
    class Register : public RegisterBase {
    public:
        explicit Register(const std::string& name) { PluginFactory::RegisterPlugin(name, this); }
        sp<Plugin> ConstructPlugin() override { return sp<Plugin>(new T()); }
    };

    // False, with a warning line, when the name is empty or taken.
    static bool RegisterPlugin(const std::string& name, RegisterBase* registration);
    // Empty when the name is not registered.
    static sp<Plugin> CreatePlugin(const std::string& name);
    static std::vector<std::string> GetRegisteredNames();
};

}  // namespace Orvane
}  // namespace android

// Registers a plugin class under its class name, in the .cpp file that defines it. Archives of
// plugins must be linked whole, or the linker drops the registration.
#define ORVANE_REGISTER_PLUGIN(ClassName) \
    static ::android::Orvane::PluginFactory::Register<ClassName> g_orvaneRegister##ClassName(#ClassName)

#endif  // ORVANE_PLATFORM_PLUGIN_FACTORY_H
