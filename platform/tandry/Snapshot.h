#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/tandry/RegistryState.h"
#include "platform/tandry/RuleIndexes.h"
#include "platform/tandry/TextIndex.h"

namespace platform::tandry {

/// The installed plug-ins at one moment, with indexes. Immutable; usable from any thread.
class Snapshot {
  public:
    explicit Snapshot(const RegistryState& state);
    Snapshot(const Snapshot&) = delete;
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
    void append(const PlugInEntry& entry);
    void sort();

    TDPlugInProxyList plugIns_;
    std::vector<std::pair<Uuid, Position>> uuids_;  // sorted
    TextIndex points_;
    TextIndex identifiers_;
    RuleIndexes rules_{plugIns_};
};

}  // namespace platform::tandry
