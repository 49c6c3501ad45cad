#include <map>
#include <random>
#include <set>

#include "platform/tandry/CurrentSnapshot.h"
#include "platform/tandry/RuleIndexes.h"
#include "platform/values/VersionText.h"
#include "tests/platform/tandry/RegistryFixture.h"

namespace platform::tandry {
namespace {

TEST(ComparisonKey, IsTheSameForWhatComparesEqual) {
    for (auto [a, b] : {std::pair{"a.1", "a.01"}, {"0", "000"}, {"x007y00", "x7y0"}, {"", ""}})
        EXPECT_EQ(comparisonKey(a), comparisonKey(b)) << a << " / " << b;
    std::set<std::uint64_t> keys;
    for (const char* text : {"", "0", "1", "10", "100", "a", "A", "a0", "a1", "a10", "1.0", "1"})
        keys.insert(comparisonKey(text));
    EXPECT_EQ(keys.size(), 11u);
}

TEST(CurrentSnapshot, EndsTheWaitForAFirstScanThatNeverComes) {
    CurrentSnapshot current;
    auto waiting = std::async(std::launch::async, [&current] { return current.get(); });
    current.close();
    EXPECT_EQ(waiting.get(), nullptr);
}

constexpr const char* kPoint = "VXExtensionPointIdentifier";
constexpr const char* kIdentifier = "VXExtensionIdentifier";
constexpr const char* kRight = "ENTITLEMENT:right";

/// Values and queries from a small stock, so that they often meet.
class Dice {
  public:
    int roll(int sides) { return std::uniform_int_distribution(0, sides - 1)(engine_); }
    std::string text() {
        static const char* const stock[] = {"a.1", "a.01", "a.10", "A.1", "b", "007", "7"};
        return stock[roll(std::size(stock))];
    }
    Value value() {
        switch (roll(6)) {
            case 0:
                return Array{text(), 1, text()};
            case 1:
                return Value(roll(3));
            default:
                return text();
        }
    }
    std::string stringPattern() {
        static const char* const operators[] = {"",  "",  "=",  "=",  "<>",
                                                "<", ">", ">=", "<=", "?UT-IS:"};
        return operators[roll(std::size(operators))] + text();
    }
    Value pattern() {
        switch (roll(7)) {
            case 0:
                return Value(roll(3));
            case 1:
                return Dictionary{{"items", Array()}};
            case 2:
                return Array();
            case 3:
                return Array{stringPattern(), 5, stringPattern(), stringPattern()};
            default:
                return stringPattern();
        }
    }

