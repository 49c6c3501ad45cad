#include "platform/threads/RunLoop.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <optional>
#include <string>
#include <thread>

#include "platform/system/UniqueFd.h"

namespace platform {
namespace {

using std::chrono::milliseconds;

struct Pair {
    Pair() {
        int fds[2];
        EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, fds), 0);
        mine.reset(fds[0]);
        other.reset(fds[1]);
    }
    UniqueFd mine, other;
};

TEST(RunLoop, RunsPostedWorkInOrderUntilStopped) {
    RunLoop loop;
    std::string order;
    loop.post([&] {
        order += 'a';
        EXPECT_TRUE(loop.isCurrent());
        loop.post([&] { order += 'c'; });
    });
    loop.post([&] { order += 'b'; });
    EXPECT_FALSE(loop.isCurrent());
    std::thread other([&] { loop.post([&] { loop.post([&] { loop.stop(); }); }); });
    loop.run();
    other.join();
    EXPECT_EQ(order, "abc");

    loop.post([&] { order += 'd'; });
    EXPECT_EQ(loop.poll(), 1u) << "a stop ends one run only";
    loop.post([&] { order += 'e'; });
    loop.finish();
    loop.run();
    EXPECT_EQ(order, "abcde");
}

TEST(RunLoop, WatchesDescriptors) {
    RunLoop loop;
    Pair pair;
    std::string seen;
    std::optional<RunLoop::Watch> watch(std::in_place, loop, pair.mine.get());
    watch->awaitReadable([&] { seen += 'r'; });
    watch->awaitHangup([&] { seen += 'h'; });
    EXPECT_FALSE(loop.runOnce(milliseconds(0)));
    ASSERT_EQ(write(pair.other.get(), "x", 1), 1);
    EXPECT_TRUE(loop.runOnce(milliseconds(1000)));
    EXPECT_EQ(seen, "r");
    // Readiness that was there before awaiting counts too; half a close is no hang-up.
    watch->awaitReadable([&] { seen += 'r'; });
    watch->awaitWritable([&] { seen += 'w'; });
    shutdown(pair.other.get(), SHUT_WR);
    while (loop.runOnce(milliseconds(10))) {
    }
    EXPECT_EQ(seen.size(), 3u) << seen;
    pair.other.reset();
    EXPECT_TRUE(loop.runOnce(milliseconds(1000)));
    EXPECT_EQ(seen.back(), 'h');

    // Gone, although both callbacks were due.
    watch->awaitReadable([&] { watch.reset(); });
    watch->awaitReadable([&] { seen += '!'; });
    while (loop.runOnce(milliseconds(10))) {
    }
    EXPECT_FALSE(watch);
    EXPECT_EQ(seen.find('!'), std::string::npos);
    EXPECT_GE(fcntl(pair.mine.get(), F_GETFD), 0) << "the descriptor was only borrowed";
}

TEST(RunLoop, FiresTheLastStartOfATimer) {
    RunLoop loop;
    std::string fired;
    std::optional<RunLoop::Timer> timer(std::in_place, loop);
    timer->start(milliseconds(0), [&] { fired += '1'; });
    timer->start(milliseconds(1), [&] { fired += '2'; });
    while (fired.empty()) loop.runOnce(milliseconds(1000));
    EXPECT_EQ(fired, "2");
    timer->start(milliseconds(0), [&] { fired += '3'; });
    timer->cancel();
    timer->start(milliseconds(0), [&] { fired += '4'; });
    timer.reset();
    while (loop.runOnce(milliseconds(10))) {
    }
    EXPECT_EQ(fired, "2");
}

TEST(RunLoop, TakesWhatItStillHoldsAlong) {
    auto token = std::make_shared<int>();
    Pair pair;
    {
        RunLoop loop;
        auto watch = std::make_shared<RunLoop::Watch>(loop, pair.mine.get());
        watch->awaitReadable([token, watch] {});
        loop.post([token] {});
        watch.reset();
    }
    EXPECT_EQ(token.use_count(), 1);
}

}  // namespace
}  // namespace platform
