#include <sys/resource.h>
#include <unistd.h>

#include <filesystem>

#include "platform/tandry/DictionaryRoom.h"
#include "tests/platform/tandry/RegistryFixture.h"

namespace platform::tandry {
namespace {

namespace fs = std::filesystem;

TEST_F(RegistryTest, RegistersByPathAcrossRestarts) {
    const std::string loose = addPlugIn("opt/App.appex", "loose");
    const std::string app = addApplication("opt/App.app");
    const std::string inside = addPlugIn("opt/App.app/PlugIns/A.appex", "a");
    addPlugIn("opt/App.app/PlugIns/B.appex", "b");
    files.makeDirectory("opt/App.app/PlugIns/Broken.appex");
    start();
    EXPECT_EQ(registerPlugIn(loose), std::nullopt);
    EXPECT_EQ(registerPlugIn(inside), std::nullopt);
    EXPECT_THAT(recorder.take(), ElementsAre("+loose", "+a"));
    EXPECT_EQ(plugIn("a")->containingApplication->bundlePath, app);
    const Uuid uuid = plugIn("a")->plugInUuid;
    EXPECT_EQ(registerPlugIn(app), std::nullopt);
    EXPECT_THAT(recorder.take(), ElementsAre("+b"));
    start();
    EXPECT_THAT(installed(), ElementsAre("a", "b", "loose"));
    EXPECT_THAT(recorder.take(), IsEmpty());
    EXPECT_EQ(plugIn("a")->plugInUuid, uuid);

    addPlugIn("opt/App.app/PlugIns/B.appex", "b", {}, {{"changed", true}});
    EXPECT_EQ(registerPlugIn(app), std::nullopt);
    EXPECT_THAT(recorder.take(), ElementsAre("-b", "+b"));
    EXPECT_EQ(plugIn("a")->plugInUuid, uuid);

    EXPECT_TRUE(unregisterPlugIn(files.path("opt")));
    EXPECT_EQ(unregisterPlugIn(app), std::nullopt);
    EXPECT_THAT(recorder.take(), ElementsAre("-a", "-b"));
    EXPECT_TRUE(unregisterPlugIn(app));
    fs::remove_all(loose);
    EXPECT_EQ(unregisterPlugIn(loose), std::nullopt);
    start();
    EXPECT_THAT(installed(), IsEmpty());
    EXPECT_THAT(recorder.take(), ElementsAre("-loose"));
}

TEST_F(RegistryTest, RefusesWithTheReason) {
    start();
    const std::string broken = files.path("opt/Broken.appex");
    files.write("opt/Broken.appex/Info.plist", "broken");
    addApplication("opt/Empty.app");
    // Any client can ask for a line in the log: it is no error, and tells nobody of files.
    std::set<std::pair<LogLevel, std::string>> told;
    const auto tell = [&](const auto&, LogLevel level, const std::string& text) {
        if (text.starts_with("leaving out")) told.emplace(level, text);
    };
    const LogCapture log(tell, LogCapture::Private::Hidden);
    for (const std::string& path : {broken, files.path("opt/Empty.app"), files.path("missing"),
                                    files.path("opt/Broken.appex/Info.plist")}) {
        std::optional<Error> error = registerPlugIn(path);
        ASSERT_TRUE(error) << path;
        EXPECT_THAT(error->text, HasSubstr(path));
        EXPECT_TRUE(unregisterPlugIn(path)) << path;
    }
    addPlugIn("opt/Broken.appex", "mended");
    EXPECT_EQ(registerPlugIn(broken), std::nullopt);
    // A registered bundle that breaks goes; mended, it is back without another registration.
    files.write("opt/Broken.appex/Info.plist", "");
    EXPECT_TRUE(registerPlugIn(broken));
    EXPECT_THAT(recorder.take(), ElementsAre("+mended", "-mended"));
    addPlugIn("opt/Broken.appex", "mended");
    start();
    EXPECT_THAT(installed(), ElementsAre("mended"));
    EXPECT_THAT(told, ElementsAre(std::pair(LogLevel::Info, "leaving out a plug-in: <private>")));
}

TEST_F(RegistryTest, DoesNothingForConfinedProcesses) {
    const std::string loose = addPlugIn("opt/Loose.appex", "loose");
    start();
    ErrorLines errors;
    EXPECT_THAT(workspace->registerPlugIn(loose, Requester::Confined)->text, HasSubstr(loose));
    EXPECT_EQ(registerPlugIn(loose), std::nullopt);
    EXPECT_TRUE(workspace->unregisterPlugIn(loose, Requester::Confined));
    EXPECT_THAT(recorder.take(), ElementsAre("+loose"));
    EXPECT_THAT(errors.lines,
                ElementsAre("refusing to register " + loose + ": a confined process asks",
                            "refusing to unregister " + loose + ": a confined process asks"));
}

TEST_F(RegistryTest, TakesNothingFromWhereConfinedProcessesWrite) {
    // Names say nothing: the places themselves are reached through links.
    const auto link = [this](const std::string& target, const std::string& name) {
        fs::create_directories(fs::path(files.path(name)).parent_path());
        fs::create_directory_symlink(files.path(target), files.path(name));
    };
    files.makeDirectory("disk/containers");
    files.makeDirectory("disk/run/zorvan");
    files.makeDirectory("disk/busy");
    link("disk/containers", "home/zorvan/Containers");
    link("disk/run", "run");
    link("disk/busy", "disk/run/zorvan/tenurd");
    const std::pair<const char*, const char*> places[] = {
        {"disk/containers/x", "a data container"},
        {"disk/busy/x", "an assertion folder"},
        {"disk/run", "the runtime directory"},
    };
    start();
    for (const auto& [place, name] : places) {
        const std::string evil = addPlugIn(place + std::string("/Evil.appex"), "evil");
        const std::string app = addApplication(place + std::string("/Evil.app"));
        addPlugIn(place + std::string("/Evil.app/PlugIns/E.appex"), "evil");
        fs::remove_all(files.path("opt"));
        link(place + std::string("/Evil.appex"), "opt/Link.appex");
        ErrorLines errors;
        for (const std::string& path : {evil, app, files.path("opt/Link.appex")})
            EXPECT_THAT(registerPlugIn(path)->text, HasSubstr(name)) << path;
        EXPECT_THAT(errors.lines, testing::Each(AllOf(HasSubstr(place), HasSubstr(name))));
        EXPECT_EQ(errors.lines.size(), 3u);

        // What a good place leads to is not better for it.
        fs::remove_all(files.path(apps));
        const std::string mixed = addApplication("opt/Mixed.app");
        addPlugIn("opt/Mixed.app/PlugIns/Good.appex", "good");
        link(place + std::string("/Evil.appex"), "opt/Mixed.app/PlugIns/Evil.appex");
        link(place + std::string("/Evil.app"), apps + "Linked.app");
        addApplication(apps + "Half.app");
        link(place + std::string("/Evil.app/PlugIns"), apps + "Half.app/PlugIns");
        errors.lines.clear();
        EXPECT_EQ(registerPlugIn(mixed), std::nullopt);
        start();
        EXPECT_THAT(installed(), ElementsAre("good"));
        for (const char* what : {"/Evil.appex: ", "/Evil.app: ", "/Evil.app/PlugIns: "})
            EXPECT_THAT(errors.lines, testing::Contains(AllOf(HasSubstr(what), HasSubstr(name))));
        EXPECT_EQ(unregisterPlugIn(mixed), std::nullopt);
    }
}

TEST_F(RegistryTest, DropsWhatItKnowsOnceConfinedProcessesWriteThere) {
    const std::string loose = addPlugIn("opt/Loose.appex", "loose");
    start();
    EXPECT_EQ(registerPlugIn(loose), std::nullopt);
    directories.runtime = files.path("opt");
    ErrorLines errors;
    start();
    EXPECT_THAT(installed(), IsEmpty());
    EXPECT_THAT(errors.lines, ElementsAre("leaving out a plug-in: " + loose +
                                          ": it lies in the runtime directory"));
    EXPECT_EQ(unregisterPlugIn(loose), std::nullopt);
}

TEST_F(RegistryTest, AnUnregisteredBundleStaysForgottenUntilItChanges) {
    addApplication(apps + "A.app");
    const std::string a = addPlugIn(apps + "A.app/PlugIns/A.appex", "a");
    addPlugIn(apps + "A.app/PlugIns/B.appex", "b");
    const std::string app = files.path(apps + "A.app");
    start();
    EXPECT_EQ(unregisterPlugIn(a), std::nullopt);
    EXPECT_TRUE(unregisterPlugIn(a));
    start();
    EXPECT_THAT(installed(), ElementsAre("b"));
    EXPECT_EQ(registerPlugIn(a), std::nullopt);
    EXPECT_THAT(installed(), ElementsAre("a", "b"));

    // Edited, and then removed without a scan in between.
    addPlugIn(apps + "A.app/PlugIns/A.appex", "a", {}, {{"edited", true}});
    EXPECT_EQ(unregisterPlugIn(app), std::nullopt);
    start();
    EXPECT_THAT(installed(), IsEmpty());
    addPlugIn(apps + "A.app/PlugIns/A.appex", "a", {}, {{"edited", "again"}});
    start();
    EXPECT_THAT(installed(), ElementsAre("a"));
    EXPECT_EQ(registerPlugIn(app), std::nullopt);
    EXPECT_THAT(installed(), ElementsAre("a", "b"));
}

TEST_F(RegistryTest, RegisteringAnApplicationKeepsWhatOtherRoadsLeadTo) {
    const std::string app = addApplication("opt/A.app");
    addPlugIn("opt/A.app/PlugIns/A.appex", "a");
    const std::string extra = addPlugIn("opt/A.app/Extras/E.appex", "extra");
    addApplication("opt/A.app/Inner.app");
    addPlugIn("opt/A.app/Inner.app/PlugIns/I.appex", "inner");
    files.makeDirectory(apps);
    fs::create_symlink(files.path("opt/A.app/Inner.app"), files.path(apps + "Inner.app"));
    start();
    EXPECT_EQ(registerPlugIn(extra), std::nullopt);
    EXPECT_EQ(registerPlugIn(app), std::nullopt);
    EXPECT_THAT(recorder.take(), ElementsAre("+inner", "+extra", "+a"));
    EXPECT_THAT(installed(), UnorderedElementsAre("a", "extra", "inner"));
}

/// Lets the process open no file while it lives, also in the place of one that is closed.
class NoDescriptors {
  public:
    NoDescriptors() {
        ::getrlimit(RLIMIT_NOFILE, &before_);
        rlimit none = before_;
        none.rlim_cur = 0;
        ::setrlimit(RLIMIT_NOFILE, &none);
    }
    ~NoDescriptors() { ::setrlimit(RLIMIT_NOFILE, &before_); }

