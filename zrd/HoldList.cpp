#include "zrd/HoldList.h"

#include <utility>

#include "zrd/ZRDLumClient.h"
#include "zrd/ZRDPlugIn.h"

namespace zorvan {

/// Calls `change` with each table that counts what the hold has, and its key there.
template <class Change>
void HoldList::forEachCount(const ZRDPlugInHold& hold, Change change) {
    for (const auto& plugIn : hold.blocked()) {
        change(plugIns_, plugIn->uuid());
        if (hold.applications().empty()) change(bundles_, plugIn->path());
    }
    for (const std::string& application : hold.applications()) change(applications_, application);
}

void HoldList::add(const Hold& hold) {
    holds_.emplace(++last_, hold);
    tokens_.emplace(hold->uuid(), last_);
    clients_[hold->owner()].insert(last_);
    forEachCount(*hold, [](auto& counts, const auto& key) { ++counts[key]; });
}

HoldList::Hold HoldList::takeNumber(Number number) {
    Hold hold = std::move(holds_.extract(number).mapped());
    tokens_.erase(hold->uuid());
    const auto own = clients_.find(hold->owner());
    own->second.erase(number);
    if (own->second.empty()) clients_.erase(own);
    forEachCount(*hold, [](auto& counts, const auto& key) {
        const auto count = counts.find(key);
        if (--count->second == 0) counts.erase(count);
    });
    return hold;
}

HoldList::Hold HoldList::take(const platform::Uuid& token) {
    const auto found = tokens_.find(token);
    return found == tokens_.end() ? nullptr : takeNumber(found->second);
}

HoldList::Hold HoldList::takeOldestOf(const ZRDLumClient& client) {
    const auto own = clients_.find(client.weak_from_this());
    return own == clients_.end() ? nullptr : takeNumber(*own->second.begin());
}

bool HoldList::has(const ZRDPlugIn& plugIn) const {
    const auto& application = plugIn.containingPath();
    return plugIns_.contains(plugIn.uuid()) || bundles_.contains(plugIn.path()) ||
           (application && applications_.contains(*application));
}

std::vector<HoldList::Hold> HoldList::all() const {
    std::vector<Hold> holds;
    for (const auto& [number, hold] : holds_) holds.push_back(hold);
    return holds;
}

}  // namespace zorvan
