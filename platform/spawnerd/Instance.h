#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/spawnerd/Allowance.h"
#include "platform/spawnerd/InstanceGroups.h"
#include "platform/spawnerd/InstanceNetwork.h"
#include "platform/spawnerd/OutputLog.h"
#include "platform/spawnerd/SandboxNamespaces.h"
#include "platform/spawnerd/SandboxedProcess.h"
#include "platform/system/UniqueFd.h"
#include "platform/threads/RunLoop.h"

namespace platform::spawnerd {

/// A plug-in that is being started, runs, or ends: the bubblewrap process outside, and the first
/// process of the sandbox's pid namespace, with which everything in there ends, whatever the
/// plug-in forked. On the loop's thread.
class Instance {
  public:
    /// `allowance` is in force before the plug-in runs, and that of `group`, if it is one, too;
    /// when it is allowed the network, which `pasta` brings, and that cannot be had, an error line
    /// says so and the plug-in runs without. `runs` is called once the sandbox is there; `ended`,
    /// once, when no process of it is left, with the plug-in's exit status, or 128 and the number
    /// of the signal that ended it. The instance may be destroyed in `ended`.
    Instance(RunLoop& loop, const Keeper& keeper, std::string pasta, SandboxedProcess process,
             std::string name, const Allowance& allowance, InstanceGroup group,
             std::function<void()> runs, std::function<void(int status)> ended);
    Instance(const Instance&) = delete;
    /// Ends it, if it has not ended.
    ~Instance();

    /// Ends everything in the sandbox; `ended` follows. The plug-in is not asked: the sandbox's
    /// first process takes no other signal, and what is to go must not be able to delay it.
    void kill();

  private:
    /// Reads of `info` what is there; true once all is read that will be.
    bool readInfo();
    /// The same, waiting for it: where nobody else waits any more.
    void takeInfoNow();
    void awaitInfo();
    /// Sets the limits on the sandbox's first process, which waits at the gate; false, with an
    /// error line, when that cannot be done.
    bool limit(const Result<SandboxNamespaces>& namespaces) const;
    void connect(const SandboxNamespaces& namespaces);
    void connected(const std::optional<Error>& error);
    void pass();
    void watchFirst();
    void takeStatus();
    void endedPartly();

    pid_t firstPid() const;

    RunLoop& loop_;
    const Keeper& keeper_;
    const std::string pasta_;
    SandboxedProcess process_;
    const std::string name_;
    const Allowance allowance_;
    const InstanceGroup group_;
    const std::function<void()> runs_;
    const std::function<void(int)> ended_;
    OutputLog output_;
    std::string infoText_;
    UniqueFd first_;             // pidfd of the sandbox's first process, once it is known
    std::optional<int> status_;  // once bubblewrap has ended
    std::unique_ptr<InstanceNetwork> network_;
    bool isDoomed_ = false;
    // Behind the descriptors that they watch.
    std::optional<RunLoop::Watch> endWatch_, infoWatch_, firstWatch_;
};

}  // namespace platform::spawnerd
