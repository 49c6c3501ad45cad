#pragma once

#include <array>
#include <compare>
#include <cstdint>
#include <cstring>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace platform {

/// A 16-byte universally unique identifier (RFC 4122). A plain value: copy it freely.
struct Uuid {
    std::array<std::uint8_t, 16> bytes{};

    /// A new random (version 4) identifier.
    static Uuid random();

    /// Reads the 36-character text form, in either case. None for anything else.
    static std::optional<Uuid> parse(std::string_view text);

    /// The 36-character text form in upper case, with hyphens.
    std::string string() const;

    auto operator<=>(const Uuid&) const = default;  // NOLINT(modernize-use-nullptr)
};

std::string describe(const Uuid& uuid);

}  // namespace platform

template <>
struct std::hash<platform::Uuid> {
    // Identifiers are random already: any eight bytes of them are a good hash.
    std::size_t operator()(const platform::Uuid& uuid) const noexcept {
        std::size_t hash = 0;
        std::memcpy(&hash, uuid.bytes.data(), sizeof hash);
        return hash;
    }
};
