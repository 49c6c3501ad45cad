#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Zorvan/ZRError.h"
#include "platform/SerialQueue.h"
#include "platform/Uuid.h"
#include "platform/Value.h"
#include "platform/lum/ClientConnection.h"
#include "platform/lum/Message.h"

namespace zorvan {

/// The host's end of the request protocol: one connection to the daemon, and one operation a
/// request type. Each operation may be called from any thread; it builds its message, sends it and
/// returns. The reply goes to the callback, on the serial queue "zrd_client", one at a time, in the
/// order of arrival.
///
/// Turn a reply into an error with `errorInReply`, then read its data keys (docs/protocol.md). When
/// the daemon goes away, every callback still waiting gets an error event, and so does every later
/// request: make a new client to connect again.
class ZRDaemonClient {
  public:
    using Reply = platform::ClientConnection::Reply;
    using ReplyCallback = std::function<void(const Reply&)>;

    /// Connects to the named service ("com.orbel.zorvan.zrd" for a null name) in this user's
    /// runtime directory.
    static std::shared_ptr<ZRDaemonClient> initWithServiceName(const char* serviceName);
    /// Not from inside a callback.
    ~ZRDaemonClient();

    std::int64_t protocolVersion() const { return protocolVersion_; }
    void setProtocolVersion(std::int64_t version) { protocolVersion_ = version; }
    platform::ClientConnection& zrd() { return *zrd_; }
    platform::SerialQueue& replyQueue() { return replyQueue_; }

    platform::Message request(const char* type) const;
    platform::Message request(const char* type, const std::vector<std::string>& paths) const;
    static void setUuids(platform::Message& message, const std::vector<platform::Uuid>& uuids);
    void send(platform::Message message, ReplyCallback reply);

    /// The error that a reply carries, or none. A reply with a message but no code throws
    /// `ZRInternalInconsistency`; the daemon never sends one.
    static std::optional<ZRError> errorInReply(const Reply& reply);
    /// Packs a property list for a protocol version; none for any version but 3.
    static std::optional<platform::Value> convertToLum(platform::Value value, std::int64_t version);
    /// Unpacks; none unless this client speaks version 3, and for what was not packed.
    std::optional<platform::Value> convertFromLum(const platform::Value& value) const;

    void addPlugIns(const std::vector<std::string>& paths, ReplyCallback reply);
    void removePlugIns(const std::vector<std::string>& paths, ReplyCallback reply);
    void bulkPlugins(std::uint64_t flags, ReplyCallback reply);
    void readyPlugIns(const std::vector<platform::Uuid>& uuids, std::uint64_t flags,
                      ReplyCallback reply);
    void accessPlugIns(const std::vector<platform::Uuid>& uuids, std::uint64_t flags,
                       ReplyCallback reply);
    void matchPlugIns(const platform::Dictionary& rules, std::uint64_t flags, ReplyCallback reply);
    void setPluginAnnotations(const std::vector<platform::Uuid>& uuids,
                              const platform::Dictionary& annotations, ReplyCallback reply);
    void bulkSetPluginAnnotations(const platform::Dictionary& annotations, ReplyCallback reply);
    void holdPlugins(const std::vector<std::string>& paths, std::uint64_t flags,
                     ReplyCallback reply);
    void releaseHold(const platform::Uuid& token, ReplyCallback reply);

  private:
    explicit ZRDaemonClient(const char* serviceName);

    platform::SerialQueue replyQueue_;
    std::unique_ptr<platform::ClientConnection> zrd_;
    std::atomic<std::int64_t> protocolVersion_;
};

}  // namespace zorvan
