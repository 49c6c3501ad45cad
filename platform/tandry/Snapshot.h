#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/tandry/RegistryState.h"

namespace platform::tandry {

/// A number of a text such that texts which compare equal in rules (digit runs by their numeric
/// value, everything else byte by byte) have the same number. Others hardly ever share one.
std::uint64_t comparisonKey(std::string_view text);

/// The installed plug-ins at one moment, with indexes. Immutable; usable from any thread.
class Snapshot {
  public:
    explicit Snapshot(const RegistryState& state);
    /// The same for a state that differs from the one of `before` by `changes`, at a fraction of
    /// the cost.
    Snapshot(const Snapshot& before, const RegistryState& state, const RegistryChanges& changes);

    /// In the order of their paths.
    const TDPlugInProxyList& plugIns() const { return plugIns_; }
    TDPlugInProxyRef plugInWithUuid(const Uuid& uuid) const;
    TDPlugInProxyRef plugInAtPath(std::string_view path) const;
    TDPlugInProxyList plugInsOfApplication(const std::string& path) const;

    /// The plug-ins that `query` may match, in the order of their paths: see
    /// `Workspace::plugInsMatching`.
    TDPlugInProxyList candidates(const Dictionary& query) const;

  private:
    using Position = std::uint32_t;  // in plugIns_
    /// From a key to the plug-ins that have it, sorted.
    using Index = std::vector<std::pair<std::uint64_t, Position>>;
    using Positions = std::vector<Position>;

    std::optional<Positions> find(const Index& index, const Value* pattern) const;
    void append(const PlugInEntry& entry);
    void sort();

    TDPlugInProxyList plugIns_;
    std::vector<std::pair<Uuid, Position>> uuids_;  // sorted
    Index points_;
    Index identifiers_;
};

}  // namespace platform::tandry