  private:
    rlimit before_;
};

TEST_F(RegistryTest, WhatTheFirstWalkCannotReachIsWhatItWas) {
#ifdef __SANITIZE_ADDRESS__
    GTEST_SKIP() << "the sanitizers of this build open a pipe for each class that they meet";
#endif
    addApplication(apps + "B.app");
    addPlugIn(apps + "B.app/PlugIns/B.appex", "b");
    start();
    const TDPlugInProxyRef before = plugIn("b");
    addApplication(apps + "A.app");
    writePlist("home/zorvan/SDKs/org.point.plist", {{"FromSdk", true}});
    addPlugIn(apps + "A.app/PlugIns/A.appex", "a", {{"VXExtensionPointIdentifier", "org.point"}});
    std::optional<NoDescriptors> limit;
    const LogCapture end([&](const std::string&, LogLevel, const std::string& text) {
        if (text.find("B.app/PlugIns: Too many") != std::string::npos) limit.reset();
    });
    TDPlugInProxyRef seen;
    std::optional<std::string> container;
    onMerge = [&] {
        if (merges == 1) return void(limit.emplace());
        // In the second walk, before it comes there.
        seen = workspace->plugInAtPath(*before->bundlePath);
        container = seen->dataContainerPath;
    };
    start();
    ASSERT_TRUE(seen);
    EXPECT_EQ(seen->plugInUuid, before->plugInUuid);
    EXPECT_EQ(container, before->dataContainerPath);
    EXPECT_EQ(plugIn("b"), seen);
}

TEST_F(RegistryTest, AnApplicationHasSoMuchRoom) {
    watching.retry = std::chrono::milliseconds(20);
    const std::string folder = apps + "A.app/PlugIns/";
    addApplication(apps + "A.app");
    const std::string text(500'000, 'x');
    const auto name = [](int number) { return "p" + std::to_string(number); };
    constexpr int kFit = 67;
    for (int i = 10; i < 10 + kFit + 2; ++i)
        addPlugIn(folder + name(i), name(i), {{"VXExtensionPointIdentifier", "org.point"}},
                  {{"Text", text}});
    writePlist("home/zorvan/SDKs/org.point.plist", {{"FromSdk", true}});
    addApplication(apps + "B.app");
    addPlugIn(apps + "B.app/PlugIns/b", "b");
    for (const int read : {kFit + 2, 0}) {
        ErrorLines errors;
        start();
        EXPECT_EQ(merges, read);
        EXPECT_EQ(installed().size(), kFit + 1u);
        EXPECT_TRUE(plugIn("b"));
        EXPECT_THAT(errors.lines,
                    ElementsAre(AllOf(HasSubstr("/p77"), HasSubstr("32 MiB")), HasSubstr("/p78")));
    }
    // Where another goes there is room.
    recorder.take();
    EXPECT_EQ(unregisterPlugIn(files.path(folder + "p20")), std::nullopt);
    EXPECT_THAT(recorder.take(2), ElementsAre("-p20", "+p77"));
}

TEST(DictionaryRoom, BoundsAnApplicationAndTheWhole) {
    RegistryState state;
    const auto add = [&](const std::string& application, const std::string& path) {
        PlugInEntry& entry = state.plugIns[application + path];
        entry.record = std::make_shared<TDPlugInProxy>();
        if (!application.empty())
            entry.record->containingApplication = std::make_shared<TDApplicationProxy>(
                TDApplicationProxy{application, "", "", false});
        entry.dictionaries = std::make_shared<const std::string>(kMaxApplicationSize / 2, 'x');
    };
    for (const char* application : {"/a", "/b", "/c", ""})
        for (const char* path : {"/1", "/2"}) add(application, path);
    DictionaryRoom room;
    room.count(state);
    EXPECT_FALSE(room.excess("/a", 0));
    EXPECT_TRUE(room.excess("/d", 1)) << "all together have their bound";
    room.remove(state.plugIns.at("/b/1"));
    EXPECT_TRUE(room.excess("/a", 1));
    EXPECT_FALSE(room.excess("/b", kMaxApplicationSize / 2));
    EXPECT_FALSE(room.excess("", kMaxApplicationSize / 2));
    EXPECT_TRUE(room.excess("", kMaxApplicationSize / 2 + 1));
}

TEST_F(RegistryTest, WhatIsForgottenStaysSoWhileItCannotBeRead) {
#ifdef __SANITIZE_ADDRESS__
    GTEST_SKIP() << "the sanitizers of this build open a pipe for each class that they meet";
#endif
    const std::string app = addApplication("opt/A.app");
    const std::string a = addPlugIn("opt/A.app/PlugIns/A.appex", "a");
    addPlugIn("opt/A.app/PlugIns/B.appex", "b");
    start();
    EXPECT_EQ(registerPlugIn(app), std::nullopt);
    EXPECT_EQ(unregisterPlugIn(a), std::nullopt);
    {
        const NoDescriptors limit;
        for (const std::string& path : {a, app})
            EXPECT_THAT(registerPlugIn(path)->text, HasSubstr("Too many open files"));
    }
    EXPECT_THAT(installed(), ElementsAre("b"));
    // As a volume that is not mounted, reached by registration or by a link.
    files.makeDirectory(apps);
    for (int i = 0; i < 2; ++i) {
        fs::rename(files.path("opt"), files.path("away"));
        start();
        EXPECT_THAT(installed(), IsEmpty());
        fs::rename(files.path("away"), files.path("opt"));
        start();
        EXPECT_THAT(installed(), ElementsAre("b"));
        if (i != 0) continue;
        fs::create_symlink("../../../opt/A.app", files.path(apps + "Link.app"));
        start();
        EXPECT_EQ(unregisterPlugIn(app), std::nullopt);
        EXPECT_EQ(registerPlugIn(files.path("opt/A.app/PlugIns/B.appex")), std::nullopt);
    }
}

}  // namespace
}  // namespace platform::tandry
