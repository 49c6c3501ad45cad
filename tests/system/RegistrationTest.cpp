// What a confined process gains by what it registers, or has others register, and by the names that
// it claims.

#include <sys/socket.h>

#include <csignal>
#include <filesystem>
#include <optional>

#include "Zorvan/ZRPlugInProcess.h"
#include "platform/plist/PropertyList.h"
#include "tests/system/PlugInTest.h"

namespace test {

namespace {

using testing::ElementsAre;
using testing::HasSubstr;

class Registration : public SystemTest {
  protected:
    /// A plug-in "com.test.shell" of an application, which runs what it is sent.
    void addShell(const std::string& application, const std::string& version) {
        const std::string bundle = plugInPath(application, "shell");
        Dictionary plist = info("com.test.shell", version);
        plist.set("QFBundleExecutable", "run");
        home_.write(bundle + "/run", "#!/bin/sh\nexec <&3 >&3 2>&1\nexec /bin/sh\n");
        std::filesystem::permissions(home_.path(bundle + "/run"), std::filesystem::perms(0755));
        writePlugIn(bundle, plist);
    }
    std::unique_ptr<zorvan::ZRPlugInProcess> startShell(const std::string& application) {
        const auto found =
            forms({{"VXExtensionIdentifier", "com.test.shell"},
                   {"VXExtensionContainingApp", home_.path(kApps + application + ".app")}});
        const auto uuid = platform::Uuid::parse(*found.at(0).find("uuid")->string());
        EXPECT_EQ(errorOf(ask(
                      [&](auto& client, auto& reply) { client.readyPlugIns({*uuid}, 0, reply); })),
                  "");
        std::optional<zorvan::ZRError> error;
        return zorvan::ZRPlugInProcess::start(
            nullptr, home_.path(plugInPath(application, "shell") + "/run"), {}, error);
    }
    /// What a command writes, in the sandbox.
    static std::string run(const zorvan::ZRPlugInProcess& shell, const std::string& command) {
        const std::string line = command + "\necho .\n";
        ::send(shell.connection(), line.data(), line.size(), MSG_NOSIGNAL);
        std::string answer;
        for (char byte; !("\n" + answer).ends_with("\n.\n");) {
            if (::recv(shell.connection(), &byte, 1, 0) != 1) return answer + " and no more";
            answer += byte;
        }
        return answer.substr(0, answer.size() - 2);
    }
};

TEST_F(Registration, AConfinedHostRegistersAndUnregistersNothing) {
    NEEDS_BUBBLEWRAP();
    const std::string path = writePlugIn("else/E.app/PlugIns/one.appex", info("one"));
    start();
    const auto confined = [&](const char* command) {
        auto zrctl = spawn("/usr/bin/bwrap",
                           {"--bind", "/", "/", "--unshare-user", zrctlProgram_, command, path});
        EXPECT_EQ(zrctl->wait(), 3) << zrctl->err();
        return zrctl->err();
    };
    EXPECT_THAT(confined("add"), HasSubstr("unable to register plug-in at " + path));
    EXPECT_EQ(zrd_->errLines("refusing to register " + path + ": a confined process"), 1u);
    EXPECT_EQ(add({path}), "");
    EXPECT_NE(confined("remove"), "");
    EXPECT_THAT(match(), ElementsAre("one 1"));
}

TEST_F(Registration, WhatAPlugInWritesIsNeverABundle) {
    NEEDS_BUBBLEWRAP();
    addShell("A", "1");
    start();
    const auto shell = startShell("A");
    ASSERT_TRUE(shell);
    const std::string evil = "\"$HOME\"/E.app/PlugIns/evil.appex";
    run(*shell, "mkdir -p " + evil);
    run(*shell, "cat > " + evil + "/Info.plist <<'END'\n" +
                    *platform::writeXmlPropertyList(info("com.test.evil")) + "\nEND");
    EXPECT_EQ(run(*shell, "cd " + evil + " && echo *"), "Info.plist\n");
    const std::string container = home_.path("data/zorvan/Containers/com.test.shell/");
    for (const char* path : {"E.app", "E.app/PlugIns/evil.appex"}) {
        EXPECT_EQ(add({container + path}), "2 unable to register plug-in at " + container + path);
        EXPECT_EQ(zrd_->errLines("refusing to register " + container + path +
                                 ": it lies in a data container"),
                  1u);
    }
    std::filesystem::create_directory_symlink(container + "E.app",
                                              home_.path(kApps + std::string("E.app")));
    stop(SIGTERM);
    start();
    EXPECT_THAT(match(), ElementsAre("com.test.shell 1"));
}

TEST_F(Registration, ANameThatIsClaimedTwiceIsNoWayToTheOthersData) {
    NEEDS_BUBBLEWRAP();
    addShell("Victim", "1");
    start();
    auto victim = startShell("Victim");
    ASSERT_TRUE(victim);
    const std::string home = run(*victim, "echo secret > \"$HOME\"/file; echo $HOME");
    EXPECT_EQ(home, home_.path("data/zorvan/Containers/com.test.shell\n"));
    addShell("A thief", "99");
    EXPECT_TRUE(
        waitUntil([&] { return match() == std::vector{std::string("com.test.shell 99")}; }));
    const auto thief = startShell("A thief");
    ASSERT_TRUE(thief);
    EXPECT_NE(run(*thief, "echo $HOME"), home);
    EXPECT_THAT(run(*thief, "cat \"$HOME\"/file file"), testing::Not(HasSubstr("secret")));
    EXPECT_EQ(run(*thief, "echo mine > \"$HOME\"/file; cat file"), "mine\n");
    const std::string place = home.substr(0, home.size() - 1);
    EXPECT_THAT(run(*thief, "cat '" + place + "/file'"), HasSubstr("No such file"));

    // Nor when the registry has to begin anew.
    stop(SIGTERM);
    for (const char* suffix : {"", "-wal", "-shm"})
        std::filesystem::remove(home_.path("data/zorvan/Tandry.db") + suffix);
    start();
    victim = startShell("Victim");
    ASSERT_TRUE(victim);
    EXPECT_EQ(run(*victim, "cat \"$HOME\"/file"), "secret\n");
}

}  // namespace

}  // namespace test
