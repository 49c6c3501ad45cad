#include "platform/tandry/PackedBytes.h"

#include <algorithm>
#include <limits>

namespace platform::tandry {

PackedBytes::PackedBytes(std::string_view bytes) {
    constexpr std::size_t kMostFollowing = std::numeric_limits<unsigned char>::max();
    std::string packed;
    packed.reserve(bytes.size());
    while (!bytes.empty()) {
        packed += bytes.front();
        bytes.remove_prefix(1);
        if (packed.back() != '\0') continue;
        const std::size_t zeros = std::min(bytes.find_first_not_of('\0'), bytes.size());
        const std::size_t following = std::min(zeros, kMostFollowing);
        packed += static_cast<char>(following);
        bytes.remove_prefix(following);
    }
    packed_.assign(packed);
}

std::string PackedBytes::unpacked() const {
    std::string bytes;
    for (std::size_t i = 0; i < packed_.size(); ++i) {
        bytes += packed_[i];
        if (packed_[i] == '\0') bytes.append(static_cast<unsigned char>(packed_[++i]), '\0');
    }
    return bytes;
}

}  // namespace platform::tandry
