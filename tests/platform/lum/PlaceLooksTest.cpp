#include "platform/lum/PlaceLooks.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

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
    PlaceLooks looks(loop, std::chrono::milliseconds(100));
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

}  // namespace
}  // namespace platform
