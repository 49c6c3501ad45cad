// The request "match".

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "Zorvan/ZRDaemonClient.h"
#include "zrd/CandidateGates.h"
#include "zrd/MatchResult.h"
#include "zrd/Probes.h"
#include "zrd/Transaction.h"
#include "zrd/ZRDLumClient.h"
#include "zrd/ZRDPlugIn.h"
#include "zrd/ZRDServer.h"

namespace zorvan {

using platform::Dictionary;
using platform::Value;

namespace {

/// Matching costs candidates times rules, and everybody waits for it.
constexpr std::size_t kMaxRuleValues = 4096;

bool areRules(const Value& value) {
    return value.dictionary() && platform::countValues(value, kMaxRuleValues) <= kMaxRuleValues &&
           platform::isPropertyList(value);
}

/// The dictionaries of a stored exclusions value; anything else in it excludes nothing.
std::vector<Dictionary> exclusionRules(const std::optional<Value>& stored) {
    std::vector<Dictionary> rules;
    if (!stored || !stored->array()) return rules;
    for (const Value& element : *stored->array()) {
        if (element.dictionary()) rules.push_back(*element.dictionary());
    }
    return rules;
}

}  // namespace

void Transaction::matchPlugIns() {
    const Value* rules = request_.find(message::kRules);
    if (rules && !areRules(*rules)) {
        return fail(kZRErrorInvalidRequest, "invalid request format (bad rules dictionary)");
    }
    CandidateQuery query;
    query.rules = rules ? rules->dictionary() : nullptr;
    query.flags = unsignedUnder(message::kFlags);
    if ((query.flags & ZRDiscoverAll) &&
        (!client_->hasEntitlement(entitlement::kManager) || client_->isSandboxed())) {
        return fail(kZRErrorDenied, "unauthorized discovery flag (ZRDiscoverAll)");
    }
    query.exclusions = exclusionRules(server().userPrefs().exclusions());
    query.host = client_.get();
    query.isOnHold = [this](const ZRDPlugIn& plugIn) { return server().holdOnPlugIn(plugIn); };
    if (client_->bundle()) query.hostPlugInsPath = client_->bundle()->plugInsPath();

    // Before the candidates: it says of their records that they hold still, not of older ones.
    const auto untouched = server().services().workspace->untouchedBundles();
    auto candidates = server().findPlugIns(query.rules).value_or(ZRDPlugInList());
    probes::discoverRaw(static_cast<unsigned int>(candidates.size()));
    MatchResult result(query.flags, candidates.size());
    std::size_t leftOut = 0;
    for (const auto& plugIn : candidates) {
        if (firstClosedGate(*plugIn, query)) continue;
        std::optional<ZRError> error;
        auto draft = plugIn->draftForm(untouched, error);
        if (error) {
            EVLOG_ERROR(ops(), "failed to export matching plug-in {}: {}", pub(plugIn->uuid()),
                        pub(*error));
        }
        if (!draft || !result.admit(*plugIn)) continue;
        // Only who has won is given tokens.
        Dictionary form = plugIn->completedForm(*std::move(draft));
        addAnnotationForPlugIn(*plugIn, form);
        if (!result.append(plugIn, std::move(form))) ++leftOut;
    }
    if (leftOut != 0)
        EVLOG_ERROR(ops(), "leaving {} plug-ins out of a match that no reply can hold", leftOut);
    result.linkOverrides();
    EVLOG_INFO(ops(), "match returned {} plug-ins", result.size());
    if (auto matches =
            ZRDaemonClient::convertToLum(result.forms(), static_cast<std::int64_t>(version()))) {
        reply_.set(message::kMatches, *std::move(matches));
    }
    EVLOG_DEBUG(ops(), "reply marshalled");
    done();
}

}  // namespace zorvan
