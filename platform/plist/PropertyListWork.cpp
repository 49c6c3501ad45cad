#include "platform/plist/PropertyListWork.h"

#include <algorithm>
#include <array>
#include <cstdint>

namespace platform {

namespace {

/// So many keys libplist compares one by one. From then on it has a table of fixed size.
constexpr std::size_t kScannedKeys = 256;
constexpr std::size_t kBuckets = 4096;
/// A dictionary of so many keys fills a cache; comparisons in larger ones cost more and more.
constexpr std::size_t kCachedKeys = 4096;
/// So many bytes are compared or moved in the time of a short comparison.
constexpr std::size_t kBytesPerComparison = 256;

/// As libplist does it, where only the low bits decide.
std::size_t bucketOf(std::string_view key) {
    std::uint32_t hash = 5381;
    for (char character : key) hash = hash * 33 + static_cast<std::uint32_t>(character);
    return hash % kBuckets;
}

std::size_t costOfComparing(std::string_view key) {
    return 1 + key.size() / kBytesPerComparison;
}

std::size_t workOfTable(std::span<const std::string_view> keys) {
    std::array<std::uint32_t, kBuckets> buckets{};
    std::size_t work = 0;
    for (std::string_view key : keys) {
        // One that XML spells in several ways may be in any bucket, or be there already: then it
        // replaces a value, for which the library walks through all of them.
        bool isPlain =
            std::ranges::none_of(key, [](char c) { return c == '&' || c == '<' || c == '>'; });
        work += costOfComparing(key) * (isPlain ? buckets[bucketOf(key)]++ : keys.size());
    }
    return work * (1 + keys.size() / kCachedKeys);
}

}  // namespace

const char* PropertyListWork::addKeys(std::span<std::string_view> keys) {
    std::size_t work = 0;
    for (std::size_t i = 0; i < std::min(keys.size(), kScannedKeys); ++i)
        work += i * costOfComparing(keys[i]);
    if (keys.size() > kScannedKeys) {
        work += workOfTable(keys);
        std::ranges::sort(keys);
        if (std::ranges::adjacent_find(keys) != keys.end()) return "a key twice in a dictionary";
    }
    return take(work, "too many keys");
}

const char* PropertyListWork::addText(std::size_t references, std::size_t length) {
    // The library moves the rest of a text at each of its references.
    return take(references * (length / kBytesPerComparison), "too many references in a text");
}

const char* PropertyListWork::take(std::size_t work, const char* problem) {
    if (work > left_) return problem;
    left_ -= work;
    return nullptr;
}

}  // namespace platform
