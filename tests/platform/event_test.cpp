#include "platform/event.h"

#include <gtest/gtest.h>

namespace android::Orvane {

TEST(EventTest, ParamsAndExtraParamsAreSeparateAndAbsentOrEmptyKeysHandled) {
    sp<Event> event = new Event("test");
    event->SetValue("", "x");
    event->SetValue("count", -7, true);
    EXPECT_TRUE(event->params.empty());
    EXPECT_EQ(event->GetIntValue("count"), -1);  // absent from this map
    EXPECT_EQ(event->GetIntValue("count", true), -7);
}

}  // namespace android::Orvane
