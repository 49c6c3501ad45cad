#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform {

struct Directories;

namespace lum {

/// A listening socket together with the ownership of its service's name: the lock on the file
/// `<name>.lock` beside the socket, held as long as this object. A socket made here is removed from
/// its directory at the end.
class ServiceSocket {
  public:
    /// Errors: as `socketPath`; EADDRINUSE when the name has an owner; the system's. The
    /// directories are made where they are missing, and must be this user's own.
    static Result<ServiceSocket> make(const Directories& directories,
                                      const std::string& serviceName);
    ServiceSocket(ServiceSocket&&) = default;
    ~ServiceSocket();

    /// Borrows; non-blocking.
    int fd() const { return socket_.get(); }

  private:
    ServiceSocket(UniqueFd lock, UniqueFd socket, std::string ownPath)
        : lock_(std::move(lock)), socket_(std::move(socket)), ownPath_(std::move(ownPath)) {}

    UniqueFd lock_;
    UniqueFd socket_;
    std::string ownPath_;  // empty for a socket that was passed to this process
};

/// Removes every socket that this process has made for a service from its directory: for a process
/// that ends without waiting for their owners to be destroyed. From any thread.
void removeServiceSockets();

/// The process that connected to a service, if it may speak to it: processes of this user and of
/// root may, others get a log line. None, too, when it has closed the connection already: to find
/// out who it was takes longer than to connect. The id may have come to mean another process.
std::optional<pid_t> admittedPeer(int connected);

}  // namespace lum
}  // namespace platform
