#pragma once

#include <string>
#include <vector>

#include "bench/Report.h"
#include "bench/World.h"

namespace bench {

/// What is measured with, in one way of running.
struct Run {
    /// The worlds by size, the smallest first; all but one figure are taken in the largest.
    const std::vector<World>& worlds;
    std::string scratch;  // a directory for the echo servers
    bool quick;
    int freshScans;  // rounds of the figures that are slow: files have to go, or are written often
    Report& report;

    const World& largest() const { return worlds.back(); }
};

/// How soon a daemon answers after its start, and what it then holds. Leaves full catalogues.
void measureStarts(const Run& run);

/// How fast running daemons answer.
void measureReplies(const Run& run);

/// How fast plug-ins are made ready and started.
void measurePlugIns(const Run& run);

/// What does not depend on the machine's speed: how often what costs is done.
void measureCounts(const Run& run);

/// What ten times as many plug-ins cost. Making them takes minutes.
void measureLarge(const Run& run);

/// How fast choices get to the disk, and how soon an installed bundle is found.
void measureChanges(const Run& run);

}  // namespace bench
