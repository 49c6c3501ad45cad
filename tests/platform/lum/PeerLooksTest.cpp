#include "platform/lum/PeerLooks.h"

#include <gtest/gtest.h>

#include <future>

#include "platform/threads/RunLoop.h"

namespace platform {
namespace {

using std::chrono::milliseconds;

class PeerLooksTest : public testing::Test {
  protected:
    /// One that hangs until the test lets all go.
    PeerLooks::Look hanging() {
        return [gate = gate_](PeerLooks::Pace&) { gate.wait(); };
    }
    PeerLooks::Outcome counting(int& done, int& givenUp) {
        return [&](bool isDone, std::size_t) { ++(isDone ? done : givenUp); };
    }
    void runUntil(const std::function<bool()>& condition) {
        while (!condition()) loop_.runOnce(milliseconds(1000));
    }

    std::promise<void> letGo_;
    const std::shared_future<void> gate_ = letGo_.get_future().share();
    RunLoop loop_;
    const Origin one_{1, 1, 0}, other_{1, 2, 0};
};

TEST_F(PeerLooksTest, WhoHangsIsGivenUpAndTakesAQuarterOfTheThreadsAtTheMost) {
    constexpr std::size_t kQuarter = PeerLooks::kMostThreads / 4;
    int done = 0, givenUp = 0, others = 0, none = 0;
    PeerLooks looks(loop_, milliseconds(1000));
    for (std::size_t i = 0; i < kQuarter - 1; ++i)
        looks.look(one_, hanging(), counting(done, givenUp));
    looks.look(
        one_, [](PeerLooks::Pace&) {}, counting(done, givenUp));
    runUntil([&] { return done == 1; });
    EXPECT_EQ(givenUp, 0) << "one thread was left";
    looks.look(one_, hanging(), counting(done, givenUp));
    looks.look(
        one_, [](PeerLooks::Pace&) { FAIL() << "it has its threads"; }, counting(done, givenUp));
    for (int i = 0; i < 100; ++i) {
        looks.look(
            other_, [](PeerLooks::Pace&) {}, counting(others, none));
        runUntil([&] { return others == i + 1; });
    }
    runUntil([&] { return givenUp == static_cast<int>(kQuarter) + 1; });
    EXPECT_EQ(none, 0);
    letGo_.set_value();
    looks.look(
        one_, [](PeerLooks::Pace&) {}, counting(done, givenUp));
    runUntil([&] { return done == 2; });
    EXPECT_EQ(givenUp, static_cast<int>(kQuarter) + 1) << "once each";
}

TEST_F(PeerLooksTest, WhatGetsOnIsNotGivenUpAndWhatItFoundBeforeItHangsCounts) {
    PeerLooks looks(loop_, milliseconds(1000));
    std::vector<int> found(8);
    std::optional<std::size_t> steps;
    looks.look(
        one_,
        [&](PeerLooks::Pace& pace) {
            for (int& value : found) {
                value = 7;
                pace.step();
                gate_.wait_for(milliseconds(150));
            }
            gate_.wait();
        },
        [&](bool isDone, std::size_t count) {
            EXPECT_FALSE(isDone);
            steps = count;
        });
    runUntil([&] { return steps.has_value(); });
    EXPECT_EQ(steps, 8u);
    EXPECT_EQ(found, std::vector<int>(8, 7));
    letGo_.set_value();
}

TEST_F(PeerLooksTest, WhoHasWaitedForItsTurnHasAllOfTheTimeThen) {
    PeerLooks looks(loop_, milliseconds(2000), 1);
    int done = 0, givenUp = 0;
    for (int i = 0; i < 2; ++i)
        looks.look(
            one_, [gate = gate_](PeerLooks::Pace&) { gate.wait_for(milliseconds(1200)); },
            counting(done, givenUp));
    runUntil([&] { return done + givenUp == 2; });
    EXPECT_EQ(done, 2);
}

}  // namespace
}  // namespace platform
