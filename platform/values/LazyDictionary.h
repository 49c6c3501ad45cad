#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <string_view>

#include "platform/values/Value.h"

namespace platform {

/// A dictionary that was made from one, or from its encoded bytes and is then decoded at its first
/// use. Immutable; copies share it; usable from any thread.
class LazyDictionary {
  public:
    LazyDictionary() = default;
    LazyDictionary(Dictionary dictionary);
    /// Told, once and on the thread of the first use, why bytes are no dictionary's.
    using FaultHandler = void (*)(std::string_view reason);
    /// Bytes of `encodeCbor`. Should they turn out not to be a dictionary's, `onFault` is called
    /// and the dictionary is empty.
    LazyDictionary(EncodedBytes bytes, FaultHandler onFault);

    /// The dictionary; the reference is good as long as this object. Made from bytes, it and every
    /// dictionary inside it carry their encoded bytes.
    const Dictionary& get() const;
    /// Shows it to `see`, without keeping what had to be decoded for that.
    void look(const std::function<void(const Dictionary&)>& see) const;

  private:
    struct State {
        bool isEncoded = false;  // made from bytes
        EncodedBytes bytes;
        FaultHandler onFault = nullptr;
        std::once_flag once;
        std::atomic<bool> isDecoded = false;
        Dictionary dictionary;
    };
    std::shared_ptr<State> state_;  // null: empty
};

}  // namespace platform
