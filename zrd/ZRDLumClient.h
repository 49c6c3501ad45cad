#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "platform/lum/Connection.h"
#include "zrd/HostExecutable.h"
#include "zrd/HostProcess.h"

namespace zorvan {

class Transaction;
class ZRDServer;

/// One connected host. Turns each message of its connection into a `Transaction` on the service
/// queue, tells handlers who asks, and stops work when the connection dies.
///
/// Owned by its connection and, while they live, by its transactions; it refers to the connection
/// weakly.
class ZRDLumClient final : public HostProcess, public std::enable_shared_from_this<ZRDLumClient> {
  public:
    /// Makes the record of an accepted connection, whose peer's executable has been looked at, and
    /// resumes the connection. On the queue "lum".
    static std::shared_ptr<ZRDLumClient> initWithConnection(
        const std::shared_ptr<platform::Connection>& connection, std::shared_ptr<ZRDServer> server,
        HostExecutable executable);

    pid_t pid() const override;
    std::optional<platform::AuditToken> auditToken() const override;
    /// As when its connection was accepted; nobody's when that is gone.
    platform::Origin origin() const;
    const std::string& path() const override { return executable_.path; }
    const std::shared_ptr<ZRBundle>& bundle() const override { return executable_.bundle; }
    std::optional<platform::Value> entitlementValueForKey(const std::string& name) const override;
    bool hasEntitlement(const std::string& name) const override;

    /// Whether the process runs in a sandbox. A process whose connection is gone counts as
    /// sandboxed.
    bool isSandboxed() const;
    /// Whether it is confined in any way that shows; likewise.
    bool isConfined() const;

    /// False once the connection has died: requests still queued are dropped. From any thread.
    bool acceptWork() const { return acceptWork_; }
    void setAcceptWork(bool accept) { acceptWork_ = accept; }
    /// Null when the connection is gone.
    std::shared_ptr<platform::Connection> connection() const { return connection_.lock(); }
    const std::shared_ptr<ZRDServer>& server() const { return server_; }
    platform::CodeSigningTask& task() const { return *executable_.task; }
    /// Requests received so far. On the service queue only.
    std::uint32_t requestCount() const { return requestCount_; }
    void setRequestCount(std::uint32_t count) { requestCount_ = count; }

    std::string description() const;

  private:
    ZRDLumClient(const std::shared_ptr<platform::Connection>& connection,
                 std::shared_ptr<ZRDServer> server, HostExecutable executable);

    // On the connection's event delivery.
    void handleEvent(const platform::ConnectionEvent& event);
    void receive(const platform::Message& message);
    void resolvePaths(const std::shared_ptr<Transaction>& transaction);
    void submit(std::shared_ptr<Transaction> transaction);
    void dying();
    void dead();
    // On the service queue.
    void countRequest();

    std::atomic<bool> acceptWork_{true};
    const std::weak_ptr<platform::Connection> connection_;
    const std::shared_ptr<ZRDServer> server_;
    const HostExecutable executable_;
    std::uint32_t requestCount_ = 0;
};

}  // namespace zorvan
