#include "platform/values/Utf8.h"

#include <cstdint>
#include <cstring>

namespace platform {

namespace {

/// The length of the sequence of several bytes at the start of `text`, or 0 when it is not valid.
std::size_t sequenceLength(std::string_view text) {
    auto byte = [text](std::size_t i) { return static_cast<unsigned char>(text[i]); };
    unsigned lead = byte(0);
    // The first continuation byte has a smaller range where a longer form would be overlong, a
    // surrogate or out of range.
    unsigned low = 0x80;
    unsigned high = 0xBF;
    std::size_t length = 0;
    if (lead >= 0xC2 && lead <= 0xDF) {
        length = 2;
    } else if (lead >= 0xE0 && lead <= 0xEF) {
        length = 3;
        if (lead == 0xE0) low = 0xA0;
        if (lead == 0xED) high = 0x9F;
    } else if (lead >= 0xF0 && lead <= 0xF4) {
        length = 4;
        if (lead == 0xF0) low = 0x90;
        if (lead == 0xF4) high = 0x8F;
    }
    if (length == 0 || text.size() < length || byte(1) < low || byte(1) > high) return 0;
    for (std::size_t i = 2; i < length; ++i) {
        if ((byte(i) & 0xC0) != 0x80) return 0;
    }
    return length;
}

/// Of eight bytes, whether one is below 0x20 or above 0x7F. (Where one is below, the lowest of them
/// borrows and shows, whatever that does to those above it.)
bool hasUnusual(std::uint64_t word) {
    return ((word | (word - 0x2020202020202020U)) & 0x8080808080808080U) != 0;
}

/// Whether there are ASCII characters only, no control characters among them, as in nearly all
/// texts that there are.
bool isPlain(std::string_view text) {
    std::uint64_t word = 0x2020202020202020U;
    const char* next = text.data();
    std::size_t left = text.size();
    for (; left >= sizeof word; left -= sizeof word, next += sizeof word) {
        std::memcpy(&word, next, sizeof word);
        if (hasUnusual(word)) return false;
    }
    for (; left > 0; --left, ++next)
        if (*next < 0x20) return false;  // or above 0x7F
    return true;
}

bool isInXml(std::string_view text) {
    for (std::size_t i = 0; i < text.size(); ++i) {
        const auto byte = static_cast<unsigned char>(text[i]);
        if (byte < 0x20 && byte != '\t' && byte != '\n' && byte != '\r') return false;
        if (byte == 0xEF && text.substr(i + 1, 1) == "\xBF") {
            const auto last = text.substr(i + 2, 1);
            if (last == "\xBE" || last == "\xBF") return false;
        }
    }
    return true;
}

}  // namespace

std::size_t validUtf8Prefix(std::string_view text) {
    std::size_t i = 0;
    while (i < text.size()) {
        std::uint64_t word = 0;
        if (text.size() - i >= sizeof word) {
            std::memcpy(&word, text.data() + i, sizeof word);
            if ((word & 0x8080808080808080U) == 0) {
                i += sizeof word;
                continue;
            }
        }
        if (static_cast<unsigned char>(text[i]) < 0x80) {
            ++i;
            continue;
        }
        std::size_t length = sequenceLength(text.substr(i));
        if (length == 0) return i;
        i += length;
    }
    return i;
}

TextFault textFault(std::string_view text) {
    if (isPlain(text)) return TextFault::None;
    if (text.find('\0') != std::string_view::npos) return TextFault::Nul;
    if (!isValidUtf8(text)) return TextFault::NotUtf8;
    return isInXml(text) ? TextFault::None : TextFault::NotInXml;
}

}  // namespace platform
