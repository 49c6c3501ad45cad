#pragma once

#include <sched.h>
#include <sys/types.h>

#include <string>
#include <vector>

#include "platform/system/UniqueFd.h"

namespace bench {

/// A process started by this one. Gone when the object is gone, and when this process dies.
/// Start children from the main thread only: they die with the thread that started them.
class Child {
  public:
    /// Runs `program` with its arguments (its own name not among them) and just this environment;
    /// its standard error is appended to the file `log`. It inherits the CPUs of the caller.
    Child(const std::string& program, const std::vector<std::string>& arguments,
          const std::vector<std::string>& environment, const std::string& log);
    Child(Child&& other) noexcept;
    Child& operator=(Child&&) = delete;
    ~Child();

    pid_t pid() const { return pid_; }
    bool running() const;
    /// Ends the process and waits until it is gone.
    void stop();
    /// Waits until the process has used no CPU for a while: until it is done with what it does
    /// after its first replies, such as filling its catalogue. A minute at most.
    void waitUntilIdle() const;
    /// VmRSS of the process, in MB (10^6 bytes).
    double residentMegabytes() const;
    /// How often any of its threads has gone to sleep: each time, something has woken it.
    long sleeps() const;

  private:
    long cpuTicks() const;

    pid_t pid_ = -1;
    platform::UniqueFd pidfd_;
};

/// The CPUs that the calling thread, and whatever it starts, may use.
cpu_set_t allowedCpus();
void useCpus(const cpu_set_t& cpus);
/// The last of a set, as a set of its own: interrupts prefer the first.
cpu_set_t lastCpuOf(const cpu_set_t& cpus);

}  // namespace bench
