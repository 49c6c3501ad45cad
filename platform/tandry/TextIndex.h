#pragma once

#include <cstdint>
#include <limits>
#include <optional>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/values/Value.h"

namespace platform::tandry {

/// A plug-in's place in a snapshot's list.
using Position = std::uint32_t;
using Positions = std::vector<Position>;

/// From places in the snapshot before to those in the next one.
using Moves = std::vector<Position>;
inline constexpr Position kGone = std::numeric_limits<Position>::max();

/// A number of a text such that texts which compare equal in rules (digit runs by their numeric
/// value, everything else byte by byte) have the same number. Others hardly ever share one.
std::uint64_t comparisonKey(std::string_view text);

/// From texts to the plug-ins that have them, for rules that compare for equality.
class TextIndex {
  public:
    void add(std::string_view text, Position position);
    /// Makes what has been added ready to be asked.
    void sort();
    /// Takes over what is left of an older one. Moving does not change the order of places. Call it
    /// once this one is sorted.
    void takeOver(const TextIndex& before, const Moves& moves);

    std::size_t size() const { return entries_.size(); }
    /// Whether the pattern compares for equality alone.
    static bool narrowsBy(const Value& pattern);
    /// The plug-ins with a text that satisfies the pattern, and hardly any others, in order. None
    /// when the pattern does not narrow, or looking at each of `plugIns` plug-ins costs less.
    std::optional<Positions> find(const Value& pattern, std::size_t plugIns) const;

  private:
    std::vector<std::pair<std::uint64_t, Position>> entries_;  // sorted, once sorted
};

}  // namespace platform::tandry
