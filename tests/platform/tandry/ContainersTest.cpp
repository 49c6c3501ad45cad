// Whose data containers are.

#include <filesystem>
#include <fstream>

#include "platform/system/Files.h"
#include "tests/platform/tandry/RegistryFixture.h"

namespace platform::tandry {
namespace {

namespace fs = std::filesystem;

class ContainersTest : public RegistryTest {
  protected:
    /// An application with a plug-in "x", and an identifier unless that is empty.
    void addApp(const std::string& path, const std::string& identifier) {
        Dictionary info;
        if (!identifier.empty()) info.set("QFBundleIdentifier", identifier);
        addApplication(path, info);
        addPlugIn(path + "/PlugIns/X.appex", "x");
    }
    void rename(const std::string& from, const std::string& to) {
        fs::create_directories(fs::path(files.path(to)).parent_path());
        fs::rename(files.path(from), files.path(to));
    }
    /// The container of the plug-in inside an application, or of a plug-in; empty for none.
    std::string containerAt(const std::string& path) {
        for (const auto& plugIn : workspace->installedPlugIns())
            if (plugIn->bundlePath->starts_with(files.path(path)))
                return plugIn->dataContainerPath.value_or("");
        return {};
    }
    void loseCatalogue() {
        stop();
        for (const char* suffix : {"", "-wal", "-shm"})
            fs::remove(files.path("home/zorvan/Tandry.db") + suffix);
    }

