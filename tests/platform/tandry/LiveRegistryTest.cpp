#include <fcntl.h>
#include <sys/resource.h>

#include <filesystem>
#include <random>

#include "platform/system/UniqueFd.h"
#include "platform/tandry/ChangeGatherer.h"
#include "tests/platform/tandry/RegistryFixture.h"

namespace platform::tandry {
namespace {

namespace fs = std::filesystem;

class LiveRegistryTest : public RegistryTest {
  protected:
    LiveRegistryTest() {
        watching.quiet = std::chrono::milliseconds(20);
        watching.longest = std::chrono::milliseconds(40);
    }
    fs::path at(const std::string& path) const { return files.path(path); }
};

TEST_F(LiveRegistryTest, FollowsAnApplicationThroughItsLife) {
    start();
    // Not even the directory is there yet.
    addApplication("new/A.app");
    addPlugIn("new/A.app/PlugIns/A.appex", "a");
    addPlugIn("new/A.app/PlugIns/B.appex", "b");
    fs::create_directories(at(apps));
    fs::rename(at("new/A.app"), at(apps + "A.app"));
    EXPECT_THAT(recorder.take(2), ElementsAre("+a", "+b"));
    EXPECT_TRUE(fs::exists(at("home/zorvan/Containers/a/tmp")));
    // A walk that finds nothing new looks at containers, too. (All go at once: one may be in the
    // making.)
    const fs::path containers = at("home/zorvan/Containers");
    fs::rename(containers, at("old-containers"));
    files.write(apps + "A.app/PlugIns/note", "");
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    const auto hasContainer = [&](const char* name) {
        const auto found = plugIn(name);
        return found && found->dataContainerPath && fs::exists(containers / name / "tmp");
    };
    const auto areThere = [&] { return hasContainer("a") && hasContainer("b"); };
    while (!areThere() && std::chrono::steady_clock::now() < end) settle();
    EXPECT_TRUE(areThere());
    // A walk may have seen one of them while it had none.
    settle();
    recorder.take();
    const Uuid uuid = plugIn("a")->plugInUuid;

    // A new file under an old name.
    addPlugIn("new/A.appex", "a", {}, {{"changed", true}});
    fs::rename(at("new/A.appex/Info.plist"), at(apps + "A.app/PlugIns/A.appex/Info.plist"));
    EXPECT_THAT(recorder.take(2), ElementsAre("-a", "+a"));
    EXPECT_NE(plugIn("a")->plugInUuid, uuid);
    writePlist(apps + "A.app/PlugIns/B.appex/Entitlements.plist", {{"right", true}});
    EXPECT_THAT(recorder.take(2), ElementsAre("-b", "+b"));

    files.write(apps + "A.app/.placeholder", "");
    EXPECT_THAT(recorder.take(4), ElementsAre("-a", "-b", "+a", "+b"));
    EXPECT_TRUE(plugIn("a")->containingApplication->isPlaceholder);
    fs::remove(at(apps + "A.app/.placeholder"));
    EXPECT_THAT(recorder.take(4), ElementsAre("-a", "-b", "+a", "+b"));
    EXPECT_FALSE(plugIn("a")->containingApplication->isPlaceholder);

    fs::rename(at(apps + "A.app/PlugIns/A.appex"), at(apps + "A.app/PlugIns/C.appex"));
    EXPECT_THAT(recorder.take(2), ElementsAre("-a", "+a"));
    fs::rename(at(apps + "A.app"), at(apps + "B.app"));
    EXPECT_THAT(recorder.take(4), UnorderedElementsAre("-b", "-a", "+b", "+a"));
    EXPECT_EQ(plugIn("b")->containingApplication->bundlePath, at(apps + "B.app"));
    // What has a new name is watched under it.
    fs::remove_all(at(apps + "B.app/PlugIns/C.appex"));
    EXPECT_THAT(recorder.take(1), ElementsAre("-a"));
    fs::rename(at("home"), at("gone"));
    EXPECT_THAT(recorder.take(1), ElementsAre("-b"));
    fs::rename(at("gone"), at("home"));
    EXPECT_THAT(recorder.take(1), ElementsAre("+b"));
    const Uuid last = plugIn("b")->plugInUuid;
    start();
    EXPECT_THAT(recorder.take(), IsEmpty());
    EXPECT_EQ(plugIn("b")->plugInUuid, last);
}

TEST_F(LiveRegistryTest, WhatIsRenamedIntoPlaceInWholeNeedsNoQuiet) {
    fs::create_directories(at(apps));
    watching = {.quiet = std::chrono::hours(1), .longest = std::chrono::hours(1)};
    start();
    addPlugIn("new/A.app/PlugIns/A.appex", "a");
    fs::rename(at("new/A.app"), at(apps + "A.app"));
    EXPECT_THAT(recorder.take(1), ElementsAre("+a"));
    // So is the next version, though the one before goes first.
    addPlugIn("new/A.app/PlugIns/A.appex", "b");
    fs::rename(at(apps + "A.app"), at("old"));
    fs::rename(at("new/A.app"), at(apps + "A.app"));
    EXPECT_THAT(recorder.take(2), ElementsAre("-a", "+b"));
}

TEST_F(LiveRegistryTest, TellsAtOnceThatABundleMayHaveBeenExchanged) {
    const std::string linked = addPlugIn("opt/Linked.appex", "linked");
    const std::string bundle = addPlugIn(apps + "A.app/PlugIns/A.appex", "a");
    fs::create_directory_symlink(linked, at(apps + "A.app/PlugIns/Link.appex"));
    start();
    const auto untouched = [&](const std::string& path) {
        return workspace->untouchedBundles().contains(path);
    };
    const auto becomesUntouched = [&](const std::string& path) {
        const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(30);
        while (!untouched(path) && std::chrono::steady_clock::now() < end) settle();
        return untouched(path);
    };
    EXPECT_TRUE(becomesUntouched(bundle));
    const std::string decoy = files.makeDirectory("decoy");
    for (const std::string& way : {bundle, linked})
        for (fs::path part = way; part != files.path(); part = part.parent_path()) {
            for (int times = 0; times < 2; ++times) {
                const fs::path link = at("exchange");
                fs::create_directory_symlink(decoy, link);
                ASSERT_EQ(
                    ::renameat2(AT_FDCWD, link.c_str(), AT_FDCWD, part.c_str(), RENAME_EXCHANGE),
                    0);
                EXPECT_FALSE(untouched(way)) << part;
                ASSERT_EQ(
                    ::renameat2(AT_FDCWD, link.c_str(), AT_FDCWD, part.c_str(), RENAME_EXCHANGE),
                    0);
                fs::remove(link);
                EXPECT_TRUE(becomesUntouched(way)) << part;
            }
        }
    // Directories that may be passed but not read cannot be watched.
    fs::permissions(at("opt"), fs::perms::owner_exec);
    EXPECT_TRUE(becomesUntouched(bundle));
    EXPECT_EQ(becomesUntouched(linked), ::geteuid() == 0);
    fs::permissions(at("opt"), fs::perms::owner_all);
}

TEST_F(LiveRegistryTest, FollowsWhatWasRegisteredAndItsDictionary) {
    const std::string loose =
        addPlugIn("opt/Loose.appex", "loose", {{"VXExtensionPointIdentifier", "org.point"}});
    addApplication("opt/A.app");
    const std::string inside = addPlugIn("opt/A.app/Extras/E.appex", "extra");
    start();
    for (const std::string& path : {loose, inside}) EXPECT_EQ(registerPlugIn(path), std::nullopt);
    recorder.take();
    writePlist("home/zorvan/SDKs/org.point.plist", {{"FromSdk", true}});
    EXPECT_THAT(recorder.take(2), ElementsAre("-loose", "+loose"));
    files.write("opt/A.app/.placeholder", "");
    EXPECT_THAT(recorder.take(2), ElementsAre("-extra", "+extra"));
    EXPECT_TRUE(plugIn("extra")->containingApplication->isPlaceholder);
    fs::rename(at("opt"), at("away"));
    EXPECT_THAT(recorder.take(2), ElementsAre("-extra", "-loose"));
    fs::rename(at("away"), at("opt"));
    EXPECT_THAT(recorder.take(2), ElementsAre("+extra", "+loose"));
    // An unregistered bundle stays out, whatever happens around it.
    EXPECT_EQ(unregisterPlugIn(inside), std::nullopt);
    recorder.take();
    files.write("opt/A.app/Extras/E.appex/new", "");
    fs::remove_all(loose);
    EXPECT_THAT(recorder.take(1), ElementsAre("-loose"));
}

TEST_F(LiveRegistryTest, AFaultCostsOneLineHoweverOftenItIsMet) {
    files.makeDirectory(apps);
    fs::create_symlink("Loop.app", at(apps + "Loop.app"));
    files.write(apps + "File.app/PlugIns", "not a directory");
    files.makeDirectory(apps + "Bare.app/PlugIns/Bare.appex");
    ErrorLines errors;
    start();
    // What a client asked for is less than an error; what comes afterwards is not.
    EXPECT_TRUE(registerPlugIn(files.makeDirectory("asked")));
    files.write(apps + "Late.app/PlugIns", "not a directory");
    for (const char* name : {"a", "b", "c"}) {
        addPlugIn(std::string("opt/") + name, name);
        fs::rename(at(std::string("opt/") + name), at(apps + "Bare.app/PlugIns/" + name));
        recorder.take(1);
        // A walk over everything.
        fs::create_directory_symlink(at("opt"), at(apps + name + ".app"));
        addPlugIn("opt/PlugIns/" + std::string(name), name);
    }
    stop();
    for (const char* name : {"Loop.app", "File.app/PlugIns", "Bare.appex", "Late.app/PlugIns"})
        EXPECT_THAT(errors.lines, testing::Contains(HasSubstr(name)).Times(1)) << name;
}

TEST_F(LiveRegistryTest, WithoutEnoughWatchesItLooksFromTimeToTime) {
    watching.mostWatches = 5;
    watching.retry = std::chrono::milliseconds(20);
    addApplication(apps + "A.app");
    ErrorLines errors;
    start();
    for (const char* name : {"a", "b"}) {
        addPlugIn(apps + "A.app/PlugIns/" + name, name);
        EXPECT_THAT(recorder.take(1), ElementsAre("+" + std::string(name)));
    }
    stop();
    EXPECT_THAT(errors.lines, testing::Contains(HasSubstr("cannot watch all")).Times(1));
}

/// While it lives, this process can open no descriptors, or few.
class FewDescriptors {
  public:
    static constexpr std::size_t kMost = 32;

