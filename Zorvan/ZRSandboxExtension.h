#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>

namespace zorvan {

/// Read access to a plug-in's bundle, or to a file or directory in it, that a daemon has given to
/// this process as a token. Owned by whoever received the token. The accessors may be used from any
/// thread; `consume` and `expel` from one at a time. The access ends with this object.
class ZRSandboxExtension {
  public:
    static std::shared_ptr<ZRSandboxExtension> initWithExtension(const std::string& token);
    ZRSandboxExtension(const ZRSandboxExtension&) = delete;
    /// Expels.
    ~ZRSandboxExtension();

    /// Trades the token for access, unless it is consumed already; this may wait for the daemon.
    /// Afterwards `handle` is a descriptor, owned by this object and open for reading, of the file
    /// or directory (use openat, or fdopendir on a duplicate), which nothing can be written through
    /// and nothing outside be reached from; or still 0 when the token is refused: it was altered,
    /// its daemon has ended, or another file lies there by now.
    void consume();
    /// Gives the access back, if there is any. The token can be consumed again.
    void expel();

    std::string token() const;
    /// Has no effect on access that was consumed already.
    void setToken(const std::string& token);
    /// 0 while the token is not consumed.
    std::int64_t handle() const { return handle_; }
    /// Takes over a handle of `platform::consumeExtension`; one held before is forgotten, and not
    /// given back.
    void setHandle(std::int64_t handle) { handle_ = handle; }

  private:
    explicit ZRSandboxExtension(const std::string& token) : token_(token) {}

    mutable std::mutex mutex_;  // guards token_
    std::string token_;
    std::atomic<std::int64_t> handle_ = 0;
};

}  // namespace zorvan
