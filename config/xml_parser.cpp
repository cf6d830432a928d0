#include "config/xml_parser.h"

#include <cstdio>
#include <cstring>

#include <libxml/parser.h>

#include "utils/orvane_log.h"
#include "utils/trace.h"
#include "utils/zip_pack.h"

namespace android {
namespace Orvane {

Mutex gXmlDocumentMutex;

namespace {

constexpr size_t kBlockSize = 4096;
constexpr size_t kFirstBytes = 4;

const char* OrEmpty(const xmlChar* text) {
    return text != nullptr ? reinterpret_cast<const char*>(text) : "";
}

// libxml2's element callbacks, called from xmlParseChunk while a reader holds the document lock.
void OnStartElementNs(void* ctx, const xmlChar* localname, const xmlChar* prefix, const xmlChar* URI, int nb_namespaces,
                      const xmlChar** namespaces, int nb_attributes, int nb_defaulted, const xmlChar** attributes)
        REQUIRES(gXmlDocumentMutex) {
    XmlParser* parser = static_cast<XmlParser*>(ctx);
    if (parser == nullptr) {
        OLOGD("%s local=%s parser is null. pre=%s,uri=%s,nb=%d,ns=%p,nb_de=%d", OrEmpty(localname), OrEmpty(prefix),
              OrEmpty(URI), nb_namespaces, static_cast<const void*>(namespaces), nb_defaulted);
        return;
    }
    if (parser->IsFinish()) {
        return;  // the rest of a block already handed to libxml2 after the parser had enough
    }
    std::string name = OrEmpty(localname);
    if (!parser->IsStart() && !parser->IsMatch(name)) {
        return;  // everything before the document's root element
    }
    // Each attribute is five pointers: local name, prefix, URI, value start, value end.
    std::map<std::string, std::string> attrs;
    for (int i = 0; i < nb_attributes; ++i) {
        const xmlChar** attr = attributes + i * 5;
        const char* valueStart = reinterpret_cast<const char*>(attr[3]);
        const char* valueEnd = reinterpret_cast<const char*>(attr[4]);
        attrs[OrEmpty(attr[0])].assign(valueStart, valueEnd);
    }
    parser->OnStartElement(name, attrs);
}

void OnEndElementNs(void* ctx, const xmlChar* localname, const xmlChar* prefix, const xmlChar* URI)
        REQUIRES(gXmlDocumentMutex) {
    XmlParser* parser = static_cast<XmlParser*>(ctx);
    if (parser == nullptr) {
        OLOGI("%s parser is null. pre=%s,uri=%s", OrEmpty(prefix), OrEmpty(URI));
        return;
    }
    if (parser->IsStart() && !parser->IsFinish()) {
        parser->OnEndElement(OrEmpty(localname));
    }
}

void InitSaxHandler(xmlSAXHandler& handler) {
    memset(&handler, 0, sizeof(handler));
    handler.initialized = XML_SAX2_MAGIC;
    handler.startElementNs = OnStartElementNs;
    handler.endElementNs = OnEndElementNs;
}

// A push parser over the handler that never substitutes entities, loads external subsets or
// reaches the network, so a document cannot make the daemon read other files. Null on failure.
xmlParserCtxtPtr CreatePushParser(xmlSAXHandler& handler, XmlParser* parser, const char* first, int size) {
    xmlParserCtxtPtr ctxt = xmlCreatePushParserCtxt(&handler, parser, first, size, nullptr);
    if (ctxt != nullptr) {
        xmlCtxtUseOptions(ctxt, XML_PARSE_NONET);
    }
    return ctxt;
}

// Frees the context with the document libxml2 builds on its own to keep a DOCTYPE's entity
// declarations (for expat compatibility); nothing here uses them, and the context leaves it behind.
void FreePushParser(xmlParserCtxtPtr ctxt) {
    if (ctxt->myDoc != nullptr) {
        xmlFreeDoc(ctxt->myDoc);
        ctxt->myDoc = nullptr;
    }
    xmlFreeParserCtxt(ctxt);
}

// The trace section's name, built only while tracing is on.
std::string TraceName(const char* op, const std::string& path) {
    return ScopedTrace::IsTraceEnabled() ? op + path : std::string();
}

class FileCloser {
public:
    explicit FileCloser(FILE* file) : file_(file) {}
    ~FileCloser() {
        if (file_ != nullptr) {
            fclose(file_);
        }
    }
    FileCloser(const FileCloser&) = delete;
    FileCloser& operator=(const FileCloser&) = delete;

private:
    FILE* file_;
};

}  // namespace

bool XmlParser::OnProcess(const std::string&) {
    return true;  // a parser without a text mode has nothing to look for
}

void XmlParser::OnStartElement(const std::string&, const std::map<std::string, std::string>&) {}

void XmlParser::OnEndElement(const std::string&) {}

std::string XmlParser::GetAttribute(const std::map<std::string, std::string>& attributes, const std::string& key) {
    auto it = attributes.find(key);
    return it != attributes.end() ? it->second : std::string();
}

int32_t XmlParser::ParserXmlFile(const std::string& path, bool elementMode) {
    Mutex::Autolock lock(gXmlDocumentMutex);
    ClearFlags();
    sp<XmlParser> self(this);
    return elementMode ? ReadXmlFile(path, self) : ReadXmlFileWithBuf(path, self);
}

int32_t XmlParser::ParserZipXmlFile(const std::string& zipPath, const std::string& entryName) {
    Mutex::Autolock lock(gXmlDocumentMutex);
    ZipReader reader;
    if (!reader.Open(zipPath)) {
        return -1;
    }
    ClearFlags();
    xmlSAXHandler handler;
    InitSaxHandler(handler);
    xmlInitParser();
    xmlParserCtxtPtr ctxt = CreatePushParser(handler, this, nullptr, 0);
    if (ctxt == nullptr) {
        OLOGE("%s create xml parser failed for %s", zipPath.c_str());
        xmlCleanupParser();
        return -1;
    }
    bool entrySeen = false;
    bool failed = false;
    // Runs inside ExtractFile, below, with the document lock held.
    auto consumer = [&](const char* data, uint32_t, int32_t length) REQUIRES(gXmlDocumentMutex) -> int {
        if (length < 0) {
            failed = true;
            return -1;
        }
        entrySeen = true;
        if (xmlParseChunk(ctxt, data, length, length == 0 ? 1 : 0) != 0 && !failed) {
            // Once per document (not per block), and collapsed when documents are read per lookup.
            xmlParserError(ctxt, "xmlParseChunk");
            OLOG_LIMITED_AS(ANDROID_LOG_ERROR, "operator()", "%s xml parse chunk failed: %s",
                            std::string(data, length).c_str());
            failed = true;
        }
        return IsFinish() ? 1 : 0;
    };
    char buffer[kBlockSize];
    bool extracted = reader.ExtractFile(entryName, buffer, sizeof(buffer), consumer);
    FreePushParser(ctxt);
    xmlCleanupParser();
    reader.Close();
    if (extracted && !entrySeen) {
        OLOGE_LIMITED("%s no entry %s in %s", entryName.c_str(), zipPath.c_str());
        return -1;
    }
    return (extracted && !failed) ? 0 : -1;
}

int32_t ReadXmlFile(const std::string& path, const sp<XmlParser>& parser) {
    ScopedTrace trace(TraceName("ReadXmlFile ", path));
    FILE* file = fopen(path.c_str(), "rb");
    if (file == nullptr) {
        OLOGE("%s not open file %s", path.c_str());
        return -1;
    }
    FileCloser closer(file);
    char chunk[kBlockSize];
    size_t n = fread(chunk, 1, kFirstBytes, file);
    if (n == 0) {
        OLOGE("%s file formate err, %s:", path.c_str());
        return -1;
    }
    xmlSAXHandler handler;
    InitSaxHandler(handler);
    xmlInitParser();
    xmlParserCtxtPtr ctxt = CreatePushParser(handler, parser.get(), chunk, static_cast<int>(n));
    if (ctxt == nullptr) {
        OLOGE("%s create xml parser failed for %s", path.c_str());
        xmlCleanupParser();
        return -1;
    }
    int32_t result = 0;
    while (true) {
        n = fread(chunk, 1, sizeof(chunk), file);
        // The terminating call reports a document that ends inside an element.
        bool last = n == 0;
        if (xmlParseChunk(ctxt, chunk, static_cast<int>(n), last ? 1 : 0) != 0) {
            xmlParserError(ctxt, "xmlParseChunk");
            OLOGE("%s xml parse chunk failed: %s", std::string(chunk, n).c_str());
            result = -1;
            break;
        }
        if (last || parser->IsFinish()) {
            break;
        }
    }
    FreePushParser(ctxt);
    xmlCleanupParser();
    return result;
}

int32_t ReadXmlFileWithBuf(const std::string& path, const sp<XmlParser>& parser) {
    ScopedTrace trace(TraceName("ReadXmlFileWithBuf ", path));
    FILE* file = fopen(path.c_str(), "rb");
    if (file == nullptr) {
        // Text mode serves lookups made per event: a missing catalogue would repeat this for each.
        OLOGE_LIMITED("%s not open file %s", path.c_str());
        return -1;
    }
    FileCloser closer(file);
    // Each call sees the previous and the current block joined, so a pattern that straddles a
    // block boundary is still seen whole.
    std::string previous;
    std::string joined;
    char block[kBlockSize];
    size_t n;
    while ((n = fread(block, 1, sizeof(block), file)) > 0) {
        joined.assign(previous).append(block, n);
        if (parser->OnProcess(joined)) {
            break;
        }
        previous.assign(block, n);
    }
    return 0;
}

}  // namespace Orvane
}  // namespace android
