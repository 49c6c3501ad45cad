#pragma once

#include <cstddef>
#include <span>
#include <string_view>

namespace platform {

/// Adds up the work of libplist with an XML list that grows faster than the list, and says when it
/// is more than a list may cause (about half a second).
///
/// A dictionary of 50 000 keys passes, as long as they spread over the library's hash table; of
/// keys that all collide there, about 4000 do. A text of 128 KiB may be nothing but references
/// (&amp;), a longer one has to have fewer.
class PropertyListWork {
  public:
    /// In comparisons of keys within the processor's caches: about 20 ns.
    static constexpr std::size_t kMost = 1u << 24;

    /// Adds a dictionary with these keys, whose order may change. Says what is wrong, or null. Keys
    /// of XML may come as they stand there.
    const char* addKeys(std::span<std::string_view> keys);
    /// Adds a text of `length` bytes of XML, so many of them references. As above.
    const char* addText(std::size_t references, std::size_t length);

    /// How much was added up, but for what was too much.
    std::size_t used() const { return kMost - left_; }

  private:
    const char* take(std::size_t work, const char* problem);

    std::size_t left_ = kMost;
};

}  // namespace platform
