#pragma once

#include <string>
#include <vector>

#include "platform/spawnerd/Keeper.h"
#include "platform/spawnerd/Protocol.h"
#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform::spawnerd {

/// The program that confines plug-ins.
inline constexpr const char* kBubblewrap = "/usr/bin/bwrap";

/// The first of the numbers that the descriptors of a `SandboxSetup` have in bubblewrap, one after
/// the other; those below are for what every sandbox has.
inline constexpr int kFirstSetupDescriptor = kConnectionDescriptor + 8;

struct SandboxSetup;

/// A bubblewrap process that was just started, and our ends of its pipes.
struct SandboxedProcess {
    Keeper::Child child;
    UniqueFd info;    // what it tells about the sandbox; non-blocking
    UniqueFd gate;    // the sandbox is set up when something is written here
    UniqueFd output;  // what the plug-in writes to its standard output and error; non-blocking

    /// Starts `program` (bubblewrap) with this setup, and with `command` to be run inside, under
    /// the filter of system calls (which is in force from just before the command on). The command
    /// inherits `connection` as `kConnectionDescriptor`, and nothing else but /dev/null and
    /// `output`. Error: the system's.
    static Result<SandboxedProcess> spawn(const Keeper& keeper, const std::string& program,
                                          const SandboxSetup& setup,
                                          const std::vector<std::string>& command,
                                          const UniqueFd& connection);
};

}  // namespace platform::spawnerd
