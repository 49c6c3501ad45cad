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

bool areRules(const Value& value) {
    return value.dictionary() && RuleSet::isAffordable(*value.dictionary()) &&
           platform::isPropertyList(value);
}

/// The dictionaries of a stored exclusions value; anything else in it excludes nothing.
std::vector<RuleSet> exclusionRules(const std::optional<Value>& stored,
                                    const std::shared_ptr<platform::Types>& types) {
    std::vector<RuleSet> rules;
    if (!stored || !stored->array()) return rules;
    for (const Value& element : *stored->array()) {
        if (element.dictionary()) rules.emplace_back(*element.dictionary(), types);
    }
    return rules;
}

}  // namespace

void Transaction::matchPlugIns() {
    const Value* rules = request_.find(message::kRules);
    if (rules && !areRules(*rules)) {
        return fail(kZRErrorInvalidRequest, "invalid request format (bad rules dictionary)");
    }
    const Dictionary* given = rules ? rules->dictionary() : nullptr;
    CandidateQuery query;
    query.types = server().services().types;
    query.flags = unsignedUnder(message::kFlags);
    if ((query.flags & ZRDiscoverAll) &&
        (!client_->hasEntitlement(entitlement::kManager) || client_->isSandboxed())) {
        return fail(kZRErrorDenied, "unauthorized discovery flag (ZRDiscoverAll)");
    }
    if (given) query.rules.emplace(*given, query.types);
    query.exclusions = exclusionRules(server().userPrefs().exclusions(), query.types);
    query.host = client_.get();
    query.isOnHold = [this](const ZRDPlugIn& plugIn) { return server().holdOnPlugIn(plugIn); };
    if (client_->bundle()) query.hostPlugInsPath = client_->bundle()->plugInsPath();

    // Before the candidates: it says of their records that they hold still, not of older ones.
    const auto untouched = server().services().workspace->untouchedBundles();
    auto candidates = server().findPlugIns(given).value_or(ZRDPlugInList());
    probes::discoverRaw(static_cast<unsigned int>(candidates.size()));
    MatchResult result(query.flags, candidates.size());
    std::size_t leftOut = 0;
    for (const auto& plugIn : candidates) {
        // Nobody works for a host that is gone.
        if (!client_->acceptWork()) return;
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
