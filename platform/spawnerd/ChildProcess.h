#pragma once

#include <sys/types.h>

#include <utility>
#include <vector>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform::spawnerd {

/// How a child process of a program with threads begins: with the descriptors that it is given and
/// no others, with the signals as they are by default, as the first to go when memory runs out, and
/// without the names that namespaces do not take away: it possesses no key of the user's session,
/// and where the kernel can do that (Landlock) it reaches no abstract socket that was not made by
/// itself or its children.
class ChildProcess {
  public:
    /// The child's descriptors have numbers up to `lastDescriptor`.
    explicit ChildProcess(int lastDescriptor) : lastDescriptor_(lastDescriptor) {}

    /// Duplicates `source` for the child; false when there are no descriptors left.
    bool give(int source, int target);

    /// Starts the program, on whose calling thread parent-death signals will depend. Error: the
    /// system's, also that the program could not be run.
    Result<pid_t> run(const char* program, char* const argv[], char* const environment[]) const;

  private:
    [[noreturn]] void begin(const char* program, char* const argv[], char* const environment[],
                            int failure) const;

    const int lastDescriptor_;
    std::vector<std::pair<UniqueFd, int>> given_;
};

}  // namespace platform::spawnerd
