#ifndef ORVANE_TESTS_COMMON_TEST_DATA_H
#define ORVANE_TESTS_COMMON_TEST_DATA_H

#include <string>

#include <android-base/file.h>

namespace android {
namespace Orvane {

// The folder that holds the shipped configuration (etc/) and the test keys (tests/common/): the
// source tree on the host, the test's own folder on a device, where its data is installed.
inline std::string TestDataDir() {
#ifdef __ANDROID__
    return android::base::GetExecutableDirectory();
#else
    return ORVANE_SOURCE_DIR;
#endif
}

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_TESTS_COMMON_TEST_DATA_H
