#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "zrd/HostRestriction.h"
#include "zrd/RuleSet.h"

namespace zorvan {

class HostProcess;
class ZRDPlugIn;

/// What one discovery request asks of every candidate. Borrows what it points to.
struct CandidateQuery {
    std::optional<RuleSet> rules;
    std::uint64_t flags = 0;  // ZRDiscover… bits
    std::vector<RuleSet> exclusions;
    const HostProcess* host = nullptr;
    mutable std::optional<HostRestriction> restriction;  // of the host, made when it is asked
    std::shared_ptr<platform::Types> types;
    std::optional<std::string> hostPlugInsPath;  // of the plug-ins inside the host's own bundle
    std::function<bool(const ZRDPlugIn&)> isOnHold;
};

/// Why a gate turns a candidate away, in words for people; none: the candidate passes.
using Refusal = std::optional<std::string>;

/// One step of the walk that decides whether a host gets to see a plug-in.
struct CandidateGate {
    std::string_view name;
    /// Whether ZRDiscoverAll opens the gate.
    bool openForAll;
    Refusal (*check)(const ZRDPlugIn& plugIn, const CandidateQuery& query);
    /// Logs a refusal; null for gates whose refusals are the everyday case.
    void (*report)(const ZRDPlugIn& plugIn, const CandidateQuery& query, const std::string& reason);
};

/// All gates, in the order in which a candidate meets them.
std::span<const CandidateGate> candidateGates();

/// The first gate that turns the candidate away, whose refusal has been logged then, or null.
const CandidateGate* firstClosedGate(const ZRDPlugIn& plugIn, const CandidateQuery& query);

}  // namespace zorvan
