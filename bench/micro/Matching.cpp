#include <benchmark/benchmark.h>

#include <memory>

#include "Zorvan/Keys.h"
#include "bench/InfoPlist.h"
#include "platform/plist/PropertyList.h"
#include "zrd/PlugInContext.h"
#include "zrd/RuleSet.h"
#include "zrd/ZRDPlugIn.h"

namespace {

std::shared_ptr<zorvan::ZRDPlugIn> plugIn() {
    auto application = std::make_shared<platform::TDApplicationProxy>();
    application->bundlePath = "/Applications/Application.app";
    auto proxy = std::make_shared<platform::TDPlugInProxy>();
    proxy->plugInUuid = platform::Uuid::random();
    proxy->bundlePath = application->bundlePath + "/PlugIns/PlugIn.appex";
    proxy->plugInIdentifier = "org.example.plug-in";
    proxy->containingApplication = application;
    proxy->dataContainerPath = "/Containers/org.example.plug-in";
    const auto info = *platform::parsePropertyList(bench::plugInInfo(1, "org.example.point", ""));
    proxy->infoPlist = platform::LazyDictionary(*info.dictionary());
    return zorvan::ZRDPlugIn::initWithTDData(proxy, std::make_shared<zorvan::PlugInContext>());
}

/// One candidate against the rules of a usual host: a list of categories and a flag.
void matchTwoRules(benchmark::State& state) {
    const auto candidate = plugIn();
    if (!candidate) return state.SkipWithError("no plug-in");
    const platform::Dictionary rules{
        {"ExampleCategory", platform::Array{"category-0", "category-1"}},
        {"ExampleSupportsPreview", true},
    };
    const zorvan::RuleSet set(rules, nullptr);
    if (!candidate->match(set)) return state.SkipWithError("no match");
    for (auto _ : state) benchmark::DoNotOptimize(candidate->match(set));
}
BENCHMARK(matchTwoRules);

}  // namespace
