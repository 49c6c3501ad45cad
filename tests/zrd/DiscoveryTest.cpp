// The walk of the candidates: its gates, and what becomes of those that pass them.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Zorvan/Keys.h"
#include "platform/values/Cbor.h"
#include "tests/zrd/Fakes.h"
#include "zrd/CandidateGates.h"
#include "zrd/MatchResult.h"

namespace zorvan {

namespace {

using testing::ElementsAre;

class GatesTest : public testing::Test {
  protected:
    std::string closed(const platform::TDPlugInProxyRef& proxy) {
        query_.rules.emplace(rules_, nullptr);
        query_.host = &host_;
        query_.isOnHold = [this](const ZRDPlugIn&) { return isOnHold_; };
        const CandidateGate* gate = firstClosedGate(*world_.record(proxy), query_);
        return gate ? std::string(gate->name) : "";
    }

    FakeWorld world_;
    FakeHost host_;
    Dictionary rules_;
    CandidateQuery query_;
    bool isOnHold_ = true;
};

TEST_F(GatesTest, ACandidateMeetsThemInOrderUnlessAllAreAskedFor) {
    // Fails at every gate; what is mended below opens one after another.
    auto proxy = makeProxy("com.a", {}, {{"Dedicated", true}, {"VXExtensionHostEntitlement", "e"}});
    rules_ = {{"VXExtensionIdentifier", "com.b"}};
    for (const char* top : {"other", "top"})
        query_.exclusions.emplace_back(Dictionary{{"Top", top}}, nullptr);
    query_.hostPlugInsPath = "/Apps/Other.app/PlugIns";
    query_.flags = ZRDiscoverSystemOnly;
    auto data = makeProxy("com.a", {}, {{"Dedicated", true}});
    data->bundlePath = "/System/a.appex";
    data->containingApplication.reset();
    EXPECT_EQ(closed(data), "application");
    EXPECT_EQ(closed(proxy), "system-only");
    data->onSystemPartition = proxy->onSystemPartition = true;
    EXPECT_EQ(closed(data), "dedicated");
    EXPECT_EQ(closed(proxy), "dedicated");
    proxy->onSystemPartition = false;
    query_.flags = 0;
    query_.hostPlugInsPath.reset();
    EXPECT_EQ(closed(proxy), "dedicated");
    query_.hostPlugInsPath = "/Apps/Host.app/PlugIns";
    EXPECT_EQ(closed(proxy), "holds");
    isOnHold_ = false;
    EXPECT_EQ(closed(proxy), "rules");

    rules_ = {};
    EXPECT_EQ(closed(proxy), "exclusions");
    query_.flags = ZRDiscoverAll;
    EXPECT_EQ(closed(proxy), "exclusions");
    query_.exclusions.clear();
    query_.hostPlugInsPath.reset();
    isOnHold_ = true;
    EXPECT_EQ(closed(proxy), "");
    isOnHold_ = false;
    query_.flags = 0;
    query_.hostPlugInsPath = "/Apps/Host.app/PlugIns";
    EXPECT_EQ(closed(proxy), "admission");
    host_.entitlements = {{"e", true}};
    EXPECT_EQ(closed(proxy), "");
}

class MatchResultTest : public testing::Test {
  protected:
    struct Candidate {
        const char* identifier;
        Value version;
        const char* name;
        bool system = false;
        int modified = 0;
        std::optional<Value> replaces = std::nullopt;
    };

    static void add(MatchResult& result, const FakeWorld& world, const Candidate& candidate) {
        auto proxy = makeProxy(candidate.identifier, {{"VXExtensionVersion", candidate.version}});
        proxy->localizedName = candidate.name;
        proxy->onSystemPartition = candidate.system;
        proxy->registrationDate = {static_cast<double>(candidate.modified)};
        if (candidate.replaces)
            proxy->entitlements = Dictionary{{entitlement::kReplacePlugIn, *candidate.replaces}};
        auto plugIn = world.record(proxy);
        std::optional<ZRError> error;
        auto form = plugIn->exportForm(error);
        if (result.admit(*plugIn)) result.append(plugIn, *form);
    }

