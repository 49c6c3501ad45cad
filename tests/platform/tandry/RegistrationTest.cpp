#include <sys/resource.h>
#include <unistd.h>

#include <filesystem>

#include "tests/platform/tandry/RegistryFixture.h"

namespace platform::tandry {
namespace {

namespace fs = std::filesystem;

TEST_F(RegistryTest, RegistersByPathAcrossRestarts) {
    const std::string loose = addPlugIn("opt/Loose.appex", "loose");
    const std::string app = addApplication("opt/App.app");
    const std::string inside = addPlugIn("opt/App.app/PlugIns/A.appex", "a");
    addPlugIn("opt/App.app/PlugIns/B.appex", "b");
    files.makeDirectory("opt/App.app/PlugIns/Broken.appex");
    start();
    EXPECT_EQ(workspace->registerPlugIn(loose), std::nullopt);
    EXPECT_EQ(workspace->registerPlugIn(inside), std::nullopt);
    EXPECT_THAT(recorder.take(), ElementsAre("+loose", "+a"));
    EXPECT_EQ(plugIn("a")->containingApplication, workspace->applicationAtPath(app));
    const Uuid uuid = plugIn("a")->plugInUuid;
    EXPECT_EQ(workspace->registerPlugIn(app), std::nullopt);
    EXPECT_THAT(recorder.take(), ElementsAre("+b"));
    start();
    EXPECT_THAT(installed(), ElementsAre("a", "b", "loose"));
    EXPECT_THAT(recorder.take(), IsEmpty());
    EXPECT_EQ(plugIn("a")->plugInUuid, uuid);

    addPlugIn("opt/App.app/PlugIns/B.appex", "b", {}, {{"changed", true}});
    EXPECT_EQ(workspace->registerPlugIn(app), std::nullopt);
    EXPECT_THAT(recorder.take(), ElementsAre("-b", "+b"));
    EXPECT_EQ(plugIn("a")->plugInUuid, uuid);

    EXPECT_TRUE(workspace->unregisterPlugIn(files.path("opt")));
    EXPECT_EQ(workspace->unregisterPlugIn(app), std::nullopt);
    EXPECT_THAT(recorder.take(), ElementsAre("-a", "-b"));
    EXPECT_EQ(workspace->applicationAtPath(app), nullptr);
    EXPECT_TRUE(workspace->unregisterPlugIn(app));
    fs::remove_all(loose);
    EXPECT_EQ(workspace->unregisterPlugIn(loose), std::nullopt);
    start();
    EXPECT_THAT(installed(), IsEmpty());
    EXPECT_THAT(recorder.take(), ElementsAre("-loose"));
}

TEST_F(RegistryTest, RefusesWithTheReason) {
    start();
    const std::string broken = files.path("opt/Broken.appex");
    files.write("opt/Broken.appex/Info.plist", "broken");
    addApplication("opt/Empty.app");
    for (const std::string& path : {broken, files.path("opt/Empty.app"), files.path("missing"),
                                    files.path("opt/Broken.appex/Info.plist")}) {
        std::optional<Error> error = workspace->registerPlugIn(path);
        ASSERT_TRUE(error) << path;
        EXPECT_THAT(error->text, HasSubstr(path));
        EXPECT_TRUE(workspace->unregisterPlugIn(path)) << path;
    }
    addPlugIn("opt/Broken.appex", "mended");
    EXPECT_EQ(workspace->registerPlugIn(broken), std::nullopt);
    // A registered bundle that breaks goes; mended, it is back without another registration.
    files.write("opt/Broken.appex/Info.plist", "");
    EXPECT_TRUE(workspace->registerPlugIn(broken));
    EXPECT_THAT(recorder.take(), ElementsAre("+mended", "-mended"));
    addPlugIn("opt/Broken.appex", "mended");
    start();
    EXPECT_THAT(installed(), ElementsAre("mended"));
}

TEST_F(RegistryTest, AnUnregisteredBundleStaysForgottenUntilItChanges) {
    addApplication(apps + "A.app");
    const std::string a = addPlugIn(apps + "A.app/PlugIns/A.appex", "a");
    addPlugIn(apps + "A.app/PlugIns/B.appex", "b");
    const std::string app = files.path(apps + "A.app");
    start();
    EXPECT_EQ(workspace->unregisterPlugIn(a), std::nullopt);
    EXPECT_TRUE(workspace->unregisterPlugIn(a));
    start();
    EXPECT_THAT(installed(), ElementsAre("b"));
    EXPECT_EQ(workspace->registerPlugIn(a), std::nullopt);
    EXPECT_THAT(installed(), ElementsAre("a", "b"));

    // Edited, and then removed without a scan in between.
    addPlugIn(apps + "A.app/PlugIns/A.appex", "a", {}, {{"edited", true}});
    EXPECT_EQ(workspace->unregisterPlugIn(app), std::nullopt);
    start();
    EXPECT_THAT(installed(), IsEmpty());
    EXPECT_TRUE(workspace->applicationAtPath(app));
    addPlugIn(apps + "A.app/PlugIns/A.appex", "a", {}, {{"edited", "again"}});
    start();
    EXPECT_THAT(installed(), ElementsAre("a"));
    EXPECT_EQ(workspace->registerPlugIn(app), std::nullopt);
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
    EXPECT_EQ(workspace->registerPlugIn(extra), std::nullopt);
    EXPECT_EQ(workspace->registerPlugIn(app), std::nullopt);
    EXPECT_THAT(recorder.take(), ElementsAre("+inner", "+extra", "+a"));
    EXPECT_THAT(installed(), UnorderedElementsAre("a", "extra", "inner"));
}

/// Leaves the process no file descriptors while it lives.
class NoDescriptors {
  public:
    NoDescriptors() {
        ::getrlimit(RLIMIT_NOFILE, &before_);
        rlimit none = before_;
        const int lowest = ::dup(STDIN_FILENO);
        ::close(lowest);
        none.rlim_cur = static_cast<rlim_t>(lowest);
        ::setrlimit(RLIMIT_NOFILE, &none);
    }
    ~NoDescriptors() { ::setrlimit(RLIMIT_NOFILE, &before_); }

  private:
    rlimit before_;
};

TEST_F(RegistryTest, WhatIsForgottenStaysSoWhileItCannotBeRead) {
#ifdef __SANITIZE_ADDRESS__
    GTEST_SKIP() << "the sanitizers of this build open a pipe for each class that they meet";
#endif
    const std::string app = addApplication("opt/A.app");
    const std::string a = addPlugIn("opt/A.app/PlugIns/A.appex", "a");
    addPlugIn("opt/A.app/PlugIns/B.appex", "b");
    start();
    EXPECT_EQ(workspace->registerPlugIn(app), std::nullopt);
    EXPECT_EQ(workspace->unregisterPlugIn(a), std::nullopt);
    {
        const NoDescriptors limit;
        for (const std::string& path : {a, app})
            EXPECT_THAT(workspace->registerPlugIn(path)->text, HasSubstr("Too many open files"));
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
        EXPECT_EQ(workspace->unregisterPlugIn(app), std::nullopt);
        EXPECT_EQ(workspace->registerPlugIn(files.path("opt/A.app/PlugIns/B.appex")), std::nullopt);
    }
}

}  // namespace
}  // namespace platform::tandry
