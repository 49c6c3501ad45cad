#pragma once

#include <optional>
#include <string>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace zrctl {

/// Carries bytes both ways between standard input and output and a connection. On one thread.
class Relay {
  public:
    /// Takes the connection, a stream socket, over.
    explicit Relay(platform::UniqueFd connection);

    /// Carries on until `stop` is readable (false), or until `ended` is and all that has come over
    /// the connection is written (true). At the end of standard input the connection is
    /// half-closed; when nobody reads standard output any more, neither is the connection read.
    /// Error: the system's.
    platform::Result<bool> run(int ended, int stop);

  private:
    /// One direction. Holds no more than a pipe takes without waiting.
    struct Stream {
        int from, to;
        std::string pending = {};
        bool atEnd = false;  // nothing more is read

        bool reads() const { return !atEnd && pending.empty(); }
        bool isDone() const { return atEnd && pending.empty(); }
        void read();
        /// Answers 0, or why nothing more can be written.
        int write();
    };

    void moveInput(bool readable, bool writable);
    std::optional<platform::Error> moveOutput(bool readable, bool writable);

    platform::UniqueFd connection_;
    Stream input_, output_;
};

}  // namespace zrctl
