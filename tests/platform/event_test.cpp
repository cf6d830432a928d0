#include "platform/event.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <deque>
#include <type_traits>

#include "utils/string_util.h"
#include "utils/time_util.h"

namespace android {
namespace Orvane {
namespace {

static_assert(std::is_same_v<decltype(Event::eventType), uint32_t>);
static_assert(std::is_same_v<decltype(Event::dispatchType), uint32_t>);
static_assert(sizeof(Event::reservedShort) == 2);
static_assert(std::is_same_v<decltype(Event::eventId), uint32_t>);
static_assert(std::is_same_v<decltype(Event::happenTime), uint64_t>);
static_assert(sizeof(Event::reservedLong) == 8);
static_assert(std::is_same_v<decltype(Event::timestamp), uint64_t>);
static_assert(sizeof(Event::reservedFlag) == 1);
static_assert(std::is_same_v<EVENT_RET, int32_t>);

TEST(EventTest, ConstructionSetsSenderDefaultsAndCurrentTimestamp) {
    uint64_t before = TimeUtil::GetTimestampUS();
    sp<Event> event = new Event("EventLogrelaySource");
    uint64_t after = TimeUtil::GetTimestampUS();

    EXPECT_EQ(event->sender, "EventLogrelaySource");
    EXPECT_EQ(event->eventType, 0u);
    EXPECT_EQ(event->dispatchType, 1u);
    EXPECT_EQ(event->reservedShort, 0);
    EXPECT_EQ(event->eventId, 0u);
    EXPECT_EQ(event->happenTime, 0u);
    EXPECT_EQ(event->reservedLong, 0u);
    EXPECT_FALSE(event->reservedFlag);
    EXPECT_TRUE(event->params.empty());
    EXPECT_TRUE(event->extraParams.empty());
    EXPECT_GE(event->timestamp, before);
    EXPECT_LE(event->timestamp, after);

    event->timestamp = 1;
    event->ResetTimestamp();
    EXPECT_GE(event->timestamp, after);
}

TEST(EventTest, ValuesLiveInTwoSeparateOrderedMaps) {
    sp<Event> event = new Event("test");
    event->SetValue("zeta", "last");
    event->SetValue("alpha", "first");
    event->SetValue("Beta", 42);
    event->SetValue("alpha", "again");
    event->SetValue("secret", "hidden", true);
    event->SetValue("count", -7, true);

    EXPECT_EQ(event->GetValue("alpha"), "again");
    EXPECT_EQ(event->GetIntValue("Beta"), 42);
    // Each set is invisible to the other.
    EXPECT_EQ(event->GetValue("secret"), "");
    EXPECT_EQ(event->GetValue("alpha", true), "");
    EXPECT_EQ(event->GetValue("secret", true), "hidden");
    EXPECT_EQ(event->GetIntValue("count", true), -7);
    EXPECT_EQ(event->GetIntValue("count"), -1);

    // Byte-wise key order: upper case sorts before lower case.
    std::map<std::string, std::string> params = event->GetKeyValuePairs();
    std::vector<std::string> keys;
    for (const auto& [key, value] : params) {
        keys.push_back(key);
    }
    EXPECT_EQ(keys, (std::vector<std::string>{"Beta", "alpha", "zeta"}));
    EXPECT_EQ(event->GetKeyValuePairs(true).size(), 2u);

    // The pairs are a copy, not a view.
    params["alpha"] = "changed";
    EXPECT_EQ(event->GetValue("alpha"), "again");
}

TEST(EventTest, EmptyKeysAndUnreadableNumbers) {
    sp<Event> event = new Event("test");
    event->SetValue("", "x");
    event->SetValue("", 5, true);
    EXPECT_TRUE(event->params.empty());
    EXPECT_TRUE(event->extraParams.empty());

    EXPECT_EQ(event->GetIntValue("absent"), -1);
    event->SetValue("word", "abc");
    event->SetValue("mixed", " 12ab");
    EXPECT_EQ(event->GetIntValue("word"), StringUtil::ConvertInt("abc"));
    EXPECT_EQ(event->GetIntValue("mixed"), StringUtil::ConvertInt(" 12ab"));
}

LoopEvent EntryDueAt(uint64_t targetTime) {
    LoopEvent entry;
    entry.targetTime = targetTime;
    return entry;
}

TEST(LoopEventTest, HeapPutsEarliestDueOnTopAndLeavesTiesUnordered) {
    EXPECT_TRUE(EntryDueAt(20) < EntryDueAt(10));
    EXPECT_FALSE(EntryDueAt(10) < EntryDueAt(20));
    EXPECT_FALSE(EntryDueAt(10) < EntryDueAt(10));
    // Compared as unsigned: the largest time is the latest, not a negative one.
    EXPECT_TRUE(EntryDueAt(UINT64_MAX) < EntryDueAt(0));

    std::deque<LoopEvent> heap;
    for (uint64_t target : {50u, 10u, 40u, 10u, 30u, 20u, 60u}) {
        heap.push_back(EntryDueAt(target));
        std::push_heap(heap.begin(), heap.end());
    }
    std::vector<uint64_t> order;
    while (!heap.empty()) {
        std::pop_heap(heap.begin(), heap.end());
        order.push_back(heap.back().targetTime);
        heap.pop_back();
    }
    EXPECT_EQ(order, (std::vector<uint64_t>{10, 10, 20, 30, 40, 50, 60}));
}

TEST(LoopEventTest, CopySharesAndMoveEmptiesThePointers) {
    sp<Event> event = new Event("test");
    sp<EventHandler> handler = new EventHandler();
    int calls = 0;

    LoopEvent original;
    original.isRepeat = true;
    original.event = event;
    original.handler = handler;
    original.task = [&calls] { ++calls; };
    original.syncTask = std::make_shared<std::packaged_task<EVENT_RET()>>([] { return 0; });

    LoopEvent copy(original);
    EXPECT_EQ(event->getStrongCount(), 3);
    EXPECT_EQ(copy.syncTask, original.syncTask);
    copy.task();
    EXPECT_EQ(calls, 1);

    LoopEvent moved(std::move(original));
    EXPECT_EQ(event->getStrongCount(), 3);
    EXPECT_EQ(original.event, nullptr);
    EXPECT_EQ(original.handler, nullptr);
    EXPECT_EQ(original.syncTask, nullptr);
    EXPECT_TRUE(moved.isRepeat);

}

}  // namespace
}  // namespace Orvane
}  // namespace android
