// libFuzzer target: bytes as the kernel event device hands them over, one record of at most
// 4096 bytes made NUL-terminated as the read loop does, through the kernel event source's
// parser into a pipeline that keeps the event. The parser is checked against sscanf with the
// record format: a record is published exactly when sscanf matches it and its id and time fit
// their fields, and the event carries what sscanf reads.
#include <charconv>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>

#include "fuzz/event_keeper.h"
#include "platform/pipeline.h"
#include "plugins/event_radiator.h"

using namespace android;
using namespace android::Orvane;
using namespace android::Orvane::FuzzEvents;

namespace {

// A decimal number as the scan conversions read it (optional sign), when it lies in [min, max].
bool InRange(std::string_view text, int64_t min, int64_t max, int64_t& value) {
    if (!text.empty() && text.front() == '+') {
        text.remove_prefix(1);
    }
    auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
    return error == std::errc() && end == text.data() + text.size() && value >= min && value <= max;
}

void Check(bool condition, const char* what) {
    if (!condition) {
        fprintf(stderr, "kernel_record_fuzzer: %s\n", what);
        abort();
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static KeepLast* keeper = HeldForRun(new KeepLast());
    static EventRadiator* radiator = [] {
        EventRadiator* created = HeldForRun(new EventRadiator());
        created->AddPipeline("dftFaultEvent", new Pipeline("dftFaultEvent", {keeper}));
        return created;
    }();
    char record[4097] = {};
    memcpy(record, data, size < 4096 ? size : 4096);
    keeper->last = nullptr;
    std::string text(record);
    radiator->ParseEvent(record);

    int idStart = -1, idEnd = -1, timeStart = -1, timeEnd = -1, tokenStart = -1, tokenEnd = -1;
    sscanf(text.c_str(), "EventId %n%*d%n -t %n%*u%n -paraList %n%*4096s%n", &idStart, &idEnd, &timeStart, &timeEnd,
           &tokenStart, &tokenEnd);
    int64_t id = 0, time = 0;
    bool accepted = tokenEnd >= 0 &&
                    InRange(std::string_view(text).substr(idStart, idEnd - idStart), 1, INT32_MAX, id) &&
                    text[timeStart] != '-' &&
                    InRange(std::string_view(text).substr(timeStart, timeEnd - timeStart), 0, INT64_MAX, time);
    Check(accepted == (keeper->last != nullptr), accepted ? "a valid record was dropped" : "an invalid record passed");
    if (accepted) {
        Check(keeper->last->eventId == static_cast<uint32_t>(id), "wrong id");
        Check(keeper->last->happenTime == static_cast<uint64_t>(time), "wrong time");
        std::string token = text.substr(tokenStart, tokenEnd - tokenStart);
        Check(keeper->last->GetValue("param_list") == text.substr(text.find(token)), "wrong parameter text");
    }
    return 0;
}
