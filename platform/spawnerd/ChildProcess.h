#pragma once

#include <sys/types.h>

#include <string>
#include <utility>
#include <vector>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform::spawnerd {

/// How a child process begins: with the descriptors that it is given and no others, with the
/// signals as they are by default, with an environment of one fixed search path, as the first to go
/// when memory runs out, and without the name that no namespace takes away: it possesses no key of
/// the user's session. It ends when its parent does.
class ChildProcess {
  public:
    /// Duplicates `source` for the child; false when there are no descriptors left.
    bool give(int source, int target);

    /// Starts the program that is the first of `words`, from a process with one thread. Error: the
    /// system's, also that the program could not be run.
    Result<pid_t> run(const std::vector<std::string>& words) const;

  private:
    [[noreturn]] void begin(char* const argv[], int failure) const;

    std::vector<std::pair<UniqueFd, int>> given_;
};

}  // namespace platform::spawnerd
