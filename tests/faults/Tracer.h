#pragma once

#include <memory>
#include <string>
#include <vector>

#include "tests/system/Process.h"

namespace test {

/// A moment in the work of a process: the n-th of one of its system calls, and what befalls it
/// then.
struct Fault {
    static constexpr const char* kKill = "signal=KILL";

    std::string call;
    int number;
    std::string what;  // as strace injects it: "signal=KILL", or "error=EIO"

    bool kills() const { return what == kKill; }
    std::string text() const { return call + " " + std::to_string(number) + " " + what; }
};

/// Waits until the threads of a process have done nothing for a while.
bool waitUntilIdle(pid_t process);

/// strace, which watches system calls and has some of them fail.
class Tracer {
  public:
    /// Whom it follows: the threads of a process but its first, which talks to clients, or those
    /// and all that come to be.
    enum Scope { Others, All };
    /// Without a fault it only takes notes. Each thread counts its system calls for itself.
    Tracer(pid_t process, Scope scope, std::string log, const Fault* fault);
    /// Starts a program under it.
    Tracer(std::vector<std::string> command, std::string log, const Fault* fault);

    /// Lets go of what it follows.
    void stop();
    /// The exit status of the program that it has started, or minus the signal that ended it.
    int wait() { return strace_->wait(); }

    /// Every fault that there can be in what was noted, from the first system call on that names
    /// `marker`. Only those that work on files can fail; a process can be killed at any.
    std::vector<Fault> faults(const std::string& marker = {}) const;

  private:
    void start(const Fault* fault, std::vector<std::string> arguments);

    std::string log_;
    std::unique_ptr<Process> strace_;
};

}  // namespace test
