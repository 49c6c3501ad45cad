#include "platform/tandry/ForeignPlaces.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <optional>
#include <string_view>
#include <utility>

#include "platform/system/Files.h"

namespace platform::tandry {

namespace {

constexpr int kMostLinks = 40;

bool isForeign(const MountTable::Mount* mount) {
    // Without the root nothing goes on anyhow.
    return mount && mount->place != "/" && !mount->isOwn();
}

/// Takes the first component off a path.
std::string takeComponent(std::string& path) {
    path.erase(0, path.find_first_not_of('/'));
    std::string component = path.substr(0, path.find('/'));
    path.erase(0, component.size());
    return component;
}

/// Where a symbolic link leads; none, with errno set, where there is none.
std::optional<std::string> targetOf(const std::string& path) {
    char target[PATH_MAX];
    const ssize_t size = ::readlink(path.c_str(), target, sizeof target);
    if (size < 0) return std::nullopt;
    return std::string(target, static_cast<std::size_t>(size));
}

}  // namespace

void ForeignPlaces::beginWalk() {
    mounts_.refresh();
    known_.clear();
}

bool ForeignPlaces::isAvoided(const std::string& path) const {
    const auto* const mount = avoided_.empty() ? nullptr : mounts_.of(path);
    return mount && avoided_.contains(mount->id);
}

bool ForeignPlaces::answers(const std::string& path, std::string* unseen) {
    std::string way = "/", rest = path;
    for (std::string_view above = parentPath(path); above.size() > 1; above = parentPath(above))
        if (known_.contains(std::string(above))) {
            way = above;
            rest = path.substr(above.size());
            break;
        }
    std::vector<std::string> places;
    std::string name = takeComponent(rest);
    for (; !name.empty(); name = takeComponent(rest)) {
        if (name == ".") continue;
        if (name == "..") {
            way = parentPath(way);
            continue;
        }
        const std::string next = joinPath(way, name);
        if (isAvoided(next)) {
            if (unseen) *unseen = next + rest;
            return false;
        }
        places.push_back(next);
        noteAt(places);
        const std::optional<std::string> target = targetOf(next);
        if (!target) {
            if (!rest.empty() && errno == EINVAL) known_.insert(next);
            places.pop_back();
            way = next;
            continue;
        }
        if (places.size() > kMostLinks) break;  // whoever looks finds that out
        if (target->starts_with('/')) way.assign(1, '/');
        rest.insert(0, '/' + *target);
    }
    places.push_back(way);
    noteAt(std::move(places));
    return true;
}

bool ForeignPlaces::answersWithin(const std::string& path) {
    return answers(path) && !holdsAvoided(path);
}

bool ForeignPlaces::entryAnswersWithin(const std::string& path) {
    if (isAvoided(path)) return false;
    noteAt({path});
    return !holdsAvoided(path);
}

bool ForeignPlaces::holdsAvoided(const std::string& path) const {
    if (avoided_.empty()) return false;
    const auto inside = mounts_.within(path);
    return std::ranges::any_of(inside,
                               [this](const auto* mount) { return avoided_.contains(mount->id); });
}

void ForeignPlaces::noteAt(std::vector<std::string> places) {
    const std::lock_guard lock(mutex_);
    if (isGivenUp_) throw GivenUp();
    if (!places.empty()) places_ = std::move(places);
    ++steps_;
}

std::uint64_t ForeignPlaces::steps() const {
    const std::lock_guard lock(mutex_);
    return steps_;
}

std::string ForeignPlaces::place() const {
    const std::lock_guard lock(mutex_);
    return places_.empty() ? std::string() : places_.back();
}

/// Of those on the way, or else of those that lie within what the walk looks into.
std::set<int> ForeignPlaces::awaited() const {
    MountTable mounts;
    mounts.refresh();
    std::set<int> found;
    const std::lock_guard lock(mutex_);
    for (const std::string& place : places_)
        if (const auto* mount = mounts.of(place); isForeign(mount)) found.insert(mount->id);
    if (!found.empty() || places_.empty()) return found;
    for (const auto* mount : mounts.within(places_.back()))
        if (isForeign(mount)) found.insert(mount->id);
    return found;
}

void ForeignPlaces::giveUp() {
    const std::lock_guard lock(mutex_);
    isGivenUp_ = true;
}

}  // namespace platform::tandry
