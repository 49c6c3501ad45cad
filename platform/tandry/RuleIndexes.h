#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/tandry/TextIndex.h"
#include "platform/tandry/TextList.h"
#include "platform/tandry/Workspace.h"

namespace platform::tandry {

/// What plug-ins have under one key that rules ask for. Immutable once shared.
class RuleIndex {
  public:
    /// Of those at `positions`, which are in order. `isOrdered`: for patterns that compare for
    /// order as well, for which the texts themselves are kept.
    RuleIndex(std::string key, const TDPlugInProxyList& plugIns, const Positions& positions,
              bool isOrdered);
    /// Takes over what an index of the same key and kind knows of those that have moved.
    void takeOver(const RuleIndex& before, const Moves& moves);

    const std::string& key() const { return key_; }
    bool isOrdered() const { return isOrdered_; }
    /// All plug-ins that satisfy the pattern, and hardly any others, in order.
    Positions find(const Value& pattern) const;

  private:
    void add(const TDPlugInProxy& plugIn, Position position);
    void addText(std::string_view text, Position position);
    void dropExcess();
    Positions withoutTruth() const;

    std::string key_;
    bool isOrdered_;
    std::size_t plugIns_;   // that there are
    Positions present_;     // who has anything there, in order
    Positions false_;       // and who has what equals false
    bool hasTexts_ = true;  // not when they were too many
    TextIndex texts_;
    bool hasTextList_ = true;  // likewise
    TextList textList_;
};

/// The indexes of a snapshot's plug-ins by keys that rules have asked for: each is made when it is
/// asked for first, and the number is bounded. Usable from any thread.
class RuleIndexes {
  public:
    /// `plugIns` outlives this.
    explicit RuleIndexes(const TDPlugInProxyList& plugIns) : plugIns_(plugIns) {}

    /// Brings the indexes of a snapshot before up to date: plug-ins at `fresh` are new.
    void takeOver(const RuleIndexes& before, const Moves& moves, const Positions& fresh);

    /// What the query leaves of the plug-ins by the rule that leaves the fewest, in order; none
    /// when no rule narrows. Makes one index at the most: it costs a look at every plug-in.
    std::optional<Positions> find(const Dictionary& query) const;

  private:
    using Shared = std::shared_ptr<const RuleIndex>;
    struct Entry {
        Shared index;
        std::uint64_t asked;  // when, for the last time
    };

    static bool isIndexed(std::string_view key);
    Shared known(std::string_view key, const Value& pattern) const;
    Shared make(std::string_view key, const Value& pattern) const;

    const TDPlugInProxyList& plugIns_;
    mutable std::mutex mutex_;  // guards what follows
    mutable std::vector<Entry> entries_;
    mutable std::uint64_t clock_ = 0;
};

}  // namespace platform::tandry
