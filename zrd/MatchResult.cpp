#include "zrd/MatchResult.h"

#include <algorithm>

#include "Zorvan/Helpers.h"
#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "platform/lum/Limits.h"
#include "platform/values/Cbor.h"
#include "platform/values/SliceList.h"
#include "zrd/ZRDPlugIn.h"

namespace zorvan {

using platform::Dictionary;
using platform::Value;

namespace {

/// What "overrider" and "overriding" add to a form at the most, and what stands around all forms.
constexpr std::size_t kMarks = 512;
constexpr std::size_t kFrame = 4096;

std::size_t encodedSize(const Dictionary& form) {
    if (const auto kept = form.encoded()) return kept->bytes.size();
    platform::SliceList slices;
    platform::encodeCbor(form, slices);
    return slices.size();
}

/// How a candidate's version compares with an accepted form's. Versions that are no text count as
/// missing: a candidate without one compares as equal, a form without one is older than any.
int compareVersions(const Value* candidate, const Value* accepted) {
    if (!candidate || !candidate->string()) return 0;
    if (!accepted || !accepted->string()) return 1;
    return compareVersionString(*candidate->string(), *accepted->string());
}

}  // namespace

MatchResult::MatchResult(std::uint64_t flags, std::size_t expected) : flags_(flags) {
    accepted_.reserve(expected);
    byIdentifier_.reserve(expected);
}

bool MatchResult::wins(const ZRDPlugIn& plugIn, const Dictionary& accepted,
                       int versionOrder) const {
    if (versionOrder != 0) return versionOrder > 0;
    const Value* resident = accepted.find(form::kSystemResident);
    if (plugIn.onSystemVolume() && !(resident && platform::equalsTrue(*resident))) return true;
    const Value* modified = accepted.find(form::kLastModified);
    return plugIn.lastModified() > (modified ? modified->numberAsInteger().value_or(0) : 0);
}

bool MatchResult::admit(const ZRDPlugIn& plugIn) {
    constexpr std::uint64_t kKeepAll = ZRDiscoverVersions | ZRDiscoverDuplicates;
    rivals_ = &byIdentifier_[plugIn.identifier()];
    beaten_.reset();
    if ((flags_ & kKeepAll) == kKeepAll) return true;
    for (std::size_t index = rivals_->first; index != kNone; index = accepted_[index].next) {
        Accepted& rival = accepted_[index];
        if (rival.displaced) continue;
        int order = compareVersions(plugIn.version(), rival.form.find(form::kVersion));
        if ((flags_ & ZRDiscoverVersions) && order != 0) continue;
        rival.displaced = wins(plugIn, rival.form, order);
        if (!rival.displaced) return false;
        bytes_ -= rival.bytes;
        beaten_ = index;
        return true;
    }
    return true;
}

bool MatchResult::append(std::shared_ptr<ZRDPlugIn> plugIn, Dictionary form) {
    const std::size_t bytes = encodedSize(form) + kMarks;
    if (bytes_ + bytes > platform::lum::kMaxReplyPayload - kFrame) {
        // Better the one that it would have beaten than neither.
        if (beaten_) {
            accepted_[*beaten_].displaced = false;
            bytes_ += accepted_[*beaten_].bytes;
        }
        return false;
    }
    bytes_ += bytes;
    std::size_t index = accepted_.size();
    (rivals_->first == kNone ? rivals_->first : accepted_[rivals_->last].next) = index;
    rivals_->last = index;
    const Value* replaced = plugIn->replaced();
    accepted_.push_back({std::move(plugIn), std::move(form), bytes});
    if (!replaced) return true;
    if (replaced->string()) replacers_[replaced->string()->string()] = index;
    if (!replaced->array()) return true;
    for (const Value& element : *replaced->array()) {
        if (element.string()) replacers_[element.string()->string()] = index;
    }
    return true;
}

bool MatchResult::replace(std::size_t number, Dictionary form) {
    Accepted& accepted = accepted_[number];
    const std::size_t bytes = encodedSize(form) + kMarks;
    const std::size_t others = bytes_ - accepted.bytes;
    if (others + bytes > platform::lum::kMaxReplyPayload - kFrame) return false;
    bytes_ = others + bytes;
    accepted.bytes = bytes;
    accepted.form = std::move(form);
    return true;
}

void MatchResult::linkOverrides() {
    if (replacers_.empty()) return;
    for (Accepted& accepted : accepted_) {
        if (accepted.displaced) continue;
        auto replacer = replacers_.find(accepted.plugIn->identifier());
        if (replacer == replacers_.end()) continue;
        Accepted& overrider = accepted_[replacer->second];
        const std::string uuid = overrider.plugIn->uuid().string();
        accepted.form.set(form::kOverrider, uuid);
        overrider.form.set(form::kOverriding, accepted.plugIn->identifier());
        EVLOG_INFO(ops(), "plug-in {} overrides {}", pub(uuid), pub(accepted.plugIn->uuid()));
    }
}

platform::Array MatchResult::takeForms() {
    std::vector<Value> forms;
    forms.reserve(accepted_.size());
    for (Accepted& accepted : accepted_)
        if (!accepted.displaced) forms.emplace_back(std::move(accepted.form));
    return platform::Array(std::move(forms));
}

}  // namespace zorvan
