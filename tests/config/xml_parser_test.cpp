#include "config/xml_parser.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "tests/common/log_capture.h"
#include "utils/zip_pack.h"

namespace android::Orvane {
namespace {

// Element mode: records the callbacks from the root on (finishing at the first with finishOnFirst).
// Text mode: records the sizes of the pieces and stops once the marker is seen.
class RecordingParser : public XmlParser {
public:
    explicit RecordingParser(const std::string& root, bool finishOnFirst = false, const std::string& marker = "")
        : XmlParser("doc.xml"), root_(root), marker_(marker), finishOnFirst_(finishOnFirst) {}
    // Recognises the root element and sets the start flag.
    bool IsMatch(const std::string& name) override { return name == root_ && (SetStart(), true); }
    bool OnProcess(const std::string& text) override {
        sizes.push_back(text.size());
        return text.find(marker_) != std::string::npos;
    }
    void OnStartElement(const std::string& name, const std::map<std::string, std::string>& attributes) override {
        starts.push_back(name);
        for (const auto& [key, value] : attributes)
            attrs.push_back(name + "." + key + "=" + value);
        if (finishOnFirst_)
            SetFinish();
    }
    void OnEndElement(const std::string& name) override { ends.push_back(name); }
    std::vector<std::string> starts, ends, attrs;
    std::vector<size_t> sizes;
    std::string root_, marker_;
    bool finishOnFirst_;
};

class XmlParserTest : public ::testing::Test {
protected:
    void TearDown() override { std::filesystem::remove_all(dir_); }
    std::string Write(const std::string& name, const std::string& content) {
        std::ofstream(dir_ + "/" + name, std::ios::binary | std::ios::trunc) << content;
        return dir_ + "/" + name;
    }
    std::string Zip(const std::string& file) {  // an archive holding file, under its path without the leading "/"
        ZipPack pack;
        EXPECT_TRUE(pack.CreateZip(file + ".zip") && pack.AddFiles({file}));
        pack.Close();
        return file + ".zip";
    }
    static std::string Items(int n) {  // n elements of about 60 bytes inside <root>
        std::string doc = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<root>\n";
        for (int i = 0; i < n; ++i)
            doc += "  <item i=\"" + std::to_string(i) + "\" pad=\"...........................\"/>\n";
        return doc + "</root>\n";
    }
    std::string dir_ = mkdtemp(std::string("/tmp/xml_parser_test.XXXXXX").data());
};

TEST_F(XmlParserTest, ElementModeStartsAtTheRootAndStopsOnFinish) {
    std::string path = Write("doc.xml",
                             "<?xml version=\"1.0\"?>\n<outer><pre a=\"1\"><x/></pre><root ver=\"2\">"
                             "<item k=\"v\" n:k2=\"w\" xmlns:n=\"urn:n\"/><!-- c --></root><after/></outer>");
    sp<RecordingParser> parser = new RecordingParser("root");
    ASSERT_EQ(parser->ParserXmlFile(path, true), 0);
    EXPECT_EQ(parser->starts, (std::vector<std::string>{"root", "item", "after"}));
    EXPECT_EQ(parser->ends, (std::vector<std::string>{"item", "root", "after", "outer"}));
    EXPECT_EQ(parser->attrs, (std::vector<std::string>{"root.ver=2", "item.k=v", "item.k2=w"}));

    // About 60 KiB of elements, then a broken tail that only a full reading meets.
    path = Write("long.xml", Items(1000) + "<broken attr=unquoted>");
    std::string zip = Zip(path);
    for (bool zipped : {false, true}) {
        sp<RecordingParser> all = new RecordingParser("root"), first = new RecordingParser("root", true);
        EXPECT_EQ(zipped ? all->ParserZipXmlFile(zip, path.substr(1)) : all->ParserXmlFile(path, true), -1) << zipped;
        EXPECT_EQ(all->starts.size(), 1001u) << zipped;
        EXPECT_EQ(zipped ? first->ParserZipXmlFile(zip, path.substr(1)) : first->ParserXmlFile(path, true), 0)
                << zipped;
        // Nothing after the finish arrives, not even the rest of the block.
        EXPECT_EQ(first->starts.size() + first->ends.size(), 1u) << zipped;
    }
}

TEST_F(XmlParserTest, TextModeJoinsThePreviousBlock) {
    // The marker straddles the first 4096-byte boundary.
    std::string path = Write("doc.xml", std::string(4090, 'a') + "<MARKER/>" + std::string(10000, 'b'));
    sp<RecordingParser> parser = new RecordingParser("", false, "<MARKER/>");
    ASSERT_EQ(parser->ParserXmlFile(path, false), 0);
    EXPECT_EQ(parser->sizes, (std::vector<size_t>{4096, 8192}));
    LogCapture logs;
    parser->sizes.clear();
    EXPECT_EQ(parser->ParserXmlFile(Write("empty.xml", ""), false), 0);
    EXPECT_TRUE(parser->sizes.empty());
    EXPECT_EQ(parser->ParserXmlFile(dir_ + "/empty.xml", true), -1);  // element mode refuses it
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "ReadXmlFile file formate err, " + dir_ + "/empty.xml:"));
}

