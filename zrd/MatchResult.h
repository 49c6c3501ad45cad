#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/Value.h"

namespace zorvan {

class ZRDPlugIn;

/// The forms that one discovery request has accepted so far: one an identifier unless the flags
/// keep more, with plug-ins that replace others marked on both sides at the end. Lives as long as
/// its request, on the service queue.
class MatchResult {
  public:
    /// `flags` are the request's ZRDiscover… bits.
    explicit MatchResult(std::uint64_t flags) : flags_(flags) {}

    /// Whether the plug-in wins against the accepted forms of its identifier; the form that it
    /// beats is taken out.
    bool admit(const ZRDPlugIn& plugIn);
    /// Accepts the form of a plug-in that was admitted.
    void append(const ZRDPlugIn& plugIn, platform::Dictionary form);
    /// Sets "overrider" on the form of each replaced plug-in and "overriding" on its replacer's.
    void linkOverrides();

    std::size_t size() const;
    /// The accepted forms, in the order of their acceptance.
    platform::Array forms() const;

  private:
    using FormRef = std::shared_ptr<platform::Dictionary>;

    bool wins(const ZRDPlugIn& plugIn, const platform::Dictionary& accepted,
              int versionOrder) const;

    std::uint64_t flags_;
    std::vector<FormRef> accepted_;  // null: displaced since
    std::unordered_map<std::string, std::vector<std::size_t>>
        byIdentifier_;  // indexes of accepted_
    /// The form of the plug-in that replaces an identifier. It stays here when it is displaced.
    std::unordered_map<std::string, FormRef> replacers_;
};

}  // namespace zorvan
