#pragma once

#include <cstddef>
#include <map>
#include <string>

#include "platform/tandry/RegistryState.h"

namespace platform::tandry {

/// Most bytes of encoded dictionaries of all plug-ins inside one application, and of all that are
/// registered: they are kept in memory, and one reply may hold them all.
inline constexpr std::size_t kMaxApplicationSize = 32u << 20;
inline constexpr std::size_t kMaxRegistrySize = 128u << 20;

/// How much room the encoded dictionaries of the registered plug-ins take. Belongs to the
/// registry's thread.
class DictionaryRoom {
  public:
    /// Counts anew. To be called before anything else.
    void count(const RegistryState& state);
    void add(const PlugInEntry& entry);
    void remove(const PlugInEntry& entry);

    /// What is exceeded once so many more bytes are taken inside an application (its path, empty
    /// for none), in words for people; null when there is room.
    const char* excess(const std::string& application, std::size_t size) const;

    /// The application whose room a record takes.
    static std::string applicationOf(const TDPlugInProxy& record);

  private:
    std::map<std::string, std::size_t> applications_;
    std::size_t all_ = 0;
};

}  // namespace platform::tandry
