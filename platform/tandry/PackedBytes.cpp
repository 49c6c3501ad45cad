#include "platform/tandry/PackedBytes.h"

#include <algorithm>
#include <climits>
#include <functional>

namespace platform::tandry {

// A start packs and compares kilobytes for each application: not by a look at the capacity for
// every byte.
PackedBytes::PackedBytes(std::string_view bytes) {
    std::string packed(2 * bytes.size(), '\0');
    char* to = packed.data();
    const char* const end = bytes.data() + bytes.size();
    for (const char* next = bytes.data(); next != end;) {
        if ((*to++ = *next++) != '\0') continue;
        unsigned char zeros = 0;
        for (; next != end && *next == '\0' && zeros != UCHAR_MAX; ++next) ++zeros;
        *to++ = static_cast<char>(zeros);
    }
    packed_.assign(packed.data(), to);
}

std::string PackedBytes::unpacked() const {
    std::string bytes;
    for (std::size_t i = 0; i < packed_.size(); ++i) {
        bytes += packed_[i];
        if (packed_[i] == '\0') bytes.append(static_cast<unsigned char>(packed_[++i]), '\0');
    }
    return bytes;
}

bool PackedBytes::holds(std::string_view bytes) const {
    const char* next = bytes.data();
    const char* const end = next + bytes.size();
    for (const char* packed = packed_.data(); packed != packed_.data() + packed_.size();) {
        if (next == end || *next++ != *packed) return false;
        if (*packed++ != '\0') continue;
        const auto zeros = static_cast<unsigned char>(*packed++);
        if (end - next < zeros || std::any_of(next, next + zeros, std::identity())) return false;
        next += zeros;
    }
    return next == end;
}

}  // namespace platform::tandry
