#include "config/xml_parser.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "tests/common/log_capture.h"
#include "utils/file_util.h"
#include "utils/zip_pack.h"

namespace android {
namespace Orvane {
namespace {

// Records what the element callbacks deliver from the root element named at construction on.
class RecordingParser : public XmlParser {
public:
    explicit RecordingParser(const std::string& root, bool finishOnFirst = false)
        : XmlParser("doc.xml"), root_(root), finishOnFirst_(finishOnFirst) {}

    bool IsMatch(const std::string& name) override {
        if (name != root_) {
            return false;
        }
        SetStart();
        return true;
    }
    void OnStartElement(const std::string& name, const std::map<std::string, std::string>& attributes) override {
        starts.push_back(name);
        for (const auto& [key, value] : attributes) {
            attrs.push_back(name + "." + key + "=" + value);
        }
        if (finishOnFirst_) {
            SetFinish();
        }
    }
    void OnEndElement(const std::string& name) override { ends.push_back(name); }

    std::vector<std::string> starts;
    std::vector<std::string> ends;
    std::vector<std::string> attrs;

private:
    std::string root_;
    bool finishOnFirst_;
};

// Looks for a marker in the text handed over block by block.
class TextParser : public XmlParser {
public:
    explicit TextParser(const std::string& marker) : XmlParser("doc.xml"), marker_(marker) {}
    bool IsMatch(const std::string&) override { return false; }
    bool OnProcess(const std::string& text) override {
        sizes.push_back(text.size());
        found = text.find(marker_) != std::string::npos;
        return found;
    }

    std::vector<size_t> sizes;
    bool found = false;

private:
    std::string marker_;
};

class XmlParserTest : public ::testing::Test {
protected:
    void SetUp() override {
        char pattern[] = "/tmp/xml_parser_test.XXXXXX";
        ASSERT_NE(mkdtemp(pattern), nullptr);
        dir_ = pattern;
    }
    void TearDown() override {
        uint64_t freed = 0;
        FileUtil::DeleteDirectoryOrFile(dir_, freed, true);
    }
    std::string Write(const std::string& name, const std::string& content) {
        std::string path = dir_ + "/" + name;
        std::ofstream(path, std::ios::binary | std::ios::trunc) << content;
        return path;
    }
    std::string Zip(const std::string& name, const std::vector<std::string>& files) {
        std::string path = dir_ + "/" + name;
        ZipPack pack;
        EXPECT_TRUE(pack.CreateZip(path));
        EXPECT_TRUE(pack.AddFiles(files));
        pack.Close();
        return path;
    }
    // n elements <item i="k"/> inside <root>, a few KiB each 100 elements.
    static std::string Items(int n) {
        std::string doc = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<root>\n";
        for (int i = 0; i < n; ++i) {
            doc += "  <item i=\"" + std::to_string(i) + "\" pad=\"................................\"/>\n";
        }
        return doc + "</root>\n";
    }

