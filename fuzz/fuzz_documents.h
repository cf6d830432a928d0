#ifndef ORVANE_FUZZ_FUZZ_DOCUMENTS_H
#define ORVANE_FUZZ_FUZZ_DOCUMENTS_H

// Helpers of the fuzzers of configuration documents: quiet logs and fresh document files.

#include <stdio.h>
#include <stdlib.h>
#include <unistd.h>
#include <zip.h>

#include <cstdint>
#include <string>
#include <vector>

#include <android/log.h>
#include <libxml/xmlerror.h>

#include "config/config_document.h"

namespace android {
namespace Orvane {
namespace FuzzDocuments {

// liblog's logger hook takes one message record on a device, the record and the text on the host.
#if defined(__ANDROID__)
inline void DropLogLine(const struct __android_log_message*) {}
#else
inline void DropLogLine(const struct __android_logger_data*, const char*) {}
#endif
inline void DropXmlError(void*, const char*, ...) {}

// Every log line is still formatted, so that its arguments are checked, but written nowhere;
// libxml2's own error text neither.
inline void QuietLogs() {
    __android_log_set_minimum_priority(ANDROID_LOG_VERBOSE);
    __android_log_set_logger(DropLogLine);
    xmlSetGenericErrorFunc(nullptr, DropXmlError);
}

// A property of the input that must hold; a crash, so that the fuzzer keeps the input.
inline void Check(bool holds) {
    if (!holds) {
        __builtin_trap();
    }
}

// A folder of the process's own for the whole run, ending in "/".
inline std::string Folder(const char* name) {
    std::string pattern = std::string("/tmp/") + name + ".XXXXXX";
    if (mkdtemp(pattern.data()) == nullptr) {
        abort();
    }
    return pattern + "/";
}

// Puts content at path as a new file (a new inode, so that readers see a new version however
// fast the inputs come), as a zip archive holding it under `entry` when that is not empty, and
// announces it as a config-update does, so that the next choice looks at the file at once.
inline void Replace(const std::string& path, const std::string& content, const std::string& entry = "") {
    std::string next = path + ".next";
    if (entry.empty()) {
        FILE* file = fopen(next.c_str(), "wb");
        if (file == nullptr || fwrite(content.data(), 1, content.size(), file) != content.size()) {
            abort();
        }
        fclose(file);
    } else {
        zipFile archive = zipOpen(next.c_str(), APPEND_STATUS_CREATE);
        if (archive == nullptr ||
            zipOpenNewFileInZip(archive, entry.c_str(), nullptr, nullptr, 0, nullptr, 0, nullptr, Z_DEFLATED,
                                Z_DEFAULT_COMPRESSION) != ZIP_OK ||
            zipWriteInFileInZip(archive, content.data(), static_cast<unsigned>(content.size())) != ZIP_OK ||
            zipCloseFileInZip(archive) != ZIP_OK || zipClose(archive, nullptr) != ZIP_OK) {
            abort();
        }
    }
    if (rename(next.c_str(), path.c_str()) != 0) {
        abort();
    }
    ConfigDocument::Forget();
}

// The numbers that follow `key` in text (at most `limit` of them), as ids the input names.
inline void AddNumbersAfter(const std::string& text, const std::string& key, size_t limit, std::vector<uint32_t>& ids) {
    for (size_t at = text.find(key); at != std::string::npos && limit > 0; at = text.find(key, at + 1), --limit) {
        ids.push_back(static_cast<uint32_t>(strtoul(text.c_str() + at + key.size(), nullptr, 10)));
    }
}

}  // namespace FuzzDocuments
}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_FUZZ_FUZZ_DOCUMENTS_H
