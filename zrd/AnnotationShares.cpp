#include "zrd/AnnotationShares.h"

namespace zorvan {

using platform::Origin;
using platform::PropertyListCost;

bool AnnotationShares::hasRoomFor(const Origin& origin, const std::string& key,
                                  const PropertyListCost& cost) const {
    constexpr std::size_t kParts = 4;
    PropertyListCost after = cost;
    const auto all = byOrigin_.find(origin);
    if (all != byOrigin_.end()) after += all->second;
    const auto current = byKey_.find(key);
    if (current != byKey_.end() && current->second.owner == origin) after -= current->second.cost;
    return after.fits(room_, kParts);
}

void AnnotationShares::give(const Origin& origin, const std::string& key) {
    drop(key);
    byKey_[key] = {origin, {}};
}

void AnnotationShares::changed(const std::string& key,
                               const std::optional<PropertyListCost>& cost) {
    if (!cost) return drop(key);
    const auto owned = byKey_.find(key);
    if (owned == byKey_.end()) return;
    PropertyListCost& sum = byOrigin_[owned->second.owner];
    sum -= owned->second.cost;
    sum += *cost;
    owned->second.cost = *cost;
}

void AnnotationShares::drop(const std::string& key) {
    const auto owned = byKey_.find(key);
    if (owned == byKey_.end()) return;
    const auto sum = byOrigin_.find(owned->second.owner);
    if (sum != byOrigin_.end()) {
        sum->second -= owned->second.cost;
        if (sum->second.objects == 0) byOrigin_.erase(sum);
    }
    byKey_.erase(owned);
}

}  // namespace zorvan
