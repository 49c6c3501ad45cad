#pragma once

#include <cstddef>
#include <cstdint>
#include <string_view>

namespace platform {

/// The head of one encoded item, with the bytes of a string. What messages do not have (null,
/// undefined, other simple values, indefinite lengths) is no head.
struct CborHead {
    enum class Kind : std::uint8_t {
        Unsigned,
        Negative,
        Bytes,
        Text,
        Array,
        Map,
        Tag,
        Real,
        Boolean
    };

    Kind kind = Kind::Unsigned;
    std::uint64_t number = 0;  // integer, count, tag or truth; of a negative integer, -1 minus it
    double real = 0;
    std::string_view string;

    /// Reads the head at `position` and moves that behind it, and behind a string's bytes. Answers
    /// what is wrong, or null.
    const char* read(std::string_view bytes, std::size_t& position);

  private:
    /// Of major type 7.
    void setSimple(unsigned information);
};

}  // namespace platform
