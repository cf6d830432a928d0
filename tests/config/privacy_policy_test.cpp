#include "config/privacy_policy.h"

#include <sys/stat.h>
#include <unistd.h>

#include <android-base/file.h>
#include <gtest/gtest.h>

#include "tests/common/envelope_opener.h"
#include "tests/common/log_capture.h"
#include "tests/common/test_data.h"
#include "tests/common/write_document.h"

namespace android::Orvane {
namespace {

std::string Policy(const std::string& levels, const std::string& body = "") {
    return "<PrivacyPolicy>" + levels + body + "</PrivacyPolicy>\n";
}

class PrivacyPolicyTest : public ::testing::Test {
protected:
    std::shared_ptr<const PrivacyPolicy> Get() { return parser_->GetPolicy({cloud_, config_, &stats_}); }

    TemporaryDir root_;
    std::string config_ = std::string(root_.path) + "/etc/";
    std::string cloud_ = std::string(root_.path) + "/cloud/";
    sp<PrivacyPolicyParser> parser_ = new PrivacyPolicyParser();
    DaemonStats stats_;

    void SetUp() override {
        ASSERT_EQ(mkdir(config_.c_str(), 0775), 0);
        ASSERT_EQ(mkdir(cloud_.c_str(), 0775), 0);
    }
};

// The shipped document reads as its comments say: the levels, the identifiers with the test
// key beside it, the filter list with its pattern, and log paths whose forbidden patterns win
// inside the allowed folders.
TEST_F(PrivacyPolicyTest, ShippedPolicy) {
    std::string error;
    std::string etc = TestDataDir() + "/etc/";
    auto policy = PrivacyPolicyParser::ReadPolicy(etc + "privacy_policy.xml", etc, error);
    ASSERT_NE(policy, nullptr) << error;
    EXPECT_EQ(policy->MaxLevel(true), 3u);
    EXPECT_EQ(policy->MaxLevel(false), 2u);
    EXPECT_EQ(policy->unchecked, UncheckedAction::kStrip);
    EXPECT_NE(policy->cipher, nullptr);
    EventParamInfoCfg byName, byLevel, unmarked;  // unmarked parameters have level 5
    byName.name = "serial", byLevel.privacyLevel = 4;
    EXPECT_TRUE(policy->IsIdentifier(byName) && policy->IsIdentifier(byLevel));
    EXPECT_FALSE(policy->IsIdentifier(unmarked));
    EXPECT_TRUE(policy->IsFiltered("com.android.providers.contacts"));
    EXPECT_TRUE(policy->IsFiltered("com.quor.wallet:pay"));
    EXPECT_FALSE(policy->IsFiltered("com.android.providers.contacts2"));
    EXPECT_FALSE(policy->IsFiltered("com.quor.walle"));
    for (const char* allowed : {"/data/log/kernel.log", "/data/anr/traces.txt", "/proc/meminfo", "/data/log"}) {
        EXPECT_TRUE(policy->AllowsPath(allowed)) << allowed;
    }
    for (const char* refused : {"/data/logs/x", "/data/log/a/keystore/b", "/proc/12/environ", "/data/anr/x.db",
                                "/data/log/DCIM/a.jpg", "/data/quorlog/orvane/config/event.xml", "/etc/passwd", "/"}) {
        EXPECT_FALSE(policy->AllowsPath(refused)) << refused;
    }
}

// A missing, broken or hostile document never replaces the policy in force: with none read yet
// the safest one holds, later the last good one. Each bad version is reported by one error line
// and counted once, however often the policy is asked for, and never read twice.
TEST_F(PrivacyPolicyTest, BadDocumentsLeaveThePolicyInForce) {
    LogCapture capture;
    auto safest = Get();
    EXPECT_EQ(safest, PrivacyPolicy::Safest());
    EXPECT_EQ(safest->MaxLevel(true), 1u);
    EXPECT_FALSE(safest->AllowsPath("/data/log/a"));
    Get();
    EXPECT_EQ(capture.Count(ANDROID_LOG_ERROR, "refused (missing)"), 1u) << capture.Dump();

    std::string path = config_ + PrivacyPolicyParser::kFileName;
    ASSERT_TRUE(WriteDocument("<PrivacyPolicy><Levels switchOn=\"L9\" switchOff=\"1\"/></PrivacyPolicy>", path));
    EXPECT_EQ(Get(), PrivacyPolicy::Safest());

    ASSERT_TRUE(WriteDocument(
            Policy("<Levels switchOn=\"4\" switchOff=\"L2\"/>", "<LogPaths><Allow prefix=\"/data/log\"/></LogPaths>"),
            path));
    auto good = Get();
    ASSERT_NE(good, PrivacyPolicy::Safest());
    EXPECT_EQ(good->MaxLevel(true), 4u);
    EXPECT_TRUE(good->AllowsPath("/data/log/a"));

    std::string bigList = "<FilterList params=\"pkg\">";
    for (int i = 0; i < 10000; ++i) {
        bigList += "<Name value=\"p" + std::to_string(i) + "\"/>";
    }
    bigList += "</FilterList>";
    std::string laughs = "<!DOCTYPE PrivacyPolicy [<!ENTITY a \"aaaaaaaaaa\">";  // a billion of them
    for (char c = 'b'; c <= 'k'; ++c) {
        std::string references;
        for (int i = 0; i < 10; ++i) {
            references += std::string("&") + static_cast<char>(c - 1) + ";";
        }
        laughs += std::string("<!ENTITY ") + c + " \"" + references + "\">";
    }
    const std::string levels = "<Levels switchOn=\"5\" switchOff=\"5\"/>";
    const std::string hostile[] = {
            "<!DOCTYPE PrivacyPolicy [<!ENTITY x SYSTEM \"file:///etc/passwd\">]>" +
                    Policy(levels, "<FilterList params=\"pkg\"><Name value=\"&x;\"/></FilterList>"),
            laughs + "]>" + Policy(levels, "<FilterList params=\"pkg\"><Name value=\"&k;\"/></FilterList>"),
            std::string(1 << 20, '<'),
            Policy(levels, bigList),
            Policy(levels.substr(0, 20)),
            Policy(levels, "<Name value=\"outside\"/>"),
            Policy(levels, "<UnknownEvent action=\"maybe\"/>"),
            Policy(levels, "<Identifiers key=\"../../etc/key.pem\"><Param name=\"serial\"/></Identifiers>"),
            Policy(levels, "<LogPaths><Allow prefix=\"data/log\"/></LogPaths>"),
            Policy(""),
            "<Other>" + levels + "</Other>",
            std::string("\xff\xfe<\x00P", 5),
    };
    int version = 0;
    for (const std::string& document : hostile) {
        ASSERT_TRUE(WriteDocument(document, path));
        capture.Clear();
        EXPECT_EQ(Get(), good) << "document " << version;
        EXPECT_EQ(Get(), good);
        EXPECT_EQ(capture.Count(ANDROID_LOG_ERROR, "stays in force"), 1u) << version << capture.Dump();
        EXPECT_EQ(capture.Dump().find("root:"), std::string::npos);  // /etc/passwd was never read
        ++version;
    }
    EXPECT_EQ(stats_.Value("privacy.policy.refused"), 2u + std::size(hostile));
    EXPECT_EQ(stats_.Value("privacy.policy.loaded"), 1u);
}

// The document is read again only when its file changes; the cloud copy wins while it exists and
// is well-formed; the key file is the one beside the copy in force, and without a usable one
// identifiers are withheld, said once at load.
TEST_F(PrivacyPolicyTest, ReloadsOnChangeOnlyAndFindsTheKeyBesideTheCopyInForce) {
    std::string publicPem, privatePem;
    EnvelopeOpener::MakeKeyPair(publicPem, privatePem);
    ASSERT_TRUE(WriteDocument(publicPem, config_ + "server.pem"));
    const std::string identifiers = "<Identifiers key=\"server.pem\"><Param name=\"serial\"/></Identifiers>";
    std::string system = config_ + PrivacyPolicyParser::kFileName;
    ASSERT_TRUE(WriteDocument(Policy("<Levels switchOn=\"3\" switchOff=\"2\"/>", identifiers), system));
    LogCapture capture;
    auto first = Get();
    EXPECT_EQ(first->source, system);
    EXPECT_NE(first->cipher, nullptr);
    for (int i = 0; i < 100; ++i) {
        EXPECT_EQ(Get(), first);
    }
    EXPECT_EQ(stats_.Value("privacy.policy.loaded"), 1u);

    struct timespec later[2] = {{0, UTIME_OMIT}, {time(nullptr) + 10, 0}};  // a touch: same text, new stamp
    ASSERT_EQ(utimensat(AT_FDCWD, system.c_str(), later, 0), 0);
    ConfigDocument::Forget();
    auto touched = Get();
    EXPECT_NE(touched, first);
    EXPECT_EQ(touched->MaxLevel(true), 3u);

    std::string cloud = cloud_ + PrivacyPolicyParser::kFileName;
    ASSERT_TRUE(WriteDocument(Policy("<Levels switchOn=\"4\" switchOff=\"1\"/>", identifiers), cloud));
    auto pushed = Get();
    EXPECT_EQ(pushed->source, cloud);
    EXPECT_EQ(pushed->MaxLevel(false), 1u);
    EXPECT_EQ(pushed->cipher, nullptr);  // the key lies beside the system copy only
    EXPECT_EQ(capture.Count(ANDROID_LOG_WARN, "identifiers are removed"), 1u);
    Get();
    EXPECT_EQ(capture.Count(ANDROID_LOG_WARN, "identifiers are removed"), 1u);

    ASSERT_EQ(unlink(cloud.c_str()), 0);
    ConfigDocument::Forget();
    EXPECT_EQ(Get()->source, system);
    EXPECT_EQ(capture.Dump().find(publicPem.substr(30, 20)), std::string::npos);
}

}  // namespace
}  // namespace android::Orvane
