#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Zorvan/ZRError.h"
#include "platform/system/UniqueFd.h"

namespace zorvan {

class ZRPlugInCore;

/// A plug-in that this process, its host, has started, in its sandbox, and the connection to it.
///
///     std::optional<ZRError> error;
///     auto plugIn = ZRPlugInProcess::start(nullptr, *form, {}, error);   // after "ready"
///     if (!plugIn) return report(*error);
///     write(plugIn->connection(), text.data(), text.size());
///     shutdown(plugIn->connection(), SHUT_WR);
///     while ((count = read(plugIn->connection(), buffer, sizeof buffer)) > 0) ...
///
/// The plug-in ends by itself, when it is told to, when its bundle is removed, with this object,
/// and with this process. Operations may be called from any thread; not from several at once.
class ZRPlugInProcess {
  public:
    /// Called once, with the status as `wait` answers it, on a queue of this object's own, in which
    /// it may not be destroyed.
    using EndHandler = std::function<void(std::optional<int> status)>;

    /// Has the daemon of a service name ("com.orbel.zorvan.zrd" for a null name) start an
    /// executable, for which a "ready" request must have been granted to this process, and waits
    /// until it runs: some milliseconds. Null, and the reason in `error`, when that fails: in the
    /// domain "POSIX" EPERM (it was not made ready), EAGAIN (too many plug-ins run), E2BIG (more
    /// arguments than 256, or than 64 KiB of them), ENOENT (this machine has no bubblewrap), EIO
    /// (the sandbox could not be set up), or what the system said; code 4 of the daemon's own
    /// domain when there is no daemon.
    static std::unique_ptr<ZRPlugInProcess> start(const char* serviceName,
                                                  const std::string& executable,
                                                  const std::vector<std::string>& arguments,
                                                  std::optional<ZRError>& error);
    /// The same with a plug-in's executable. EINVAL: its bundle names none.
    static std::unique_ptr<ZRPlugInProcess> start(const char* serviceName,
                                                  const ZRPlugInCore& plugIn,
                                                  const std::vector<std::string>& arguments,
                                                  std::optional<ZRError>& error);
    ZRPlugInProcess(const ZRPlugInProcess&) = delete;
    /// Ends the plug-in, and waits for that.
    ~ZRPlugInProcess();

    /// A connected stream socket, blocking. Borrowed; -1 once taken. It reads as ended when the
    /// plug-in has closed its end, at the latest when the plug-in has ended.
    int connection() const { return connection_.get(); }
    platform::UniqueFd takeConnection() { return std::move(connection_); }

    /// Ends the plug-in and whatever it has started, at once. Returns before it is gone.
    void terminate();
    /// Waits until the plug-in and whatever it has started are gone. Its exit status, or 128 and
    /// the number of the signal that ended it; none when the daemon, with which it ends too, went
    /// away first.
    std::optional<int> wait();
    /// Replaces the handler. When the plug-in has ended already it is called soon.
    void setEndHandler(EndHandler handler);

  private:
    struct State;
    explicit ZRPlugInProcess(const char* serviceName);
    std::optional<ZRError> ask(const std::string& executable,
                               const std::vector<std::string>& arguments);

    std::unique_ptr<State> state_;
    platform::UniqueFd connection_;
};

}  // namespace zorvan
