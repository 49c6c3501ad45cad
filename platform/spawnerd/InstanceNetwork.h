#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/spawnerd/Keeper.h"
#include "platform/spawnerd/SandboxNamespaces.h"
#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"
#include "platform/threads/RunLoop.h"

namespace platform::spawnerd {

/// The program that connects instances with the network.
inline constexpr const char* kPasta = "/usr/bin/pasta";

/// The user's network, for an instance that has a network namespace of its own: a program carries
/// what is sent there out as if it had sent that itself. Neither what listens on the machine's
/// loopback interface nor abstract sockets can be reached from inside, and nobody can connect to
/// what listens there. On the loop's thread; the program ends with this object.
class InstanceNetwork {
  public:
    /// `done` is called once: with nothing when the network is there, or with why it is not.
    using Done = std::function<void(std::optional<Error>)>;

    /// Error: the system's; then `done` is not called.
    static Result<std::unique_ptr<InstanceNetwork>> connect(RunLoop& loop, const Keeper& keeper,
                                                            const std::string& program,
                                                            const SandboxNamespaces& namespaces,
                                                            Done done);
    InstanceNetwork(const InstanceNetwork&) = delete;
    ~InstanceNetwork();

    /// The program's.
    pid_t pid() const { return child_.pid; }

  private:
    InstanceNetwork(RunLoop& loop, Keeper::Child child, UniqueFd told, Done done);

    void read();
    void finish(std::optional<Error> error);

    Keeper::Child child_;
    UniqueFd told_;  // what the program writes
    std::string text_;
    Done done_;
    RunLoop::Watch watch_;
    RunLoop::Timer patience_;
};

/// What stands in an instance's resolv.conf, by what stands in the machine's: the same, but where
/// that leads to a resolver on the machine's loopback interface, an address that leads there all
/// the same.
std::string resolverSettings(std::string_view machine);

}  // namespace platform::spawnerd