  private:
    std::mt19937 engine_{7};
};

/// What may be accepted; types count as accepting all that is there.
bool accepts(const Value& pattern, const Value* value) {
    if (equalsFalse(pattern)) return !value || equalsFalse(*value);
    if (equalsTrue(pattern)) return value && !equalsFalse(*value);
    if (pattern.isNumber()) return false;
    if (!value) return false;
    if (const Array* alternatives = pattern.array())
        return std::any_of(
            alternatives->begin(), alternatives->end(),
            [value](const Value& element) { return element.string() && accepts(element, value); });
    const auto* text = pattern.string();
    if (!text || text->view().starts_with('?')) return true;
    if (const Array* array = value->array())
        return std::any_of(array->begin(), array->end(),
                           [&](const Value& element) { return accepts(pattern, &element); });
    const std::string_view all = text->view();
    const auto prefix = std::min(all.find_first_not_of("<>="), all.size());
    const int order =
        value->string() ? compareVersionString(*value->string(), all.substr(prefix)) : 9;
    for (const auto& [operation, orders] :
         std::map<std::string_view, std::set<int>>{{"", {0}},
                                                   {"=", {0}},
                                                   {"<>", {-1, 1}},
                                                   {"<", {-1}},
                                                   {"<=", {-1, 0}},
                                                   {">", {1}},
                                                   {">=", {0, 1}}})
        if (all.substr(0, prefix) == operation) return orders.contains(order);
    return false;
}

bool accepts(const TDPlugInProxy& plugIn, const Dictionary& query) {
    for (const auto& [key, pattern] : query) {
        const Dictionary* attributes = plugIn.attributes();
        const Value* value = attributes ? attributes->find(key) : nullptr;
        if (!value) value = plugIn.infoPlist.get().find(key);
        Value identifier(plugIn.plugInIdentifier.value_or(""));
        if (key == kIdentifier) value = &identifier;
        if (key == kRight) value = plugIn.entitlements.get().find("right");
        if (!accepts(pattern, value)) return false;
    }
    return true;
}

Dictionary someInfo(Dice& dice) {
    Dictionary extension;
    Dictionary info;
    Dictionary attributes;
    for (const char* key : {kPoint, "colour", "size"}) {
        if (dice.roll(3) == 0) attributes.set(key, dice.value());
        if (dice.roll(3) == 0) info.set(key, dice.value());
    }
    if (dice.roll(3)) extension.set(kPoint, dice.value());
    if (dice.roll(4) == 0) attributes.set(kIdentifier, dice.value());
    info.set("QFBundleIdentifier", dice.text());
    if (dice.roll(4)) info.set(kIdentifier, dice.text());
    if (dice.roll(4)) extension.set("VXExtensionAttributes", attributes);
    info.set("VXExtension", extension);
    return info;
}

/// The second time, indexes are there that were made for other plug-ins.
TEST_F(RegistryTest, NarrowingNeverDropsAMatch) {
    Dice dice;
    addApplication(apps + "A.app");
    start();
    for (const int first : {0, 60}) {
        for (int i = first; i < first + 120; ++i) {
            const std::string path = apps + "A.app/PlugIns/" + std::to_string(i);
            writePlist(path + "/Info.plist", someInfo(dice));
            if (dice.roll(2)) writePlist(path + "/Entitlements.plist", {{"right", dice.value()}});
        }
        ASSERT_EQ(registerPlugIn(files.path(apps + "A.app")), std::nullopt);
        const TDPlugInProxyList all = workspace->installedPlugIns();
        ASSERT_EQ(all.size(), first + 120u);
        std::size_t dropped = 0;
        for (int i = 0; i < 600; ++i) {
            Dictionary query;
            for (const char* key : {kPoint, kIdentifier, "colour", "size", kRight})
                if (dice.roll(3) == 0) query.set(key, dice.pattern());
            auto found = workspace->plugInsMatching(query, nullptr);
            ASSERT_TRUE(found);
            std::set<TDPlugInProxyRef> kept(found->begin(), found->end());
            EXPECT_EQ(kept.size(), found->size()) << describe(query);
            for (const auto& plugIn : all)
                EXPECT_TRUE(kept.contains(plugIn) || !accepts(*plugIn, query))
                    << describe(query) << " " << describe(*plugIn);
            dropped += all.size() - kept.size();
        }
        EXPECT_GT(dropped, 600 * all.size() / 3);
    }
}

TEST(RuleIndex, StaysCompleteWithoutTheTextsThatWereTooMany) {
    std::vector<Value> many;
    for (int i = 0; i < 40; ++i) many.emplace_back(fmt::format("t{}", i));
    TDPlugInProxyList plugIns;
    for (const Value& value : {Value(Array(many)), Value("t1")}) {
        const auto plugIn = std::make_shared<TDPlugInProxy>();
        plugIn->infoPlist = Dictionary{{"K", value}};
        plugIns.push_back(plugIn);
    }
    const RuleIndex before("K", {plugIns[0]}, {0}, true);
    RuleIndex index("K", plugIns, {1}, true);
    EXPECT_EQ(index.find("<t2"), Positions{1});
    index.takeOver(before, {0});
    for (const char* pattern : {"t39", ">t38"})
        EXPECT_EQ(index.find(pattern), (Positions{0, 1})) << pattern;
    EXPECT_TRUE(index.find(false).empty());
}

TEST_F(RegistryTest, TheFilterSeesIdentifierAndEntitlements) {
    addApplication(apps + "A.app");
    for (const char* name : {"a", "b", "c"})
        addPlugIn(apps + "A.app/PlugIns/" + name, name,
                  {{kPoint, "org.point"}, {"VXExtensionAttributes", Dictionary()}});
    writePlist(apps + "A.app/PlugIns/b/Entitlements.plist", {{"right", true}});
    start();
    auto found = workspace->plugInsMatching(
        {{kPoint, "org.point"}},
        [](const std::optional<std::string>& identifier, const Dictionary& entitlements) {
            return identifier == "a" || entitlements.contains("right");
        });
    ASSERT_TRUE(found);
    EXPECT_EQ(found->size(), 2u);
    EXPECT_TRUE(workspace->plugInsMatching({{kPoint, "org"}}, nullptr)->empty());
}

TEST(Snapshot, ASuccessorIsAsOneMadeAnew) {
    RegistryState state;
    auto before = std::make_unique<const Snapshot>(state);
    std::mt19937 random(3);
    for (int round = 0; round < 200; ++round) {
        RegistryChanges changes;
        for (std::size_t i = 0; i < random() % 4; ++i) {
            const std::string path = fmt::format("/{}", random() % 20);
            if (auto found = state.plugIns.find(path); found != state.plugIns.end()) {
                changes.uninstalled.push_back(found->second.record);
                state.plugIns.erase(found);
            }
            if (random() % 3 == 0) continue;
            PlugInEntry& entry = state.plugIns[path];
            entry.record = std::make_shared<TDPlugInProxy>();
            entry.record->plugInUuid = Uuid::random();
            entry.record->bundlePath = path;
            entry.record->plugInIdentifier = std::to_string(random() % 3);
            entry.points = std::string("p") + (random() % 2 ? "1" : "2") + '\0';
            changes.installed.push_back(entry.record);
        }
        auto after = std::make_unique<const Snapshot>(*before, state, changes);
        const Snapshot anew(state);
        ASSERT_EQ(after->plugIns(), anew.plugIns());
        for (const TDPlugInProxyRef& plugIn : anew.plugIns())
            ASSERT_EQ(after->plugInWithUuid(plugIn->plugInUuid), plugIn);
        for (const Dictionary& query : {Dictionary{{"VXExtensionIdentifier", "1"}},
                                        Dictionary{{"VXExtensionPointIdentifier", "p2"}}})
            ASSERT_EQ(after->candidates(query), anew.candidates(query));
        before = std::move(after);
    }
}

}  // namespace
}  // namespace platform::tandry
