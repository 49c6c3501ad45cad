#include <fmt/core.h>

#include <cstdio>
#include <optional>
#include <regex>
#include <string>
#include <string_view>
#include <vector>

#include "bench/Child.h"
#include "bench/EchoServer.h"
#include "bench/Failure.h"
#include "bench/Figures.h"
#include "bench/Interrupt.h"
#include "bench/Report.h"
#include "bench/World.h"

namespace {

using namespace bench;

constexpr unsigned kMostSeconds = 1800;
constexpr const char* kUsage =
    "Usage: zrd_bench [--quick] [--large] [--tsv] [--only REGEX]\n"
    "Measures the daemon against bare echoes of the same bytes.\n"
    "  --quick  few rounds and at most 1000 plug-ins, to see that everything runs\n"
    "  --large  also 100000 plug-ins, which takes minutes\n"
    "  --tsv    lines of key, value and unit instead of a table\n"
    "  --only   just the figures whose keys (as --tsv has them, without what stands before the "
    "first\n"
    "           slash) contain a match of the regular expression\n";

struct Options {
    bool quick = false;
    bool large = false;
    bool tsv = false;
    std::optional<std::regex> only{};
};

void progress(std::string_view text) {
    fmt::print(stderr, "zrd_bench: {}\n", text);
    std::fflush(stderr);
}

/// Everything on one CPU, which is the way to compare by, and then free.
void measure(const std::vector<World>& worlds, const Options& options, const std::string& scratch,
             Report& report) {
    const cpu_set_t all = allowedCpus();
    for (const bool onOneCpu : {true, false}) {
        const char* title = onOneCpu ? "Both processes on one CPU" : "Free to use every CPU";
        progress(title);
        useCpus(onOneCpu ? lastCpuOf(all) : all);
        report.begin(title, onOneCpu ? "" : "/free");
        const int freshScans = onOneCpu && !options.quick ? 3 : 1;
        const Run run{worlds, scratch, options.quick, freshScans, report};
        measureStarts(run);
        measureReplies(run);
        measurePlugIns(run);
        measureChanges(run);
        if (onOneCpu) measureCounts(run);
        if (onOneCpu && options.large) measureLarge(run);
    }
}

void run(const Options& options) {
    catchInterrupts(kMostSeconds);
    const TemporaryDirectory directory;
    std::vector<std::size_t> sizes{100, 1000};
    if (!options.quick) sizes.push_back(10000);
    std::vector<World> worlds;
    for (std::size_t size : sizes) {
        progress(fmt::format("making {} plug-ins", size));
        worlds.emplace_back(directory.path(), size);
    }
    Report report(options.only);
    try {
        measure(worlds, options, directory.path(), report);
    } catch (const Failure&) {
        for (const World& world : worlds) {
            if (const std::string log = world.logTail(); !log.empty()) {
                fmt::print(stderr, "The daemon with {} plug-ins logged:\n{}", world.plugIns(), log);
            }
        }
        throw;
    }
    fmt::print("{}", options.tsv ? report.tsv() : report.table());
}

}  // namespace

int main(int argc, char** argv) {
    const std::vector<std::string> arguments(argv + 1, argv + argc);
    Options options;
    try {
        if (arguments.size() == 4 && arguments[0] == kEchoOption) {
            return serveEcho(arguments[1], arguments[2], arguments[3]);
        }
        for (auto argument = arguments.begin(); argument != arguments.end(); ++argument) {
            if (*argument == "--quick") {
                options.quick = true;
            } else if (*argument == "--large") {
                options.large = true;
            } else if (*argument == "--tsv") {
                options.tsv = true;
            } else if (*argument == "--only" && argument + 1 != arguments.end()) {
                options.only = std::regex(*++argument, std::regex::extended);
            } else {
                fmt::print(stderr, "{}", kUsage);
                return 2;
            }
        }
        run(options);
    } catch (const std::exception& error) {
        fmt::print(stderr, "zrd_bench: {}\n", error.what());
        return 1;
    }
    return 0;
}
