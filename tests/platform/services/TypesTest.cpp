#include "platform/services/Types.h"

#include <gtest/gtest.h>

#include "platform/system/Directories.h"
#include "tests/support/TemporaryDirectory.h"

namespace platform {
namespace {

Directories dataDirectories(const std::string& home, std::vector<std::string> system) {
    Directories directories;
    directories.dataHome = home;
    directories.dataDirs = std::move(system);
    return directories;
}

struct Conformance {
    const char* type;
    const char* ancestor;
    bool conforms;
};

void expectConformance(Types& types, std::initializer_list<Conformance> cases) {
    for (const auto& [type, ancestor, conforms] : cases)
        EXPECT_EQ(types.conforms(type, ancestor), conforms) << type << " -> " << ancestor;
}

TEST(MimeTypes, FollowAliasesAndSubclassesOfAllDirectories) {
    const test::TemporaryDirectory files;
    files.write("home/mime/aliases", "a/old a/users\n");
    files.write("system/mime/aliases", "a/old a/systems\nx/parent-alias a/middle");
    files.write("system/mime/subclasses",
                "a/users x/parent-alias\na/middle A/Top\na/top text/csv\n"
                "loop/1 loop/2\nloop/2 loop/1\n\nbroken\n broken\nbroken \n");
    const auto types =
        makeMimeTypes(dataDirectories(files.path("home"), {files.path("system"), "/nowhere"}));
    expectConformance(*types, {{"a/users", "A/USERS", true},
                               {"a/old", "a/users", true},
                               {"a/users", "a/old", true},
                               {"a/old", "a/systems", false},
                               {"A/Old", "a/top", true},
                               {"a/old", "text/csv", true},
                               {"a/old", "text/plain", true},
                               {"a/top", "a/middle", false},
                               {"loop/1", "loop/2", true},
                               {"loop/1", "a/top", false},
                               {"text/unheard-of", "text/plain", true},
                               {"text/plain", "text/unheard-of", false},
                               {"un/known", "application/octet-stream", true},
                               {"inode/directory", "application/octet-stream", false},
                               {"", "a/top", false}});
}

TEST(MimeTypes, AreReadAgainAfterAPassingFailure) {
    const test::TemporaryDirectory files;
    const std::string broken = files.makeDirectory("mime") + "/subclasses";
    std::filesystem::create_symlink("/proc/self/mem", broken);
    const auto types = makeMimeTypes(dataDirectories(files.path(), {}));
    expectConformance(*types, {{"a/below", "a/above", false}, {"a/b", "A/B", true}});
    std::filesystem::remove(broken);
    files.write("mime/subclasses", "a/below a/above\n");
    expectConformance(*types, {{"a/below", "a/above", true}});
    files.write("mime/subclasses", "");
    expectConformance(*types, {{"a/below", "a/above", true}});
}

TEST(MimeTypes, ReadTheSharedDatabase) {
    if (!std::filesystem::exists("/usr/share/mime/subclasses")) GTEST_SKIP();
    const auto types = makeMimeTypes(dataDirectories("/nowhere", {"/usr/share"}));
    expectConformance(*types, {{"image/svg+xml", "application/xml", true},
                               {"image/svg+xml", "text/plain", true},
                               {"application/x-pdf", "application/pdf", true},
                               {"image/png", "image/jpeg", false}});
}

Dictionary offer(std::initializer_list<Value> items) {
    return {{"items", Array(items)}};
}

Value item(std::initializer_list<Value> types) {
    return Dictionary{{"types", Array(types)}};
}

TEST(ActivationRule, CountsConformingItemsOfWellFormedOffers) {
    const auto types = makeMimeTypes(dataDirectories("/nowhere", {}));
    const Value csv = item({"text/csv"});
    const Value both = item({"image/png", "TEXT/CSV"});
    const Value other = item({"audio/ogg"});
    const Value twoTexts = Dictionary{{"text/plain", 2}};
    const Value textOrImage = Dictionary{{"text/plain", 1}, {"image/png", 2}};
    const Value none = Dictionary{{"text/plain", 0}};
    struct Case {
        Value rule;
        Dictionary offer;
        bool accepted;
    };
    const std::vector<Case> cases{
        {true, {}, true},
        {false, offer({csv}), false},
        {twoTexts, offer({csv}), true},
        {twoTexts, offer({csv, csv}), true},
        {twoTexts, offer({csv, csv, csv}), false},
        {twoTexts, offer({csv, other}), false},
        {twoTexts, offer({}), false},
        {twoTexts, {}, false},
        {textOrImage, offer({both, item({"image/png"})}), true},
        {textOrImage, offer({both, csv}), false},  // both count as text
        {none, offer({csv}), false},
        {Dictionary{}, offer({csv}), false},
        {Dictionary{{"text/plain", "2"}}, offer({csv}), false},
        {Dictionary{{"text/plain", 2}, {"image/png", -1}}, offer({csv}), false},
        {Dictionary{{"text/plain", 2.5}}, offer({csv, csv}), true},
        {"text/plain", offer({csv}), false},
        {Array{"text/plain"}, offer({csv}), false},
        {twoTexts, offer({item({})}), false},
        {twoTexts, offer({csv, "text/csv"}), false},
        {twoTexts, offer({item({"text/csv", 1})}), false},
        {twoTexts, {{"items", csv}}, false},
        {twoTexts, offer({Dictionary{{"types", "text/csv"}}}), false},
    };
    for (const Case& c : cases)
        EXPECT_EQ(ActivationOffer(c.offer, *types).isAcceptedBy(c.rule), c.accepted)
            << describe(c.rule) << " " << describe(c.offer);
}

TEST(ActivationRule, RefusesWhatWouldTakeTooLong) {
    class : public Types {
      public:
        std::string name(const std::string&) override { return ++questions, "any"; }
        std::vector<std::string> lineage(const std::string&) override { return {"any"}; }
        int questions = 0;
    } types;
    const auto accepts = [&types](std::size_t listed, std::size_t items, std::size_t typesOfItem) {
        Dictionary rule;
        for (std::size_t i = 0; i < listed; ++i) rule.set(std::to_string(i), 10000);
        const Value item =
            Dictionary{{"types", Array(std::vector<Value>(typesOfItem, Value("a/b")))}};
        const Array all(std::vector<Value>(items, item));
        types.questions = 0;
        return ActivationOffer({{"items", all}}, types).isAcceptedBy(rule);
    };
    EXPECT_TRUE(accepts(256, 4096, 4));
    EXPECT_EQ(types.questions, 256) << "however much is offered";
    EXPECT_FALSE(accepts(256, 4096, 5));
    EXPECT_FALSE(accepts(257, 1, 1));
    EXPECT_FALSE(accepts(1, 4097, 1));
    EXPECT_FALSE(accepts(1, 1, 257));
}

}  // namespace
}  // namespace platform
