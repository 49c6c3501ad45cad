#pragma once

#include <cstddef>
#include <string_view>

namespace bench {

/// Decodes a reply frame with the CBOR library's callbacks, packed property lists included, and
/// builds nothing. Answers the number of items: the least that any reader of a reply has to do.
std::size_t streamDecode(std::string_view frame);

}  // namespace bench
