// libFuzzer target: bytes as the exception log node hands them over, one read of at most 1023
// bytes, through the log relay source into a pipeline that keeps the event: whatever the bytes
// (NULs, line feeds, invalid text), the event is 902902 and carries them unchanged.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "fuzz/event_keeper.h"
#include "platform/pipeline.h"
#include "plugins/event_logrelay_source.h"

using namespace android;
using namespace android::Orvane;
using namespace android::Orvane::FuzzEvents;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static KeepLast* keeper = HeldForRun(new KeepLast());
    static EventLogrelaySource* relay = [] {
        EventLogrelaySource* created = HeldForRun(new EventLogrelaySource());
        created->AddPipeline("dftFaultEvent", new Pipeline("dftFaultEvent", {keeper}));
        return created;
    }();
    std::string record(reinterpret_cast<const char*>(data), size < 1023 ? size : 1023);
    keeper->last = nullptr;
    relay->ParseEvent(record);
    if (keeper->last == nullptr || keeper->last->eventId != 902902 ||
        keeper->last->GetValue("save_param_list") != record || keeper->last->sender != "EventLogrelaySource") {
        fprintf(stderr, "logrelay_record_fuzzer: the record did not arrive unchanged\n");
        abort();
    }
    return 0;
}
