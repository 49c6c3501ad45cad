#include <time.h>

#include <filesystem>

#include "bench/Counts.h"
#include "bench/Failure.h"
#include "bench/Figures.h"
#include "bench/Frames.h"
#include "bench/Interrupt.h"
#include "bench/Questions.h"

namespace bench {

namespace {

Target atMost(double count) {
    return {Target::Kind::ValueAtMost, count};
}

Figure countOf(std::string key, std::string title, double count, double most) {
    return {.key = std::move(key),
            .title = std::move(title),
            .value = count,
            .unit = "calls",
            .now = atMost(most),
            .goal = atMost(most)};
}

/// How often a daemon is woken that nobody asks anything.
void measureIdle(const Run& run, const CountedDaemon& daemon) {
    if (!run.report.wants({"idle/wake-ups"})) return;
    const int seconds = run.quick ? 2 : 15;
    const long before = daemon.process().sleeps();
    for (int i = 0; i < seconds; ++i) {
        constexpr timespec kSecond{1, 0};
        checkInterrupted();
        ::nanosleep(&kSecond, nullptr);
    }
    const double woken = static_cast<double>(daemon.process().sleeps() - before) * 60 / seconds;
    Figure figure = countOf("idle/wake-ups", "wake-ups of an idle daemon", woken, 0);
    figure.unit = "1/min";
    run.report.add(std::move(figure));
}

void measureAllocations(const Run& run, const World& world, const CountedDaemon& daemon) {
    if (run.report.wants({"small/allocations"}))
        run.report.add(countOf("small/allocations", "allocations of a small request",
                               daemon.allocationsOf(smallRequest()), kMostForSmall));
    const Question question = Question::ofAll(kCountedPlugIns);
    if (run.report.wants({"match-1000/allocations"}))
        run.report.add(countOf("match-1000/allocations", "allocations of a match of 1000",
                               daemon.allocationsOf(question.frame), kMostForMatch));
    if (!run.report.wants({"match-1000+decode/allocations"})) return;
    LibraryClient library(world);
    run.report.add(countOf("match-1000+decode/allocations", "  of decoding its reply",
                           allocationsOf(library, question), kMostForDecoding));
}

/// The second time, when everything has its place: the file is replaced for each plug-in, and at
/// the end it is synced, and its directory. One replacement more tells others of it.
void measureSyncs(const Run& run, const World& world, const CountedDaemon& daemon) {
    const std::string key = fmt::format("bulk-annotate-{}", kCountedPlugIns);
    if (!run.report.wants({key + "/syncs", key + "/replacements"})) return;
    FrameClient client(world.socketPath());
    const auto plugIns = uuidsIn(client.exchange(Question::ofAll(kCountedPlugIns).frame));
    const std::string request = bulkAnnotateRequest(plugIns);
    expectSuccess(client.exchange(request));
    const std::uint64_t syncs = daemon.counters().syncs;
    const std::uint64_t replacements = daemon.counters().replacements;
    expectSuccess(client.exchange(request));
    run.report.add(countOf(key + "/syncs", "syncs of a bulk-annotate of 1000",
                           static_cast<double>(daemon.counters().syncs - syncs), 2));
    run.report.add({.key = key + "/replacements",
                    .title = "  replacements of files",
                    .value = static_cast<double>(daemon.counters().replacements - replacements),
                    .unit = "calls"});
}

}  // namespace

void measureCounts(const Run& run) {
    if (!run.report.wants({"idle/wake-ups", "small/allocations", "match-1000/allocations",
                           "match-1000+decode/allocations", "bulk-annotate-1000/syncs",
                           "bulk-annotate-1000/replacements"}))
        return;
    const World& world = run.worlds[1];
    std::filesystem::remove(world.annotationsFile());
    const CountedDaemon daemon(world);
    measureIdle(run, daemon);
    measureAllocations(run, world, daemon);
    measureSyncs(run, world, daemon);
}

}  // namespace bench
