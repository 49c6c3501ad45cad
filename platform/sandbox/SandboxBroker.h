#pragma once

#include <memory>
#include <string>

#include "platform/sandbox/SandboxTokens.h"
#include "platform/system/Error.h"

namespace platform {

class RunLoop;
struct Directories;

/// Trades tokens for access: a service of its own beside the one whose tokens they are. A peer
/// connects, sends one token and a newline, and gets one line: "0" with the descriptor, else the
/// errno of the refusal (EACCES for what is no token of ours). Then it is cut off, as are peers
/// that send something else, or nothing for some seconds. Each origin has a quarter of the places
/// and of the mounts that are made at a time: whoever comes beyond that waits for its turn, or gets
/// EAGAIN; where places run out, those that are silent go first.
class SandboxBroker {
  public:
    /// Serves, as long as it lives, on `loop`, which must outlive it. Errors: those of
    /// `lum::ServiceSocket`.
    static Result<std::unique_ptr<SandboxBroker>> make(const Directories& directories,
                                                       const std::string& serviceName,
                                                       const SandboxTokens& tokens, RunLoop& loop);
    SandboxBroker(const SandboxBroker&) = delete;
    /// On the loop's thread, or while the loop does not run. Nothing is left of its children.
    ~SandboxBroker();

  private:
    struct State;
    explicit SandboxBroker(std::unique_ptr<State> state);
    std::unique_ptr<State> state_;
};

}  // namespace platform
