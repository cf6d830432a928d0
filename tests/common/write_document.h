#ifndef ORVANE_TESTS_COMMON_WRITE_DOCUMENT_H
#define ORVANE_TESTS_COMMON_WRITE_DOCUMENT_H

#include <string>

#include <android-base/file.h>

#include "config/config_document.h"

namespace android {
namespace Orvane {

// Writes a configuration document and announces it, as the companion app's config-update does,
// so that the readers' next choice sees it (unannounced, a change is seen within a second).
inline bool WriteDocument(const std::string& content, const std::string& path) {
    bool written = base::WriteStringToFile(content, path);
    ConfigDocument::Forget();
    return written;
}

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_TESTS_COMMON_WRITE_DOCUMENT_H
