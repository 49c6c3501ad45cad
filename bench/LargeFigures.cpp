#include <sys/socket.h>
#include <sys/time.h>

#include "bench/Failure.h"
#include "bench/Figures.h"
#include "bench/Frames.h"
#include "bench/Measure.h"
#include "bench/Questions.h"

namespace bench {

namespace {

constexpr std::size_t kLarge = 100'000;

/// A connection to a daemon that has made its first scan: the first match waits for that.
FrameClient connectAfterScan(const World& world, const Child& daemon) {
    constexpr timeval kPatience{600, 0};
    FrameClient client(waitForSocket(world.socketPath(), daemon));
    ::setsockopt(client.socket(), SOL_SOCKET, SO_RCVTIMEO, &kPatience, sizeof kPatience);
    const Question question = Question::byPoint(10);
    expectAnswered(question, client.exchange(question.frame));
    return client;
}

}  // namespace

void measureLarge(const Run& run) {
    const std::string resident = fmt::format("rss-{}", kLarge);
    const std::string against =
        fmt::format("match-10/{}-against-{}", kLarge, run.largest().plugIns());
    const std::string match = fmt::format("match-10/of-{}/p50", kLarge);
    if (!run.report.wants({resident, against, match})) return;
    const World large(run.scratch, kLarge);
    const Child other = run.largest().startDaemon();
    const Child daemon = large.startDaemon();
    FrameClient otherClient = connectAfterScan(run.largest(), other);
    FrameClient client = connectAfterScan(large, daemon);
    const Question many = Question::byPoint(1000), question = Question::byPoint(10);
    expectAnswered(many, client.exchange(many.frame));
    daemon.waitUntilIdle();
    other.waitUntilIdle();
    run.report.add({.key = resident,
                    .title = fmt::format("resident memory, matched 1000 of {}", kLarge),
                    .value = daemon.residentMegabytes(),
                    .unit = "MB"});
    const auto p50 = medianOfEach({3000, 20, run.quick ? 0.3 : 2.5},
                                  {timed([&] { client.exchange(question.frame); }),
                                   timed([&] { otherClient.exchange(question.frame); })});
    const Target limit{Target::Kind::ValueAtMost, 1.5};
    run.report.add({.key = match,
                    .title = fmt::format("match of 10 with {} installed, p50", kLarge),
                    .value = p50[0],
                    .now = {Target::Kind::ValueAtMost, limit.limit * p50[1]}});
    run.report.add({.key = against,
                    .title = fmt::format("match of 10, {} against {} installed", kLarge,
                                         run.largest().plugIns()),
                    .value = p50[0] / p50[1],
                    .unit = "x",
                    .now = limit,
                    .goal = limit});
}

}  // namespace bench
