#include <gtest/gtest.h>
#include <sys/inotify.h>
#include <sys/ioctl.h>
#include <sys/stat.h>

#include <filesystem>
#include <thread>

#include "platform/log/Log.h"
#include "platform/lum/LumBundle.h"
#include "platform/plist/DictionaryFile.h"
#include "platform/plist/PropertyList.h"
#include "platform/services/Consent.h"
#include "platform/services/Notifications.h"
#include "platform/services/Preferences.h"
#include "platform/services/SdkDictionaries.h"
#include "platform/system/Directories.h"
#include "platform/system/FileStamp.h"
#include "platform/system/Files.h"
#include "platform/system/UniqueFd.h"
#include "tests/support/TemporaryDirectory.h"

namespace platform {
namespace {

/// Services whose files lie in a temporary directory; counts the error lines.
class SettingsFiles : public testing::Test {
  protected:
    SettingsFiles() {
        directories_.runtime = files_.path("run");
        directories_.dataHome = files_.path("data");
        directories_.dataDirs = {files_.path("system")};
        directories_.configHome = files_.path("config");
    }

    std::string write(std::string_view relative, const Value& value) const {
        return files_.write(relative, *writeXmlPropertyList(value));
    }
    /// Puts a file there that fails with EIO when it is read.
    void breakFile(std::string_view relative) const {
        std::filesystem::remove(files_.path(relative));
        std::filesystem::create_symlink("/proc/self/mem", files_.path(relative));
    }