    /// The names of the accepted forms, with "+" for an overrider and ">" for what is overridden.
    static std::vector<std::string> outcome(std::uint64_t flags,
                                            const std::vector<Candidate>& candidates) {
        FakeWorld world;
        MatchResult result(flags, 0);
        for (const Candidate& candidate : candidates) add(result, world, candidate);
        result.linkOverrides();
        std::vector<std::string> names;
        const Array forms = result.takeForms();
        for (const Value& value : forms) {
            const Dictionary& form = *value.dictionary();
            const Value* overriding = form.find("overriding");
            names.push_back(form.find("localizedDisplayName")->string()->string() +
                            (form.contains("overrider") ? "+" : "") +
                            (overriding ? ">" + overriding->string()->string() : ""));
        }
        return names;
    }
};

TEST_F(MatchResultTest, OneAnIdentifierUnlessFlagsKeepMore) {
    const std::vector<Candidate> candidates{{"a", "1.2", "old"},  {"b", "1", "other"},
                                            {"a", "1.10", "new"}, {"a", "1.3", "mid"},
                                            {"A", "1", "case"},   {"a", "1.10", "twin"}};
    EXPECT_THAT(outcome(0, candidates), ElementsAre("other", "new", "case"));
    EXPECT_THAT(outcome(ZRDiscoverDuplicates, candidates), ElementsAre("other", "new", "case"));
    EXPECT_THAT(outcome(ZRDiscoverVersions, candidates),
                ElementsAre("old", "other", "new", "mid", "case"));
    EXPECT_THAT(outcome(ZRDiscoverVersions | ZRDiscoverDuplicates, candidates),
                ElementsAre("old", "other", "new", "mid", "case", "twin"));
}

TEST_F(MatchResultTest, EqualVersionsAreDecidedByTheSystemVolumeThenByTheTime) {
    const Candidate plain{"a", "1", "plain", false, 5}, twin{"a", "1", "twin", false, 5};
    const Candidate later{"a", "1", "later", false, 6}, system{"a", "1", "system", true, 1};
    const Candidate newSystem{"a", "1", "newSystem", true, 2};
    for (std::uint64_t flags : {std::uint64_t{0}, std::uint64_t{ZRDiscoverVersions}}) {
        EXPECT_THAT(outcome(flags, {plain, twin}), ElementsAre("plain"));
        EXPECT_THAT(outcome(flags, {plain, later}), ElementsAre("later"));
        EXPECT_THAT(outcome(flags, {later, plain}), ElementsAre("later"));
        EXPECT_THAT(outcome(flags, {plain, system}), ElementsAre("system"));
        EXPECT_THAT(outcome(flags, {system, plain}), ElementsAre("plain"));
        EXPECT_THAT(outcome(flags, {system, newSystem}), ElementsAre("newSystem"));
        EXPECT_THAT(outcome(flags, {newSystem, system}), ElementsAre("newSystem"));
    }
}

TEST_F(MatchResultTest, NoMoreIsAcceptedThanOneReplyHolds) {
    const Dictionary large{{"text", std::string(100u << 20, 'x')}};
    platform::keepCborEncoded(large);
    const FakeWorld world;
    MatchResult result(0, 0);
    const auto accepts = [&](const char* identifier, const Dictionary& form) {
        const auto plugIn = world.record(makeProxy(identifier, {{"VXExtensionVersion", "1"}}));
        return result.admit(*plugIn) && result.append(plugIn, form);
    };
    EXPECT_TRUE(accepts("a", large) && accepts("b", large));
    const Dictionary larger{{"a", large}, {"b", large}};
    EXPECT_FALSE(accepts("c", large) || accepts("a", larger) || result.replace(1, larger));
    EXPECT_TRUE(accepts("a", large)) << "it displaces the other";
    EXPECT_EQ(result.takeForms().size(), 2u);
}

TEST_F(MatchResultTest, AVersionThatIsNoTextIsMissing) {
    const Candidate text{"a", "0", "text"}, number{"a", 9, "number"},
        later{"a", 9, "later", false, 1};
    EXPECT_THAT(outcome(0, {number, text}), ElementsAre("text")) << "older than any";
    EXPECT_THAT(outcome(0, {text, number}), ElementsAre("text")) << "as old as what it meets";
    EXPECT_THAT(outcome(0, {text, later}), ElementsAre("later"));
}

TEST_F(MatchResultTest, ReplacersAreLinkedWithWhatTheyReplace) {
    const Candidate a{"a", "1", "a"}, b{"b", "1", "b"};
    EXPECT_THAT(outcome(0, {a, {"r", "1", "r", false, 0, "a"}}), ElementsAre("a+", "r>a"));
    EXPECT_THAT(outcome(0, {{"r", "1", "r", false, 0, Array{"gone", 1, "b"}}, a, b}),
                ElementsAre("r>b", "a", "b+"));
    EXPECT_THAT(outcome(0, {a, {"r", "1", "r", false, 0, 7}}), ElementsAre("a", "r"));
    // The later replacer takes the place of the earlier one in the table.
    EXPECT_THAT(outcome(0, {{"r", "1", "r", false, 0, "a"}, {"s", "1", "s", false, 0, "a"}, a}),
                ElementsAre("r", "s>a", "a+"));
    // A replacer that was displaced is still named.
    EXPECT_THAT(outcome(0, {a, {"r", "1", "r", false, 0, "a"}, {"r", "2", "r2"}}),
                ElementsAre("a+", "r2"));
}

}  // namespace

}  // namespace zorvan
