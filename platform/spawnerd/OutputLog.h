#pragma once

#include <cstddef>
#include <optional>
#include <string>

#include "platform/system/UniqueFd.h"
#include "platform/threads/RunLoop.h"

namespace platform::spawnerd {

/// Logs what a plug-in, or bubblewrap on its behalf, writes to its standard output and error, a
/// line at a time, at info level. After so many bytes or lines it closes the pipe: what is written
/// then fails (EPIPE, SIGPIPE), and costs nobody anything. On the loop's thread.
class OutputLog {
  public:
    static constexpr std::size_t kMaxLogged = 64u << 10;
    static constexpr std::size_t kMaxLine = 1024;
    static constexpr std::size_t kMaxLines = 1024;

    /// `pipe` is non-blocking.
    OutputLog(RunLoop& loop, UniqueFd pipe, std::string name);
    OutputLog(const OutputLog&) = delete;

    /// Logs what is left: nobody writes any more.
    void finish();

  private:
    void await();
    /// Whether there may be more to come.
    bool readOn();
    bool isFull() const { return logged_ == kMaxLogged || lines_ == kMaxLines; }
    void take(const char* bytes, std::size_t count);
    void endLine();

    UniqueFd pipe_;  // none after the end of the output
    const std::string name_;
    std::string line_;
    std::size_t logged_ = 0, lines_ = 0;
    std::optional<RunLoop::Watch> watch_;  // as long as there is a pipe
};

}  // namespace platform::spawnerd