TEST_F(XmlParserTest, BadDocumentsFailWithoutHarm) {
    const std::string bad[] = {"<root><item i=\"1\"><item i=\"2\"></root>",
                               "<?xml version=\"1.0\" encoding=\"no-such-encoding\"?><root/>",
                               std::string("\x00\x01\xff\xfe garbage \x80\x81", 16) + std::string(5000, '\xc3'),
                               Items(200).substr(0, 5000),
                               "<root><item i=\"1",
                               "<root><item i=\"1\">" + std::string(9000, 'x')};
    LogCapture logs;
    for (const std::string& content : bad) {
        sp<RecordingParser> parser = new RecordingParser("root");
        std::string path = Write("bad.xml", content);
        EXPECT_EQ(parser->ParserXmlFile(path, true), -1) << content.substr(0, 40);
        EXPECT_EQ(parser->ParserZipXmlFile(Zip(path), path.substr(1)), -1) << content.substr(0, 40);
    }
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "ReadXmlFile xml parse chunk failed: "));
    sp<RecordingParser> parser = new RecordingParser("root");
    std::string good = Write("good.xml", Items(3)), zip = Zip(good);
    EXPECT_EQ(parser->ParserZipXmlFile(zip, "good.xml"), -1);
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "ParserZipXmlFile no entry good.xml in " + zip));
    // The same parser still reads good documents afterwards.
    EXPECT_EQ(parser->ParserZipXmlFile(zip, good.substr(1)), 0);
    EXPECT_EQ(parser->ParserXmlFile(good, true), 0);
    EXPECT_EQ(parser->starts.size(), 8u);
}

TEST_F(XmlParserTest, ExternalEntitiesAreNeverRead) {
    std::string secret = Write("secret.txt", "TOPSECRET");
    std::string dtd = Write("evil.dtd", "<!ENTITY leak \"TOPSECRET\"><!ATTLIST item d CDATA \"TOPSECRET\">");
    for (const std::string& doc :
         {"<!DOCTYPE root [<!ENTITY xxe SYSTEM \"file://" + secret + "\">]><root><item v=\"&xxe;\"/></root>",
          "<!DOCTYPE root [<!ENTITY % ext SYSTEM \"file://" + dtd + "\"> %ext;]><root><item v=\"&leak;\"/></root>",
          "<!DOCTYPE root SYSTEM \"" + dtd + "\"><root><item v=\"&leak;\"/></root>",
          std::string("<!DOCTYPE root SYSTEM \"http://127.0.0.1:9/evil.dtd\"><root><item/></root>")}) {
        sp<RecordingParser> parser = new RecordingParser("root");
        parser->ParserXmlFile(Write("xxe.xml", "<?xml version=\"1.0\"?>" + doc), true);
        for (const std::string& attr : parser->attrs)
            EXPECT_EQ(attr.find("TOPSECRET"), std::string::npos) << doc;
    }
}

}  // namespace
}  // namespace android::Orvane
