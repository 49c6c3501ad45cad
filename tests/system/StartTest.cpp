// Starts, among damage and other daemons.

#include <unistd.h>

#include <csignal>
#include <filesystem>
#include <iterator>
#include <sstream>

#include "platform/plist/PropertyList.h"
#include "tests/system/SystemTest.h"

namespace test {

namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using namespace std::string_literals;

std::vector<std::string> words(const char* text) {
    std::istringstream stream(text);
    return {std::istream_iterator<std::string>(stream), {}};
}

class Start : public SystemTest {
  protected:
    std::string uuidOf(const char* identifier) {
        const auto found = forms({{"VXExtensionIdentifier", identifier}});
        return found.size() == 1 ? found[0].find("uuid")->string()->string() : "";
    }
};

TEST_F(Start, WrongUsageGetsTheUsageTextAlone) {
    for (std::vector<std::string> arguments :
         {std::vector<std::string>{"-x"}, {"-S"}, {"operand", "-S", "a"}, {"-c1", "--", "-c"}}) {
        auto zrd = spawn(ZRD_PROGRAM, arguments);
        EXPECT_EQ(zrd->wait(), 2);
        EXPECT_EQ(zrd->err(), "Usage: zrd [-S servicename] [-v]\n");
    }
    EXPECT_THAT(std::filesystem::is_empty(home_.path("run")), true);
}

TEST_F(Start, ASecondDaemonIsNotConstructedAndTheFirstGoesOn) {
    writePlugIn(plugInPath("A", "one"), info("one"));
    start();
    for (std::string name :
         {"com.orbel.zorvan.zrd"s, "com.other"s, "a/b"s, ".hidden"s, ""s, std::string(200, 'x')}) {
        auto second = spawn(ZRD_PROGRAM, {"-S", name});
        EXPECT_EQ(second->wait(), 1) << name;
        EXPECT_EQ(second->errLines(" ops error unable to construct server"), 1u) << name;
        EXPECT_THAT(match(), ElementsAre("one 1")) << name;
    }
    ::setenv("XDG_DATA_HOME", home_.path("free").c_str(), 1);
    EXPECT_EQ(spawn(ZRD_PROGRAM, {})->wait(), 1);
    for (std::string name : {"a/b"s, ".hidden"s, ""s, std::string(200, 'x')})
        EXPECT_EQ(spawn(ZRD_PROGRAM, {"-S", name})->wait(), 1) << name;
    EXPECT_THAT(match(), ElementsAre("one 1"));
}

TEST_F(Start, ClosedStandardStreamsAreNoFilesOfItsOwn) {
    auto zrd = spawn("/bin/sh", {"-c", "exec '" ZRD_PROGRAM "' <&- >&- 2>&-"});
    ASSERT_TRUE(waitUntil([&] { return std::filesystem::exists(socket_); }));
    const std::string descriptors = "/proc/" + std::to_string(zrd->pid()) + "/fd/";
    for (const char* number : {"0", "1", "2"})
        EXPECT_EQ(std::filesystem::read_symlink(descriptors + number), "/dev/null");
}

TEST_F(Start, NobodyHasToReadWhatItWrites) {
    int ends[2];
    ASSERT_EQ(::pipe(ends), 0);
    ::close(ends[0]);
    const std::string unread = " 2>&" + std::to_string(ends[1]);
    const auto daemon = [&](const std::string& start) {
        return spawn("/bin/sh", {"-c", start + unread});
    };
    EXPECT_EQ(daemon("exec '" ZRD_PROGRAM "' -v -x")->wait(), 2);
    zrd_ = daemon("export ZR_LOG=info; exec '" ZRD_PROGRAM "' -v");
    ::close(ends[1]);
    EXPECT_TRUE(waitUntil([&] { return !zrd_->isRunning() || RawClient(socket_).isConnected(); }));
}

TEST_F(Start, AnExecutableWithTooLongAPathIsNotKnown) {
    ::setenv("ZR_LOG", "ops=debug", 1);
    start();
    for (std::size_t length : {2047, 2048}) {
        const std::string program = home_.pathOfLength(length);
        std::filesystem::create_hard_link(zrctlProgram_, program);
        auto host = spawn(program.c_str(), {"match"});
        EXPECT_EQ(host->wait(), 1) << "there is nothing to be found";
        const std::string line = "new client " + std::to_string(host->pid()) + ' ';
        EXPECT_EQ(zrd_->errLines(line), 1u);
        EXPECT_EQ(zrd_->errLines(line + '/'), length < 2048 ? 1u : 0u);
    }
    ::unsetenv("ZR_LOG");
}

TEST_F(Start, AJournalOutOfReachLosesNoLines) {
    if (std::filesystem::exists("/run/systemd/journal/socket")) GTEST_SKIP();
    auto zrd =
        spawn("/bin/sh",
              {"-c", "export JOURNAL_STREAM=$(stat -L -c %d:%i /proc/$$/fd/2); exec '" ZRD_PROGRAM
                     "' -S a/b"});
    EXPECT_EQ(zrd->wait(), 1);
    EXPECT_EQ(zrd->errLines("unable to construct server"), 1u);
}

TEST_F(Start, AKilledDaemonComesBackWithTheSameUuids) {
    writePlugIn(plugInPath("A", "one"), info("one"));
    const std::string path = writePlugIn("else/E.app/PlugIns/two.appex", info("two"));
    start();
    EXPECT_EQ(add({path}), "");
    const std::string one = uuidOf("one"), two = uuidOf("two");
    EXPECT_EQ(one.size(), 36u);
    stop(SIGKILL);
    EXPECT_EQ(errorOf(ask([](auto& client, auto& reply) { client.bulkPlugins(0, reply); }))[0],
              '4');
    writePlugIn(plugInPath("A", "three"), info("three"));
    start();
    EXPECT_THAT(match(), ElementsAre("one 1", "three 1", "two 1"));
    EXPECT_EQ(uuidOf("one"), one);
    EXPECT_EQ(uuidOf("two"), two);
    stop(SIGTERM);

    writePlugIn(plugInPath("A", "one"), info("one", "2"));
    std::filesystem::remove_all(path);
    start();
    EXPECT_THAT(match(), ElementsAre("one 2", "three 1"));
    EXPECT_NE(uuidOf("one"), one);
}

TEST_F(Start, DamagedBundlesAreLeftOutWithOneLineEach) {
    const std::string xml = *platform::writeXmlPropertyList(info("whole"));
    const std::string head = xml.substr(0, xml.find("<dict>"));
    std::string deep = head;
    for (int i = 0; i < 20000; ++i) deep += "<array>";
    // 16 arrays, each of four times the next one: 4^16 values.
    std::string bomb = "bplist00", offsets;
    for (int i = 0; i < 16; ++i) {
        offsets += static_cast<char>(bomb.size());
        bomb += '\xa4' + std::string(4, static_cast<char>(i + 1));
    }
    offsets += static_cast<char>(bomb.size());
    bomb += "\x10\x01" + offsets + "\0\0\0\0\0\0\x01\x01"s;
    for (char number : {17, 0, 90}) bomb += std::string(7, '\0') + number;

    const std::pair<const char*, std::string> files[] = {
        {"empty", ""},
        {"truncated", xml.substr(0, xml.size() / 2)},
        {"json", "{\"VXExtension\": {}}"},
        {"large", xml + std::string(20 << 20, ' ')},
        {"deep", deep},
        {"bomb", bomb},
        {"list", head + "<array/></plist>"},
        {"plain", *platform::writeXmlPropertyList(Dictionary{{"QFBundleIdentifier", "plain"}})},
    };
    for (const auto& [name, bytes] : files)
        home_.write(plugInPath("A", name) + "/Info.plist", bytes);
    home_.makeDirectory(plugInPath("A", "missing"));
    home_.makeDirectory(plugInPath("A", "directory") + "/Info.plist");
    writePlugIn(plugInPath("A", "escape"), info("../../escape"));
    writePlugIn(plugInPath("A", "good"), info("good"));
    writePlist(kApps + "A.app/Info.plist"s, Dictionary{{"QFBundleIdentifier", "com.a"}});
    start();
    EXPECT_THAT(match(), ElementsAre("good 1"));
    EXPECT_THAT(match(), ElementsAre("good 1"));
    for (const char* name : {"empty", "truncated", "json", "large", "deep", "bomb", "list", "plain",
                             "missing", "directory", "escape"})
        EXPECT_EQ(zrd_->errLines(plugInPath("A", name) + "/Info.plist: "), 1u) << name << '\n'
                                                                               << zrd_->err();
}

TEST_F(Start, ValuesOfWrongTypesHarmNobody) {
    const Dictionary plain = info("plain");
    const auto topLevel = words(
        "QFBundleIdentifier QFBundleVersion QFBundleName QFBundleDisplayName QFBundleExecutable "
        "VXExtension Zorvan QFBundleInfoPlistURL VXExtensionIdentifier VXOriginalIdentifier "
        "QFBundleShortVersionString");
    const auto plugIn = words(
        "VXExtensionAttributes VXExtensionPointIdentifier VXExtensionProtocol PrincipalClass "
        "EmbeddedCode Dedicated PassProxy HubProtocolVersion Shared VXExtensionHostEntitlement "
        "VXExtensionIdentifier Multiple");
    const Value odd[] = {-7, true, Array{Dictionary{{"k", 1}}}, Dictionary{{"k", "v"}}};
    int number = 0;
    auto write = [&](const Dictionary& infoPlist, const Dictionary& entitlements = {}) {
        writePlugIn(plugInPath("Odd", std::to_string(++number)), infoPlist, entitlements);
    };
    for (const Value& value : odd) {
        for (const std::string& key : topLevel) {
            Dictionary damaged = info("top" + std::to_string(number));
            damaged.set(key, value);
            write(damaged);
        }
        for (const std::string& key : plugIn) {
            Dictionary damaged = info("in" + std::to_string(number));
            Dictionary inner = *damaged.find("VXExtension")->dictionary();
            inner.set(key, value);
            damaged.set("VXExtension", inner);
            write(damaged);
        }
        write(info("entitled" + std::to_string(number)),
              {{"com.orbel.developer.replace-plugin", value},
               {"com.orbel.developer.auto-elect-plugin", value}});
    }
    writePlist(kApps + "Odd.app/Info.plist"s,
               Dictionary{{"QFBundleIdentifier", 1}, {"QFBundleDisplayName", Array{}}});
    writePlugIn(plugInPath("A", "good"), info("good"));
    start();
    auto all = zrctl({"match", "--all", "--versions", "--duplicates"});
    EXPECT_EQ(all->wait(), 0) << all->err();
    EXPECT_THAT(match({{"VXExtensionContainingApp", home_.path(kApps + "A.app"s)}}),
                ElementsAre("good 1"));
    for (const std::string& key : plugIn) match({{key, Dictionary{{"items", 1}}}});
}

TEST_F(Start, DamagedFilesOfItsOwnAreReplaced) {
    writePlugIn(plugInPath("A", "one"), info("one"));
    start();
    const std::string before = uuidOf("one");
    stop(SIGTERM);
    for (const char* suffix : {"-wal", "-shm"})
        std::filesystem::remove(home_.path("data/zorvan/Tandry.db"s + suffix));
    home_.write("data/zorvan/Tandry.db", std::string(20000, '\x5a'));
    home_.write("state/com.orbel.zorvan/Annotations", "damaged");
    start();
    EXPECT_NE(uuidOf("one"), before);
    EXPECT_EQ(zrd_->errLines("Tandry.db"), 1u) << zrd_->err();
    EXPECT_EQ(zrd_->errLines("unable to load annotation database:" + home_.path("state/")), 1u);
    stop(SIGTERM);

    writePlist(
        "state/com.orbel.zorvan/Annotations",
        Dictionary{{"version", 16}, {"data", Dictionary{{"one", Dictionary{{"election", 2}}}}}});
    start();
    EXPECT_THAT(match({{"VXUserElection", "2"}}), ElementsAre("one 1"));
    stop(SIGTERM);
    start({"-d", home_.path("data")});  // a directory
    EXPECT_EQ(zrd_->errLines("unable to load annotation database:" + home_.path("data")), 1u);
    EXPECT_THAT(match({{"VXUserElection", "2"}}), IsEmpty());
    stop(SIGTERM);

    ::setenv("XDG_STATE_HOME", home_.write("file", "").c_str(), 1);
    auto homeless = spawn(ZRD_PROGRAM, {});
    EXPECT_EQ(homeless->wait(), -SIGABRT);
    EXPECT_EQ(homeless->errLines("ops error internal inconsistency"), 1u);
}

}  // namespace

}  // namespace test
