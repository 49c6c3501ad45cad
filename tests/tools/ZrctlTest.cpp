#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Zorvan/Keys.h"
#include "tools/zrctl/Json.h"
#include "tools/zrctl/Listing.h"
#include "tools/zrctl/Options.h"
#include "tools/zrctl/Outcome.h"
#include "tools/zrctl/RegistrationCommands.h"
#include "tools/zrctl/Rules.h"
#include "tools/zrctl/ShellWord.h"
#include "tools/zrctl/Table.h"
#include "tools/zrctl/Terminal.h"

using platform::Array;
using platform::Data;
using platform::Date;
using platform::Dictionary;
using platform::Value;
using testing::HasSubstr;

namespace zrctl {

namespace {

std::variant<Options, Outcome> parse(std::vector<const char*> arguments) {
    arguments.insert(arguments.begin(), "zrctl");
    return Options::parse(static_cast<int>(arguments.size()), arguments.data());
}

class Terminal : public testing::Test {
  protected:
    static void SetUpTestSuite() { terminal::useUtf8(); }
};
using ListingTest = Terminal;

Dictionary form(const char* identifier, Value version, const char* path) {
    return {{"identifier", identifier}, {"version", std::move(version)}, {"path", path}};
}

}  // namespace

TEST(Rules, TheFirstEqualsSignSplitsAndBooleansAreTheirWords) {
    const auto rules = parseRules({"VXExtensionVersion=>=1.2", "Types=a,b", "Title==true",
                                   "Multi=true", "Dark=false", "Empty=", "Says=TRUE"});
    ASSERT_TRUE(rules);
    EXPECT_EQ(*rules, (Dictionary{{"VXExtensionVersion", ">=1.2"},
                                  {"Types", "a,b"},
                                  {"Title", "=true"},
                                  {"Multi", true},
                                  {"Dark", false},
                                  {"Empty", ""},
                                  {"Says", "TRUE"}}));
}

TEST(Rules, ARepeatedKeyGivesTheListOfItsPatterns) {
    const auto rules = parseRules({"K=a", "Other=x", "K=true", "K=c"});
    ASSERT_TRUE(rules);
    EXPECT_EQ(*rules, (Dictionary{{"K", Array{"a", true, "c"}}, {"Other", "x"}}));
    EXPECT_EQ(merged({{"K", "file"}, {"Kept", "file"}}, *rules),
              (Dictionary{{"K", Array{"a", true, "c"}}, {"Kept", "file"}, {"Other", "x"}}));
}

TEST(Rules, WhatIsNoRuleIsRefusedWithItsText) {
    for (const char* text : {"nothing", "=pattern", "K=\x01", "K=\xff"})
        EXPECT_FALSE(parseRules({"A=b", text})) << text;
    const auto slip = parseRules({"Version>=1.2"});
    ASSERT_FALSE(slip);
    EXPECT_THAT(slip.error().text, HasSubstr("Version=>=1.2"));
}

TEST(Rules, TheirTextsAreTheRulesAgain) {
    for (const auto& texts : std::vector<std::vector<std::string>>{
             {"A=b", "A=c", "Dark=false", "Multi=true", "V=>=1.2"}, {"Title==true"}, {"Empty="}}) {
        EXPECT_EQ(ruleTexts(*parseRules(texts)), texts);
    }
    EXPECT_EQ(ruleTexts({{"A", 1}, {"B", 0}, {"C", "true"}, {"D", Array{"false", 7}}}),
              (std::vector<std::string>{"A=true", "B=false", "C==true", "D==false", "D=7"}));
    EXPECT_EQ(ruleTexts({}), std::vector<std::string>{""});
    EXPECT_EQ(ruleTexts({{"A", Array{}}}), std::vector<std::string>{"A=[]"});
}

TEST_F(Terminal, WordsAreQuotedForTheShellAsFarAsNeeded) {
    EXPECT_EQ(shellWord("Key.a-b=1,2"), "Key.a-b=1,2");
    EXPECT_EQ(shellWord(""), "''");
    EXPECT_EQ(shellWord("V=>=1"), "'V=>=1'");
    EXPECT_EQ(shellWord("it's ü"), "'it'\\''s ü'");
    EXPECT_EQ(shellWord("a\n'\\\u202e"), "$'a\\012\\047\\134\\342\\200\\256'");
}

TEST(CommandLine, ChoicesAndExclusionsSayWhatIsMeant) {
    const auto elected = parse({"elect", "ignore", "a", "b", "-S", "other"});
    ASSERT_TRUE(std::holds_alternative<Options>(elected));
    EXPECT_EQ(std::get<Options>(elected).election, 2);
    EXPECT_EQ(std::get<Options>(elected).plugIns, (std::vector<std::string>{"a", "b"}));
    EXPECT_EQ(std::get<Options>(elected).service, "other");
    const auto excluded = parse({"exclude", "remove", "A=b", "C=<>d"});
    ASSERT_TRUE(std::holds_alternative<Options>(excluded));
    EXPECT_EQ(std::get<Options>(excluded).command, Options::Command::ExcludeRemove);
    EXPECT_EQ(std::get<Options>(excluded).rules, (std::vector<std::string>{"A=b", "C=<>d"}));
}

TEST(CommandLine, MatchTakesRulesAndOptionsInAnyOrder) {
    const auto parsed = parse({"match", "A=b", "--versions", "-S", "other", "V=>=1", "--all",
                               "--json", "--rules", "file"});
    ASSERT_TRUE(std::holds_alternative<Options>(parsed));
    const auto& options = std::get<Options>(parsed);
    EXPECT_EQ(options.command, Options::Command::Match);
    EXPECT_EQ(options.service, "other");
    EXPECT_EQ(options.rules, (std::vector<std::string>{"A=b", "V=>=1"}));
    EXPECT_EQ(options.rulesFile, "file");
    EXPECT_EQ(options.flags, zorvan::ZRDiscoverAll | zorvan::ZRDiscoverVersions);
    EXPECT_EQ(options.format, Format::Json);
}

TEST(CommandLine, WrongUsageIsStatusTwo) {
    testing::internal::CaptureStderr();
    for (const auto& arguments :
         std::vector<std::vector<const char*>>{{},
                                               {"find"},
                                               {"add"},
                                               {"match", "--json", "--long"},
                                               {"match", "--no-such"},
                                               {"-S"},
                                               {"elect", "use"},
                                               {"elect", "never", "a"},
                                               {"annotate"},
                                               {"exclude"},
                                               {"exclude", "add"}})
        EXPECT_EQ(std::get<Outcome>(parse(arguments)).status, kUsageError);
    testing::internal::GetCapturedStderr();
    const auto help = std::get<Outcome>(parse({"match", "--help"}));
    EXPECT_EQ(help.status, kDone);
    EXPECT_THAT(help.output, HasSubstr("KEY=PATTERN"));
    EXPECT_EQ(std::get<Outcome>(parse({"--version"})).status, kDone);
}

TEST(CommandLine, RelativePathsStandInTheCurrentDirectoryUnresolved) {
    EXPECT_EQ(*absolutePath("../A.app", "/home/me"), "/home/me/../A.app");
    EXPECT_EQ(*absolutePath("/x//./A.app", "/home/me"), "/x//./A.app");
    EXPECT_FALSE(absolutePath("", "/home/me"));
    EXPECT_FALSE(absolutePath("\xff", "/home/me"));
}

TEST_F(Terminal, NothingThatSteersATerminalGetsThrough) {
    EXPECT_EQ(terminal::safe("plain Ünïcode 日本"), "plain Ünïcode 日本");
    EXPECT_EQ(terminal::safe("\x1b[2J\n\x7f"), "\\u{1b}[2J\\u{a}\\u{7f}");
    EXPECT_EQ(terminal::safe("a\u009b\u202eb\u2028"), "a\\u{9b}\\u{202e}b\\u{2028}");
    EXPECT_EQ(terminal::safe(std::string_view("\xff\0\xe6\x97", 4)), "\\x{ff}\\u{0}\\x{e6}\\x{97}");
}

TEST_F(Terminal, ColumnsAlignByTheColumnsThatTheirTextTakes) {
    Table table({"NAME", "X"});
    table.add({"日本語", "1"});
    table.add({"e\u0301", ""});
    EXPECT_EQ(table.text(),
              "NAME    X\n"
              "日本語  1\n"
              "e\u0301       -\n");
}

TEST_F(ListingTest, PlugInsAreInTheOrderOfIdentifierVersionAndPath) {
    const Listing listing({form("b", "1", "/b"), form("a", "1.10", "/a"), "no form",
                           form("a", "1.9", "/z"), form("a", "1.9", "/y")});
    EXPECT_EQ(listing.forms(), (Array{form("a", "1.9", "/y"), form("a", "1.9", "/z"),
                                      form("a", "1.10", "/a"), form("b", "1", "/b")}));
    EXPECT_TRUE(Listing(Array{}).empty());
}

TEST_F(ListingTest, TextsForPeopleSurviveValuesOfAnyType) {
    Dictionary odd = form("a", 7, "/A.app/P.appex");
    odd.set("containingPath", "/A.app");
    odd.set("localizedDisplayName", "Name\n");
    odd.set("annotations", Dictionary{{"election", 0x101}});
    odd.set("overriding", "x");
    odd.set("info", Dictionary{{"VXExtensionAttributes", Dictionary{{"K", Array{1, "v"}}}}});
    odd.set("entitlements", "none");
    const Listing listing({odd, Dictionary{}});
    EXPECT_EQ(listing.table(),
              "IDENTIFIER  VERSION  ELECTION  NAME       APPLICATION  PATH\n"
              "-           -        default   -          -            -\n"
              "a           7        use       Name\\u{a}  A.app        /A.app/P.appex\n");
    EXPECT_THAT(listing.paragraphs(), HasSubstr("\n  replaces          x\n"));
    EXPECT_THAT(listing.paragraphs(), HasSubstr("\n    K = [1, \"v\"]\n"));
}

TEST(Elections, HaveNames) {
    const auto named = [](Value election) {
        const Value annotation = Dictionary{{"election", std::move(election)}};
        return electionName(&annotation);
    };
    EXPECT_EQ(electionName(nullptr), "default");
    EXPECT_EQ(named(0), "default");
    EXPECT_EQ(named(1), "use");
    EXPECT_EQ(named(2), "ignore");
    EXPECT_EQ(named(70000), "65648");
    EXPECT_EQ(named("1"), "default");
}

TEST(Json, EveryKindHasItsText) {
    const Value value = Dictionary{
        {"b", true},        {"a", Array{-1, UINT64_MAX, 0.5}}, {"data", Data("ab\xff\xfe")},
        {"none", Data("")}, {"date", Date{86400.5}},           {"never", Date{1e300}},
        {"text", "é\n\""}};
    EXPECT_EQ(jsonText(value), R"({
  "a": [
    -1,
    18446744073709551615,
    0.5
  ],
  "b": true,
  "data": "YWL//g==",
  "date": "1970-01-02T00:00:00Z",
  "never": "1e+300",
  "none": "",
  "text": "é\n\""
}
)");
}

}  // namespace zrctl
