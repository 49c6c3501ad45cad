#include "platform/tandry/Snapshot.h"

#include <algorithm>
#include <set>

namespace platform::tandry {

namespace {

std::string_view pathOf(const TDPlugInProxyRef& plugIn) {
    return *plugIn->bundlePath;
}

}  // namespace

Snapshot::Snapshot(const RegistryState& state) {
    plugIns_.reserve(state.plugIns.size());
    uuids_.reserve(state.plugIns.size());
    for (const auto& [path, entry] : state.plugIns) append(entry);
    sort();
}

Snapshot::Snapshot(const Snapshot& before, const RegistryState& state,
                   const RegistryChanges& changes) {
    std::set<std::string_view> changed;
    for (const TDPlugInProxyList* list : {&changes.installed, &changes.uninstalled})
        for (const TDPlugInProxyRef& plugIn : *list) changed.insert(pathOf(plugIn));
    plugIns_.reserve(before.plugIns_.size() + changed.size());
    Moves moved(before.plugIns_.size(), kGone);
    Positions fresh;
    Position next = 0;
    auto copyUntil = [&](Position end) {
        const auto first = before.plugIns_.begin();
        auto position = static_cast<Position>(plugIns_.size());
        plugIns_.insert(plugIns_.end(), first + next, first + end);
        while (next < end) moved[next++] = position++;
    };
    for (std::string_view path : changed) {
        auto place = std::ranges::lower_bound(before.plugIns_, path, {}, pathOf);
        copyUntil(static_cast<Position>(place - before.plugIns_.begin()));
        if (place != before.plugIns_.end() && pathOf(*place) == path) ++next;
        auto found = state.plugIns.find(std::string(path));
        if (found == state.plugIns.end()) continue;
        fresh.push_back(static_cast<Position>(plugIns_.size()));
        append(found->second);
    }
    copyUntil(static_cast<Position>(before.plugIns_.size()));
    sort();
    for (const auto& [uuid, position] : before.uuids_)
        if (moved[position] != kGone) uuids_.emplace_back(uuid, moved[position]);
    std::ranges::sort(uuids_);
    points_.takeOver(before.points_, moved);
    identifiers_.takeOver(before.identifiers_, moved);
    rules_.takeOver(before.rules_, moved, fresh);
}

/// Adds a plug-in, and its entries at the ends of the indexes.
void Snapshot::append(const PlugInEntry& entry) {
    const auto position = static_cast<Position>(plugIns_.size());
    const TDPlugInProxyRef& record = plugIns_.emplace_back(entry.record);
    uuids_.emplace_back(record->plugInUuid, position);
    for (std::string_view rest = entry.points; !rest.empty();) {
        std::string_view point = rest.substr(0, rest.find('\0'));
        points_.add(point, position);
        rest.remove_prefix(point.size() + 1);
    }
    if (record->plugInIdentifier) identifiers_.add(*record->plugInIdentifier, position);
}

void Snapshot::sort() {
    std::ranges::sort(uuids_);
    points_.sort();
    identifiers_.sort();
}

TDPlugInProxyRef Snapshot::plugInWithUuid(const Uuid& uuid) const {
    auto place = std::ranges::lower_bound(uuids_, uuid, {}, &std::pair<Uuid, Position>::first);
    return place != uuids_.end() && place->first == uuid ? plugIns_[place->second] : nullptr;
}

TDPlugInProxyRef Snapshot::plugInAtPath(std::string_view path) const {
    auto place = std::ranges::lower_bound(plugIns_, path, {}, pathOf);
    return place != plugIns_.end() && pathOf(*place) == path ? *place : nullptr;
}

TDPlugInProxyList Snapshot::plugInsOfApplication(const std::string& path) const {
    TDPlugInProxyList list;
    const std::string inside = path + "/";
    auto place = std::ranges::lower_bound(plugIns_, std::string_view(inside), {}, pathOf);
    for (; place != plugIns_.end() && pathOf(*place).starts_with(inside); ++place) {
        const TDApplicationProxyRef& application = (*place)->containingApplication;
        if (application && application->bundlePath == path) list.push_back(*place);
    }
    return list;
}

TDPlugInProxyList Snapshot::candidates(const Dictionary& query) const {
    std::optional<Positions> best;
    for (const auto& [index, key] : {std::pair(&points_, "VXExtensionPointIdentifier"),
                                     std::pair(&identifiers_, "VXExtensionIdentifier")}) {
        const Value* pattern = query.find(key);
        auto found = pattern ? index->find(*pattern, plugIns_.size()) : std::nullopt;
        if (found && (!best || found->size() < best->size())) best = std::move(found);
    }
    // The point names few in general: then no other index is needed.
    if (!best) best = rules_.find(query);
    if (!best) return plugIns_;
    TDPlugInProxyList list;
    list.reserve(best->size());
    for (Position position : *best) list.push_back(plugIns_[position]);
    return list;
}

}  // namespace platform::tandry
