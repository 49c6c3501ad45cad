#pragma once

#include <cstddef>
#include <string_view>

namespace platform {

/// The length of the longest prefix of `text` that is valid UTF-8 (RFC 3629: no surrogates, no
/// overlong forms, nothing above U+10FFFF). NUL counts as valid.
std::size_t validUtf8Prefix(std::string_view text);

inline bool isValidUtf8(std::string_view text) {
    return validUtf8Prefix(text) == text.size();
}

}  // namespace platform
