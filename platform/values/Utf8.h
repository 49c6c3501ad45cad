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

/// What is wrong with a text.
enum class TextFault {
    None,
    NotInXml,  // a character that XML 1.0 forbids, but NUL: a control character but tab, line feed
               // and carriage return, U+FFFE or U+FFFF
    Nul,
    NotUtf8,  // and there is no NUL
};
TextFault textFault(std::string_view text);

}  // namespace platform
