#include "config/xml_parser.h"

#include <fstream>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/log_capture.h"
#include "utils/zip_pack.h"

namespace android::Orvane {
namespace {

// Records the element callbacks from <root> on.
class RecordingParser : public XmlParser {
public:
    RecordingParser() : XmlParser("doc.xml") {}
    bool IsMatch(const std::string& name) REQUIRES(gXmlDocumentMutex) override {
        return name == "root" && (SetStart(), true);
    }
    void OnStartElement(const std::string& name, const std::map<std::string, std::string>& attributes) override {
        starts.push_back(name);
        for (const auto& [key, value] : attributes)
            attrs.push_back(name + "." + key + "=" + value);
    }
    void OnEndElement(const std::string& name) override { ends.push_back(name); }
    std::vector<std::string> starts, ends, attrs;
};

class XmlParserTest : public ::testing::Test {
protected:
    std::string Write(const std::string& name, const std::string& content) {
        std::ofstream(dir_ + "/" + name, std::ios::binary | std::ios::trunc) << content;
        return dir_ + "/" + name;
    }
    // Reads the file in element mode, directly or from an archive holding it under its path without the leading "/".
    static int32_t Read(const sp<RecordingParser>& parser, const std::string& path, bool zipped) {
        if (!zipped)
            return parser->ParserXmlFile(path, true);
        ZipPack pack;
        EXPECT_TRUE(pack.CreateZip(path + ".zip") && pack.AddFiles({path}));
        pack.Close();
        return parser->ParserZipXmlFile(path + ".zip", path.substr(1));
    }
    static std::string Items(int n) {  // n elements of about 60 bytes inside <root>
        std::string doc = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<root>\n";
        for (int i = 0; i < n; ++i)
            doc += "  <item i=\"" + std::to_string(i) + "\" pad=\"...........................\"/>\n";
        return doc + "</root>\n";
    }
    TemporaryDir temp_;
    std::string dir_ = temp_.path;
};

TEST_F(XmlParserTest, ElementModeStartsAtTheRootInFilesAndArchives) {
    std::string doc = Write("doc.xml",
                            "<?xml version=\"1.0\"?>\n<outer><pre a=\"1\"><x/></pre><root ver=\"2\">"
                            "<item k=\"v\" n:k2=\"w\" xmlns:n=\"urn:n\"/><!-- c --></root><after/></outer>");
    sp<RecordingParser> parser = new RecordingParser();
    ASSERT_EQ(Read(parser, doc, false), 0);
    EXPECT_EQ(parser->starts, (std::vector<std::string>{"root", "item", "after"}));
    EXPECT_EQ(parser->ends, (std::vector<std::string>{"item", "root", "after", "outer"}));
    EXPECT_EQ(parser->attrs, (std::vector<std::string>{"root.ver=2", "item.k=v", "item.k2=w"}));

    // About 60 KiB of elements, then a broken tail that only a full reading meets.
    std::string path = Write("long.xml", Items(1000) + "<broken attr=unquoted>");
    for (bool zipped : {false, true}) {
        sp<RecordingParser> all = new RecordingParser();
        EXPECT_EQ(Read(all, path, zipped), -1) << zipped;
        EXPECT_EQ(all->starts.size(), 1001u) << zipped;
    }
}

TEST_F(XmlParserTest, BadDocumentsFailWithoutHarm) {
    LogCapture logs;
    sp<RecordingParser> parser = new RecordingParser();  // the same parser all along
    for (const std::string& content :
         {std::string(), std::string("<root><item i=\"1\"><item i=\"2\"></root>"),
          std::string("<?xml version=\"1.0\" encoding=\"no-such-encoding\"?><root/>"),
          std::string("\x00\x01\xff\xfe garbage \x80\x81", 16) + std::string(5000, '\xc3'), Items(200).substr(0, 5000),
          std::string("<root><item i=\"1"), "<root><item i=\"1\">" + std::string(9000, 'x')}) {
        for (bool zipped : {false, true})
            EXPECT_EQ(Read(parser, Write("bad.xml", content), zipped), -1) << zipped << content.substr(0, 40);
    }
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "ReadXmlFile xml parse chunk failed: "));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "ReadXmlFile file formate err, " + dir_ + "/bad.xml:"));
    std::string good = Write("good.xml", Items(3));
    parser->starts.clear();
    EXPECT_EQ(Read(parser, good, true), 0);
    EXPECT_EQ(Read(parser, good, false), 0);
    EXPECT_EQ(parser->starts.size(), 8u);
    EXPECT_EQ(parser->ParserZipXmlFile(good + ".zip", "good.xml"), -1);
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "ParserZipXmlFile no entry good.xml in " + good + ".zip"));
}

// No entity is loaded or expanded: a document that needs one fails, and nothing of an entity's
// text reaches the parser, however the entities nest.
TEST_F(XmlParserTest, EntitiesAreNeverLoadedNorExpanded) {
    std::string secret = Write("secret.txt", "TOPSECRET"),
                dtd = Write("evil.dtd", "<!ENTITY leak \"TOPSECRET\"><!ATTLIST item d CDATA \"TOPSECRET\">");
    std::string laughs = "<!ENTITY a \"TOPSECRET\">";
    for (char name = 'b'; name <= 'k'; ++name)
        laughs += std::string("<!ENTITY ") + name + " \"" + std::string(10, ' ') + "\">";
    for (char name = 'b'; name <= 'k'; ++name) {  // each entity is ten of the one before
        std::string refs;
        for (int i = 0; i < 10; ++i)
            refs += std::string("&") + static_cast<char>(name - 1) + ";";
        laughs.replace(laughs.find(std::string("<!ENTITY ") + name) + 11, 10, refs);
    }
    // With an external subset (never read) an unknown entity is no error; without, it is.
    const std::pair<std::string, int32_t> cases[] = {
            {"<!DOCTYPE root [<!ENTITY xxe SYSTEM \"file://" + secret + "\">]><root><item v=\"&xxe;\"/></root>", -1},
            {"<!DOCTYPE root [<!ENTITY % ext SYSTEM \"file://" + dtd + "\"> %ext;]><root><item v=\"&leak;\"/></root>",
             -1},
            {"<!DOCTYPE root SYSTEM \"" + dtd + "\"><root><item v=\"&leak;\"/></root>", 0},
            {"<!DOCTYPE root [<!ENTITY s \"TOPSECRET\">]><root><item v=\"&s;\">&s;</item></root>", -1},
            {"<!DOCTYPE root [" + laughs + "]><root><item v=\"&k;\">&k;</item></root>", -1}};
    for (const auto& [doc, result] : cases) {
        for (bool zipped : {false, true}) {
            sp<RecordingParser> parser = new RecordingParser();
            EXPECT_EQ(Read(parser, Write("xxe.xml", "<?xml version=\"1.0\"?>" + doc), zipped), result) << doc;
            for (const std::string& attr : parser->attrs)
                EXPECT_EQ(attr.find("TOPSECRET"), std::string::npos) << doc;
        }
    }
}

}  // namespace
}  // namespace android::Orvane
