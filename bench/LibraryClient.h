#pragma once

#include <cstddef>
#include <memory>

#include "Zorvan/ZRDaemonClient.h"
#include "bench/Questions.h"
#include "bench/World.h"

namespace bench {

/// Asks through the client library, as a host does.
class LibraryClient {
  public:
    explicit LibraryClient(const World& world);

    /// Sends a match and visits every value of its reply. Answers the time from the call to the
    /// last value, in microseconds. Throws a `Failure` when the reply is not the expected one.
    double matchAndVisit(const Question& question);

  private:
    std::shared_ptr<zorvan::ZRDaemonClient> client_;
};

}  // namespace bench
