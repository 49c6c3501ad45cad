#include "platform/tandry/TextList.h"

#include <algorithm>
#include <utility>

#include "platform/values/VersionText.h"

namespace platform::tandry {

namespace {

/// Each text is compared with each alternative of a pattern.
constexpr std::size_t kMaxAlternatives = 16;

/// A text is accepted when it compares with the operand in one of the ways that `orders` has, a
/// bit for each: less, equal, greater.
struct Comparison {
    unsigned orders;
    std::string_view operand;

    bool holds(std::string_view text) const {
        return (orders >> (compareVersionString(text, operand) + 1) & 1) != 0;
    }
};

/// None for what is no comparison of texts.
std::optional<Comparison> comparison(std::string_view pattern) {
    static constexpr std::pair<std::string_view, unsigned> operators[] = {
        {"<>", 5}, {"<=", 3}, {">=", 6}, {"=", 2}, {"<", 1}, {">", 4}, {"", 2}};
    if (pattern.starts_with('?')) return std::nullopt;
    const auto* found = std::ranges::find_if(
        operators, [pattern](const auto& entry) { return pattern.starts_with(entry.first); });
    return Comparison{found->second, pattern.substr(found->first.size())};
}

/// The alternatives of a pattern; none when one of them is no comparison, or they are many.
std::optional<std::vector<Comparison>> comparisons(const Value& pattern) {
    std::vector<Comparison> all;
    const auto add = [&all](const Value& alternative) {
        // What is no text matches nothing.
        if (!alternative.string()) return true;
        const auto one = comparison(*alternative.string());
        if (one) all.push_back(*one);
        return one && all.size() <= kMaxAlternatives;
    };
    if (!pattern.string() && !pattern.array()) return std::nullopt;
    const bool areAll = pattern.array() ? std::ranges::all_of(*pattern.array(), add) : add(pattern);
    return areAll ? std::optional(std::move(all)) : std::nullopt;
}

}  // namespace

bool TextList::isFor(const Value& pattern) {
    return !TextIndex::narrowsBy(pattern) && comparisons(pattern);
}

void TextList::add(std::string_view text, Position position) {
    bytes_ += text;
    entries_.push_back({bytes_.size(), position});
}

void TextList::takeOver(const TextList& before, const Moves& moves) {
    const TextList fresh = std::exchange(*this, TextList());
    std::size_t next = 0;
    const auto takeFreshUntil = [&](Position position) {
        for (; next < fresh.entries_.size() && fresh.entries_[next].position < position; ++next)
            add(fresh.text(next), fresh.entries_[next].position);
    };
    for (std::size_t i = 0; i < before.entries_.size(); ++i) {
        const Position moved = moves[before.entries_[i].position];
        if (moved == kGone) continue;
        takeFreshUntil(moved);
        add(before.text(i), moved);
    }
    takeFreshUntil(kGone);
}

std::string_view TextList::text(std::size_t index) const {
    const std::size_t begin = index == 0 ? 0 : entries_[index - 1].end;
    return std::string_view(bytes_).substr(begin, entries_[index].end - begin);
}

std::optional<Positions> TextList::find(const Value& pattern) const {
    const auto wanted = comparisons(pattern);
    if (!wanted) return std::nullopt;
    Positions found;
    for (std::size_t i = 0; i < entries_.size(); ++i) {
        const Position position = entries_[i].position;
        if (!found.empty() && found.back() == position) continue;
        const auto holds = [one = text(i)](const Comparison& each) { return each.holds(one); };
        if (std::ranges::any_of(*wanted, holds)) found.push_back(position);
    }
    return found;
}

}  // namespace platform::tandry
