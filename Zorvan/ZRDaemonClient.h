#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Zorvan/ZRError.h"
#include "platform/lum/ClientConnection.h"
#include "platform/lum/Message.h"
#include "platform/threads/SerialQueue.h"
#include "platform/values/Uuid.h"
#include "platform/values/Value.h"

namespace zorvan {

/// The host's end of the request protocol: one connection to the daemon, and one operation a
/// request type. Each operation may be called from any thread; it builds its message, sends it and
/// returns. Its callback is called once, with the reply or with the connection's error event, on
/// the serial queue "zrd_client": one callback at a time, in the order of arrival.
///
///     auto client = ZRDaemonClient::initWithServiceName(nullptr);
///     client->matchPlugIns({{key::kExtensionPoint, "com.example.point"}}, 0,
///                          [client](const ZRDaemonClient::Reply& reply) {
///         if (auto error = ZRDaemonClient::errorInReply(reply)) return report(*error);
///         const auto& message = std::get<platform::Message>(reply);
///         auto forms = client->convertFromLum(*message.find(message::kMatches));
///         for (const platform::Value& form : *forms->array())
///             use(ZRPlugInCore::initWithForm(*form.dictionary()));
///     });
///
/// Turn a reply into an error with `errorInReply` first, then read its data keys
/// (docs/protocol.md). When the daemon goes away, every callback still waiting gets the error
/// event, and so does every later request: make a new client to connect again.
///
/// The last reference may be dropped anywhere, also inside a callback. That closes the connection;
/// callbacks that still wait are then released without being called.
class ZRDaemonClient {
  public:
    using Reply = platform::ClientConnection::Reply;
    using ReplyCallback = std::function<void(const Reply&)>;

    /// Connects to the named service ("com.orbel.zorvan.zrd" for a null name) in this user's
    /// runtime directory. Never null, and never waits: without a daemon there, every request is
    /// answered by an error event; while the daemon lets nobody in, requests wait.
    static std::shared_ptr<ZRDaemonClient> initWithServiceName(const char* serviceName);

    /// The version that requests carry, 3 unless it is set.
    std::int64_t protocolVersion() const { return protocolVersion_; }
    void setProtocolVersion(std::int64_t version) { protocolVersion_ = version; }
    platform::ClientConnection& zrd() { return *zrd_; }
    platform::SerialQueue& replyQueue() { return replyQueue_; }

    /// Replaces what is called, once, when the connection has ended, and with it this client's
    /// holds: on the queue, after the connection's error event was logged. Soon when it has ended
    /// already.
    void setEndHandler(std::function<void()> handler);

    /// A request with its type and version, and with its "paths".
    platform::Message request(const char* type) const;
    platform::Message request(const char* type, const std::vector<std::string>& paths) const;
    /// Sets the "uuids" of a request.
    static void setUuids(platform::Message& message, const std::vector<platform::Uuid>& uuids);
    /// Sends a request; the operations below all end here. What the daemon would have to refuse by
    /// its limits (docs/protocol.md: text that is not UTF-8, too many values, ...) is not sent: it
    /// is answered by an error event of its own. `reply` may be empty.
    void send(platform::Message message, ReplyCallback reply);

    /// The error that a reply carries, or none. A reply with a message but no code throws
    /// `ZRInternalInconsistency`; the daemon never sends one.
    static std::optional<ZRError> errorInReply(const Reply& reply);
    /// Packs a property list for a protocol version; none for any version but 3.
    static std::optional<platform::Value> convertToLum(platform::Value value, std::int64_t version);
    /// Unpacks; none unless this client speaks version 3, and for what was not packed.
    std::optional<platform::Value> convertFromLum(const platform::Value& value) const;

    /// Registers and unregisters the plug-ins of bundles by absolute path, in order, up to the
    /// first that fails.
    void addPlugIns(const std::vector<std::string>& paths, ReplyCallback reply);
    void removePlugIns(const std::vector<std::string>& paths, ReplyCallback reply);
    /// A request that does nothing.
    void bulkPlugins(std::uint64_t flags, ReplyCallback reply);
    /// Lets this process start and talk to plug-ins.
    void readyPlugIns(const std::vector<platform::Uuid>& uuids, std::uint64_t flags,
                      ReplyCallback reply);
    /// Read access to the bundles of plug-ins; the reply has one token each, in order, under
    /// "extensions".
    void accessPlugIns(const std::vector<platform::Uuid>& uuids, std::uint64_t flags,
                       ReplyCallback reply);
    /// The plug-ins that satisfy `rules`, as forms; the reply has them, packed, under "matches".
    /// `flags`: ZRDiscover… in Keys.h.
    void matchPlugIns(const platform::Dictionary& rules, std::uint64_t flags, ReplyCallback reply);
    /// Records the user's choices: one change ("election", "extension") for every plug-in listed.
    void setPluginAnnotations(const std::vector<platform::Uuid>& uuids,
                              const platform::Dictionary& annotations, ReplyCallback reply);
    /// Records a dictionary as the "extension" of each plug-in; the keys are UUIDs as text.
    void bulkSetPluginAnnotations(const platform::Dictionary& annotations, ReplyCallback reply);
    /// Takes the plug-ins at these paths out of service until the hold is released or this
    /// connection ends; the reply has the token of the hold under "uuids".
    void holdPlugins(const std::vector<std::string>& paths, std::uint64_t flags,
                     ReplyCallback reply);
    void releaseHold(const platform::Uuid& token, ReplyCallback reply);

  private:
    explicit ZRDaemonClient(const char* serviceName);
    ~ZRDaemonClient();
    static void destroy(ZRDaemonClient* client);

    // The queue's.
    std::function<void()> endHandler_;
    bool hasEnded_ = false;
    // The connection goes before the queue that it delivers on, and that before what is used there.
    platform::SerialQueue replyQueue_;
    std::unique_ptr<platform::ClientConnection> zrd_;
    std::atomic<std::int64_t> protocolVersion_;
};

}  // namespace zorvan
