#include <fcntl.h>
#include <sqlite3.h>

#include <cerrno>
#include <filesystem>

#include "platform/system/Files.h"
#include "platform/tandry/Sqlite.h"
#include "tests/platform/tandry/RegistryFixture.h"

namespace platform::tandry {
namespace {

namespace fs = std::filesystem;

class CatalogueTest : public RegistryTest {
  protected:
    CatalogueTest() {
        addApplication(apps + "A.app", {{"QFBundleIdentifier", "app"}});
        writePlist("home/zorvan/SDKs/org.point.plist", {{"FromSdk", true}});
        for (const char* name : {"a", "b", "c"}) add(name);
    }
    void add(const std::string& name, const Dictionary& more = {}) {
        addPlugIn(folder + name, name,
                  {{"VXExtensionAttributes", Dictionary{{"key", name}}},
                   {"VXExtensionPointIdentifier", "org.point"}},
                  more);
    }
    std::map<std::string, Uuid> uuids() {
        std::map<std::string, Uuid> result;
        for (const auto& plugIn : workspace->installedPlugIns())
            result[plugIn->plugInIdentifier.value_or("?")] = plugIn->plugInUuid;
        return result;
    }

    FileIdentity identity(const std::string& name) {
        return FileIdentity::at(AT_FDCWD, files.path(folder + name).c_str());
    }

    /// Changes rows of plug-ins, whose digests keep fitting.
    void editPlugIns(const std::string& change) {
        auto opened = SqliteDatabase::open(database);
        ASSERT_TRUE(opened);
        const std::string sum =
            "UPDATE plugins SET sum = checksum(path, uuid, application, bundle_identifier,"
            " identifier, original_identifier, version, registered, name, short_name,"
            " executable, sdk, points, container, stamps, info_plist_size, dictionaries)";
        EXPECT_EQ(opened->run(("UPDATE plugins SET " + change + "; " + sum).c_str()), std::nullopt);
    }
    void sql(const char* statement) {
        sqlite3* handle = nullptr;
        sqlite3_open(database.c_str(), &handle);
        EXPECT_EQ(sqlite3_exec(handle, statement, nullptr, nullptr, nullptr), SQLITE_OK);
        sqlite3_close(handle);
    }

