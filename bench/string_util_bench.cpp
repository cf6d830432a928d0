#include <string>

#include <benchmark/benchmark.h>

#include "utils/string_util.h"

namespace android {
namespace Orvane {
namespace {

// Text shaped like event parameters: short fields, a delimiter every few bytes, quotes in it.
std::string MakeInput(size_t bytes) {
    static const std::string kPattern = "key=it's,value,,a'b;";
    std::string text;
    text.reserve(bytes);
    while (text.size() < bytes) {
        text += kPattern;
    }
    text.resize(bytes);
    return text;
}

void BM_SplitStr(benchmark::State& state) {
    const std::string input = MakeInput(static_cast<size_t>(state.range(0)));
    for (auto _ : state) {
        benchmark::DoNotOptimize(StringUtil::SplitStr(input, ','));
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * state.range(0));
}

void BM_ReplaceStr(benchmark::State& state) {
    const std::string input = MakeInput(static_cast<size_t>(state.range(0)));
    for (auto _ : state) {
        benchmark::DoNotOptimize(StringUtil::ReplaceStr(input, ",", ";;"));
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * state.range(0));
}

void BM_EscapeSqliteChar(benchmark::State& state) {
    const std::string input = MakeInput(static_cast<size_t>(state.range(0)));
    for (auto _ : state) {
        std::string text = input;
        benchmark::DoNotOptimize(StringUtil::EscapeSqliteChar(text));
    }
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * state.range(0));
}

// 4 KiB is the typical size; 1 to 64 KiB show that the cost per byte stays flat.
#define ORVANE_SIZES ->Arg(1 << 10)->Arg(4 << 10)->Arg(16 << 10)->Arg(64 << 10)
BENCHMARK(BM_SplitStr) ORVANE_SIZES;
BENCHMARK(BM_ReplaceStr) ORVANE_SIZES;
BENCHMARK(BM_EscapeSqliteChar) ORVANE_SIZES;

}  // namespace
}  // namespace Orvane
}  // namespace android

BENCHMARK_MAIN();
