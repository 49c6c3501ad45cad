#include "zrd/CandidateGates.h"

#include <algorithm>

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "zrd/HostProcess.h"
#include "zrd/ZRDPlugIn.h"

namespace zorvan {

namespace {

Refusal insideApplication(const ZRDPlugIn& plugIn, const CandidateQuery&) {
    if (plugIn.onSystemVolume() || plugIn.containingPath()) return std::nullopt;
    return "it is neither on the system volume nor inside an application";
}

Refusal systemOnly(const ZRDPlugIn& plugIn, const CandidateQuery& query) {
    if (plugIn.onSystemVolume() || !(query.flags & ZRDiscoverSystemOnly)) return std::nullopt;
    return "it is not on the system volume";
}

Refusal dedicated(const ZRDPlugIn& plugIn, const CandidateQuery& query) {
    if (!plugIn.isDedicated()) return std::nullopt;
    if (query.hostPlugInsPath && plugIn.path().starts_with(*query.hostPlugInsPath)) {
        return std::nullopt;
    }
    return "it is dedicated to the application around it";
}

Refusal holds(const ZRDPlugIn& plugIn, const CandidateQuery& query) {
    if (!query.isOnHold(plugIn)) return std::nullopt;
    return "it is on hold";
}

Refusal rules(const ZRDPlugIn& plugIn, const CandidateQuery& query) {
    if (!query.rules || plugIn.match(*query.rules)) return std::nullopt;
    return "a rule does not hold";
}

Refusal exclusions(const ZRDPlugIn& plugIn, const CandidateQuery& query) {
    bool excluded = std::ranges::any_of(query.exclusions,
                                        [&](const RuleSet& rules) { return plugIn.match(rules); });
    if (!excluded) return std::nullopt;
    return "globally excluded";
}

void reportExclusion(const ZRDPlugIn& plugIn, const CandidateQuery& query,
                     const std::string& reason) {
    EVLOG_DEBUG(ops(), "client {} plugin {} {}", query.host->pid(), pub(plugIn.uuid()),
                pub(reason));
}

Refusal admission(const ZRDPlugIn& plugIn, const CandidateQuery& query) {
    if (!query.restriction) query.restriction.emplace(*query.host, query.types);
    return plugIn.allowForClient(*query.host, *query.restriction);
}

void reportAdmission(const ZRDPlugIn& plugIn, const CandidateQuery& query,
                     const std::string& reason) {
    EVLOG_DEBUG(ops(), "client {} cannot use plugin {}: {}", query.host->pid(), pub(plugIn.uuid()),
                pub(reason));
}

constexpr CandidateGate kGates[] = {
    {"application", true, insideApplication, nullptr},
    {"system-only", true, systemOnly, nullptr},
    {"dedicated", true, dedicated, nullptr},
    {"holds", true, holds, nullptr},
    {"rules", false, rules, nullptr},
    {"exclusions", false, exclusions, reportExclusion},
    {"admission", true, admission, reportAdmission},
};

}  // namespace

std::span<const CandidateGate> candidateGates() {
    return kGates;
}

const CandidateGate* firstClosedGate(const ZRDPlugIn& plugIn, const CandidateQuery& query) {
    bool all = query.flags & ZRDiscoverAll;
    for (const CandidateGate& gate : candidateGates()) {
        if (all && gate.openForAll) continue;
        if (auto reason = gate.check(plugIn, query)) {
            if (gate.report) gate.report(plugIn, query, *reason);
            return &gate;
        }
    }
    return nullptr;
}

}  // namespace zorvan
