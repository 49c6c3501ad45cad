#pragma once

#include <string>
#include <string_view>

#include "bench/Child.h"

namespace bench {

/// How an echo server waits for requests.
enum class EchoKind {
    Blocking,  // one connection at a time, one read and one write a round
    Many,      // any number of connections, over epoll
};

/// A process that reads requests over the daemon's kind of socket and answers each with the same
/// prepared bytes: what a request costs when nothing is done for it.
class EchoServer {
  public:
    /// Starts the process, in the directory `root`, and returns when it listens. `name` tells the
    /// servers of one directory apart; `reply` is a whole frame.
    EchoServer(const std::string& root, const std::string& name, std::string_view reply,
               EchoKind kind);

    const std::string& socketPath() const { return socketPath_; }

  private:
    std::string socketPath_;
    Child process_;
};

/// The command line that makes this program an echo server, and the server: returns only when it
/// fails. Arguments: the kind ("blocking", "many"), the socket's path, the file of the reply.
inline constexpr const char* kEchoOption = "--serve-echo";
int serveEcho(const std::string& kind, const std::string& socketPath, const std::string& replyFile);

}  // namespace bench
