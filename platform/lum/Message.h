#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <utility>

#include "platform/system/UniqueFd.h"
#include "platform/values/Value.h"

namespace platform {

/// A typed dictionary of the messaging service: one request or reply. A value type; see
/// `Dictionary` for what copies share.
class Message {
  public:
    Message() = default;
    explicit Message(Dictionary contents) : contents_(std::move(contents)) {}

    /// An empty reply to `request`: it carries the request's serial.
    static Message replyTo(const Message& request);

    const Dictionary& contents() const { return contents_; }
    /// The value under a key, or null.
    const Value* find(std::string_view key) const { return contents_.find(key); }
    void set(std::string_view key, Value value) { contents_.set(key, std::move(value)); }

    std::uint64_t serial() const { return serial_; }
    void setSerial(std::uint64_t serial) { serial_ = serial; }

    /// A received request holds its connection's turn: the connection delivers its next message
    /// only when the last copy of this one is gone. Replies hold nothing.
    void setTurn(std::shared_ptr<void> turn) { turn_ = std::move(turn); }

    /// The key, with the value true, of a reply that a descriptor comes with.
    static constexpr const char* kDescriptor = "descriptor";
    /// Has a descriptor travel with a reply: the receiver gets a duplicate. Copies share it.
    void setDescriptor(UniqueFd descriptor) {
        set(kDescriptor, true);
        attach(std::move(descriptor));
    }
    /// The descriptor that came, or is to go, with this message; none once it, or a copy's, has
    /// been taken. Not from two threads at once.
    UniqueFd takeDescriptor() const { return descriptor_ ? std::move(*descriptor_) : UniqueFd(); }
    /// The same without the key, which a received message has.
    void attach(UniqueFd descriptor) {
        descriptor_ = std::make_shared<UniqueFd>(std::move(descriptor));
    }

  private:
    std::shared_ptr<void> turn_;  // goes last: it may see to it where the contents are freed
    Dictionary contents_;
    std::uint64_t serial_ = 0;
    std::shared_ptr<UniqueFd> descriptor_;
};

/// The text of the whole message, for tracers: never cut.
std::string describe(const Message& message);

}  // namespace platform