    std::string dir_;
};

TEST_F(XmlParserTest, ElementModeSkipsEverythingBeforeTheRoot) {
    std::string path = Write("doc.xml",
                             "<?xml version=\"1.0\"?>\n<outer><pre a=\"1\"><x/></pre>"
                             "<root ver=\"2\"><item k=\"v\" n:k2=\"w\" xmlns:n=\"urn:n\"/><!-- c --></root>"
                             "<after/></outer>");
    sp<RecordingParser> parser = new RecordingParser("root");
    ASSERT_EQ(parser->ParserXmlFile(path, true), 0);
    EXPECT_EQ(parser->starts, (std::vector<std::string>{"root", "item", "after"}));
    EXPECT_EQ(parser->ends, (std::vector<std::string>{"item", "root", "after", "outer"}));
    // Attributes by local name; a namespace prefix is dropped.
    EXPECT_EQ(parser->attrs, (std::vector<std::string>{"root.ver=2", "item.k=v", "item.k2=w"}));

    // Both flags start clear on every reading.
    sp<RecordingParser> again = parser;
    parser->starts.clear();
    ASSERT_EQ(again->ParserXmlFile(Write("small.xml", "<r/>"), true), 0);  // no root named "root"
    EXPECT_TRUE(parser->starts.empty());
    sp<RecordingParser> tiny = new RecordingParser("r");
    ASSERT_EQ(tiny->ParserXmlFile(dir_ + "/small.xml", true), 0);  // four bytes are a whole document
    EXPECT_EQ(tiny->starts, std::vector<std::string>{"r"});
}

TEST_F(XmlParserTest, FinishFlagStopsReadingAfterTheCurrentBlock) {
    // About 60 KiB of elements, then a broken tail that only a full reading meets.
    std::string doc = Items(1000) + "<broken attr=unquoted>";
    std::string path = Write("doc.xml", doc);
    sp<RecordingParser> all = new RecordingParser("root");
    EXPECT_EQ(all->ParserXmlFile(path, true), -1);
    EXPECT_EQ(all->starts.size(), 1001u);

    sp<RecordingParser> first = new RecordingParser("root", true);
    EXPECT_EQ(first->ParserXmlFile(path, true), 0);
    // Nothing after the finish reaches the parser, not even the rest of the block.
    EXPECT_EQ(first->starts, std::vector<std::string>{"root"});
    EXPECT_TRUE(first->ends.empty());

    std::string zip = Zip("doc.zip", {path});
    sp<RecordingParser> zipped = new RecordingParser("root", true);
    EXPECT_EQ(zipped->ParserZipXmlFile(zip, path.substr(1)), 0);
    EXPECT_EQ(zipped->starts, std::vector<std::string>{"root"});
    sp<RecordingParser> zippedAll = new RecordingParser("root");
    EXPECT_EQ(zippedAll->ParserZipXmlFile(zip, path.substr(1)), -1);
    EXPECT_EQ(zippedAll->starts, all->starts);
    EXPECT_EQ(zippedAll->ends, all->ends);
}

TEST_F(XmlParserTest, TextModeJoinsThePreviousBlock) {
    std::string doc(4090, 'a');
    doc += "<MARKER/>";  // straddles the first block boundary
    doc += std::string(10000, 'b');
    std::string path = Write("doc.xml", doc);
    sp<TextParser> parser = new TextParser("<MARKER/>");
    ASSERT_EQ(parser->ParserXmlFile(path, false), 0);
    EXPECT_TRUE(parser->found);
    EXPECT_EQ(parser->sizes, (std::vector<size_t>{4096, 8192}));

    sp<TextParser> absent = new TextParser("<NONE/>");
    ASSERT_EQ(absent->ParserXmlFile(path, false), 0);
    EXPECT_FALSE(absent->found);
    EXPECT_EQ(absent->sizes, (std::vector<size_t>{4096, 8192, 8192, doc.size() - 3 * 4096 + 4096}));

    LogCapture logs;
    sp<TextParser> empty = new TextParser("x");
    EXPECT_EQ(empty->ParserXmlFile(Write("empty.xml", ""), false), 0);
    EXPECT_TRUE(empty->sizes.empty());
    EXPECT_EQ(empty->ParserXmlFile(dir_ + "/absent.xml", false), -1);
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "ReadXmlFileWithBuf not open file " + dir_ + "/absent.xml"));
}

TEST_F(XmlParserTest, BadDocumentsFailWithoutHarm) {
    std::string good = Write("good.xml", Items(3));
    std::string longOpen = "<root><item i=\"1\">" + std::string(9000, 'x');  // never closed
    std::string garbage;
    for (int i = 0; i < 10000; ++i) {
        garbage.push_back(static_cast<char>((i * 7919) % 251));
    }
    const std::vector<std::pair<std::string, std::string>> bad = {
        {"unclosed.xml", "<root><item i=\"1\"><item i=\"2\"></root>"},
        {"encoding.xml", "<?xml version=\"1.0\" encoding=\"no-such-encoding\"?><root/>"},
        {"garbage.xml", garbage},
        {"truncated.xml", Items(200).substr(0, 5000)},
        {"truncated_tag.xml", "<root><item i=\"1"},
        {"long_open.xml", longOpen},
    };
    LogCapture logs;
    for (const auto& [name, content] : bad) {
        sp<RecordingParser> parser = new RecordingParser("root");
        EXPECT_EQ(parser->ParserXmlFile(Write(name, content), true), -1) << name;
        EXPECT_EQ(parser->ParserZipXmlFile(Zip(name + ".zip", {dir_ + "/" + name}), dir_.substr(1) + "/" + name), -1)
            << name;
    }
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "ReadXmlFile xml parse chunk failed: "));
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "operator() xml parse chunk failed: "));

    sp<RecordingParser> parser = new RecordingParser("root");
    EXPECT_EQ(parser->ParserXmlFile(Write("empty.xml", ""), true), -1);
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "ReadXmlFile file formate err, " + dir_ + "/empty.xml:"));
    EXPECT_EQ(parser->ParserXmlFile(dir_ + "/absent.xml", true), -1);
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "ReadXmlFile not open file " + dir_ + "/absent.xml"));
    EXPECT_EQ(parser->ParserXmlFile(dir_, true), -1);  // a folder

    // Archives: missing, broken, or without the entry.
    std::string zip = Zip("good.zip", {good});
    EXPECT_EQ(parser->ParserZipXmlFile(dir_ + "/absent.zip", "good.xml"), -1);
    EXPECT_EQ(parser->ParserZipXmlFile(good, "good.xml"), -1);
    EXPECT_EQ(parser->ParserZipXmlFile(zip, "good.xml"), -1);
    EXPECT_TRUE(logs.Contains(ANDROID_LOG_ERROR, "ParserZipXmlFile no entry good.xml in " + zip));

    // The same parser still reads good documents afterwards.
    parser->starts.clear();
    EXPECT_EQ(parser->ParserZipXmlFile(zip, good.substr(1)), 0);
    EXPECT_EQ(parser->starts.size(), 4u);
    parser->starts.clear();
    EXPECT_EQ(parser->ParserXmlFile(good, true), 0);
    EXPECT_EQ(parser->starts.size(), 4u);
}

