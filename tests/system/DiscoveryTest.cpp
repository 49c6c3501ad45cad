// Hosts that ask for plug-ins, and register them.

#include <filesystem>

#include "Zorvan/ZRPlugInCore.h"
#include "platform/plist/PropertyList.h"
#include "platform/services/Preferences.h"
#include "platform/system/Directories.h"
#include "tests/system/SystemTest.h"

namespace test {

namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

const Dictionary kPoint{{"VXExtensionPointIdentifier", "com.test.point"}};

class Discovery : public SystemTest {
  protected:
    /// An application A with plug-ins of two identifiers, one of them in two versions.
    void writeApplication() {
        writePlist(kApps + std::string("A.app/Info.plist"),
                   Dictionary{{"QFBundleIdentifier", "com.a"}, {"QFBundleDisplayName", "Anna"}});
        writePlugIn(plugInPath("A", "one"), info("one", "1.9"));
        writePlugIn(plugInPath("A", "one-new"), info("one", "1.10"));
        writePlugIn(plugInPath("A", "two"),
                    info("two", "3", {{"VXExtensionAttributes", Dictionary{{"Loud", true}}}}));
    }
};

TEST_F(Discovery, APropertyListThatLiesOutsideItsBundleIsNotRead) {
    writeApplication();
    const std::string secret = writePlist("private.plist", Dictionary{{"secret", "treasure"}});
    const std::string link = home_.path(plugInPath("A", "two") + "/Entitlements.plist");
    std::filesystem::remove(link);
    std::filesystem::create_symlink(secret, link);
    start();
    EXPECT_THAT(match(kPoint), ElementsAre("one 1.10"));
    EXPECT_EQ(zrd_->errLines(link + ": a symbolic link or a mount that leads out of the bundle"),
              1u);
    EXPECT_THAT(add({home_.path(plugInPath("A", "two"))}), testing::StartsWith("2 "));
    EXPECT_THAT(match(), ElementsAre("one 1.10"));
    // One that is exchanged for such a link later goes.
    std::filesystem::remove(link);
    EXPECT_TRUE(waitUntil([&] { return match().size() == 2; }));
    std::filesystem::create_symlink(secret, link);
    EXPECT_TRUE(waitUntil([&] { return match().size() == 1; }));
}

TEST_F(Discovery, AHostAndTheCommandLineSeeTheSamePlugIns) {
    writeApplication();
    writePlist("data/zorvan/SDKs/com.test.point.plist",
               Dictionary{{"VXExtension",
                           Dictionary{{"VXExtensionAttributes", Dictionary{{"Sdk", "yes"}}}}}});
    start();
    EXPECT_THAT(match(kPoint), ElementsAre("one 1.10", "two 3"));
    EXPECT_THAT(match(kPoint, zorvan::ZRDiscoverVersions),
                ElementsAre("one 1.10", "one 1.9", "two 3"));
    EXPECT_THAT(match({{"Loud", true}, {"Sdk", "yes"}}), ElementsAre("two 3"));
    EXPECT_THAT(match({{"VXExtensionVersion", ">=1.10"}, {"Loud", false}}),
                ElementsAre("one 1.10"));
    EXPECT_THAT(match(kPoint, zorvan::ZRDiscoverSystemOnly), IsEmpty());

    const Dictionary form = forms({{"Loud", true}}).at(0);
    const auto plugIn = zorvan::ZRPlugInCore::initWithForm(form);
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(plugIn->path(), home_.path(plugInPath("A", "two")));
    EXPECT_EQ(plugIn->containingPath(), home_.path(kApps + std::string("A.app")));
    EXPECT_EQ(plugIn->localizedContainingName(), "Anna");
    EXPECT_FALSE(plugIn->onSystemVolume());
    EXPECT_EQ(match({{"com.orbel.uuid", plugIn->uuid().string()}}).size(), 1u);

    auto listed = zrctl({"match", "Loud=true"});
    EXPECT_EQ(listed->wait(), 0) << listed->err();
    EXPECT_THAT(listed->out(), HasSubstr(plugInPath("A", "two")));
    auto forms = zrctl({"match", "--plist", "--all", "VXExtensionIdentifier=two"});
    const auto same = platform::parsePropertyList(forms->out());
    ASSERT_TRUE(same) << forms->err();
    EXPECT_EQ(*same, Value(Array{form}));
    EXPECT_EQ(zrctl({"match", "Loud=no"})->wait(), 1);
    auto nobody = zrctl({"-S", "nobody", "match"});
    EXPECT_EQ(nobody->wait(), 3);
    EXPECT_THAT(nobody->err(), HasSubstr("zrd is not running: no service at " + home_.path()));
}

TEST_F(Discovery, ReplacersAreMarkedAndElectThemselves) {
    writeApplication();
    writePlugIn(plugInPath("B", "better"), info("better"),
                {{"com.orbel.developer.replace-plugin", "one"},
                 {"com.orbel.developer.auto-elect-plugin", true}});
    const std::string database = home_.path("chosen");
    for (int run : {1, 2}) {
        start({"-d", database, "-c", "1"});
        const auto found = forms({{"VXUserElection", "1"}});
        // In the second run the election is stored, and shared with what is replaced.
        EXPECT_EQ(found.size(), run == 1 ? 1u : 2u);
        EXPECT_EQ(*found.at(0).find("annotations"), Value(Dictionary{{"election", 1}}));
        std::map<std::string, Dictionary> byName;
        for (const auto& form : forms(kPoint))
            byName[form.find("identifier")->string()->string()] = form;
        EXPECT_EQ(*byName["one"].find("overrider"), *byName["better"].find("uuid"));
        EXPECT_EQ(*byName["better"].find("overriding"), Value("one"));
        EXPECT_EQ(*byName["two"].find("annotations"), Value(Dictionary()));
        stop(SIGTERM);
    }
    EXPECT_EQ(*platform::readPropertyListFile(database),
              Value(Dictionary{{"version", 16},
                               {"data", Dictionary{{"one", Dictionary{{"election", 1}}}}}}));
}

TEST_F(Discovery, TheApplicationAroundTheHostDecidesWhatItMayUse) {
    writeApplication();
    writePlugIn(plugInPath("A", "own"), info("own", "1", {{"Dedicated", true}}));
    writePlugIn(plugInPath("B", "demanding"),
                info("demanding", "1", {{"VXExtensionHostEntitlement", "com.test.right"}}));
    const std::string host = home_.path(kApps + std::string("A.app/host"));
    std::filesystem::copy_file(ZRCTL_PROGRAM, host);
    start();
    EXPECT_THAT(match(kPoint), ElementsAre("one 1.10", "two 3"));
    auto seen = [&](const Dictionary& entitlements) {
        writePlist(kApps + std::string("A.app/Entitlements.plist"), entitlements);
        auto process = spawn(host.c_str(), {"match", "--plist"});
        process->wait();
        std::vector<std::string> identifiers;
        const auto forms = platform::parsePropertyList(process->out());
        if (!forms) return identifiers;
        for (const Value& form : *forms->array())
            identifiers.push_back(form.dictionary()->find("identifier")->string()->string());
        std::ranges::sort(identifiers);
        return identifiers;
    };
    EXPECT_THAT(seen({}), ElementsAre("one", "own", "two"));
    EXPECT_THAT(seen({{"com.test.right", true}}), ElementsAre("demanding", "one", "own", "two"));
    EXPECT_THAT(seen({{"com.orbel.developer.zorvan.allowedplugins", Dictionary{{"Loud", true}}}}),
                ElementsAre("two"));
    EXPECT_THAT(seen({{"com.orbel.developer.zorvan.allowedplugins", true}}), IsEmpty());
}

TEST_F(Discovery, ExclusionsTakeEffectWithTheNextRequest) {
    writeApplication();
    start();
    const std::string file = platform::Preferences(platform::Directories::fromEnvironment())
                                 .path("com.orbel.zorvan.userprefs")
                                 .substr(home_.path().size() + 1);
    EXPECT_EQ(match().size(), 2u);
    writePlist(file, Dictionary{{"exclusions", Array{Dictionary{{"Loud", true}}}}});
    EXPECT_THAT(match(), ElementsAre("one 1.10"));
    auto all = zrctl({"match", "--all"});
    EXPECT_EQ(all->wait(), 0) << all->err();
    EXPECT_THAT(all->out(), testing::Not(HasSubstr("two")));
    home_.write(file, "damaged");
    EXPECT_EQ(match().size(), 2u);
    EXPECT_EQ(match().size(), 2u);
    EXPECT_EQ(zrd_->errLines("cannot read preferences: " + home_.path()), 1u);
    std::filesystem::remove(home_.path(file));
    EXPECT_EQ(match().size(), 2u);
}

TEST_F(Discovery, RegistrationStopsAtTheFirstFailureAndKeepsWhatWasDone) {
    std::vector<std::string> paths;
    for (std::string name : {"a", "b", "c"})
        paths.push_back(writePlugIn("else/E.app/PlugIns/" + name + ".appex", info(name)));
    const std::string bad = writePlugIn("else/Bad.app/PlugIns/bad.appex", {{"VXExtension", 1}});
    const std::string gone = home_.path("gone"), application = home_.path("else/E.app");
    start();
    EXPECT_THAT(match(), IsEmpty());
    EXPECT_EQ(add({}), "");
    EXPECT_EQ(add({paths[0], gone, paths[1]}), "9 invalid plugin path: " + gone);
    EXPECT_THAT(match(), ElementsAre("a 1"));
    EXPECT_EQ(add({bad, paths[1]}), "2 unable to register plug-in at " + bad);
    EXPECT_EQ(zrd_->errLines("failed to register plug-in at " + bad), 1u);
    EXPECT_EQ(add({home_.path("else/../else/E.app/PlugIns/b.appex"), "relative"}),
              "9 absolute path required: relative");
    EXPECT_THAT(match(), ElementsAre("a 1", "b 1"));

    EXPECT_EQ(remove({paths[0]}), "11 caller lacks entitlement for this operation");
    EXPECT_EQ(zrd_->errLines("refused request from pid=" + std::to_string(getpid())), 1u);
    auto removed = zrctl({"remove", paths[0], gone, paths[1]});
    EXPECT_EQ(removed->wait(), 3);
    EXPECT_THAT(removed->err(), HasSubstr("no plugin at " + gone));
    EXPECT_THAT(match(), ElementsAre("b 1"));
    EXPECT_EQ(zrctl({"add", application})->wait(), 0);
    EXPECT_EQ(match().size(), 3u);
    EXPECT_EQ(zrctl({"remove", application})->wait(), 0);
    EXPECT_THAT(match(), IsEmpty());
    EXPECT_EQ(zrctl({"remove", application})->wait(), 3);
}

}  // namespace

}  // namespace test