    const std::string folder = apps + "A.app/PlugIns/";
    const std::string database = files.path("home/zorvan/Tandry.db");
};

TEST_F(CatalogueTest, ARestartReadsNothingAgain) {
    start();
    EXPECT_EQ(merges, 3);
    EXPECT_THAT(recorder.take(), UnorderedElementsAre("+a", "+b", "+c"));
    TDPlugInProxyRef before = plugIn("b");
    start();
    EXPECT_EQ(merges, 0);
    EXPECT_THAT(recorder.take(), IsEmpty());
    TDPlugInProxyRef after = plugIn("b");
    EXPECT_EQ(after->plugInUuid, before->plugInUuid);
    EXPECT_EQ(after->registrationDate, before->registrationDate);
    EXPECT_EQ(after->infoPlist.get(), before->infoPlist.get());
    EXPECT_EQ(after->originalIdentifier, before->originalIdentifier);
    EXPECT_EQ(after->dataContainerPath, before->dataContainerPath);
    EXPECT_EQ(after->localizedName, before->localizedName);
    EXPECT_EQ(after->containingApplication->bundleIdentifier, "app");
}

TEST_F(CatalogueTest, AnExchangedDirectoryIsAnotherPlugIn) {
    start();
    const TDPlugInProxyRef before = plugIn("b");
    EXPECT_EQ(before->bundleIdentity, identity("b"));
    start();
    EXPECT_EQ(plugIn("b")->bundleIdentity, before->bundleIdentity);
    EXPECT_EQ(plugIn("b")->plugInUuid, before->plugInUuid);

    // With the very files.
    fs::rename(files.path(folder + "b"), files.path("old"));
    fs::create_directory(files.path(folder + "b"));
    fs::rename(files.path("old/Info.plist"), files.path(folder + "b/Info.plist"));
    start();
    EXPECT_EQ(plugIn("b")->bundleIdentity, identity("b"));
    EXPECT_NE(plugIn("b")->bundleIdentity, before->bundleIdentity);
    EXPECT_NE(plugIn("b")->plugInUuid, before->plugInUuid);

    fs::rename(files.path(folder + "b"), files.path("new"));
    fs::create_directory_symlink(files.path("new"), files.path(folder + "b"));
    start();
    EXPECT_EQ(plugIn("b")->bundlePath, files.path("new"));
}

TEST_F(CatalogueTest, OnlyTheContentCountsWhereStampsSayLittle) {
    for (const char* name : {"a", "b", "c"}) add(name, {{"QFBundleExecutable", "run"}});
    for (const char* name : {"a", "b", "c"}) files.write(folder + name + "/run", "");
    start();
    const auto before = uuids();
    recorder.take();
    // A backup by hard links, and another mode.
    int links = 0;
    for (const std::string& bundle : {apps + "A.app", folder + "a", folder + "b"})
        fs::create_hard_link(files.path(bundle + "/Info.plist"),
                             files.path("link" + std::to_string(++links)));
    fs::permissions(files.path(folder + "c/run"), fs::perms::owner_all);
    for (const int read : {3, 0}) {
        start();
        EXPECT_EQ(uuids(), before);
        EXPECT_EQ(merges, read);
    }
    EXPECT_THAT(recorder.take(), IsEmpty());

    // Written anew, with the old size and time.
    const std::string info = files.path(folder + "b/Info.plist");
    const auto time = fs::last_write_time(info);
    std::string text = *readFile(info, 1 << 20);
    text.replace(text.find("<string>b<"), 10, "<string>B<");
    files.write(folder + "b/Info.plist", text);
    fs::last_write_time(info, time);
    start();
    EXPECT_EQ(recorder.take().size(), 2u);
    EXPECT_EQ(uuids()["a"], before.at("a"));

    // The devices have other numbers.
    const auto after = uuids();
    stop();
    editPlugIns("stamps = x'0102030405060708' || substr(stamps, 9)");
    start();
    EXPECT_EQ(uuids(), after);
    EXPECT_EQ(plugIn("a")->bundleIdentity, identity("a"));
    EXPECT_THAT(recorder.take(), IsEmpty());
}

TEST_F(CatalogueTest, WhatIsSeenIsStored) {
    start();
    TDPlugInProxyRef before;
    for (const bool isNew : {true, false}) {
        add("d", {{"new", isNew}});
        auto done = std::async([&] { return registerPlugIn(files.path(folder + "d")); });
        TDPlugInProxyRef seen;
        while (!(seen = plugIn("d")) || seen == before) std::this_thread::yield();
        auto stored = SqliteDatabase::open(database);
        std::string uuid = seen->plugInUuid.string();
        std::erase(uuid, '-');
        const std::string query = "SELECT count(*) FROM plugins WHERE hex(uuid) = upper('" + uuid;
        EXPECT_EQ(*stored->integer((query + "')").c_str()), 1) << isNew;
        EXPECT_EQ(done.get(), std::nullopt);
        before = seen;
    }
}

TEST_F(CatalogueTest, AFileThatIsDeletedOrExchangedIsWrittenAnew) {
    start();
    const auto before = uuids();
    const std::string copy = files.path("copy");
    const std::function<void()> losses[] = {
        [&] { fs::remove(database); },
        [&] {
            for (const char* suffix : {"", "-wal", "-shm"}) fs::remove(database + suffix);
        },
        [&] {
            static_cast<void>(*SqliteDatabase::open(copy));
            fs::rename(copy, database);
        },
    };
    int number = 0;
    for (const auto& lose : losses) {
        const std::string name = "loose" + std::to_string(++number);
        const std::string loose = addPlugIn("opt/" + name, name);
        lose();
        ErrorLines errors;
        EXPECT_EQ(registerPlugIn(loose), std::nullopt);
        EXPECT_THAT(errors.lines, ElementsAre(HasSubstr(database)));
        start();
        EXPECT_EQ(merges, 0);
        EXPECT_TRUE(plugIn(name));
        for (const auto& [identifier, uuid] : before) EXPECT_EQ(uuids()[identifier], uuid);
    }
    EXPECT_TRUE(fs::exists(database + ".damaged-1"));
}

TEST_F(CatalogueTest, ThoseOfEarlierVersionsAreTakenOver) {
    files.write(folder + "bad/Info.plist", "broken");
    start();
    EXPECT_EQ(unregisterPlugIn(files.path(folder + "c")), std::nullopt);
    const std::string own = addPlugIn("Own.app/PlugIns/own", "own");
    EXPECT_EQ(registerPlugIn(own), std::nullopt);
    auto before = uuids();
    recorder.take();
    for (const int version : {2, 1})
        for (const bool isLocked : {false, true}) {
            stop();
            sql("ALTER TABLE refusals DROP COLUMN size");
            if (version == 1) {
                sql("UPDATE forgotten SET stamps = substr(stamps, 17)");
                sql("UPDATE refusals SET stamps = substr(stamps, 17)");
                editPlugIns("stamps = substr(stamps, 17)");
            }
            sql(("PRAGMA user_version = " + std::to_string(version)).c_str());
            sqlite3* other = nullptr;
            sqlite3_open(database.c_str(), &other);
            const char* lock = "PRAGMA locking_mode = EXCLUSIVE; BEGIN EXCLUSIVE";
            if (isLocked) sqlite3_exec(other, lock, nullptr, nullptr, nullptr);
            start();
            sqlite3_close(other);
            // What could not be read at first is upgraded as well, and once only.
            EXPECT_EQ(registerPlugIn(own), std::nullopt);
            if (isLocked) before = uuids(), before.erase("c");
            for (int run = 0; run < 2; ++run) {
                ErrorLines errors;
                start();
                EXPECT_EQ(uuids(), before) << version << isLocked;
                EXPECT_EQ(merges, 0) << "nothing is read again";
                EXPECT_EQ(plugIn("b")->bundleIdentity, identity("b"));
                EXPECT_THAT(errors.lines, ElementsAre(HasSubstr("/bad/")));
            }
        }
}

TEST_F(CatalogueTest, WhatChangedGetsANewUuid) {
    struct Change {
        const char* what;
        std::function<void()> make;
        std::vector<std::string> names;
    };
    const std::vector<Change> changes{
        {"Info.plist",
         [&] {
             add("a", {{"new", true}});
         },
         {"a"}},
        {"entitlements",
         [&] {
             writePlist(folder + "b/Entitlements.plist", {{"r", 1}});
         },
         {"b"}},
        {"executable named",
         [&] {
             add("c", {{"QFBundleExecutable", "run"}});
         },
         {"c"}},
        {"executable", [&] { files.write(folder + "c/run", "#!/bin/sh\n"); }, {"c"}},
        {"placeholder", [&] { files.write(apps + "A.app/.placeholder", ""); }, {"a", "b", "c"}},
        {"the user's SDK dictionary",
         [&] {
             writePlist("home/zorvan/SDKs/org.point.plist", {{"Other", "longer"}});
         },
         {"a", "b", "c"}},
    };
    start();
    for (const auto& [what, make, names] : changes) {
        std::map<std::string, Uuid> before = uuids();
        recorder.take();
        make();
        start();
        std::vector<std::string> events;
        for (const std::string& name : names) events.push_back("-" + name);
        for (const std::string& name : names) events.push_back("+" + name);
        EXPECT_THAT(recorder.take(), testing::ElementsAreArray(events)) << what;
        EXPECT_EQ(merges, static_cast<int>(names.size())) << what;
        for (const auto& [name, uuid] : uuids())
            EXPECT_EQ(uuid != before[name], testing::Value(names, testing::Contains(name))) << what;
    }
    fs::remove_all(files.path(folder + "b"));
    start();
    EXPECT_THAT(recorder.take(), ElementsAre("-b"));
    EXPECT_THAT(installed(), ElementsAre("a", "c"));
}

TEST_F(CatalogueTest, ADamagedCatalogueIsSetAsideAndRebuilt) {
    const std::vector<std::function<void()>> damages{
        [&] { files.write("home/zorvan/Tandry.db", "no database at all"); },
        [&] { fs::resize_file(database, fs::file_size(database) / 2 + 100); },
        [&] { sql("PRAGMA user_version = 7"); },
        [&] { sql("DROP TABLE forgotten"); },
        [&] { sql("UPDATE plugins SET dictionaries = zeroblob(100) WHERE path LIKE '%/b'"); },
        [&] { sql("UPDATE plugins SET identifier = 'other' WHERE path LIKE '%/b'"); },
        [&] { sql("UPDATE applications SET identifier = 'other'"); },
        [&] {
            fs::remove(database);
            fs::create_directory(database);
        },
    };
    start();
    int number = 0;
    for (const auto& damage : damages) {
        stop();
        recorder.take();
        damage();
        ErrorLines errors;
        start();
        const std::string aside = "Tandry.db.damaged-" + std::to_string(++number);
        EXPECT_THAT(errors.lines, ElementsAre(HasSubstr(aside))) << number;
        EXPECT_TRUE(fs::exists(files.path("home/zorvan/" + aside))) << number;
        EXPECT_THAT(installed(), ElementsAre("a", "b", "c")) << number;
        EXPECT_EQ(recorder.take().size(), 3u) << number;
        start();
        EXPECT_EQ(merges, 0) << number;
        EXPECT_THAT(recorder.take(), IsEmpty()) << number;
    }
}

TEST_F(CatalogueTest, RowsThatDoNotFitTheOthersAreReadAgain) {
    start();
    stop();
    sql("DELETE FROM applications");
    ErrorLines errors;
    start();
    EXPECT_THAT(errors.lines, IsEmpty());
    EXPECT_EQ(merges, 3);
    start();
    EXPECT_EQ(merges, 0);
    EXPECT_THAT(installed(), ElementsAre("a", "b", "c"));
}

TEST_F(CatalogueTest, WorksInMemoryAndKeepsTheFileWhenItCannotBeOpened) {
    start();
    const std::map<std::string, Uuid> before = uuids();
    for (const char* suffix : {"-wal", ".lock"}) {
        stop();
        fs::remove(database + suffix);
        fs::create_directory(database + suffix);
        ErrorLines errors;
        start();
        EXPECT_THAT(errors.lines, ElementsAre(HasSubstr("working without the catalogue"),
                                              HasSubstr("cannot write the catalogue")));
        EXPECT_THAT(installed(), ElementsAre("a", "b", "c"));
        EXPECT_TRUE(unregisterPlugIn(files.path(folder + "a")));
        EXPECT_THAT(installed(), ElementsAre("b", "c"));
        stop();
        fs::remove(database + suffix);
        start();
        EXPECT_EQ(uuids(), before) << suffix;
    }
}

TEST_F(CatalogueTest, StoresLaterWhatCouldNotBeStored) {
    const std::string loose = addPlugIn("opt/Loose.appex", "loose");
    start();
    EXPECT_EQ(registerPlugIn(loose), std::nullopt);
    EXPECT_EQ(unregisterPlugIn(files.path(folder + "a")), std::nullopt);
    sqlite3* other = nullptr;
    sqlite3_open(database.c_str(), &other);
    auto lock = [&](const char* how) { sqlite3_exec(other, how, nullptr, nullptr, nullptr); };
    lock("BEGIN IMMEDIATE");
    add("d");
    const std::string d = files.path(folder + "d");
    EXPECT_THAT(registerPlugIn(d)->text, HasSubstr("locked"));
    EXPECT_THAT(installed(), ElementsAre("b", "c", "d", "loose"));
    lock("COMMIT");
    EXPECT_EQ(registerPlugIn(d), std::nullopt);
    const std::map<std::string, Uuid> before = uuids();
    start();
    EXPECT_EQ(merges, 0);
    EXPECT_EQ(uuids(), before);

    // Locked from the start: what was registered and removed before counts again afterwards.
    stop();
    lock("PRAGMA locking_mode = EXCLUSIVE; BEGIN EXCLUSIVE");
    start();
    EXPECT_THAT(installed(), ElementsAre("a", "b", "c", "d"));
    sqlite3_close(other);
    EXPECT_EQ(unregisterPlugIn(files.path(folder + "b")), std::nullopt);
    start();
    EXPECT_THAT(installed(), ElementsAre("c", "d", "loose"));
}

TEST_F(CatalogueTest, HasOneOwner) {
    start();
    auto second = openDiskWorkspace(directories, *sdks, nullptr);
    ASSERT_FALSE(second);
    EXPECT_EQ(second.error().code, EADDRINUSE);
    stop();
    EXPECT_TRUE(openDiskWorkspace(directories, *sdks, nullptr));
    directories.dataHome = files.write("file", "");
    EXPECT_TRUE(openDiskWorkspace(directories, *sdks, nullptr));
}

}  // namespace
}  // namespace platform::tandry
