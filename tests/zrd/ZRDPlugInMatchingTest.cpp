#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>

#include "tests/Zorvan/LogLines.h"
#include "tests/zrd/Fakes.h"
#include "zrd/RuleSet.h"

namespace zorvan {

namespace {

using testing::ElementsAre;

class MatchingTest : public testing::Test {
  protected:
    std::shared_ptr<ZRDPlugIn> makePlugIn() {
        proxy_->entitlements = Dictionary{{"on", true}, {"off", false}, {"text", "t"}};
        return world_.record(proxy_);
    }

    FakeWorld world_;
    std::shared_ptr<platform::TDPlugInProxy> proxy_ =
        makeProxy("com.a",
                  {{"V", "1.10"},
                   {"Name", "abc"},
                   {"Blank", ""},
                   {"Yes", true},
                   {"No", false},
                   {"Zero", 0.0},
                   {"Two", 2},
                   {"List", Array{7, "a", "b"}},
                   {"None", Array{}},
                   {"Type", "png"},
                   {"Kind", "image"},
                   {"Rule", Dictionary{{"image", 2}}},
                   {"on", "attribute"},
                   {"off", "attribute"},
                   {"VXExtensionPointIdentifier", "attribute"}},
                  {{"VXExtensionPointIdentifier", "plug-in"}});
};

TEST_F(MatchingTest, EveryOperatorKeyFormAndPatternShape) {
    auto plugIn = makePlugIn();
    const std::string uuid = proxy_->plugInUuid.string();
    const Dictionary offer{{"items", Array{Dictionary{{"types", Array{"png"}}}}}};
    struct Case {
        const char* key;
        Value pattern;
        bool holds;
    };
    // clang-format off
    const Case cases[] = {
        // Operators, with numeric runs and the longer operators first.
        {"V", "1.10", true}, {"V", "=1.10", true}, {"V", "1.1", false}, {"V", "1.010", true},
        {"V", ">=1.10", true}, {"V", ">=1.9", true}, {"V", ">=2", false}, {"V", ">1.10", false},
        {"V", ">1.9", true}, {"V", "<=1.10", true}, {"V", "<=1.9", false}, {"V", "<1.10", false},
        {"V", "<1.11", true}, {"V", "<>1.10", false}, {"V", "<>1.9", true}, {"V", "==1.10", false},
        {"Name", "abc", true}, {"Name", "ABC", false}, {"Name", "ab", false}, {"Name", "", false},
        {"Blank", "=", true}, {"Name", "=", false}, {"Blank", "<>", false}, {"Name", "<>", true},
        // Types.
        {"Type", "?UT-CONFORMS:image", true}, {"Type", "?UT-CONFORMS:png", true},
        {"Type", "?UT-CONFORMS:text", false}, {"Type", "?UT-IS:png", true},
        {"Type", "?UT-IS:image", false}, {"Kind", "?UT-IS:png", true},
        // Booleans by value.
        {"Yes", true, true}, {"Yes", 1, true}, {"Yes", 1.0, true}, {"Yes", false, false},
        {"No", false, true}, {"No", 0, true}, {"No", true, false}, {"Zero", false, true},
        {"Zero", true, false}, {"Two", true, true}, {"Two", false, false}, {"Name", true, true},
        {"Name", false, false}, {"List", true, true}, {"None", true, true}, {"Gone", true, false},
        {"Gone", false, true}, {"Gone", "x", false}, {"Gone", "<>x", false}, {"Gone", offer, false},
        // Lists on either side, and elements that are no text.
        {"List", "b", true}, {"List", "c", false}, {"List", "7", false}, {"None", "<>x", false},
        {"Name", Array{"x", "abc"}, true}, {"Name", Array{}, false}, {"Name", Array{true}, false},
        {"List", Array{"x", "a"}, true}, {"List", Array{"x", 7}, false}, {"Name", 2, false},
        {"Two", "2", false}, {"Two", 2, false}, {"Rule", "image", false}, {"Two", Array{2}, false},
        // Many alternatives, which are looked up, and bounds, of which the widest counts.
        {"V", Array{"a", "b", "c", "d", "=01.010"}, true}, {"V", Array{"a", "b", "c", "d", "1.1"}, false},
        {"List", Array{"x", "y", "z", "0", "=b"}, true}, {"Blank", Array{"a", "b", "c", "d", "="}, true},
        {"V", Array{"<1.2", "<=1.10", "<1"}, true}, {"V", Array{"<1.2", "<1.10"}, false},
        {"V", Array{">3", ">=1.10"}, true}, {"V", Array{">=2", ">1.10"}, false},
        {"V", Array{"<>1.10", "<>01.10"}, false}, {"V", Array{"<>1.10", "<>1.9"}, true},
        {"Kind", Array{"?UT-IS:png", "?x"}, true}, {"Type", Array{"?UT-CONFORMS:a", "?UT-CONFORMS:image"}, true},
        // Activation rules.
        {"Rule", offer, true}, {"Yes", offer, true}, {"No", offer, false}, {"Name", offer, false},
        // Key forms.
        {"ENTITLEMENT:on", true, true}, {"ENTITLEMENT:off", true, false},
        {"ENTITLEMENT:off", false, true}, {"ENTITLEMENT:text", "t", true},
        {"ENTITLEMENT:gone", true, false}, {"ENTITLEMENT:V", "1.10", false}, {"off", true, true},
        {"VXExtensionIdentifier", "com.a", true}, {"VXExtensionIdentifier", "com.A", false},
        {"com.orbel.uuid", uuid, true}, {"com.orbel.uuid", "<>" + uuid, false},
        {"VXExtensionContainingApp", "/Apps/Host.app", true},
        {"VXExtensionContainingApp", false, false}, {"Top", "top", true},
        {"VXUserElection", "0", true}, {"VXUserElection", false, false},
        {"VXExtensionPointIdentifier", "attribute", true},
        {"VXExtensionPointIdentifier", "plug-in", false},
    };
    // clang-format on
    for (const auto& [key, pattern, holds] : cases) {
        EXPECT_EQ(plugIn->matchKey(key, pattern), holds) << key << " / " << describe(pattern);
    }
}

TEST_F(MatchingTest, CostDoesNotGrowWithTheNumberOfAlternatives) {
    std::vector<Value> elements, alternatives;
    for (int i = 0; i < 1000; ++i) elements.emplace_back("element-" + std::to_string(i));
    for (int i = 0; i < 4000; ++i) alternatives.emplace_back("other-" + std::to_string(i));
    auto plugIn = world_.record(makeProxy("com.b", {{"Many", Array(elements)}}));
    const RuleSet rules({{"Many", Array(alternatives)}}, nullptr);
    const auto start = std::chrono::steady_clock::now();
    for (int i = 0; i < 100; ++i) EXPECT_FALSE(plugIn->match(rules));
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(2));
}

TEST_F(MatchingTest, AllRulesMustHold) {
    auto plugIn = makePlugIn();
    const Dictionary none, both{{"Name", "abc"}, {"V", ">1"}}, one{{"Name", "abc"}, {"V", "<1"}};
    EXPECT_TRUE(plugIn->match(nullptr) && plugIn->match(&none) && plugIn->match(&both));
    EXPECT_FALSE(plugIn->match(&one));
}

TEST_F(MatchingTest, UnknownOperatorsNeverMatchAndAreLogged) {
    auto plugIn = makePlugIn();
    LogLines log;
    EXPECT_FALSE(plugIn->matchKey("Name", "?"));
    EXPECT_FALSE(plugIn->matchKey("Name", "?UT-is:abc"));
    EXPECT_THAT(log.take(), ElementsAre("ops I: unrecognized match operator:?",
                                        "ops I: unrecognized match operator:?UT-is:abc"));
    // Those that are met before one that holds, once for each text.
    const RuleSet rules({{"List", Array{"?y", "b", "?z"}}}, nullptr);
    for (int i = 0; i < 2; ++i) EXPECT_TRUE(plugIn->match(rules));
    const std::string y = "ops I: unrecognized match operator:?y";
    const std::string z = "ops I: unrecognized match operator:?z";
    EXPECT_THAT(log.take(), ElementsAre(y, z, y, y, z, y));
    // Everybody waits meanwhile.
    Array many;
    for (int i = 0; i < 300; ++i) many.append("?");
    const RuleSet unknown({{"Name", many}}, nullptr);
    for (int i = 0; i < 2; ++i) EXPECT_FALSE(plugIn->match(unknown));
    EXPECT_EQ(log.take().size(), 300u);
}

TEST_F(MatchingTest, AMissingApplicationFailsEveryPattern) {
    proxy_->containingApplication.reset();
    proxy_->bundlePath = "/System/a.appex";
    auto plugIn = makePlugIn();
    for (Value pattern : {Value(true), Value(false), Value("<>x")})
        EXPECT_FALSE(plugIn->matchKey("VXExtensionContainingApp", pattern));
}

TEST_F(MatchingTest, ElectionDropsBits8To15AndIsSigned) {
    auto plugIn = makePlugIn();
    const std::pair<Value, const char*> cases[] = {
        {1, "1"},          {0x1FF01, "65537"}, {0x80000002, "-2147483646"}, {-1, "-65281"},
        {Value("3"), "0"}, {0x100000005, "5"}, {UINT64_MAX - 4, "-65285"},
    };
    for (const auto& [election, text] : cases) {
        world_.annotations->stored["com.a"] = {{"election", election}};
        EXPECT_TRUE(plugIn->matchKey("VXUserElection", std::string("=") + text)) << text;
    }
    world_.annotations->stored["com.a"] = {{"extension", Dictionary()}};
    EXPECT_TRUE(plugIn->matchKey("VXUserElection", "0"));
}

}  // namespace

}  // namespace zorvan
