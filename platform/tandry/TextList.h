#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/tandry/TextIndex.h"

namespace platform::tandry {

/// Texts, one behind another, with the plug-ins that have them, for rules that compare for order:
/// going through all of them costs less than looking at one plug-in in a hundred.
class TextList {
  public:
    /// Whether this is what a pattern is to be asked of: it compares texts, and few, and not only
    /// for equality.
    static bool isFor(const Value& pattern);

    /// In the order of places.
    void add(std::string_view text, Position position);
    /// Takes over what is left of an older one, as `TextIndex` does.
    void takeOver(const TextList& before, const Moves& moves);

    /// Of texts.
    std::size_t bytes() const { return bytes_.size(); }
    /// The plug-ins with a text that satisfies the pattern, in order. None for a pattern that this
    /// is not for.
    std::optional<Positions> find(const Value& pattern) const;

  private:
    struct Entry {
        std::size_t end;  // in `bytes_`, where the next text begins
        Position position;
    };

    std::string_view text(std::size_t index) const;

    std::string bytes_;
    std::vector<Entry> entries_;  // in the order of places
};

}  // namespace platform::tandry
