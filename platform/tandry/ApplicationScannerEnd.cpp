// The end of a walk: what it has not met goes, but for what it could not see.

#include <algorithm>
#include <utility>

#include "platform/system/Files.h"
#include "platform/tandry/ApplicationScanner.h"
#include "platform/tandry/FolderEntries.h"

namespace platform::tandry {

bool ApplicationScanner::isAllMet(const std::string& scope) {
    bool result = true;
    auto look = [&](auto entry) { result = result && entry->second.pass == pass_; };
    forEachWithin(state_.applications, scope, look);
    forEachWithin(state_.plugIns, scope, look);
    return result;
}

/// What was forgotten stays so while it cannot be looked at, be it unreadable or on a volume that
/// is not mounted.
bool ApplicationScanner::isUnreachable(const std::string& path) const {
    return std::ranges::any_of(unreachable_,
                               [&path](const auto& scope) { return isWithin(path, scope); });
}

/// Drops what lies within `scope` and was not met by this walk.
void ApplicationScanner::dropUnmet(const std::string& scope) {
    auto drop = [&](auto& map, auto note) {
        forEachWithin(map, scope, [&](auto entry) {
            if (entry->second.pass == pass_) return;
            note(*entry);
            map.erase(entry);
        });
    };
    drop(state_.plugIns, [&](auto& entry) { changes_.uninstalled.push_back(entry.second.record); });
    drop(state_.applications, [&](auto& entry) { changes_.applications.insert(entry.first); });
    drop(state_.refusals, [&](auto& entry) { changes_.refusals.insert(entry.first); });
    forEachWithin(state_.forgotten, scope, [&](auto entry) {
        if (entry->second.pass == pass_ || isUnreachable(entry->first)) return;
        changes_.forgotten.insert(entry->first);
        state_.forgotten.erase(entry);
    });
    watch_.releaseUnmarked(scope);
    complaints_.forgetUnmet(scope);
}

void ApplicationScanner::noteUnwatched(const std::string& scope) {
    // It is not asked about anything yet.
    if (watch_.isPostponed()) return;
    forEachWithin(unwatched_, scope, [this](auto path) { unwatched_.erase(path); });
    std::string known;
    forEachWithin(state_.plugIns, scope, [&](auto entry) {
        if (watch_.watchesWayTo(entry->first, known) && places_.answersWithin(entry->first) &&
            FolderWatch::isLocal(entry->first))
            known = entry->first;
        else
            unwatched_.insert(entry->first);
    });
}

RegistryChanges ApplicationScanner::finish(const Scopes& scopes) {
    if (!isIncomplete_)
        for (const std::string& scope : scopes) dropUnmet(scope);
    else
        // What the first walk could not reach is there all the same, and is to be seen now.
        for (auto& [path, entry] : state_.plugIns)
            if (entry.pass == 0) keep(entry);
    watch_.endWalk();
    containers_.endWalk();
    for (const std::string& scope : scopes) noteUnwatched(scope);
    return std::exchange(changes_, {});
}

/// What lies within a path does not answer: all that is known there stays as it is, until a walk
/// that comes later.
void ApplicationScanner::keepUnseen(const std::string& path) {
    hasTransientFailure_ = true;
    unreachable_.push_back(path);
    complaints_.add(path, "nothing is known of what does not answer:", path);
    forEachWithin(state_.plugIns, path, [this](auto entry) { keep(entry->second); });
    forEachWithin(state_.applications, path,
                  [this](auto entry) { entry->second.pass = entry->second.plugInsPass = pass_; });
    forEachWithin(state_.refusals, path, [this](auto entry) { entry->second.pass = pass_; });
}

/// Where links of a folder lead in vain.
void ApplicationScanner::noteLost(const FolderEntries& found) {
    for (const std::string& target : found.nowhere) unreachable_.push_back(target);
    for (const std::string& target : found.unseen) keepUnseen(target);
    // It may be known under another name.
    if (!found.unseen.empty()) isIncomplete_ = true;
}

/// Whether what lies at a path, and within, can be looked at; otherwise it has been kept as it was.
bool ApplicationScanner::canSee(const std::string& path) {
    const bool result = places_.answersWithin(path);
    if (!result) keepUnseen(path);
    return result;
}

bool ApplicationScanner::canSee(const BundleFolder& folder) {
    if (!folder.isEntry()) return canSee(folder.path);
    const bool result = places_.entryAnswersWithin(folder.path);
    if (!result) keepUnseen(folder.path);
    return result;
}

}  // namespace platform::tandry
