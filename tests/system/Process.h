#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <string>
#include <vector>

namespace test {

/// Polls until `condition` holds; false when it does not within half a minute.
bool waitUntil(const std::function<bool()>& condition);

/// A child process, with both its outputs in one file each that can be read while it runs. It gets
/// the environment of this process, and SIGKILL when the object goes.
class Process {
  public:
    /// Writes its outputs to `<output>.out` and `<output>.err`.
    Process(const std::string& program, std::vector<std::string> arguments, std::string output);
    Process(const Process&) = delete;
    ~Process();

    pid_t pid() const { return pid_; }
    bool isRunning();
    void signal(int number) const;
    /// Its exit status, or minus the signal that ended it.
    int wait();

    std::string out() const;
    std::string err() const;
    /// How many lines of `err` contain the text.
    std::size_t errLines(const std::string& text) const;

  private:
    pid_t pid_ = -1;
    bool ended_ = false;
    int status_ = 0;
    std::string output_;
};

}  // namespace test
