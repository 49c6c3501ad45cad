// A test: no request costs more allocations than it did.

#include <fmt/core.h>

#include <cstdio>

#include "bench/Counts.h"
#include "bench/Interrupt.h"

namespace {

using namespace bench;

bool holds(const char* what, double count, double bound) {
    fmt::print("{:<40}{:>10.1f}  at most {:.0f}\n", what, count, bound);
    return count <= bound;
}

bool allHold() {
    const TemporaryDirectory directory;
    const World world(directory.path(), kCountedPlugIns);
    const CountedDaemon daemon(world);
    const Question question = Question::ofAll(kCountedPlugIns);
    LibraryClient library(world);
    bool all = holds("small request", daemon.allocationsOf(smallRequest()), kMostForSmall);
    all &= holds("match of 1000", daemon.allocationsOf(question.frame), kMostForMatch);
    all &= holds("decoding it", allocationsOf(library, question), kMostForDecoding);
    return all;
}

}  // namespace

int main() {
    try {
        constexpr unsigned kMostSeconds = 100;
        catchInterrupts(kMostSeconds);
        return allHold() ? 0 : 1;
    } catch (const std::exception& error) {
        fmt::print(stderr, "{}\n", error.what());
        return 2;
    }
}
