// What hosts get to do with plug-ins that they were made ready for, or given access to.

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>

#include "Zorvan/ZRSandboxExtension.h"
#include "platform/system/Files.h"
#include "tests/system/PlugInTest.h"

namespace test {

namespace {

class Ready : public PlugInTest {
  protected:
    std::string refusal(const std::string& identifier) {
        return "4 unable to enable plug-in " + identifier + "(" + uuidOf(identifier).string() + ")";
    }
    std::vector<std::string> access(const platform::Uuid& plugIn) {
        const auto reply =
            ask([&](auto& client, auto& callback) { client.accessPlugIns({plugIn}, 0, callback); });
        EXPECT_EQ(errorOf(reply), "");
        std::vector<std::string> tokens;
        for (const Value& token : *std::get<platform::Message>(reply).find("extensions")->array())
            tokens.push_back(token.string()->string());
        return tokens;
    }
    /// What a token lets read of the bundle's executable, or nothing.
    static std::size_t readable(const std::string& token) {
        const auto extension = zorvan::ZRSandboxExtension::initWithExtension(token);
        extension->consume();
        if (extension->handle() == 0) return 0;
        const std::string file = "/proc/self/fd/" + std::to_string(extension->handle()) + "/run";
        return platform::readFile(file, 1u << 30)->size();
    }
};

TEST_F(Ready, APlugInRunsUntilItIsRemoved) {
    NEEDS_BUBBLEWRAP();
    EXPECT_FALSE(startPlugIn());
    EXPECT_EQ(failure_, EPERM) << "not made ready";
    ::setenv("ZR_LOG", "debug", 1);
    stop(SIGTERM);
    start();
    ::unsetenv("ZR_LOG");
    // Another one, when the daemon ended before it had written its catalogue.
    uuid_ = uuidOf("com.test.upper");
    EXPECT_EQ(ready(uuid_), "");
    const auto process = startPlugIn();
    ASSERT_TRUE(process) << zrd_->err();
    EXPECT_EQ(talk(*process, "hello"), "HELLO");
    const platform::Uuid before = uuid_;
    std::filesystem::remove_all(home_.path(bundle_));
    EXPECT_EQ(process->wait(), 128 + SIGKILL);
    EXPECT_TRUE(waitUntil(
        [&] { return zrd_->errLines("spawnerd reported plug-ins have been terminated") == 1; }));
    EXPECT_FALSE(startPlugIn());
    EXPECT_EQ(failure_, EPERM) << "what let it be started is gone too";
    EXPECT_EQ(ready(before), "4 no such plugin (uuid not found)");

    writePlugIn(bundle_, upperInfo());
    EXPECT_TRUE(waitUntil([&] { return match().size() == 1; }));
    std::filesystem::remove_all(home_.path(bundle_));
    EXPECT_TRUE(
        waitUntil([&] { return zrd_->errLines("spawnerd reported no plug-ins on record") == 1; }));
}

TEST_F(Ready, WhatAHostWasGrantedIsItsOwn) {
    NEEDS_BUBBLEWRAP();
    auto other =
        spawn("/bin/sh", {"-c", "echo data | exec " + zrctlProgram_ + " run com.test.upper"});
    EXPECT_EQ(other->wait(), 5) << other->err();
    EXPECT_EQ(other->out(), "DATA\n");
    EXPECT_FALSE(startPlugIn());
    EXPECT_EQ(failure_, EPERM) << "a host that is gone had the right";

    const std::string input = home_.path("input");
    ASSERT_EQ(::mkfifo(input.c_str(), 0600), 0);
    const platform::UniqueFd typing(::open(input.c_str(), O_RDWR | O_CLOEXEC));
    other = spawn("/bin/sh", {"-c", "exec " + zrctlProgram_ + " run com.test.upper <" + input});
    EXPECT_EQ(::write(typing.get(), "more\n", 5), 5);
    EXPECT_TRUE(waitUntil([&] { return other->out() == "MORE\n"; })) << other->err();
    EXPECT_FALSE(startPlugIn());
    EXPECT_EQ(failure_, EPERM) << "one that lives has it";
    other->signal(SIGTERM);
    EXPECT_EQ(other->wait(), 128 + SIGKILL);
}

TEST_F(Ready, BadPlugInsAreRefused) {
    const auto write = [&](const std::string& name, const Value& environment) {
        Dictionary bad = info(name);
        bad.set("QFBundleExecutable", "run");
        bad.set("LUMService", Dictionary{{"EnvironmentVariables", environment}});
        writePlugIn(plugInPath("B", name), bad);
        std::filesystem::copy_file("/bin/true", home_.path(plugInPath("B", name) + "/run"));
    };
    write("number", Dictionary{{"A", 1}});
    write("equals", Dictionary{{"A=B", "c"}});
    write("list", Array{"A"});
    write("linked", Dictionary());
    ASSERT_TRUE(waitUntil([&] { return match().size() == 5; }));
    EXPECT_EQ(ready(uuidOf("number")), refusal("number"));
    EXPECT_EQ(ready(uuidOf("equals")), refusal("equals"));
    EXPECT_EQ(ready(uuidOf("list")), "") << "what is no dictionary counts as absent";

    const std::string container = home_.path("data/zorvan/Containers/linked");
    std::filesystem::remove_all(container);
    std::filesystem::create_directory_symlink(home_.makeDirectory("elsewhere"), container);
    EXPECT_EQ(ready(uuidOf("linked")), refusal("linked"));
    EXPECT_TRUE(std::filesystem::is_empty(home_.path("elsewhere")));
    EXPECT_EQ(zrd_->errLines("spawnerd error"), 3u) << zrd_->err();
}

TEST_F(Ready, ABundleThatIsExchangedAfterItWasFoundGivesNothing) {
    NEEDS_BUBBLEWRAP();
    const std::string application = home_.path("Own.app"), bundle = "Own.app/PlugIns/own.appex",
                      path = home_.path(bundle);
    Dictionary own = info("com.test.own");
    own.set("QFBundleExecutable", "run");
    writePlugIn(bundle, own);
    std::filesystem::copy_file(TEST_PLUGIN, path + "/run");
    EXPECT_EQ(add({application}), "");
    const platform::Uuid uuid = uuidOf("com.test.own");
    EXPECT_EQ(ready(uuid), "");
    const std::string token = access(uuid).at(0);
    EXPECT_GT(readable(token), 0u);

    // Like the bundle in all but what it is.
    const std::string link = home_.path("link");
    home_.makeDirectory("private");
    std::filesystem::copy(path, home_.path("private"));
    std::filesystem::create_directory_symlink(home_.path("private"), link);
    ASSERT_EQ(::renameat2(AT_FDCWD, link.c_str(), AT_FDCWD, path.c_str(), RENAME_EXCHANGE), 0);
    const auto reply =
        ask([&](auto& client, auto& callback) { client.accessPlugIns({uuid}, 0, callback); });
    // The registry may have noticed by now.
    const std::string gone = "4 no such plugin (uuid not found)";
    EXPECT_THAT(errorOf(reply),
                testing::AnyOf("4 cannot create extension to " + path + ": 40", gone));
    std::optional<zorvan::ZRError> error;
    EXPECT_FALSE(zorvan::ZRPlugInProcess::start(nullptr, path + "/run", {}, error));
    EXPECT_THAT(error ? error->code : 0, testing::AnyOf(ELOOP, EPERM));
    EXPECT_THAT(
        ready(uuid),
        testing::AnyOf("4 unable to enable plug-in com.test.own(" + uuid.string() + ")", gone));
    EXPECT_EQ(readable(token), 0u);
    for (const Dictionary& form : forms({{"VXExtensionIdentifier", "com.test.own"}}))
        EXPECT_FALSE(form.find("extensions")->dictionary()->contains("."));
}

TEST_F(Ready, TokensGiveAccessToTheBundleAndNothingElseDoes) {
    const std::size_t size = std::filesystem::file_size(TEST_PLUGIN);
    const std::string token = access(uuid_).at(0);
    EXPECT_EQ(readable(token), size);
    const auto form = forms().at(0);
    const Dictionary* extensions = form.find("extensions")->dictionary();
    EXPECT_EQ(readable(extensions->find(".")->string()->string()), size);
    const auto process = zrctl({"access", "com.test.upper", uuid_.string()});
    const std::string lines = process->out();
    EXPECT_EQ(std::ranges::count(lines, '\n'), 2);
    EXPECT_EQ(readable(lines.substr(0, lines.find('\n'))), size);

    for (std::size_t i = 0; i < token.size(); i += 7) {
        std::string altered = token;
        altered[i] = altered[i] == 'a' ? 'b' : 'a';
        EXPECT_EQ(readable(altered), 0u) << i;
    }
    stop(SIGTERM);
    EXPECT_EQ(readable(token), 0u);
    start();
    EXPECT_EQ(readable(token), 0u) << "another daemon's";
    EXPECT_EQ(readable(access(uuid_).at(0)), size);
}

}  // namespace

}  // namespace test
