#include <sys/stat.h>

#include <cstdlib>
#include <filesystem>

#include "platform/tandry/BundleReader.h"
#include "tests/platform/tandry/RegistryFixture.h"

namespace platform::tandry {
namespace {

namespace fs = std::filesystem;

TEST_F(RegistryTest, FindsTheBundlesOfEveryApplicationFolder) {
    const std::string app = addApplication(
        apps + "Mail.app", {{"QFBundleIdentifier", "org.mail"}, {"QFBundleName", "Mail"}});
    addPlugIn(apps + "Mail.app/PlugIns/B.appex", "org.mail.b");
    const std::string a = addPlugIn(apps + "Mail.app/PlugIns/A.plugin", "org.mail.a");
    addApplication("share/zorvan/Applications/Map.app");
    addPlugIn("share/zorvan/Applications/Map.app/PlugIns/C.appex", "org.map.c");
    files.write("share/zorvan/Applications/Map.app/.placeholder", "");
    files.write(apps + "Mail.app/PlugIns/README", "not a bundle");
    addPlugIn(apps + "Mail.app/PlugIns/.hidden", "org.hidden");
    addPlugIn(apps + "Plain/PlugIns/D.appex", "org.plain");
    ErrorLines errors;
    start();

    EXPECT_THAT(errors.lines, IsEmpty());
    EXPECT_THAT(installed(), ElementsAre("org.mail.a", "org.mail.b", "org.map.c"));
    EXPECT_THAT(recorder.take(), UnorderedElementsAre("+org.mail.a", "+org.mail.b", "+org.map.c"));
    TDPlugInProxyRef found = workspace->plugInAtPath(a);
    ASSERT_TRUE(found);
    EXPECT_EQ(workspace->plugInWithUuid(found->plugInUuid), found);
    EXPECT_EQ(found->containingApplication->bundlePath, app);
    EXPECT_EQ(found->containingApplication->bundleIdentifier, "org.mail");
    EXPECT_EQ(found->containingApplication->localizedName, "Mail");
    EXPECT_FALSE(found->containingApplication->isPlaceholder);
    EXPECT_TRUE(plugIn("org.map.c")->containingApplication->isPlaceholder);
    EXPECT_EQ(workspace->plugInsOfApplication(app).size(), 2u);
    EXPECT_FALSE(workspace->plugInAtPath(app));
}

TEST_F(RegistryTest, CompletesTheDictionaries) {
    addApplication(apps + "A.app");
    writePlist("home/zorvan/SDKs/org.point.plist", {{"FromSdk", true}});
    const Dictionary attributes{{"VXExtensionAttributes", Dictionary{{"Size", 3}}},
                                {"VXExtensionPointIdentifier", "org.point"},
                                {"CleanTimeout", 7}};
    addPlugIn(apps + "A.app/PlugIns/A.appex", "a", attributes,
              {{"QFBundleShortVersionString", "2.5"},
               {"VXOriginalIdentifier", "a.original"},
               {"VXExtensionIdentifier", "a.top"}});
    writePlist(apps + "A.app/PlugIns/A.appex/Entitlements.plist", {{"right", true}});
    addPlugIn(apps + "A.app/PlugIns/B.appex", "b",
              {{"VXExtensionAttributes",
                Dictionary{{"VXExtensionVersion", 9}, {"VXExtensionPointIdentifier", "other"}}},
               {"VXExtensionPointIdentifier", "org.unknown"}},
              {{"QFBundleVersion", "7"}, {"QFBundleShortVersionString", "2"}});
    addPlugIn(apps + "A.app/PlugIns/C.appex", "c", {{"VXExtensionPointIdentifier", "org.point"}});
    addPlugIn(apps + "A.app/PlugIns/D.appex", "d");
    writePlist(apps + "A.app/PlugIns/F.appex/Info.plist",
               {{"VXExtension", Dictionary{{"VXExtensionIdentifier", "f"}}}});
    // Reading this file fails with EIO.
    std::filesystem::create_symlink("/proc/self/mem", files.path("home/zorvan/SDKs/org.bad.plist"));
    addPlugIn(apps + "A.app/PlugIns/E.appex", "e", {{"VXExtensionPointIdentifier", "org.bad"}});
    start();

    EXPECT_FALSE(plugIn("e")) << "not without its SDK dictionary";
    TDPlugInProxyRef a = plugIn("a.top");
    ASSERT_TRUE(a);
    EXPECT_EQ(a->bundleIdentifier, "a");
    EXPECT_EQ(a->originalIdentifier, "a.original");
    EXPECT_EQ(a->bundleVersion, "2.5");
    EXPECT_EQ(*a->attributes(), (Dictionary{{"Size", 3},
                                            {"VXExtensionVersion", "2.5"},
                                            {"VXExtensionPointIdentifier", "org.point"}}));
    EXPECT_EQ(*a->infoPlist.get().find("FromSdk"), Value(true));
    EXPECT_EQ(*a->plugInDictionary()->find("CleanTimeout"), Value(7));
    EXPECT_FALSE(a->plugInDictionary()->find("FromSdk"));
    EXPECT_EQ(a->entitlements.get(), (Dictionary{{"right", true}}));

    TDPlugInProxyRef b = plugIn("b");
    EXPECT_EQ(b->bundleVersion, "7");
    EXPECT_EQ(b->originalIdentifier, "b");
    EXPECT_EQ(*b->attributes()->find("VXExtensionVersion"), Value(9));
    EXPECT_EQ(*b->attributes()->find("VXExtensionPointIdentifier"), Value("other"));
    EXPECT_EQ(plugIn("c")->attributes(), nullptr);
    EXPECT_EQ(*plugIn("d")->attributes(), (Dictionary{{"VXExtensionVersion", "1"}}));
    EXPECT_EQ(plugIn("f")->bundleIdentifier, "f") << "its instances are known by it";
}

TEST_F(RegistryTest, NamesFollowTheUsersLanguage) {
    ::setenv("LC_ALL", "de_AT.UTF-8", 1);
    ::unsetenv("LANGUAGE");
    addApplication(apps + "A.app");
    addPlugIn(apps + "A.app/PlugIns/A.appex", "a", {},
              {{"QFBundleDisplayName", "Long"}, {"QFBundleName", "Short"}});
    writePlist(apps + "A.app/PlugIns/A.appex/Localized.plist",
               {{"de_AT", Dictionary{{"QFBundleDisplayName", 5}}},
                {"de", Dictionary{{"QFBundleDisplayName", "Lang"}}}});
    addPlugIn(apps + "A.app/PlugIns/B.appex", "b", {}, {{"QFBundleName", "Short"}});
    files.write(apps + "A.app/PlugIns/B.appex/Localized.plist", "broken");
    addPlugIn(apps + "A.app/PlugIns/C.appex", "c", {}, {{"QFBundleName", true}});
    start();
    EXPECT_EQ(plugIn("a")->localizedName, "Lang");
    EXPECT_EQ(plugIn("a")->localizedShortName, "Short");
    EXPECT_EQ(plugIn("b")->localizedName, "Short");
    EXPECT_EQ(plugIn("c")->localizedName, std::nullopt);
    ::setenv("LC_ALL", "C", 1);
    start();
    EXPECT_EQ(plugIn("a")->localizedName, "Long");
    ::unsetenv("LC_ALL");
}

TEST_F(RegistryTest, LeavesOutBadBundlesWithOneLineEach) {
    const std::string head = "<plist version=\"1.0\"><dict><key>VXExtension</key><dict/>";
    const std::string tail = "</dict></plist>";
    std::string deep;
    for (int i = 0; i < 70; ++i) deep = "<array>" + deep + "</array>";
    auto text = [&](const char* key, const std::string& value) {
        return head + "<key>" + key + "</key>" + value + tail;
    };
    auto string = [](const std::string& value) { return "<string>" + value + "</string>"; };
    std::string many;
    for (std::size_t i = 0; i < kMaxBundleValues; ++i) many += "<true/>";
    many = "<array>" + many + "</array>";
    auto own = [&](const char* key, const std::string& value) {
        std::string whole = text("QFBundleIdentifier", string("x"));
        return whole.replace(whole.find("<dict/>"), 7,
                             std::string("<dict><key>") + key + "</key>" + value + "</dict>");
    };
    const std::map<std::string, std::string> bad{
        {"empty", ""},
        {"garbage", "{\"json\": 1}"},
        {"truncated", head.substr(0, 40)},
        {"binary", std::string("bplist00\xD1\x01\x02\0\0\0", 14)},
        {"array", "<plist version=\"1.0\"><array/></plist>"},
        {"no-extension", "<plist version=\"1.0\"><dict/></plist>"},
        {"text-extension",
         "<plist version=\"1.0\"><dict><key>VXExtension</key><string>x</string></dict></plist>"},
        {"deep", text("Deep", deep)},
        {"large", text("Large", string(std::string(20u << 20, 'x')))},
        {"executable", text("QFBundleExecutable", string("../x"))},
        {"identifier", text("VXExtensionIdentifier", string(".x"))},
        {"bundle-identifier", text("QFBundleIdentifier", string("a/b"))},
        {"long-identifier", text("QFBundleIdentifier", string(std::string(256, 'x')))},
        {"nameless", text("QFBundleName", string("x"))},
        {"executable-type", text("QFBundleExecutable", "<integer>1</integer>")},
        {"bundle-identifier-type", text("QFBundleIdentifier", "<integer>1</integer>")},
        {"identifier-type", own("VXExtensionIdentifier", "<array/>")},
        {"original-type", own("VXOriginalIdentifier", "<true/>")},
        {"attributes-type", own("VXExtensionAttributes", string("none"))},
        {"many", own("Many", many)},
        {"bulky", own("Bulky", string(std::string(kMaxRecordSize, 'x')))},
    };
    const std::string folder = apps + "A.app/PlugIns/";
    addApplication(apps + "A.app");
    for (const auto& [name, bytes] : bad) files.write(folder + name + "/Info.plist", bytes);
    files.makeDirectory(folder + "missing");
    addPlugIn(folder + "entitlements", "x");
    files.write(folder + "entitlements/Entitlements.plist", "broken");
    addPlugIn(folder + "entitled", "x");
    files.write(folder + "entitled/Entitlements.plist",
                "<plist version=\"1.0\"><dict><key>Many</key>" + many + tail);
    // Wrong types that have another meaning.
    addPlugIn(folder + "good", "good",
              {{"VXExtensionPointIdentifier", 4}, {"VXExtensionProtocol", 1}},
              {{"QFBundleVersion", 2}, {"QFBundleName", 3}});

    for (const char* run : {"first", "second"}) {
        ErrorLines errors;
        start();
        EXPECT_THAT(installed(), ElementsAre("good")) << run;
        EXPECT_EQ(errors.lines.size(), bad.size() + 3) << run;
        EXPECT_THAT(errors.lines, testing::Contains(HasSubstr("plist: too many values")).Times(2));
        for (const auto& [name, bytes] : bad)
            EXPECT_THAT(errors.lines,
                        testing::Contains(HasSubstr("/" + name + "/Info.plist: ")).Times(1))
                << run;
    }
}

TEST_F(RegistryTest, FollowsLinksAndSkipsWhatCannotBeNamed) {
    addApplication("opt/Real.app");
    addPlugIn("opt/Real.app/PlugIns/A.appex", "a");
    const std::string stray = addPlugIn("opt/Stray.appex", "stray");
    files.makeDirectory(apps);
    fs::create_symlink(files.path("opt/Real.app"), files.path(apps + "One.app"));
    fs::create_symlink(files.path("opt/Real.app"), files.path(apps + "Two.app"));
    fs::create_symlink(files.path(apps + "Loop.app"), files.path(apps + "Loop.app"));
    fs::create_symlink(files.path("opt"), files.path(apps + "Other.app"));
    fs::create_symlink(stray, files.path("opt/Real.app/PlugIns/Link.appex"));
    addApplication(apps + "Shared.app");
    addPlugIn("opt/Shelf/S.appex", "shelved");
    fs::create_symlink(files.path("opt/Shelf"), files.path(apps + "Shared.app/PlugIns"));
    files.write(apps + "File.app/PlugIns", "not a directory");
    addPlugIn(apps + "Bad\xFF.app/PlugIns/A.appex", "x");
    addPlugIn(apps + "Line\n.app/PlugIns/A.appex", "x");
    ErrorLines errors;
    start();
    EXPECT_THAT(installed(), ElementsAre("a", "shelved", "stray"));
    EXPECT_EQ(plugIn("shelved")->bundlePath, files.path("opt/Shelf/S.appex"));
    EXPECT_EQ(plugIn("a")->bundlePath, files.path("opt/Real.app/PlugIns/A.appex"));
    EXPECT_EQ(plugIn("stray")->containingApplication, nullptr);
    EXPECT_THAT(errors.lines,
                UnorderedElementsAre(HasSubstr("Loop.app"), HasSubstr("Other.app"),
                                     HasSubstr("Bad"), HasSubstr("Line"), HasSubstr("File.app")));
}

TEST_F(RegistryTest, ReadsNothingThatLiesOutsideABundle) {
    addApplication(apps + "A.app");
    const std::string folder = apps + "A.app/PlugIns/";
    writePlist("private.plist", {{"secret", true}, {"VXExtension", Dictionary()}});
    const std::string secret = files.path("private.plist");
    for (const char* name : {"whole", "inside", "rights", "names"}) addPlugIn(folder + name, name);
    files.makeDirectory(folder + "info");
    fs::create_symlink(secret, files.path(folder + "info/Info.plist"));
    fs::create_symlink("../../../../../../private.plist",
                       files.path(folder + "rights/Entitlements.plist"));
    fs::create_symlink(secret, files.path(folder + "names/Localized.plist"));
    writePlist(folder + "inside/deep/rights.plist", {{"own", true}});
    fs::create_symlink("deep/../deep/rights.plist",
                       files.path(folder + "inside/Entitlements.plist"));
    addApplication(apps + "B.app");
    fs::remove(files.path(apps + "B.app/Info.plist"));
    fs::create_symlink(secret, files.path(apps + "B.app/Info.plist"));
    ::setenv("LANG", "de_DE.UTF-8", 1);
    const char* text = "list: a symbolic link or a mount that leads out of the bundle";
    for (int run = 0; run < 2; ++run) {
        ErrorLines errors;
        start();
        EXPECT_THAT(installed(), ElementsAre("inside", "names", "whole"));
        EXPECT_TRUE(plugIn("inside")->entitlements.get().contains("own"));
        // What only lacks a name is not told of again as long as it does not change.
        std::vector<std::string> told{"info/Info.p", "rights/Entitlements.p"};
        if (run == 0) told.insert(told.end(), {"names/Localized.p", "B.app/Info.p"});
        for (const std::string& file : told)
            EXPECT_THAT(errors.lines, testing::Contains(AllOf(HasSubstr(file), HasSubstr(text))));
    }
    ::unsetenv("LANG");
    fs::remove(files.path(folder + "rights/Entitlements.plist"));
    start();
    EXPECT_THAT(installed(), ElementsAre("inside", "names", "rights", "whole"));
    const Uuid uuid = plugIn("names")->plugInUuid;
    writePlist("private.plist", {{"another", "secret"}});
    start();
    EXPECT_EQ(plugIn("names")->plugInUuid, uuid) << "what lies outside is not looked at";
}

TEST_F(RegistryTest, MakesDataContainersThatAreTheUsersOwn) {
    addApplication(apps + "A.app");
    const std::string folder = apps + "A.app/PlugIns/";
    addPlugIn(folder + "A.appex", "a");
    addPlugIn(folder + "B.appex", "b", {{"VXExtensionProtocol", "#Data"}});
    for (const char* name : {"c", "d"}) addPlugIn(folder + name, name);
    const std::string containers = files.makeDirectory("home/zorvan/Containers");
    fs::create_symlink(files.makeDirectory("elsewhere"), containers + "/c");
    files.write("home/zorvan/Containers/d", "a file");
    start();
    EXPECT_EQ(plugIn("a")->dataContainerPath, containers + "/a");
    struct stat status;
    ASSERT_EQ(::stat((containers + "/a/tmp").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777, 0700u);
    EXPECT_FALSE(fs::exists(containers + "/b"));
    for (const char* name : {"b", "c", "d"})
        EXPECT_EQ(plugIn(name)->dataContainerPath, std::nullopt) << name;
    fs::remove(containers + "/d");
    start();
    EXPECT_EQ(plugIn("d")->dataContainerPath, containers + "/d");
    EXPECT_EQ(plugIn("a")->dataContainerPath, containers + "/a");

    fs::remove_all(containers + "/a/tmp");
    start();
    EXPECT_TRUE(fs::exists(containers + "/a/tmp"));
    fs::remove_all(containers);
    EXPECT_EQ(registerPlugIn(addPlugIn(folder + "E.appex", "e")), std::nullopt);
    EXPECT_TRUE(fs::exists(containers + "/e/tmp"));
    fs::remove_all(containers);
    files.write("home/zorvan/Containers", "a file");
    ErrorLines errors;
    start();
    EXPECT_EQ(plugIn("a")->dataContainerPath, std::nullopt);
    EXPECT_EQ(plugIn("e")->dataContainerPath, std::nullopt);
    EXPECT_THAT(errors.lines, ElementsAre(HasSubstr("no data containers")));
}

TEST_F(RegistryTest, WithdrawsAContainerThatCannotBeMadeAfterAll) {
    addApplication(apps + "A.app");
    writePlist("home/zorvan/SDKs/org.point.plist", {{"FromSdk", true}});
    for (const char* name : {"a", "b"}) addPlugIn(apps + "A.app/PlugIns/" + name, name);
    addPlugIn(apps + "A.app/PlugIns/c", "c", {{"VXExtensionPointIdentifier", "org.point"}});
    onMerge = [this] { files.write("home/zorvan/Containers/b", "in the way"); };
    start();
    EXPECT_EQ(plugIn("b")->dataContainerPath, std::nullopt);
    EXPECT_THAT(recorder.take(), ElementsAre("+a", "+b", "+c", "-b", "+b"));
    const Uuid uuid = plugIn("b")->plugInUuid;
    start();
    EXPECT_EQ(plugIn("b")->plugInUuid, uuid);
    EXPECT_TRUE(plugIn("c")->dataContainerPath);
}

}  // namespace
}  // namespace platform::tandry
