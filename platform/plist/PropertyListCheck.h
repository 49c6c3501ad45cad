#pragma once

#include <cstddef>
#include <vector>

#include "platform/values/Value.h"

namespace platform {

/// 2001-01-01 00:00 UTC, from which property lists count, in seconds since 1970.
inline constexpr double kPropertyListReferenceDate = 978307200;

/// What a look at the bytes of a property list finds, before the parser may have them.
struct PropertyListCheck {
    /// Why the parser must not have them, or null when it may.
    const char* problem = nullptr;
    /// The dates in the order of the list: the parser's own accessor cuts them.
    std::vector<Date> dates;
    /// Entries of all dictionaries together. The parser drops one whose key comes again.
    std::size_t entries = 0;
};

}  // namespace platform
