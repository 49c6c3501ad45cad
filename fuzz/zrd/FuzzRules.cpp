// Rules that a host sends: they hold when each of them holds, and the registry's index leaves out
// nothing that they fit.
// Covers: zrd/ZRDPlugInMatching.cpp zrd/RuleSet.cpp zrd/TextPatterns.cpp Zorvan/Helpers.cpp

#include <algorithm>

#include "fuzz/Support.h"
#include "platform/tandry/Snapshot.h"
#include "tests/zrd/Fakes.h"
#include "zrd/RuleSet.h"

using namespace platform;

namespace {

/// A plug-in of an application, one of the system, and so many more that keys get an index.
struct Candidates {
    Candidates() {
        const auto proxy = zorvan::makeProxy("com.a", {{"V", "1.10"},
                                                       {"VXExtensionPointIdentifier", "p.01"},
                                                       {"List", Array{7, "a", "b", "p2"}},
                                                       {"Yes", true},
                                                       {"No", 0.0},
                                                       {"Type", "png"},
                                                       {"Rule", Dictionary{{"image", 2}}}});
        proxy->entitlements = Dictionary{{"on", true}, {"text", "t"}};
        world.annotations->stored["com.a"] = Dictionary{{"election", 0x101}};
        add(proxy, "p.01");
        const auto system = zorvan::makeProxy("com.b", {{"VXExtensionPointIdentifier", "q"}});
        system->bundlePath = "/System/b.appex";
        system->containingApplication = nullptr;
        add(system, "q");
        for (int i = 0; i < 66; ++i) {
            const std::string name = "com.c" + std::to_string(i);
            add(zorvan::makeProxy(name, {{"V", std::to_string(i)}, {"No", i % 3}}), "");
        }
    }
    void add(const std::shared_ptr<TDPlugInProxy>& proxy, const std::string& point) {
        tandry::PlugInEntry entry;
        entry.record = proxy;
        entry.points = point + '\0';
        state.plugIns.emplace(*proxy->bundlePath, entry);
        plugIns.push_back(world.record(proxy));
        fuzz::require(bool(plugIns.back()));
    }
    zorvan::FakeWorld world;
    tandry::RegistryState state;
    std::vector<std::shared_ptr<zorvan::ZRDPlugIn>> plugIns;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const Candidates candidates;
    static const tandry::Snapshot snapshot(candidates.state);
    const Dictionary rules = fuzz::dictionaryIn(fuzz::text(data, size));
    (void)zorvan::RuleSet::isAffordable(rules);
    const auto found = snapshot.candidates(rules);
    for (const auto& plugIn : candidates.plugIns) {
        const bool holds = plugIn->match(&rules);
        const auto each = std::ranges::count_if(rules, [&](const auto& rule) {
            return plugIn->matchKey(rule.first.string(), rule.second);
        });
        fuzz::require(holds == (static_cast<std::size_t>(each) == rules.size()));
        if (holds) fuzz::require(std::ranges::find(found, plugIn->tdproxy()) != found.end());
    }
    return 0;
}
