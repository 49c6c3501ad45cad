#include "platform/tandry/TextIndex.h"

#include <algorithm>

namespace platform::tandry {

namespace {

bool isDigit(char c) {
    return c >= '0' && c <= '9';
}

/// The text that a pattern compares for equality; none when it compares in another way.
std::optional<std::string_view> equalityOperand(std::string_view pattern) {
    if (pattern.empty()) return pattern;
    switch (pattern.front()) {
        case '=':
            return pattern.substr(1);
        case '<':
        case '>':
        case '?':
            return std::nullopt;
        default:
            return pattern;
    }
}

/// The keys of the texts that satisfy the pattern. None when it does not narrow.
std::optional<std::vector<std::uint64_t>> patternKeys(const Value& pattern) {
    std::vector<std::uint64_t> keys;
    auto add = [&keys](std::string_view text) {
        auto operand = equalityOperand(text);
        if (operand) keys.push_back(comparisonKey(*operand));
        return operand.has_value();
    };
    if (const auto* text = pattern.string()) {
        if (!add(*text)) return std::nullopt;
        return keys;
    }
    const Array* alternatives = pattern.array();
    if (!alternatives) return std::nullopt;
    // An alternative that is no string matches nothing.
    for (const Value& alternative : *alternatives)
        if (alternative.string() && !add(*alternative.string())) return std::nullopt;
    return keys;
}

template <class List>
void sortUnique(List& list) {
    if (std::ranges::adjacent_find(list, std::ranges::greater_equal()) == list.end()) return;
    std::ranges::sort(list);
    list.erase(std::unique(list.begin(), list.end()), list.end());
}

}  // namespace

std::uint64_t comparisonKey(std::string_view text) {
    std::uint64_t key = 14695981039346656037u;  // FNV-1a
    for (std::size_t i = 0; i < text.size(); ++i) {
        bool leadingZero = text[i] == '0' && (i == 0 || !isDigit(text[i - 1]));
        if (leadingZero)
            while (i + 1 < text.size() && text[i] == '0' && isDigit(text[i + 1])) ++i;
        key = (key ^ static_cast<unsigned char>(text[i])) * 1099511628211u;
    }
    return key;
}

void TextIndex::add(std::string_view text, Position position) {
    entries_.emplace_back(comparisonKey(text), position);
}

void TextIndex::sort() {
    sortUnique(entries_);
}

void TextIndex::takeOver(const TextIndex& before, const Moves& moves) {
    const auto fresh = static_cast<std::ptrdiff_t>(entries_.size());
    entries_.reserve(entries_.size() + before.entries_.size());
    for (const auto& [key, position] : before.entries_)
        if (moves[position] != kGone) entries_.emplace_back(key, moves[position]);
    std::inplace_merge(entries_.begin(), entries_.begin() + fresh, entries_.end());
}

bool TextIndex::narrowsBy(const Value& pattern) {
    return patternKeys(pattern).has_value();
}

std::optional<Positions> TextIndex::find(const Value& pattern, std::size_t plugIns) const {
    auto keys = patternKeys(pattern);
    if (!keys) return std::nullopt;
    sortUnique(*keys);
    Positions found;
    for (std::uint64_t key : *keys) {
        // One plug-in may have many texts.
        if (found.size() > plugIns) return std::nullopt;
        using Entry = std::pair<std::uint64_t, Position>;
        const auto first = std::ranges::lower_bound(entries_, key, {}, &Entry::first);
        const auto last = std::ranges::upper_bound(first, entries_.end(), key, {}, &Entry::first);
        if (found.empty()) found.reserve(static_cast<std::size_t>(last - first));
        for (auto place = first; place != last; ++place) found.push_back(place->second);
    }
    sortUnique(found);
    return found;
}

}  // namespace platform::tandry
