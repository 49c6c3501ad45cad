// The request "match".

#include <algorithm>
#include <random>

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

/// Plug-ins that share resources, up to 64 each, for which tokens are issued in one go.
constexpr std::size_t kMostSharing = 4;

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

/// What a match has found, while it waits for tokens.
struct Transaction::Matching {
    /// An accepted form that has none yet.
    struct Late {
        std::size_t number;  // in the result
        std::shared_ptr<ZRDPlugIn> plugIn;
        ZRDPlugIn::Draft draft;
        bool isComplete = false;
    };

    Matching(std::uint64_t flags, std::size_t expected) : result(flags, expected) {}

    MatchResult result;
    std::size_t leftOut = 0;
    std::size_t unfit = 0;    // complete forms that the reply has no room for
    std::size_t sharing = 0;  // plug-ins that were met and share resources
    std::vector<Late> late;
};

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
    const auto matching = std::make_shared<Matching>(query.flags, candidates.size());
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
        if (draft && matching->result.admit(*plugIn)) accept(plugIn, *draft, *matching);
    }
    if (matching->leftOut != 0)
        EVLOG_ERROR(ops(), "leaving {} plug-ins out of a match that no reply can hold",
                    matching->leftOut);
    completeForms(matching, 0);
}

/// Only who has won is given tokens. Those that are issued for each answer anew come later where
/// they are many: nobody waits for all of them.
void Transaction::accept(const std::shared_ptr<ZRDPlugIn>& plugIn, ZRDPlugInDraft& draft,
                         Matching& matching) {
    const bool mustWait = plugIn->sharesResources() && matching.sharing++ >= kMostSharing;
    auto form = mustWait ? std::nullopt : plugIn->completedForm(draft, platform::Wait::Never);
    const bool isLate = !form;
    if (isLate) {
        form = draft.form;
        form->set(form::kExtensions, Dictionary());
    }
    addAnnotationForPlugIn(*plugIn, *form);
    if (!matching.result.append(plugIn, *std::move(form)))
        ++matching.leftOut;
    else if (isLate)
        matching.late.push_back({matching.result.lastAccepted(), plugIn, std::move(draft)});
}

/// Gives tokens to some; then others have their turn.
void Transaction::completeForms(const std::shared_ptr<Matching>& matching, std::size_t first) {
    if (!client_->acceptWork()) return;
    const std::size_t end = std::min(first + kMostSharing, matching->late.size());
    for (std::size_t next = first; next < end; ++next) {
        auto& late = matching->late[next];
        late.isComplete = !matching->result.stands(late.number);
        if (late.isComplete) continue;
        auto form = late.plugIn->completedForm(late.draft, platform::Wait::Never);
        if (!form) continue;
        addAnnotationForPlugIn(*late.plugIn, *form);
        if (!matching->result.replace(late.number, *std::move(form))) ++matching->unfit;
        late.isComplete = true;
    }
    if (end == matching->late.size()) return completeLateForms(matching);
    server().submitWork(
        [self = shared_from_this(), matching, end] { self->completeForms(matching, end); });
}

/// Gives tokens to those whose file systems have to be asked, beside the service queue.
void Transaction::completeLateForms(const std::shared_ptr<Matching>& matching) {
    std::erase_if(matching->late, [](const auto& late) { return late.isComplete; });
    if (matching->late.empty()) return answerMatch(matching->result);
    // Those at the end may not get their turn in time: they are others in each match.
    std::shuffle(matching->late.begin(), matching->late.end(), std::random_device());
    const auto forms = std::make_shared<std::vector<Dictionary>>(matching->late.size());
    std::vector<platform::PlaceLooks::Look> looks;
    for (std::size_t i = 0; i < forms->size(); ++i) {
        const auto& late = matching->late[i];
        looks.push_back(
            {late.plugIn->path(), [plugIn = late.plugIn, draft = late.draft, forms, i]() mutable {
                 (*forms)[i] = *plugIn->completedForm(draft, platform::Wait::Allowed);
             }});
    }
    lookAtBundles(std::move(looks), [this, matching, forms](const std::vector<bool>& done) {
        for (std::size_t i = 0; i < done.size(); ++i) {
            const auto& late = matching->late[i];
            if (!done[i]) {
                EVLOG_INFO(ops(),
                           "no extensions for plug-in at {}: its file system does not answer",
                           late.plugIn->path());
                continue;
            }
            addAnnotationForPlugIn(*late.plugIn, (*forms)[i]);
            if (!matching->result.replace(late.number, std::move((*forms)[i]))) ++matching->unfit;
        }
        if (matching->unfit != 0)
            EVLOG_ERROR(ops(), "leaving {} plug-ins without extensions that no reply can hold",
                        matching->unfit);
        answerMatch(matching->result);
    });
}

void Transaction::answerMatch(MatchResult& result) {
    result.linkOverrides();
    auto forms = result.takeForms();
    EVLOG_INFO(ops(), "match returned {} plug-ins", forms.size());
    if (auto matches =
            ZRDaemonClient::convertToLum(std::move(forms), static_cast<std::int64_t>(version()))) {
        reply_.set(message::kMatches, *std::move(matches));
    }
    EVLOG_DEBUG(ops(), "reply marshalled");
    done();
}

}  // namespace zorvan
