// Everybody at once: honest clients, hostile ones, applications that come and go, plug-ins that
// start. At the end the daemon has as many descriptors as before, hardly more memory, and nobody
// honest was refused, cut off or made to wait for long.

#include <poll.h>

#include <charconv>
#include <cstdlib>
#include <filesystem>
#include <string_view>

#include "bench/Failure.h"
#include "bench/Interrupt.h"
#include "bench/Measure.h"
#include "bench/soak/Player.h"

namespace bench {

namespace {

constexpr double kMostMemory = 1.05;
/// Then what the sanitizer notes of all memory that was ever used counts for more than ours.
#if defined(__SANITIZE_THREAD__) || defined(__SANITIZE_ADDRESS__)
constexpr bool kIsSanitized = true;
#else
constexpr bool kIsSanitized = false;
#endif
constexpr double kMostSlower = 10;
constexpr double kQuietSeconds = 10;
/// Of the time: until all have met often enough for the most threads and the largest crowd, the
/// allocator takes memory that is no leak.
constexpr double kWarmUpPart = 0.25;

std::size_t descriptorsOf(const Child& daemon) {
    const auto folder =
        std::filesystem::directory_iterator(fmt::format("/proc/{}/fd", daemon.pid()));
    return static_cast<std::size_t>(std::distance(begin(folder), end(folder)));
}

struct Played {
    const Part* part;
    Tally tally;
};

/// Has everybody play for some time.
std::vector<Played> play(const std::vector<const Part*>& parts, const World& world,
                         const Child& daemon, double seconds) {
    std::vector<Player> players;
    for (const Part* part : parts) players.emplace_back(*part, world);
    for (const double end = now() + seconds * 1e6; now() < end;) {
        checkInterrupted();
        if (!daemon.running()) fail("the daemon has ended; its log:\n{}", world.logTail());
        ::poll(nullptr, 0, 100);
    }
    std::vector<Played> played;
    for (std::size_t i = 0; i < parts.size(); ++i) played.push_back({parts[i], players[i].stop()});
    return played;
}

std::vector<const Part*> those(std::initializer_list<const std::vector<Part>*> kinds) {
    std::vector<const Part*> all;
    for (const std::vector<Part>* parts : kinds)
        for (const Part& part : *parts) all.push_back(&part);
    return all;
}

bool expect(bool holds, std::string_view text) {
    fmt::print("{} {}\n", holds ? "  " : "NO", text);
    return holds;
}

bool judge(const std::vector<Played>& played, double quiet) {
    bool good = true;
    for (const auto& [part, tally] : played) {
        fmt::print("   {:<20} {:>9} rounds, p99 {:>9.0f} µs, most {:>9.0f} µs  {}\n", part->name,
                   tally.rounds, tally.p99, tally.most, tally.failure);
        good = good && !(part->isHonest && (*tally.failure || tally.rounds == 0));
    }
    good = expect(good, "nobody honest was refused or cut off");
    const double attacked = played[0].tally.p99;
    return expect(attacked <= kMostSlower * quiet,
                  fmt::format(
                      "p99 of a small request: {:.0f} µs among honest clients, {:.0f} µs under "
                      "attack ({:.1f} x)",
                      quiet, attacked, attacked / quiet)) &&
           good;
}

bool soak(double minutes) {
    catchInterrupts(static_cast<unsigned>(minutes * 60 + 600));
    const TemporaryDirectory directory;
    const World world(directory.path(), 100);
    ::setenv("XDG_RUNTIME_DIR", world.runtimeDirectory().c_str(), 1);
    const Child daemon = world.startDaemon();
    waitForSocket(world.socketPath(), daemon);
    const auto everybody = those({&honestParts(), &hostileParts()});
    play(everybody, world, daemon, kWarmUpPart * minutes * 60);
    daemon.waitUntilIdle();

    // The other honest ones use the processors, too: what is asked is what the attack adds.
    const Played quiet = play(those({&honestParts()}), world, daemon, kQuietSeconds)[0];
    if (*quiet.tally.failure) fail("nobody attacks, and yet: {}", quiet.tally.failure);
    daemon.waitUntilIdle();
    const std::size_t descriptors = descriptorsOf(daemon);
    const double memory = daemon.residentMegabytes();
    const auto played = play(everybody, world, daemon, minutes * 60);
    bool good = judge(played, quiet.tally.p99);
    // What is compared has been measured after the same work: who plays last decides which freed
    // memory lies where it can go back.
    play(those({&honestParts()}), world, daemon, kQuietSeconds);
    daemon.waitUntilIdle();

    const std::size_t nowDescriptors = descriptorsOf(daemon);
    good = expect(nowDescriptors == descriptors,
                  fmt::format("descriptors: {} before, {} now", descriptors, nowDescriptors)) &&
           good;
    const double nowMemory = daemon.residentMegabytes();
    good = expect(kIsSanitized || nowMemory <= kMostMemory * memory,
                  fmt::format("resident memory: {:.1f} MB before, {:.1f} MB now", memory,
                              nowMemory)) &&
           good;
    const std::string report = world.sanitizerReport();
    return expect(report.empty(), report.empty() ? "no sanitizer has reported anything" : report) &&
           good;
}

}  // namespace

}  // namespace bench

int main(int argc, char** argv) {
    const std::string_view text = argc == 2 ? argv[1] : "";
    double minutes = 0;
    const auto [end, failure] = std::from_chars(text.data(), text.data() + text.size(), minutes);
    if (failure != std::errc() || end != text.data() + text.size() || !(minutes > 0)) {
        fmt::print(stderr, "usage: zrd_soak MINUTES\n");
        return 2;
    }
    try {
        return bench::soak(minutes) ? 0 : 1;
    } catch (const std::exception& error) {
        fmt::print(stderr, "zrd_soak: {}\n", error.what());
        return 1;
    }
}