    FewDescriptors() {
        ::getrlimit(RLIMIT_NOFILE, &before_);
        std::vector<UniqueFd> opened(kMost + 1);
        for (UniqueFd& fd : opened) {
            fd.reset(::open("/dev/null", O_RDONLY | O_CLOEXEC));
            free_.push_back(static_cast<rlim_t>(fd.get()));
        }
        allow(0);
    }
    ~FewDescriptors() { ::setrlimit(RLIMIT_NOFILE, &before_); }

    /// Together.
    void allow(std::size_t count) {
        const rlimit limit{free_[count], before_.rlim_max};
        ::setrlimit(RLIMIT_NOFILE, &limit);
    }

  private:
    rlimit before_{};
    std::vector<rlim_t> free_;
};

TEST_F(LiveRegistryTest, WhatCannotBeReadJustNowStaysAndIsReadLater) {
#ifdef __SANITIZE_ADDRESS__
    GTEST_SKIP() << "the sanitizers of this build open a pipe for each class that they meet";
#endif
    ::setenv("LC_ALL", "de", 1);
    // Nothing but the next try tells of an end of the shortage.
    watching.quiet = watching.longest = std::chrono::hours(1);
    watching.retry = std::chrono::milliseconds(20);
    addApplication(apps + "A.app", {{"QFBundleIdentifier", "app"}});
    addPlugIn(apps + "A.app/PlugIns/A.appex", "a");
    addPlugIn(apps + "A.app/PlugIns/B.appex", "b");
    start();
    recorder.take();
    const Uuid uuid = plugIn("a")->plugInUuid;
    for (const std::string bundle : {"A.app/PlugIns/A.appex", "A.app"})
        writePlist(apps + bundle + "/Localized.plist",
                   {{"de", Dictionary{{"QFBundleDisplayName", "Anna"}}}});
    fs::remove_all(at(apps + "A.app/PlugIns/B.appex"));
    std::vector<std::string> told;
    bool isSame = true;
    {
        // One more at a time, until there are enough to see into the folder, but not into its
        // files.
        FewDescriptors few;
        for (std::size_t count = 0; told.empty() && count < FewDescriptors::kMost; ++count) {
            few.allow(count);
            static_cast<void>(registerPlugIn(files.path(apps + "A.app")));
            told = recorder.take();
            isSame = isSame && plugIn("a")->plugInUuid == uuid;
        }
    }
    EXPECT_TRUE(isSame);
    EXPECT_THAT(told, ElementsAre("-b"));
    ::unsetenv("LC_ALL");
    // The application's names may be read in one walk, the plug-in's in the next.
    ASSERT_TRUE(recorder.waitUntil([&] {
        const TDPlugInProxyRef now = plugIn("a");
        return now && now->localizedName == "Anna" &&
               now->containingApplication->localizedName == "Anna";
    }));
    EXPECT_EQ(plugIn("a")->containingApplication->bundleIdentifier, "app");
}

/// Whatever happens on disk, the registry ends where one that starts then would begin.
TEST_F(LiveRegistryTest, EndsWhereAFreshStartWouldBegin) {
    const std::string shared = "share/zorvan/Applications/";
    const std::vector<std::string> names{shared + "A.app", shared + "B.app", "opt/C.app",
                                         "opt/D.app"};
    std::mt19937 random(7);
    auto pick = [&](std::size_t count) { return random() % count; };
    auto mutate = [&] {
        const std::string app = names[pick(names.size())];
        const std::string other = names[pick(names.size())];
        const std::string plugIn = "/PlugIns/" + std::string(1, static_cast<char>('x' + pick(2)));
        std::error_code ignored;
        switch (pick(9)) {
            case 0:
            case 1:
            case 2:
                if (fs::is_symlink(at(app + "/PlugIns"))) break;
                addApplication(app, {{"QFBundleIdentifier", std::to_string(pick(3))}});
                addPlugIn(app + plugIn, std::to_string(pick(1000)));
                break;
            case 3:
                fs::rename(at(app), at(other), ignored);
                break;
            case 4:
                fs::remove_all(at(app), ignored);
                break;
            case 5:
                fs::create_symlink(at(other), at(app), ignored);
                break;
            case 6:
                fs::remove_all(at(app + plugIn), ignored);
                break;
            case 7:
                fs::rename(at(app + plugIn), at(other + plugIn), ignored);
                break;
            case 8:
                fs::create_symlink(at(other + plugIn), at(app + plugIn), ignored);
                break;
        }
    };
    auto state = [](Workspace& registry) {
        std::vector<std::string> lines;
        for (const auto& record : registry.installedPlugIns())
            lines.push_back(*record->bundlePath + ' ' + *record->plugInIdentifier + ' ' +
                            (record->containingApplication
                                 ? record->containingApplication->bundleIdentifier
                                 : "none"));
        return lines;
    };
    files.makeDirectory("opt");
    addApplication("opt/C.app");
    addPlugIn("opt/C.app/PlugIns/x", "x");
    start();
    EXPECT_EQ(registerPlugIn(files.path("opt/C.app")), std::nullopt);
    for (int round = 0; round < 25; ++round) {
        for (std::size_t i = 0; i <= pick(6); ++i) try {
                mutate();
            } catch (const std::exception&) {
                // Through a link that leads nowhere.
            }
        Directories second = directories;
        second.dataHome = files.path("second-" + std::to_string(round));
        auto fresh = openDiskWorkspace(second, *sdks, nullptr);
        ASSERT_TRUE(fresh);
        (*fresh)->activate();
        if (!fs::is_symlink(at("opt/C.app")))
            static_cast<void>(
                (*fresh)->registerPlugIn(files.path("opt/C.app"), Requester::Unconfined));
        const std::vector<std::string> expected = state(**fresh);
        ASSERT_TRUE(recorder.waitUntil([&] { return state(*workspace) == expected; }))
            << "round " << round << ": " << testing::PrintToString(state(*workspace))
            << " instead of " << testing::PrintToString(expected);
    }
}

}  // namespace
}  // namespace platform::tandry
