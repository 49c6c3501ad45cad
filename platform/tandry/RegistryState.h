#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <string_view>

#include "platform/tandry/PackedBytes.h"
#include "platform/tandry/TDPlugInProxy.h"
#include "platform/tandry/Workspace.h"

namespace platform::tandry {

/// Number of a walk over the disk; 0 stands for "known from the catalogue, before any walk".
using Pass = std::uint32_t;

/// What tells whether a plug-in bundle has changed: which directory it is, the stamps of every file
/// that goes into its record, and the two names from its Info.plist that say which files those are.
struct Fingerprint {
    std::string executable;  // "QFBundleExecutable"; empty when there is none
    std::string sdk;         // its extension point, when SDK dictionaries are looked up for it
    PackedBytes stamps;      // the directory's identity first
    /// Of the executable's content, while its stamp was not settled when it was read.
    std::string executableDigest{};

    FileIdentity directory() const { return FileIdentity::from(stamps.unpacked()); }
};

/// One registered plug-in.
struct PlugInEntry {
    /// Shared with readers, and so immutable, after the first walk (`pass` is not 0).
    std::shared_ptr<TDPlugInProxy> record;
    Fingerprint print;
    /// The texts by which rules can name its extension point, each ended by a NUL.
    std::string points;
    bool needsContainer = false;
    /// The encoded Info.plist and, behind it, the encoded entitlements.
    std::shared_ptr<const std::string> dictionaries;
    std::size_t infoPlistSize = 0;
    Pass pass = 0;

    /// Lets the record read its dictionaries from `dictionaries`.
    void attachDictionaries();
};

struct ApplicationEntry {
    TDApplicationProxyRef record;
    std::string stamps;
    Pass pass = 0;
    Pass plugInsPass = 0;  // the last walk over its plug-ins
};

/// A plug-in bundle that is left out, and why.
struct Refusal {
    Fingerprint print;
    std::string reason;
    std::size_t size = 0;  // of its encoded dictionaries, when nothing else kept it out
    Pass pass = 0;
};

/// A plug-in bundle that was unregistered; left out until it changes or is registered again.
struct Forgotten {
    Fingerprint print;
    Pass pass = 0;
};

/// All that the registry knows, by canonical path. Belongs to the registry's thread.
struct RegistryState {
    std::map<std::string, ApplicationEntry> applications;
    std::map<std::string, PlugInEntry> plugIns;
    std::set<std::string> registrations;  // paths of plug-ins and applications registered by path
    std::map<std::string, Forgotten> forgotten;
    std::map<std::string, Refusal> refusals;
    Pass lastPass = 0;  // of the last walk
};

/// How the state differs from before. A changed plug-in is in both lists, under two UUIDs.
struct RegistryChanges {
    TDPlugInProxyList installed;
    TDPlugInProxyList uninstalled;
    std::set<std::string> applications;  // paths of what came, changed or went, as below
    std::set<std::string> registrations;
    std::set<std::string> forgotten;
    std::set<std::string> refusals;
    std::set<std::string> restamped;  // applications and plug-ins whose records stay
    std::string refusal;  // why the first bundle that was refused or not read was, if any was

    bool records() const {
        return !installed.empty() || !uninstalled.empty() || !applications.empty();
    }
    /// Whether anything differs that no record shows.
    bool lists() const {
        return !registrations.empty() || !forgotten.empty() || !refusals.empty() ||
               !restamped.empty();
    }
};

inline bool isOnSystemPartition(std::string_view path) {
    return path.starts_with("/usr/") || path.starts_with("/System/");
}

/// Whether `path` is `scope` or lies inside it.
inline bool isWithin(const std::string& path, const std::string& scope) {
    return path.starts_with(scope) && (path.size() == scope.size() || path[scope.size()] == '/');
}

/// Calls `visit` with the iterator of every entry of a map or set of paths within `scope` ("" is
/// everything). The visitor may erase that entry.
template <class Container, class Visit>
void forEachWithin(Container& container, const std::string& scope, Visit visit) {
    auto pathOf = [](const auto& entry) -> const std::string& {
        if constexpr (requires { entry.first; })
            return entry.first;
        else
            return entry;
    };
    for (auto next = container.lower_bound(scope); next != container.end();) {
        auto entry = next++;
        if (!pathOf(*entry).starts_with(scope)) break;
        if (scope.empty() || isWithin(pathOf(*entry), scope)) visit(entry);
    }
}

}  // namespace platform::tandry
