// libFuzzer target: bytes as a privacy policy document (a cloud copy is outside input), read the
// way the daemon reads it; a policy that is accepted is then queried like the compliance plugin
// and log collection do.

#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <string>

#include "config/privacy_policy.h"
#include "utils/file_util.h"

using namespace android::Orvane;

namespace {

// The test server key, so that documents naming "k.pem" find a usable key.
const char kServerKey[] =
        "-----BEGIN PUBLIC KEY-----\nMCowBQYDK2VuAyEA+LJhE1XjLgoFr86eUxbKQ4iIBbSYzaa/v6PZP0p/02U=\n"
        "-----END PUBLIC KEY-----\n";

struct Folder {
    Folder() {
        char pattern[] = "/tmp/privacy_policy_fuzz.XXXXXX";
        path = std::string(mkdtemp(pattern)) + "/";
        FileUtil::SaveStringToFile(path + "k.pem", kServerKey, true);
    }
    std::string path;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static const Folder folder;
    const std::string document = folder.path + PrivacyPolicyParser::kFileName;
    unlink(document.c_str());
    if (size > 0) {
        FileUtil::SaveStringToFile(document, std::string(reinterpret_cast<const char*>(data), size), true);
    }
    std::string error;
    std::shared_ptr<const PrivacyPolicy> policy = PrivacyPolicyParser::ReadPolicy(document, folder.path, error);
    if (policy == nullptr) {
        if (error.empty()) {
            __builtin_trap();  // a refusal always says why
        }
        return 0;
    }
    EventParamInfoCfg param;
    param.name = "serial";
    param.privacyLevel = 4;
    policy->IsIdentifier(param);
    policy->IsFiltered("com.android.providers.contacts");
    policy->AllowsPath("/data/log/kernel/last_kmsg");
    policy->AllowsPath("/proc/1/environ");
    policy->Describe();
    if (policy->cipher != nullptr) {
        policy->cipher->Seal("SN1");
    }
    return 0;
}
