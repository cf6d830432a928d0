#ifndef ORVANE_CONFIG_XML_PARSER_H
#define ORVANE_CONFIG_XML_PARSER_H

#include <cstdint>
#include <map>
#include <string>

#include <utils/Mutex.h>
#include <utils/RefBase.h>

namespace android {
namespace Orvane {

// Serialises all document reading: libxml2 is initialised and cleaned up around every document,
// which must not overlap with another reader.
extern Mutex gXmlDocumentMutex;

// Base of every configuration document parser. A document is read either in element mode
// (fed in 4096-byte blocks to libxml2's push parser; each element from the document's root on
// reaches OnStartElement/OnEndElement) or in text mode (the raw text reaches OnProcess block by
// block), from a file or from an entry of a zip archive.
//
// Parsers are always held by strong pointers (getInstance of each document kind): reading takes
// a strong reference of its own for the duration.
//
// Concurrency: all document reading in the process is serialised by one process-wide lock,
// gXmlDocumentMutex, that ParserXmlFile and ParserZipXmlFile take, so the flags and whatever a
// parser collects while reading are only touched by one reader at a time; the callbacks run with
// it held. Query operations of derived parsers are called from many threads and guard their own
// state with a lock of their own, always taken before this one.
class XmlParser : public RefBase {
public:
    explicit XmlParser(const std::string& fileName) : fileName_(fileName) {}

    // Called for elements met while the start flag is clear; a parser recognises its root
    // element here and calls SetStart.
    virtual bool IsMatch(const std::string& name) REQUIRES(gXmlDocumentMutex) = 0;
    // Text mode: a piece of the raw text (the last two blocks joined); true stops reading.
    virtual bool OnProcess(const std::string& text) REQUIRES(gXmlDocumentMutex);
    // Element mode: the element's attributes by local name, in name order.
    virtual void OnStartElement(const std::string& name, const std::map<std::string, std::string>& attributes)
            REQUIRES(gXmlDocumentMutex);
    virtual void OnEndElement(const std::string& name) REQUIRES(gXmlDocumentMutex);

    void SetStart() REQUIRES(gXmlDocumentMutex) { flags_ = kStartFlag; }  // also clears the finish flag
    void SetFinish() REQUIRES(gXmlDocumentMutex) { flags_ |= kFinishFlag; }
    bool IsStart() const REQUIRES(gXmlDocumentMutex) { return (flags_ & kStartFlag) != 0; }
    bool IsFinish() const REQUIRES(gXmlDocumentMutex) { return (flags_ & kFinishFlag) != 0; }
    void ClearFlags() REQUIRES(gXmlDocumentMutex) { flags_ = 0; }

    // The document's file name, e.g. "event.xml"; callers build its path from it.
    const std::string& GetFileName() const { return fileName_; }
    // Set while no lookup runs (configuration time).
    void SetFileName(const std::string& fileName) { fileName_ = fileName; }

    // Reads the document at path in element mode (elementMode true) or text mode; 0 or -1.
    int32_t ParserXmlFile(const std::string& path, bool elementMode) EXCLUDES(gXmlDocumentMutex);
    // Reads the archive's entry entryName in element mode; -1 also when the entry is missing.
    int32_t ParserZipXmlFile(const std::string& zipPath, const std::string& entryName) EXCLUDES(gXmlDocumentMutex);

protected:
    // The attribute's value, or the empty string when it is absent.
    static std::string GetAttribute(const std::map<std::string, std::string>& attributes, const std::string& key);

private:
    static constexpr uint32_t kStartFlag = 1u;
    static constexpr uint32_t kFinishFlag = 2u;

    uint32_t flags_ GUARDED_BY(gXmlDocumentMutex) = 0;
    std::string fileName_;
};

// The two readers behind ParserXmlFile; use ParserXmlFile, which takes the document lock.
int32_t ReadXmlFile(const std::string& path, const sp<XmlParser>& parser) REQUIRES(gXmlDocumentMutex);
int32_t ReadXmlFileWithBuf(const std::string& path, const sp<XmlParser>& parser) REQUIRES(gXmlDocumentMutex);

}  // namespace Orvane
}  // namespace android

#endif  // ORVANE_CONFIG_XML_PARSER_H