TEST_F(XmlParserTest, ExternalEntitiesAreNeverRead) {
    std::string secret = Write("secret.txt", "TOPSECRET");
    Write("evil.dtd", "<!ENTITY leak \"TOPSECRET\"><!ATTLIST item d CDATA \"TOPSECRET\">");
    const std::vector<std::string> docs = {
        "<?xml version=\"1.0\"?><!DOCTYPE root [<!ENTITY xxe SYSTEM \"file://" + secret +
            "\">]><root><item v=\"&xxe;\"/></root>",
        "<?xml version=\"1.0\"?><!DOCTYPE root [<!ENTITY % ext SYSTEM \"file://" + dir_ +
            "/evil.dtd\"> %ext;]><root><item v=\"&leak;\"/></root>",
        "<?xml version=\"1.0\"?><!DOCTYPE root SYSTEM \"" + dir_ + "/evil.dtd\"><root><item v=\"&leak;\"/></root>",
        "<?xml version=\"1.0\"?><!DOCTYPE root SYSTEM \"http://127.0.0.1:9/evil.dtd\"><root><item/></root>",
    };
    for (size_t i = 0; i < docs.size(); ++i) {
        sp<RecordingParser> parser = new RecordingParser("root");
        parser->ParserXmlFile(Write("xxe" + std::to_string(i) + ".xml", docs[i]), true);
        for (const std::string& attr : parser->attrs) {
            EXPECT_EQ(attr.find("TOPSECRET"), std::string::npos) << "document " << i << ": " << attr;
        }
    }
}

TEST_F(XmlParserTest, ReadersInSeveralThreadsNeverOverlap) {
    // Each reading checks that no other reading is under way at the same moment.
    static std::atomic<int> active{0};
    static std::atomic<int> overlaps{0};
    class ExclusiveParser : public RecordingParser {
    public:
        ExclusiveParser() : RecordingParser("root") {}
        void OnStartElement(const std::string& name, const std::map<std::string, std::string>& attributes) override {
            if (name == "root" && active.fetch_add(1) != 0) {
                overlaps++;
            }
            RecordingParser::OnStartElement(name, attributes);
        }
        void OnEndElement(const std::string& name) override {
            if (name == "root") {
                active.fetch_sub(1);
            }
        }
    };
    std::string path = Write("doc.xml", Items(300));
    std::string zip = Zip("doc.zip", {path});
    std::vector<std::thread> threads;
    std::atomic<int> failures{0};
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&, t] {
            sp<ExclusiveParser> parser = new ExclusiveParser();
            for (int i = 0; i < 20; ++i) {
                int ret = (i + t) % 2 == 0 ? parser->ParserXmlFile(path, true)
                                           : parser->ParserZipXmlFile(zip, path.substr(1));
                if (ret != 0 || parser->starts.size() != 301) {
                    failures++;
                }
                parser->starts.clear();
            }
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(failures.load(), 0);
    EXPECT_EQ(overlaps.load(), 0);
}

}  // namespace
}  // namespace Orvane
}  // namespace android
