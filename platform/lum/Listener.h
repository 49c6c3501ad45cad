#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/lum/Connection.h"
#include "platform/system/Error.h"
#include "platform/threads/SerialQueue.h"

namespace platform {

struct Directories;

namespace lum {

/// Where the socket of a named service lies: <runtime>/zorvan/services/<name>. Error: the name has
/// a "/" or a NUL, begins with ".", is empty, or is too long for a socket path.
Result<std::string> socketPath(const Directories& directories, const std::string& serviceName);

}  // namespace lum

/// Listens on a named service and accepts connections from processes of this user and of root;
/// others are closed with a log line.
///
/// The name is owned through a lock file beside the socket, held as long as the listener lives: one
/// process has it, and a stale socket is replaced. A socket passed by socket activation (whose
/// path, or whose LISTEN_FDNAMES entry, is the service's) is taken over instead of binding one.
class Listener {
  public:
    using EventHandler = std::function<void(std::shared_ptr<Connection>)>;

    /// A listener whose events, and those of its connections, are delivered on `queue`, a queue on
    /// a run loop, which must outlive it. Errors: as `lum::socketPath`; the name has an owner
    /// already (EADDRINUSE); the system's.
    static Result<std::unique_ptr<Listener>> make(const Directories& directories,
                                                  const std::string& serviceName,
                                                  SerialQueue& queue);
    /// As `close`.
    ~Listener();

    /// Called for each accepted connection, which is not resumed yet. The connection keeps itself
    /// alive until it has become invalid, if it was resumed. Set before `resume`.
    void setEventHandler(EventHandler handler);
    /// Begins to accept. Hosts that connected earlier have waited in the socket's backlog.
    void resume();

    /// Accepts no more, for good, and closes the connections that are still open: they let go of
    /// their handlers and contexts. On the queue they get their invalid event before that; there is
    /// no event where the loop does not run. On the queue (but not from a connection's handler), or
    /// while its loop does not run.
    void close();

  private:
    struct State;
    explicit Listener(std::shared_ptr<State> state);
    std::shared_ptr<State> state_;
};

}  // namespace platform
