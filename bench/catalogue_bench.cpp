#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <string>

#include <android-base/unique_fd.h>
#include <benchmark/benchmark.h>

#include "config/event_xml_parser.h"
#include "utils/file_util.h"

namespace android {
namespace Orvane {
namespace {

constexpr int kEntries = 20000;
constexpr uint32_t kFirstId = 901000000;
constexpr size_t kBlockSize = 4096;

// A catalogue of 20,000 entries (about 5 MB) whose last entry's id can be rewritten in place,
// so that every timed lookup reads the whole document for an id the cache has never seen.
class Catalogue {
public:
    Catalogue() {
        char pattern[] = "/tmp/catalogue_bench.XXXXXX";
        dir_ = std::string(mkdtemp(pattern)) + "/";
        std::string text = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<Events>\n";
        for (int i = 0; i < kEntries; ++i) {
            if (i == kEntries - 1) {
                lastIdOffset_ = text.size() + strlen("  <Event id=\"");
            }
            text += "  <Event id=\"" + std::to_string(kFirstId + i) +
                    "\" FaultType=\"FAULT\" FaultLevel=\"GENERAL\" PrivacyLevel=\"L2\" Extend=\"E:1|S:30|V:2\">\n"
                    "    <Param id=\"1\" name=\"pkg\" type=\"string\" len=\"64\" PrivacyLevel=\"L1\"/>\n"
                    "    <Param id=\"2\" name=\"count\" type=\"int\" PrivacyLevel=\"L3\" defVal=\"0\"/>\n"
                    "    <Param id=\"3\" name=\"detail\" type=\"class\" classID=\"901001002\" arrLen=\"8\"/>\n"
                    "  </Event>\n";
        }
        text += "</Events>\n";
        size_ = text.size();
        FileUtil::SaveStringToFile(Path(), text, true);
    }
    ~Catalogue() {
        uint64_t freed = 0;
        FileUtil::DeleteDirectoryOrFile(dir_, freed, true);
    }

    std::string Dir() const { return dir_; }
    std::string Path() const { return dir_ + "event.xml"; }
    size_t Size() const { return size_; }
    // Gives the last entry a new 9-digit id.
    void SetLastId(uint32_t id) const {
        android::base::unique_fd fd(open(Path().c_str(), O_WRONLY | O_CLOEXEC));
        std::string digits = std::to_string(id);
        if (fd < 0 || pwrite(fd, digits.data(), digits.size(), static_cast<off_t>(lastIdOffset_)) < 0) {
            fprintf(stderr, "cannot rewrite %s\n", Path().c_str());
        }
    }

private:
    std::string dir_;
    size_t lastIdOffset_ = 0;
    size_t size_ = 0;
};

const Catalogue& GetCatalogue() {
    static Catalogue catalogue;
    return catalogue;
}

void BM_CatalogueLookupLastEntryUncached(benchmark::State& state) {
    const Catalogue& catalogue = GetCatalogue();
    sp<EventXmlParser> parser = EventXmlParser::getInstance();
    uint32_t id = 990000000;
    for (auto _ : state) {
        state.PauseTiming();
        catalogue.SetLastId(++id);
        state.ResumeTiming();
        sp<EventInfoConfig> entry = parser->GetEventInfoConfig(catalogue.Dir(), id);
        if (entry == nullptr || entry->params.size() != 3) {
            state.SkipWithError("last entry not found");
            break;
        }
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * catalogue.Size()));
}
BENCHMARK(BM_CatalogueLookupLastEntryUncached)->Unit(benchmark::kMillisecond);

// The floor: the same file read in 4096-byte blocks, each searched for the key with memmem.
void BM_PlainBlockScanMemmem(benchmark::State& state) {
    const Catalogue& catalogue = GetCatalogue();
    uint32_t id = 980000000;
    for (auto _ : state) {
        state.PauseTiming();
        catalogue.SetLastId(++id);
        std::string key = "<Event id=\"" + std::to_string(id) + "\"";
        state.ResumeTiming();
        FILE* file = fopen(catalogue.Path().c_str(), "rb");
        char block[kBlockSize];
        size_t n;
        bool found = false;
        while (!found && (n = fread(block, 1, sizeof(block), file)) > 0) {
            found = memmem(block, n, key.data(), key.size()) != nullptr;
        }
        fclose(file);
        if (!found) {
            state.SkipWithError("key not found");
            break;
        }
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * catalogue.Size()));
}
BENCHMARK(BM_PlainBlockScanMemmem)->Unit(benchmark::kMillisecond);

void BM_CatalogueLookupCached(benchmark::State& state) {
    const Catalogue& catalogue = GetCatalogue();
    sp<EventXmlParser> parser = EventXmlParser::getInstance();
    const uint32_t id = kFirstId + 10;
    if (parser->GetEventInfoConfig(catalogue.Dir(), id) == nullptr) {
        state.SkipWithError("entry not found");
        return;
    }
    for (auto _ : state) {
        benchmark::DoNotOptimize(parser->GetEventInfoConfig(catalogue.Dir(), id));
    }
}
BENCHMARK(BM_CatalogueLookupCached);

}  // namespace
}  // namespace Orvane
}  // namespace android

BENCHMARK_MAIN();
