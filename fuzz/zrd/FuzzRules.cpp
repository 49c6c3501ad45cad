// Rules that a host sends: they hold when each of them holds, and the registry's index leaves out
// nothing that they fit.
// Covers: zrd/ZRDPlugInMatching.cpp zrd/RuleSet.cpp zrd/TextPatterns.cpp Zorvan/Helpers.cpp

#include <algorithm>

#include "fuzz/Support.h"
#include "platform/tandry/Snapshot.h"
#include "tests/zrd/Fakes.h"

using namespace platform;

namespace {

struct Candidate {
    Candidate() {
        const auto proxy = zorvan::makeProxy("com.a", {{"V", "1.10"},
                                                       {"VXExtensionPointIdentifier", "p.01"},
                                                       {"List", Array{7, "a", "b", "p2"}},
                                                       {"Yes", true},
                                                       {"No", 0.0},
                                                       {"Type", "png"},
                                                       {"Rule", Dictionary{{"image", 2}}}});
        proxy->entitlements = Dictionary{{"on", true}, {"text", "t"}};
        tandry::PlugInEntry entry;
        entry.record = proxy;
        entry.points = std::string("p.01") + '\0';
        state.plugIns.emplace(*proxy->bundlePath, entry);
        plugIn = world.record(proxy);
    }
    zorvan::FakeWorld world;
    tandry::RegistryState state;
    std::shared_ptr<zorvan::ZRDPlugIn> plugIn;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const Candidate candidate;
    static const tandry::Snapshot snapshot(candidate.state);
    const Dictionary rules = fuzz::dictionaryIn(fuzz::text(data, size));
    const bool holds = candidate.plugIn->match(&rules);
    fuzz::require(holds == std::ranges::all_of(rules, [&](const auto& rule) {
                      return candidate.plugIn->matchKey(rule.first, rule.second);
                  }));
    if (holds) fuzz::require(snapshot.candidates(rules).size() == 1);
    return 0;
}
