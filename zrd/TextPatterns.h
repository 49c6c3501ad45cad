#pragma once

#include <cstddef>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_set>
#include <vector>

namespace platform {
class Types;
}

namespace zorvan {

/// String patterns of which one has to hold for a text. What a text costs does not grow with their
/// number: those that compare for equality are looked up, and of those that compare for order only
/// the widest is kept. Used by one thread at a time.
class TextPatterns {
  public:
    /// `types` may be null while no pattern speaks of types.
    explicit TextPatterns(std::shared_ptr<platform::Types> types) : types_(std::move(types)) {}

    /// False for a pattern whose operator does not exist: it holds never.
    bool add(const std::string& pattern);

    /// Whether one of them holds.
    bool matches(std::string_view text) const;

  private:
    void addComparison(std::string_view prefix, std::string operand);
    bool isEqual(std::string_view text) const;
    bool isOrdered(std::string_view text) const;
    bool hasType(std::string_view text) const;

    std::shared_ptr<platform::Types> types_;
    std::vector<std::string> equal_;              // each once
    std::unordered_set<std::string> equalForms_;  // the same, in their canonical form
    std::size_t longestForm_ = 0;
    std::optional<std::string> below_, atMost_, above_, atLeast_, other_;
    bool takesAny_ = false;  // every text differs from one of two different ones
    std::unordered_set<std::string> ancestors_;    // names of types that the text may descend from
    std::unordered_set<std::string> descendants_;  // and of those that it may be an ancestor of
};

}  // namespace zorvan
