#include <sys/stat.h>

#include <utility>

#include "bench/EchoServer.h"
#include "bench/Failure.h"
#include "bench/Figures.h"
#include "bench/Frames.h"
#include "bench/Interrupt.h"
#include "bench/Measure.h"
#include "bench/Questions.h"
#include "platform/plist/PropertyList.h"

namespace bench {

namespace {

/// A daemon just started, a connection to it, and the microseconds to the reply waited for.
struct Started {
    Child daemon;
    FrameClient client;
    double microseconds;
};

Started startToSmall(const World& world) {
    const std::string request = smallRequest();
    const double start = now();
    Child daemon = world.startDaemon();
    FrameClient client(waitForSocket(world.socketPath(), daemon));
    const std::string_view reply = client.exchange(request);
    const double time = now() - start;
    expectSuccess(reply);
    return {std::move(daemon), std::move(client), time};
}

/// A reply with too few matches does not count, and neither does the time of finding that out: the
/// question is asked again.
Started startToMatch(const World& world) {
    const Question question = Question::byPoint(10);
    const double start = now();
    Child daemon = world.startDaemon();
    FrameClient client(waitForSocket(world.socketPath(), daemon));
    for (const double end = start + 60e6; now() < end;) {
        checkInterrupted();
        const std::string_view reply = client.exchange(question.frame);
        const double time = now() - start;
        if (isAnswered(question, reply)) return {std::move(daemon), std::move(client), time};
    }
    fail("no correct match within a minute of the start");
}

void readAndParse(const World& world) {
    for (const std::string& file : world.files()) {
        const auto value = platform::readPropertyListFile(file);
        if (!value) fail("{}", value.error().text);
    }
}

void statFiles(const World& world) {
    struct stat status;
    for (const std::string& file : world.files()) {
        if (::stat(file.c_str(), &status) < 0) failErrno(file);
    }
}

template <class Sample>
double medianOf(int rounds, Sample sample) {
    std::vector<double> samples;
    for (int i = 0; i < rounds; ++i) samples.push_back(sample());
    return median(std::move(samples));
}

Target atMost(const Run& run, double microseconds) {
    if (run.largest().plugIns() != 10000) return {};
    return {Target::Kind::ValueAtMost, microseconds};
}

/// Matching the largest extension point there is makes the daemon hold what it will hold. Leaves a
/// full catalogue.
double residentAfterMatching(const World& world, Started& started) {
    const Question question = Question::byPoint(world.plugIns() / 10);
    expectAnswered(question, started.client.exchange(question.frame));
    started.daemon.waitUntilIdle();
    return started.daemon.residentMegabytes();
}

void measureScan(const Run& run, int rounds) {
    const World& world = run.largest();
    const std::size_t size = world.plugIns();
    if (!run.report.wants({fmt::format("scan-{}/warm", size),
                           fmt::format("scan-{}/containers-kept/warm", size),
                           fmt::format("rss-{}", size)}))
        return;
    readAndParse(world);
    double resident = 0;
    std::vector<double> scans, parses;
    for (int i = 0; i < run.freshScans; ++i) {
        world.forget(false);
        parses.push_back(timed([&] { readAndParse(world); })());
        Started started = startToMatch(world);
        scans.push_back(started.microseconds);
        resident = residentAfterMatching(world, started);
    }
    run.report.add({.key = fmt::format("scan-{}/warm", size),
                    .title = fmt::format("first scan of {} to first match", size),
                    .value = median(std::move(scans)),
                    .besideSource = "baseline",
                    .beside = median(std::move(parses)),
                    .now = atMost(run, 1.5e6),
                    .goal = {Target::Kind::RatioAtMost, 1.3}});
    run.report.add({.key = fmt::format("scan-{}/containers-kept/warm", size),
                    .title = "  the same, data containers there already",
                    .value = medianOf(rounds,
                                      [&] {
                                          world.forget(true);
                                          return startToMatch(world).microseconds;
                                      }),
                    .now = atMost(run, 1.5e6)});
    run.report.add({.key = fmt::format("rss-{}", size),
                    .title = fmt::format("resident memory, matched {} of {}", size / 10, size),
                    .value = resident,
                    .unit = "MB",
                    .now = atMost(run, 150),
                    .goal = atMost(run, 40)});
}

void measureStart(const Run& run, int rounds) {
    const World& world = run.largest();
    const std::string key = fmt::format("start-{}/warm", world.plugIns());
    if (!run.report.wants({key})) return;
    const std::string request = smallRequest();
    std::string reply;
    std::vector<double> starts, echoes;
    startToMatch(world).daemon.waitUntilIdle();  // what the last scan was killed before writing
    for (int i = 0; i <= rounds; ++i) {
        Started started = startToSmall(world);
        if (i > 0) starts.push_back(started.microseconds);
        reply = started.client.exchange(request);
        const double start = now();
        const EchoServer server(run.scratch, "start", reply, EchoKind::Blocking);
        FrameClient(server.socketPath()).exchange(request);
        if (i > 0) echoes.push_back(now() - start);
    }
    run.report.add({.key = key,
                    .title = "start, full catalogue, to first small reply",
                    .value = median(std::move(starts)),
                    .besideSource = "echo",
                    .beside = median(std::move(echoes)),
                    .now = atMost(run, 150e3),
                    .goal = atMost(run, 30e3)});
}

void measureRescan(const Run& run, int rounds) {
    const World& world = run.largest();
    const std::string key = fmt::format("rescan-{}/warm", world.plugIns());
    const std::string residentKey = fmt::format("rss-{}/from-catalogue", world.plugIns());
    if (!run.report.wants({key, residentKey})) return;
    double resident = 0;
    const double time = medianOf(rounds, [&] {
        Started started = startToMatch(world);
        resident = residentAfterMatching(world, started);
        return started.microseconds;
    });
    run.report.add({.key = key,
                    .title = "start, nothing changed, to first match",
                    .value = time,
                    .besideSource = "baseline",
                    .beside = medianOf(rounds, timed([&] { statFiles(world); })),
                    .now = atMost(run, 300e3),
                    .goal = atMost(run, 100e3)});
    run.report.add({.key = residentKey,
                    .title = "resident memory, started from the catalogue",
                    .value = resident,
                    .unit = "MB"});
}

}  // namespace

void measureStarts(const Run& run) {
    const int rounds = run.quick ? 1 : 3;
    measureScan(run, rounds);
    measureStart(run, 2 * rounds + 1);
    measureRescan(run, 2 * rounds + 1);
}

}  // namespace bench
