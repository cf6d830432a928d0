#include "utils/thread_checker.h"

#include <thread>

#include <gtest/gtest.h>

namespace android::Orvane {
namespace {

// The owner may check again; another thread dies with one fatal line while the owner holds it,
// and may take over once it is detached.
TEST(ThreadCheckerDeathTest, ASecondThreadIsStoppedUntilTheOwnerLetsGo) {
    ThreadChecker checker;
    checker.Check("Owner");
    checker.Check("Owner");
    EXPECT_DEATH(std::thread([&checker] { checker.Check("Intruder"); }).join(),
                 "Intruder called on thread [0-9]+, owned by thread [0-9]+");
    checker.Detach();
    std::thread([&checker] {
        checker.Check("Heir");
        checker.Detach();
    }).join();
    checker.Check("Owner");
}

}  // namespace
}  // namespace android::Orvane