    test::TemporaryDirectory files_;
    Directories directories_;
    int errors_ = 0;
    LogCapture capture_{[this](const std::string&, LogLevel level, const std::string&) {
        if (level == LogLevel::Error) ++errors_;
    }};
};

TEST_F(SettingsFiles, BundleFromItsDirectory) {
    write("A.app/Info.plist", Dictionary{{"QFBundleExecutable", "tool"}});
    const std::string path = files_.path("A.app");
    const auto bundle = LumBundle::make(path + "//", LumBundle::BundleDirectory);
    EXPECT_EQ(bundle->property(LumBundle::BundlePath), path);
    EXPECT_EQ(bundle->property(LumBundle::SupportPath), path);
    EXPECT_EQ(bundle->property(LumBundle::ExecutablePath), path + "/tool");
    EXPECT_EQ(bundle->property(4), std::nullopt);

    for (const char* name : {"../tool", ".tool", "a/b", ""}) {
        write("A.app/Info.plist", Dictionary{{"QFBundleExecutable", name}});
        EXPECT_NE(bundle->property(LumBundle::ExecutablePath), std::nullopt) << "not cached";
        bundle->discardCache();
        EXPECT_EQ(bundle->property(LumBundle::ExecutablePath), std::nullopt) << name;
        write("A.app/Info.plist", Dictionary{{"QFBundleExecutable", "tool"}});
        bundle->discardCache();
        EXPECT_NE(bundle->property(LumBundle::ExecutablePath), std::nullopt);
    }
    for (const char* bytes : {"", "garbage"}) {
        files_.write("A.app/Info.plist", bytes);
        bundle->discardCache();
        EXPECT_EQ(bundle->infoDictionary(), std::nullopt);
    }
    EXPECT_EQ(LumBundle::make("A.app", LumBundle::BundleDirectory), nullptr);
}

TEST_F(SettingsFiles, BundleAroundAnExecutable) {
    write("A.app/Info.plist", Dictionary{{"QFBundleExecutable", "other"}});
    const auto inside = LumBundle::make(files_.path("A.app/tool"), LumBundle::Executable);
    EXPECT_EQ(inside->property(LumBundle::BundlePath), files_.path("A.app"));
    EXPECT_EQ(inside->property(LumBundle::ExecutablePath), files_.path("A.app/other"));

    files_.makeDirectory("bin/Info.plist");
    for (const char* path : {"bin/tool", "A.app/lib/tool"}) {
        const auto bare = LumBundle::make(files_.path(path), LumBundle::Executable);
        for (int number : {2, 3, 9}) EXPECT_EQ(bare->property(number), std::nullopt) << path;
        EXPECT_EQ(bare->infoDictionary(), std::nullopt);
    }
}

TEST_F(SettingsFiles, SdkDictionaryOfTheUserComesFirstAndIsReadAgainWhenItChanges) {
    SdkDictionaries sdks(directories_);
    EXPECT_EQ(*sdks.copyExtensionSdkEntry("point"), std::nullopt);
    write("system/zorvan/SDKs/point.plist", Dictionary{{"from", "system"}});
    EXPECT_EQ(*sdks.copyExtensionSdkEntry("point"), (Dictionary{{"from", "system"}}));
    const std::string mine = write("data/zorvan/SDKs/point.plist", Dictionary{{"from", "user"}});
    EXPECT_EQ(*sdks.copyExtensionSdkEntry("point"), (Dictionary{{"from", "user"}}));
    EXPECT_EQ(sdks.candidateFiles("point").at(0), mine);

    breakFile("data/zorvan/SDKs/point.plist");
    EXPECT_EQ(sdks.copyExtensionSdkEntry("point").error().code, EIO);
    std::filesystem::remove(mine);
    EXPECT_EQ(std::exchange(errors_, 0), 1);

    write("data/zorvan/SDKs/point.plist", Array{"no dictionary"});
    EXPECT_EQ(*sdks.copyExtensionSdkEntry("point"), std::nullopt);
    EXPECT_EQ(*sdks.copyExtensionSdkEntry("point"), std::nullopt);
    EXPECT_EQ(errors_, 1);
    std::filesystem::remove(mine);
    EXPECT_EQ(*sdks.copyExtensionSdkEntry("point"), (Dictionary{{"from", "system"}}));

    for (const std::string& name :
         {std::string("../SDKs/point"), std::string(), std::string(".p"), std::string(250, 'x')})
        EXPECT_TRUE(sdks.candidateFiles(name).empty()) << name;
}

TEST_F(SettingsFiles, DictionaryStaysUntilItsFileCanBeReadAgain) {
    const auto content = [](const char* text) { return std::optional(Dictionary{{"key", text}}); };
    DictionaryFile file(write("file", *content("first")), "test file");
    EXPECT_FALSE(file.update({{1}}));
    breakFile("file");
    for (int i = 0; i < 2; ++i) EXPECT_EQ(file.update({{2}})->code, EIO);
    EXPECT_EQ(file.dictionary(), content("first"));
    EXPECT_EQ(errors_, 1);
    std::filesystem::remove(file.path());
    write("file", *content("second"));
    EXPECT_FALSE(file.update({{2}})) << "the stamp was not remembered";
    EXPECT_EQ(file.dictionary(), content("second"));

    EXPECT_FALSE(file.update({{3}, 0, false}));
    write("file", *content("third"));
    EXPECT_FALSE(file.update({{3}}));
    write("file", *content("fourth"));
    EXPECT_FALSE(file.update({{3}}));
    EXPECT_EQ(file.dictionary(), content("third")) << "kept once the stamp had settled";
}

TEST_F(SettingsFiles, PreferencesSeeWhatOthersWrite) {
    Preferences preferences(directories_);
    const std::string file =
        "config/" + preferences.path("d").substr(files_.path("config/").size());
    const auto value = [&] {
        preferences.synchronize("d");
        return preferences.value("d", "key");
    };
    EXPECT_EQ(value(), std::nullopt);
    write(file, Dictionary{{"key", Array{"first"}}});
    EXPECT_EQ(preferences.value("d", "key"), std::nullopt) << "not synchronized yet";
    EXPECT_EQ(value(), Value(Array{"first"}));
    write(file, Dictionary{{"key", Array{"second"}}});
    EXPECT_EQ(value(), Value(Array{"second"}));
    EXPECT_EQ(errors_, 0);

    for (const char* bytes : {"garbage", "<plist><array/></plist>", ""}) {
        files_.write(file, bytes);
        EXPECT_EQ(value(), std::nullopt);
        EXPECT_EQ(value(), std::nullopt);
    }
    EXPECT_EQ(errors_, 3) << "one line for each change";
    std::filesystem::remove(files_.path(file));
    EXPECT_EQ(value(), std::nullopt);
    EXPECT_EQ(errors_, 3);
}

TEST_F(SettingsFiles, PreferencesAreEditedOneAfterTheOtherAndNeverLost) {
    const Preferences preferences(directories_);
    const auto append = [&](const char* item) {
        return preferences.edit("d", [item](Dictionary& stored) {
            const Value* list = stored.find("list");
            Array items = list ? *list->array() : Array();
            items.append(item);
            stored.set("list", items);
            return true;
        });
    };
    EXPECT_FALSE(preferences.edit("d", [](Dictionary& stored) { return !stored.empty(); }));
    EXPECT_TRUE(FileStamp::of(preferences.path("d")).isMissing()) << "nothing was to be written";
    const std::string file =
        "config/" + preferences.path("d").substr(files_.path("config/").size());
    write(file, Dictionary{{"other", true}});
    std::vector<std::thread> editors;
    for (int i = 0; i < 4; ++i)
        editors.emplace_back([&] {
            for (int edit = 0; edit < 10; ++edit) EXPECT_FALSE(append("item"));
        });
    for (std::thread& editor : editors) editor.join();
    EXPECT_EQ(preferences.read("d")->find("list")->array()->size(), 40u);
    EXPECT_EQ(*preferences.read("d")->find("other"), Value(true));

    for (const char* bytes : {"garbage", "<plist><array/></plist>", ""}) {
        files_.write(file, bytes);
        EXPECT_TRUE(append("item"));
        EXPECT_EQ(*readFile(preferences.path("d"), 100), bytes);
    }
}

TEST_F(SettingsFiles, StampsSettleAfterAChange) {
    const std::string file = files_.path("file");
    do {
        files_.write("file", "x");
    } while (FileStamp::of(file).settled);
    while (!FileStamp::of(file).settled) std::this_thread::yield();
    EXPECT_TRUE(FileStamp::of(files_.path("none")).isMissing());
    EXPECT_TRUE(FileStamp::of(files_.path("none")).settled);
}

TEST_F(SettingsFiles, ConsentIsRecordedByApplication) {
    const auto consent = makeFileConsent(directories_);
    const auto records = [&](const Value& identifier) {
        write("A.app/Info.plist", Dictionary{{"QFBundleIdentifier", identifier}});
        return consent->copyConsentInformation(
            *LumBundle::make(files_.path("A.app"), LumBundle::BundleDirectory));
    };
    std::filesystem::create_directory_symlink("A.app", files_.path("link"));
    const auto record = [&](const Value& path) {
        return Dictionary{{kConsentGranted, true},
                          {kConsentService, kKeyboardNetworkConsent},
                          {kConsentPath, path}};
    };
    const Dictionary own = record(files_.path("A.app"));
    const Dictionary linked = record(files_.path("link"));
    Dictionary anybodys = own;
    anybodys.remove(kConsentPath);
    // Others that claim the identifier: what the user allowed one of them says nothing of the rest.
    files_.makeDirectory("B.app");
    write("config/zorvan/Consent/a.plist",
          Array{own, "stray", linked, anybodys, record(files_.path("B.app")),
                record(files_.path("gone/A.app")), record("A.app"), record(7), record(Array{})});
    write("config/zorvan/Consent/b.plist", own);
    files_.write("config/zorvan/Consent/c.plist", "garbage");
    EXPECT_EQ(records("a"), (std::vector{own, linked}));
    EXPECT_EQ(records("unheard-of"), std::vector<Dictionary>());
    EXPECT_EQ(errors_, 0);
    EXPECT_EQ(records("b"), std::nullopt);
    EXPECT_EQ(records("c"), std::nullopt);
    EXPECT_EQ(errors_, 2);
    EXPECT_EQ(records("../Consent/a"), std::nullopt);
    EXPECT_EQ(records(1), std::nullopt);
}

TEST_F(SettingsFiles, NotificationsCountTheirPosts) {
    auto notifications = makeFileNotifications(directories_);
    const std::string folder = files_.path("run/zorvan/notify"), file = folder + "/name";
    const auto count = [&] {
        notifications->finish();
        return *readFile(file, 100);
    };
    notifications->post("name");
    EXPECT_EQ(count(), "1");
    struct stat status;
    ASSERT_EQ(::stat(folder.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0700u);

    const UniqueFd watch(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
    ASSERT_GE(::inotify_add_watch(watch.get(), folder.c_str(), IN_CREATE), 0);
    std::vector<std::thread> posters;
    for (int i = 0; i < 4; ++i)
        posters.emplace_back([&] {
            for (int post = 0; post < 2500; ++post) notifications->post("name");
        });
    for (std::thread& poster : posters) poster.join();
    EXPECT_EQ(count(), "10001");
    int bytes = 0;
    ::ioctl(watch.get(), FIONREAD, &bytes);
    EXPECT_LT(bytes / (sizeof(inotify_event) + 16), 5000u)
        << "one file for all that came meanwhile";
    makeFileNotifications(directories_)->post("name");
    EXPECT_EQ(count(), "10002") << "written at its end; goes on where another process stopped";
    files_.write("run/zorvan/notify/name", "garbage");
    notifications->post("name");
    EXPECT_EQ(count(), "1");

    notifications->post("../name");
    EXPECT_EQ(errors_, 1);
    auto entries = std::filesystem::directory_iterator(folder);
    EXPECT_EQ(std::distance(begin(entries), end(entries)), 1) << "nothing temporary is left";
    std::filesystem::rename(folder, folder + ".old");
    files_.write("run/zorvan/notify", "no folder");
    notifications->post("name");
    notifications->finish();
    EXPECT_EQ(errors_, 2);
    std::filesystem::remove(folder);
    notifications->post("name");
    EXPECT_EQ(count(), "2") << "what failed is not lost";
}

}  // namespace
}  // namespace platform
