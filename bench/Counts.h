#pragma once

#include <optional>
#include <string>

#include "bench/LibraryClient.h"
#include "bench/World.h"
#include "bench/counting/Counters.h"

namespace bench {

/// What neighbours on the machine do not change: how often a daemon, or the client library in this
/// process, calls what costs.

inline constexpr std::size_t kCountedPlugIns = 1000;

/// What may be allocated: what was when these were written (10.0; 4054, which is four for each
/// plug-in and what large replies and candidates need; 50.0), and a tenth of it, since a reply that
/// goes out in more turns of the run loop needs some more. Who needs fewer lowers them.
inline constexpr double kMostForSmall = 11;
inline constexpr double kMostForMatch = 4460;
inline constexpr double kMostForDecoding = 55;

/// A daemon that was started with counters.
class CountedDaemon {
  public:
    /// Started, and at rest.
    explicit CountedDaemon(const World& world);
    CountedDaemon(const CountedDaemon&) = delete;
    ~CountedDaemon();

    const Child& process() const { return *daemon_; }
    const Counters& counters() const { return *counters_; }
    /// For each of several requests, one after another.
    double allocationsOf(const std::string& request) const;

  private:
    std::string socketPath_;
    Counters* counters_;
    std::optional<Child> daemon_;
};

/// In this process, for each of several: sending it, receiving and decoding its reply, and visiting
/// that.
double allocationsOf(LibraryClient& library, const Question& question);

}  // namespace bench
