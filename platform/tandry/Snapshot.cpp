#include "platform/tandry/Snapshot.h"

#include <algorithm>
#include <limits>
#include <set>

namespace platform::tandry {

namespace {

bool isDigit(char c) {
    return c >= '0' && c <= '9';
}

/// The text that a pattern compares for equality; none when it compares in another way.
std::optional<std::string_view> equalityOperand(std::string_view pattern) {
    if (pattern.empty()) return pattern;
    switch (pattern.front()) {
        case '=':
            return pattern.substr(1);
        case '<':
        case '>':
        case '?':
            return std::nullopt;
        default:
            return pattern;
    }
}

/// The keys of the values that satisfy the pattern. None when it does not narrow.
std::optional<std::vector<std::uint64_t>> patternKeys(const Value& pattern) {
    std::vector<std::uint64_t> keys;
    auto add = [&keys](std::string_view text) {
        auto operand = equalityOperand(text);
        if (operand) keys.push_back(comparisonKey(*operand));
        return operand.has_value();
    };
    if (const auto* text = pattern.string()) {
        if (!add(*text)) return std::nullopt;
        return keys;
    }
    const Array* alternatives = pattern.array();
    if (!alternatives) return std::nullopt;
    // An alternative that is no string matches nothing.
    for (const Value& alternative : *alternatives)
        if (alternative.string() && !add(*alternative.string())) return std::nullopt;
    return keys;
}

template <class List>
void sortUnique(List& list) {
    std::ranges::sort(list);
    list.erase(std::unique(list.begin(), list.end()), list.end());
}

constexpr std::uint32_t kGone = std::numeric_limits<std::uint32_t>::max();

/// Adds what is left of an older sorted index, whose plug-ins have moved, to a sorted one. Moving
/// does not change their order.
template <class Index>
void mergeMoved(const Index& older, const std::vector<std::uint32_t>& moved, Index& index) {
    const auto fresh = static_cast<std::ptrdiff_t>(index.size());
    index.reserve(index.size() + older.size());
    for (const auto& [key, position] : older)
        if (moved[position] != kGone) index.emplace_back(key, moved[position]);
    std::inplace_merge(index.begin(), index.begin() + fresh, index.end());
}

std::string_view pathOf(const TDPlugInProxyRef& plugIn) {
    return *plugIn->bundlePath;
}

}  // namespace

std::uint64_t comparisonKey(std::string_view text) {
    std::uint64_t key = 14695981039346656037u;  // FNV-1a
    for (std::size_t i = 0; i < text.size(); ++i) {
        bool leadingZero = text[i] == '0' && (i == 0 || !isDigit(text[i - 1]));
        if (leadingZero)
            while (i + 1 < text.size() && text[i] == '0' && isDigit(text[i + 1])) ++i;
        key = (key ^ static_cast<unsigned char>(text[i])) * 1099511628211u;
    }
    return key;
}

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
    Positions moved(before.plugIns_.size(), kGone);  // from an old position to the new one
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
        if (found != state.plugIns.end()) append(found->second);
    }
    copyUntil(static_cast<Position>(before.plugIns_.size()));
    sort();
    mergeMoved(before.uuids_, moved, uuids_);
    mergeMoved(before.points_, moved, points_);
    mergeMoved(before.identifiers_, moved, identifiers_);
}

/// Adds a plug-in, and its entries at the ends of the indexes.
void Snapshot::append(const PlugInEntry& entry) {
    const auto position = static_cast<Position>(plugIns_.size());
    const TDPlugInProxyRef& record = plugIns_.emplace_back(entry.record);
    uuids_.emplace_back(record->plugInUuid, position);
    for (std::string_view rest = entry.points; !rest.empty();) {
        std::string_view point = rest.substr(0, rest.find('\0'));
        points_.emplace_back(comparisonKey(point), position);
        rest.remove_prefix(point.size() + 1);
    }
    if (record->plugInIdentifier)
        identifiers_.emplace_back(comparisonKey(*record->plugInIdentifier), position);
}

void Snapshot::sort() {
    std::ranges::sort(uuids_);
    sortUnique(points_);
    sortUnique(identifiers_);
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

/// The sorted positions under the keys of a pattern; none when there is nothing to narrow by.
std::optional<Snapshot::Positions> Snapshot::find(const Index& index, const Value* pattern) const {
    std::optional<std::vector<std::uint64_t>> keys;
    if (pattern) keys = patternKeys(*pattern);
    if (!keys) return std::nullopt;
    sortUnique(*keys);
    Positions found;
    for (std::uint64_t key : *keys) {
        // One plug-in may have many keys: then looking at each plug-in once costs less.
        if (found.size() > plugIns_.size()) return std::nullopt;
        for (auto place = std::ranges::lower_bound(index, key, {}, &Index::value_type::first);
             place != index.end() && place->first == key; ++place)
            found.push_back(place->second);
    }
    sortUnique(found);
    return found;
}

TDPlugInProxyList Snapshot::candidates(const Dictionary& query) const {
    std::optional<Positions> byPoint = find(points_, query.find("VXExtensionPointIdentifier"));
    std::optional<Positions> byIdentifier = find(identifiers_, query.find("VXExtensionIdentifier"));
    if (!byPoint && !byIdentifier) return plugIns_;
    const bool pointIsBetter = byPoint && (!byIdentifier || byPoint->size() < byIdentifier->size());
    const Positions& positions = pointIsBetter ? *byPoint : *byIdentifier;
    TDPlugInProxyList list;
    list.reserve(positions.size());
    for (Position position : positions) list.push_back(plugIns_[position]);
    return list;
}

}  // namespace platform::tandry
