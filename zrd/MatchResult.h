#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <memory_resource>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "platform/values/Value.h"

namespace zorvan {

class ZRDPlugIn;

/// The forms that one discovery request has accepted so far: one an identifier unless the flags
/// keep more, with plug-ins that replace others marked on both sides at the end. Lives as long as
/// its request, on the service queue.
class MatchResult {
  public:
    /// `flags` are the request's ZRDiscover… bits; `expected` plug-ins at the most will be
    /// accepted.
    MatchResult(std::uint64_t flags, std::size_t expected);

    /// Whether the plug-in wins against the accepted forms of its identifier; the form that it
    /// beats is taken out.
    bool admit(const ZRDPlugIn& plugIn);
    /// Accepts the form of the plug-in that was admitted last, unless one reply cannot hold it with
    /// the others: then the answer is false.
    bool append(std::shared_ptr<ZRDPlugIn> plugIn, platform::Dictionary form);
    /// The number of the form that was accepted last.
    std::size_t lastAccepted() const { return accepted_.size() - 1; }
    /// Whether an accepted form still stands, by its number.
    bool stands(std::size_t number) const { return !accepted_[number].displaced; }
    /// Puts another form of the same plug-in into the place of an accepted one, unless one reply
    /// cannot hold it with the others: then the answer is false.
    bool replace(std::size_t number, platform::Dictionary form);
    /// Sets "overrider" on the form of each replaced plug-in and "overriding" on its replacer's.
    void linkOverrides();

    /// The forms that stand, in the order of their acceptance. The last that is asked of this.
    platform::Array takeForms();

  private:
    static constexpr std::size_t kNone = ~std::size_t{0};
    /// Stays where it is, so that its index stays good, also when it is displaced.
    struct Accepted {
        std::shared_ptr<ZRDPlugIn> plugIn;
        platform::Dictionary form;
        std::size_t bytes = 0;  // that the form takes in a reply
        bool displaced = false;
        std::size_t next = kNone;  // of the same identifier
    };
    /// Those of one identifier, by their indexes.
    struct Rivals {
        std::size_t first = kNone;
        std::size_t last = kNone;
    };

    bool wins(const ZRDPlugIn& plugIn, const platform::Dictionary& accepted,
              int versionOrder) const;

    std::uint64_t flags_;
    std::vector<Accepted> accepted_;
    std::size_t bytes_ = 0;                      // of the accepted forms that were not displaced
    std::pmr::monotonic_buffer_resource nodes_;  // of the map
    /// By identifiers of plug-ins that were met.
    std::pmr::unordered_map<std::string_view, Rivals> byIdentifier_{&nodes_};
    Rivals* rivals_ = nullptr;           // of the plug-in that was admitted last
    std::optional<std::size_t> beaten_;  // by it
    /// Who replaces an identifier. It stays so when it is displaced itself.
    std::unordered_map<std::string, std::size_t> replacers_;
};

}  // namespace zorvan
