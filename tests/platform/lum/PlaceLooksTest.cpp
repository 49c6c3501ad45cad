#include "platform/lum/PlaceLooks.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sched.h>

#include <atomic>
#include <future>
#include <optional>

#include "platform/threads/RunLoop.h"

namespace platform {
namespace {

using testing::ElementsAre;

TEST(PlaceLooksTest, WhatHangsHoldsUpItsOwnFileSystemOnceOnly) {
    std::promise<void> letGo;
    const auto gate = letGo.get_future().share();
    RunLoop loop;
    PlaceLooks looks(loop, std::chrono::milliseconds(500));
    const auto made = [&](std::vector<PlaceLooks::Look> all) {
        std::optional<std::vector<bool>> result;
        looks.make(std::move(all), [&](const std::vector<bool>& done) { result = done; });
        while (!result) loop.runOnce(std::chrono::milliseconds(1000));
        return *result;
    };
    const PlaceLooks::Look quick{"/proc/absent", [] {}}, elsewhere{"/etc", [] {}};
    const PlaceLooks::Look hanging{"/proc/self", [gate] { gate.wait(); }};
    EXPECT_THAT(made({quick, elsewhere, hanging, quick}), ElementsAre(true, true, false, false));
    const PlaceLooks::Look forbidden{quick.path, [] { FAIL() << "nobody waits for it again"; }};
    for (int i = 0; i < 3; ++i) EXPECT_THAT(made({forbidden, elsewhere}), ElementsAre(false, true));
    // On the machine's own file system it is the path.
    const PlaceLooks::Look mountedUpon{"/usr", [gate] { gate.wait(); }};
    EXPECT_THAT(made({mountedUpon, elsewhere}), ElementsAre(false, true));
    letGo.set_value();
    while (!made({quick})[0]) continue;
    EXPECT_THAT(made({}), ElementsAre());
}

/// While it lasts, threads that this one makes, and it does not wait for, do not run.
class AloneOnItsCpu {
  public:
    AloneOnItsCpu() {
        ::sched_getaffinity(0, sizeof all_, &all_);
        cpu_set_t one;
        CPU_ZERO(&one);
        CPU_SET(::sched_getcpu(), &one);
        const sched_param first{.sched_priority = 1};
        isThere = ::sched_setaffinity(0, sizeof one, &one) == 0 &&
                  ::sched_setscheduler(0, SCHED_FIFO, &first) == 0;
    }
    AloneOnItsCpu(const AloneOnItsCpu&) = delete;
    ~AloneOnItsCpu() {
        const sched_param usual{};
        ::sched_setscheduler(0, SCHED_OTHER, &usual);
        ::sched_setaffinity(0, sizeof all_, &all_);
    }

    bool isThere = false;

  private:
    cpu_set_t all_{};
};

TEST(PlaceLooksTest, WhatIsGivenUpJustBeforeItBeginsIsNotMadeAndHoldsUpNobody) {
    constexpr int kMostAttempts = 20;
    RunLoop loop;
    PlaceLooks looks(loop, std::chrono::milliseconds(40));
    std::atomic<bool> isMade = true;
    std::optional<std::vector<bool>> result;
    for (int attempt = 0; isMade; ++attempt) {
        // The thread sanitizer has a thread run before whoever makes it goes on.
        if (attempt == kMostAttempts) GTEST_SKIP() << "what is made begins at once";
        isMade = false;
        result.reset();
        looks.make({{"/proc/absent", [&] { isMade = true; }}},
                   [&](const std::vector<bool>& done) { result = done; });
        const AloneOnItsCpu alone;
        if (!alone.isThere) GTEST_SKIP() << "may not keep others from a CPU";
        while (!result) loop.poll();
    }
    EXPECT_THAT(*result, ElementsAre(false));
    do {
        result.reset();
        looks.make({{"/proc/absent", [] {}}}, [&](const auto& done) { result = done; });
        loop.runOnce(std::chrono::milliseconds(1000));
        EXPECT_FALSE(result) << "nothing hangs there";
        while (!result) loop.runOnce(std::chrono::milliseconds(1000));
    } while (!result->at(0));
    EXPECT_FALSE(isMade);
}

}  // namespace
}  // namespace platform
