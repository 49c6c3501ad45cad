#pragma once

#include <cstdint>

namespace platform {

// The tags that the encoding uses, by their registered meaning: a time in seconds, an encoded item
// in a byte string, a UUID.
inline constexpr std::uint64_t kCborDateTag = 1;
inline constexpr std::uint64_t kCborPackedTag = 24;
inline constexpr std::uint64_t kCborUuidTag = 37;

}  // namespace platform
