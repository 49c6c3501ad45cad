#include "platform/values/CborHead.h"

#include <bit>
#include <cmath>

// The way that RFC 8949, section 3, lays heads out: three bits of major type, five of "additional
// information", which is the number itself or says how many bytes of it follow.

namespace platform {

namespace {

constexpr const char* kTruncated = "truncated";
constexpr const char* kUnknown = "an item that messages do not have";
constexpr unsigned kInOneByte = 24, kInEightBytes = 27;
constexpr unsigned kFalse = 20, kTrue = 21, kHalf = 25, kSingle = 26, kDouble = 27;

bool isKnown(unsigned major, unsigned information) {
    if (major < 7) return information <= kInEightBytes;
    return information == kFalse || information == kTrue ||
           (information >= kHalf && information <= kDouble);
}

/// A number of 16 bits: one of sign, five of exponent, ten of fraction.
double realOfHalf(std::uint64_t bits) {
    const int exponent = static_cast<int>(bits >> 10 & 31);
    const auto fraction = static_cast<double>(bits & 1023);
    double value = 0;
    if (exponent == 0) {
        value = std::ldexp(fraction, -24);
    } else if (exponent < 31) {
        value = std::ldexp(fraction + 1024, exponent - 25);
    } else {
        value = fraction == 0 ? INFINITY : NAN;
    }
    return bits & 0x8000 ? -value : value;
}

}  // namespace

void CborHead::setSimple(unsigned information) {
    kind = Kind::Real;
    if (information == kHalf) {
        real = realOfHalf(number);
    } else if (information == kSingle) {
        real = std::bit_cast<float>(static_cast<std::uint32_t>(number));
    } else if (information == kDouble) {
        real = std::bit_cast<double>(number);
    } else {
        kind = Kind::Boolean;
        number = information == kTrue;
    }
}

const char* CborHead::read(std::string_view bytes, std::size_t& position) {
    static constexpr Kind kinds[] = {Kind::Unsigned, Kind::Negative, Kind::Bytes, Kind::Text,
                                     Kind::Array,    Kind::Map,      Kind::Tag};
    if (position >= bytes.size()) return kTruncated;
    const auto* next = reinterpret_cast<const unsigned char*>(bytes.data()) + position;
    const std::size_t left = bytes.size() - position - 1;
    const unsigned major = *next >> 5, information = *next & 31;
    if (!isKnown(major, information)) return kUnknown;
    ++next;
    std::size_t size = 0;  // of the number behind the first byte
    number = information;
    if (information >= kInOneByte) {
        size = std::size_t{1} << (information - kInOneByte);
        if (size > left) return kTruncated;
        number = 0;
        for (std::size_t i = 0; i < size; ++i) number = number << 8 | *next++;
    }
    if (major == 7) {
        setSimple(information);
    } else {
        kind = kinds[major];
        if (kind == Kind::Bytes || kind == Kind::Text) {
            if (number > left - size) return kTruncated;
            string = {reinterpret_cast<const char*>(next), static_cast<std::size_t>(number)};
            size += string.size();
        }
    }
    position += 1 + size;
    return nullptr;
}

}  // namespace platform
