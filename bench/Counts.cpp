#include "bench/Counts.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <limits>
#include <new>

#include "bench/Failure.h"
#include "bench/Frames.h"
#include "bench/Measure.h"

namespace bench {

namespace {

constexpr int kBlocks = 6;
constexpr int kRounds = 10;

/// The average of the block that had the least: what else a process does at times only adds. What
/// is made once is made in the first block.
template <class Work>
double allocationsIn(const Counters& counters, Work work) {
    double least = std::numeric_limits<double>::infinity();
    for (int block = 0; block < kBlocks; ++block) {
        const std::uint64_t before = counters.allocations;
        for (int i = 0; i < kRounds; ++i) work();
        least = std::min(least, static_cast<double>(counters.allocations - before) / kRounds);
    }
    return least;
}

/// Counters in a new file.
Counters* countersIn(const std::string& path) {
    const platform::UniqueFd file(
        ::open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
    if (!file || ::ftruncate(file.get(), sizeof(Counters)) < 0) failErrno(path);
    void* shared =
        ::mmap(nullptr, sizeof(Counters), PROT_READ | PROT_WRITE, MAP_SHARED, file.get(), 0);
    if (shared == MAP_FAILED) failErrno(path);
    return new (shared) Counters{};
}

}  // namespace

CountedDaemon::CountedDaemon(const World& world) : socketPath_(world.socketPath()) {
    const std::string file = world.runtimeDirectory() + "/counters";
    counters_ = countersIn(file);
    daemon_.emplace(world.startDaemon(
        {"LD_PRELOAD=" ZRD_COUNTING, std::string(kCountersVariable) + '=' + file}));
    FrameClient client(waitForSocket(socketPath_, *daemon_));
    client.exchange(Question::byPoint(10).frame);  // waits for the first scan
    daemon_->waitUntilIdle();
    if (counters_->allocations == 0) fail("the daemon's allocations are not counted");
}

CountedDaemon::~CountedDaemon() {
    daemon_.reset();
    ::munmap(counters_, sizeof *counters_);
}

double CountedDaemon::allocationsOf(const std::string& request) const {
    FrameClient client(socketPath_);
    return allocationsIn(*counters_, [&] { client.exchange(request); });
}

double allocationsOf(LibraryClient& library, const Question& question) {
    static Counters counters;
    countersInUse = &counters;
    const double count = allocationsIn(counters, [&] { library.matchAndVisit(question); });
    countersInUse = nullptr;
    return count;
}

}  // namespace bench