    const std::string a = apps + "A.app", b = apps + "B.app";
    const std::string owners = "home/zorvan/ContainerOwners.plist";
    const std::string plain = files.path("home/zorvan/Containers/x");
};

TEST_F(ContainersTest, EachClaimantOfAnIdentifierHasDataOfItsOwn) {
    addApp(a, "com.a");
    start();
    EXPECT_EQ(containerAt(a), plain);
    // The names that walks meet first, and a claim to be the same application.
    addApp(apps + "0.app", "com.thief");
    addApp(b, "com.a");
    const std::string loose = addPlugIn("opt/Loose.appex", "x");
    start();
    EXPECT_EQ(registerPlugIn(loose), std::nullopt);
    std::map<std::string, std::string> before;
    for (const std::string& path : {a, b, apps + "0.app", std::string("opt")})
        before[path] = containerAt(path);
    EXPECT_EQ(before[a], plain);
    std::set<std::string> different;
    for (const auto& [path, container] : before) {
        different.insert(container);
        EXPECT_TRUE(fs::is_directory(container + "/tmp")) << container;
        const std::string name = fs::path(container).filename();
        // No other plug-in can claim it by its identifier.
        EXPECT_EQ(container != plain, !isSafeName(name)) << name;
    }
    EXPECT_EQ(different.size(), before.size());

    loseCatalogue();
    start();
    EXPECT_EQ(registerPlugIn(loose), std::nullopt);
    for (const auto& [path, container] : before) EXPECT_EQ(containerAt(path), container) << path;
}

TEST_F(ContainersTest, AContainerGoesWithItsApplication) {
    addApp(a, "com.a");
    addApp(b, "com.b");
    const std::string loose = addPlugIn("opt/Loose.appex", "x");
    start();
    EXPECT_EQ(registerPlugIn(loose), std::nullopt);
    const std::string second = containerAt(b), third = containerAt("opt");
    // Moved, and updated under another name; somebody else comes at the same time.
    addApp(apps + "0.app", "com.thief");
    rename(a, apps + "Z.app");
    fs::remove_all(files.path(b));
    addApp(apps + "B 2.app", "");  // half written
    rename("opt/Loose.appex", "opt/Moved.appex");
    loseCatalogue();
    start();
    EXPECT_EQ(registerPlugIn(files.path("opt/Moved.appex")), std::nullopt);
    EXPECT_EQ(containerAt(apps + "Z.app"), plain);
    EXPECT_NE(containerAt(apps + "B 2.app"), second);
    addApp(apps + "B 2.app", "com.b");
    EXPECT_EQ(registerPlugIn(files.path(apps + "B 2.app")), std::nullopt);
    EXPECT_EQ(containerAt(apps + "B 2.app"), second);
    EXPECT_EQ(containerAt("opt"), third);
    const std::string thief = containerAt(apps + "0.app");
    EXPECT_EQ((std::set{plain, second, third, thief}.size()), 4u);

    // The place is taken by another that has its own, and left by one whose data went along.
    fs::remove_all(files.path(apps + "0.app"));
    rename(apps + "Z.app", a);
    start();
    EXPECT_EQ(containerAt(a), plain);
}

TEST_F(ContainersTest, AnApplicationIsFollowedByLinksUntilItHasAnIdentifier) {
    addApp("share/zorvan/Applications/A.app", "");
    start();
    EXPECT_EQ(containerAt("share"), plain);
    rename("share", "disk/share");
    fs::create_directory_symlink("disk/share", files.path("share"));
    start();
    EXPECT_EQ(containerAt("disk"), plain);
    rename("disk/share/zorvan/Applications/A.app", a);
    start();
    const std::string own = containerAt(a);
    EXPECT_THAT(own, HasSubstr("/Containers/."));

    // With an identifier it is followed, whatever was uninstalled before it had one.
    addPlugIn(a + "/PlugIns/Y.appex", "y");
    start();
    fs::remove_all(files.path(a + "/PlugIns/Y.appex"));
    addApp(a, "com.a");
    start();
    rename(a, b);
    start();
    EXPECT_EQ(containerAt(b), own);
}

TEST_F(ContainersTest, WhoComesBackToALostContainerGetsAnother) {
    addApp("opt/A.app", "com.a");
    start();
    EXPECT_EQ(registerPlugIn(files.path("opt/A.app")), std::nullopt);
    EXPECT_EQ(containerAt("opt/A.app"), plain);
    const Uuid uuid = plugIn("x")->plugInUuid;
    // Not noticed as gone, as only the other path is looked at.
    rename("opt/A.app", "away/A.app");
    addApp("opt/Copy.app", "com.a");
    EXPECT_EQ(registerPlugIn(files.path("opt/Copy.app")), std::nullopt);
    EXPECT_EQ(containerAt("opt/Copy.app"), plain);
    rename("away/A.app", "opt/A.app");
    EXPECT_EQ(registerPlugIn(files.path("opt/A.app")), std::nullopt);
    EXPECT_EQ(containerAt("opt/Copy.app"), plain);
    EXPECT_THAT(containerAt("opt/A.app"), AllOf(HasSubstr("/Containers/."), testing::Ne(plain)));
    EXPECT_EQ(workspace->plugInWithUuid(uuid), nullptr);
}

TEST_F(ContainersTest, WhatHappensToContainersIsNoticedMeanwhile) {
    files.write("home/zorvan/Containers/x", "in the way");
    addApp(a, "com.a");
    const std::string b = addPlugIn(a + "/PlugIns/B.appex", "b");
    start();
    const auto walk = [&] { EXPECT_EQ(registerPlugIn(files.path(a)), std::nullopt); };
    EXPECT_EQ(containerAt(a + "/PlugIns/X"), "");
    fs::remove(plain);
    walk();
    EXPECT_EQ(containerAt(a + "/PlugIns/X"), plain);
    const TDPlugInProxyRef record = plugIn("x");

    const std::string temporary = plain + "/tmp";
    files.makeDirectory("home/zorvan/Containers/x/other");
    const std::function<void()> losses[] = {
        [&] { fs::remove(temporary); },
        [&] { fs::remove_all(plain); },
        [&] { rename("home/zorvan/Containers", "moved"); },
    };
    for (const auto& lose : losses) {
        ASSERT_TRUE(fs::exists(temporary));
        lose();
        walk();
        EXPECT_TRUE(fs::exists(temporary));
        fs::remove_all(files.path("moved"));
        lose();
        EXPECT_EQ(workspace->restoreContainer(*record), std::nullopt);
        EXPECT_TRUE(fs::exists(temporary));
        EXPECT_EQ(plugIn("x"), record);
    }
    fs::remove_all(plain);
    files.write("home/zorvan/Containers/x", "in the way again");
    EXPECT_TRUE(workspace->restoreContainer(*record));
    ErrorLines errors;
    for (int i = 0; i < 2; ++i) walk();
    EXPECT_THAT(errors.lines, ElementsAre(HasSubstr(plain)));
    EXPECT_EQ(containerAt(a + "/PlugIns/X"), "");
    EXPECT_NE(plugIn("x")->plugInUuid, record->plugInUuid);
    EXPECT_TRUE(plugIn("b")->dataContainerPath);
}

TEST_F(ContainersTest, WhatNobodyOwnsIsTheFirstClaimants) {
    files.write("home/zorvan/Containers/x/kept", "from before there were owners");
    addApp(a, "com.a");
    addApp(b, "com.b");
    start();
    EXPECT_EQ(containerAt(a), plain);
    EXPECT_NE(containerAt(b), plain);
    // Of who is gone and left nothing, nothing has to be kept.
    fs::remove_all(files.path(a));
    fs::remove_all(plain);
    addApp(apps + "C.app", "com.c");
    start();
    EXPECT_EQ(containerAt(apps + "C.app"), plain);
}

TEST_F(ContainersTest, DamagedOwnersHandNothingToStrangers) {
    addApp(b, "com.b");
    start();
    addApp(a, "com.a");
    files.makeDirectory("home/zorvan/Containers/left");
    start();
    const std::string second = containerAt(a);
    EXPECT_EQ(containerAt(b), plain);
    const std::string good = *readFile(files.path(owners), 1 << 20);
    const auto replaced = [&](const std::string& from, const std::string& to) {
        return std::string(good).replace(good.find(from), from.size(), to);
    };
    const std::string damaged[] = {
        "", good.substr(0, good.size() / 2), replaced("<string>x<", "<string>../x<"),
        replaced("<string>x<", "<string>y<"), replaced(second.substr(second.rfind('/') + 1), "x")};
    int times = 0;
    for (const std::string& bytes : damaged) {
        stop();
        files.write(owners, bytes);
        ErrorLines errors;
        start();
        EXPECT_THAT(errors.lines, ElementsAre(HasSubstr(".damaged-" + std::to_string(++times))));
        EXPECT_EQ(containerAt(a), second);
        EXPECT_EQ(containerAt(b), plain);
    }
    // Long after, too, nobody knows whose these are.
    start();
    ErrorLines errors;
    addPlugIn(apps + "A.app/PlugIns/L.appex", "left");
    loseCatalogue();
    start();
    EXPECT_THAT(*plugIn("left")->dataContainerPath, HasSubstr("/Containers/."));
    EXPECT_THAT(errors.lines, ElementsAre(AllOf(HasSubstr("left"), HasSubstr("A.app"))));
    EXPECT_EQ(containerAt(b), plain);

    loseCatalogue();
    fs::remove(files.path(owners));
    files.makeDirectory(owners);
    errors.lines.clear();
    start();
    EXPECT_EQ(containerAt(a) + containerAt(b), "");
    EXPECT_THAT(errors.lines, ElementsAre(AllOf(HasSubstr("no data containers: "),
                                                HasSubstr("ContainerOwners.plist"))));
}

}  // namespace
}  // namespace platform::tandry
