#include "zrd/MatchResult.h"

#include <algorithm>

#include "Zorvan/Helpers.h"
#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "zrd/ZRDPlugIn.h"

namespace zorvan {

using platform::Dictionary;
using platform::Value;

namespace {

/// How a candidate's version compares with an accepted form's. Versions that are no text count as
/// missing: a candidate without one compares as equal, a form without one is older than any.
int compareVersions(const Value* candidate, const Value* accepted) {
    if (!candidate || !candidate->string()) return 0;
    if (!accepted || !accepted->string()) return 1;
    return compareVersionString(*candidate->string(), *accepted->string());
}

}  // namespace

bool MatchResult::wins(const ZRDPlugIn& plugIn, const Dictionary& accepted,
                       int versionOrder) const {
    if (versionOrder != 0) return versionOrder > 0;
    const Value* resident = accepted.find(form::kSystemResident);
    if (plugIn.onSystemVolume() && !(resident && platform::equalsTrue(*resident))) return true;
    const Value* modified = accepted.find(form::kLastModified);
    return plugIn.lastModified() > (modified ? modified->numberAsInteger().value_or(0) : 0);
}

bool MatchResult::admit(const ZRDPlugIn& plugIn) {
    auto found = byIdentifier_.find(plugIn.identifier());
    if (found == byIdentifier_.end()) return true;
    auto& rivals = found->second;
    for (auto index = rivals.begin(); index != rivals.end(); ++index) {
        const Dictionary& rival = *accepted_[*index];
        int order = compareVersions(plugIn.version(), rival.find(form::kVersion));
        if ((flags_ & ZRDiscoverVersions) && (order != 0 || (flags_ & ZRDiscoverDuplicates)))
            continue;
        if (!wins(plugIn, rival, order)) return false;
        accepted_[*index] = nullptr;
        rivals.erase(index);
        return true;
    }
    return true;
}

void MatchResult::append(const ZRDPlugIn& plugIn, Dictionary form) {
    auto shared = std::make_shared<Dictionary>(std::move(form));
    byIdentifier_[plugIn.identifier()].push_back(accepted_.size());
    accepted_.push_back(shared);
    const Value* replaced = plugIn.valueForEntitlement(entitlement::kReplacePlugIn);
    if (!replaced) return;
    if (replaced->string()) replacers_[*replaced->string()] = shared;
    if (!replaced->array()) return;
    for (const Value& element : *replaced->array()) {
        if (element.string()) replacers_[*element.string()] = shared;
    }
}

void MatchResult::linkOverrides() {
    if (replacers_.empty()) return;
    for (const FormRef& form : accepted_) {
        if (!form) continue;
        const Value identifier = *form->find(form::kIdentifier);
        auto replacer = replacers_.find(*identifier.string());
        if (replacer == replacers_.end()) continue;
        const Value uuid = *replacer->second->find(form::kUuid);
        form->set(form::kOverrider, uuid);
        replacer->second->set(form::kOverriding, identifier);
        EVLOG_INFO(ops(), "plug-in {} overrides {}", pub(uuid), pub(*form->find(form::kUuid)));
    }
}

std::size_t MatchResult::size() const {
    return accepted_.size() - std::ranges::count(accepted_, nullptr);
}

platform::Array MatchResult::forms() const {
    std::vector<Value> forms;
    forms.reserve(accepted_.size());
    for (const FormRef& form : accepted_) {
        if (form) forms.emplace_back(*form);
    }
    return platform::Array(std::move(forms));
}

}  // namespace zorvan
