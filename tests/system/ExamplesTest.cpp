// The example host and its plug-ins, in their sandbox.

#include <sys/socket.h>
#include <unistd.h>

#include <filesystem>

#include "Zorvan/ZRPlugInCore.h"
#include "Zorvan/ZRPlugInProcess.h"
#include "tests/system/SystemTest.h"

namespace test {

namespace {

using testing::HasSubstr;
using testing::IsEmpty;
using testing::SizeIs;
using zorvan::ZRPlugInCore;
using zorvan::ZRPlugInProcess;

class Examples : public SystemTest {
  protected:
    void SetUp() override {
        const char* sandbox =
            "bwrap --unshare-user --disable-userns --unshare-pid --unshare-ipc --unshare-uts"
            " --unshare-cgroup --ro-bind / / --proc /proc --dev /dev true";
        if (spawn("/bin/sh", {"-c", sandbox})->wait() != 0)
            GTEST_SKIP() << "bubblewrap cannot run here";
        const auto everything = std::filesystem::copy_options::recursive;
        home_.makeDirectory("data/zorvan");
        std::filesystem::copy(EXAMPLE_APPLICATIONS, home_.path(kApps), everything);
        std::filesystem::copy(ZR_SOURCE_DIR "/examples/SDKs", home_.path("data/zorvan/SDKs"),
                              everything);
        start();
    }

    std::unique_ptr<Process> textTool(const std::string& arguments, const std::string& text = "") {
        const std::string input = home_.write("input", text);
        auto tool = spawn("/bin/sh", {"-c", "exec " TEXT_TOOL " " + arguments + " < " + input});
        tool->wait();
        return tool;
    }
    std::string transform(const std::string& identifier, const std::string& text) {
        const auto tool = textTool("com.example." + identifier, text);
        EXPECT_EQ(tool->wait(), 0) << tool->err() << zrd_->err();
        return tool->out();
    }

    std::unique_ptr<ZRPlugInCore> find(const char* identifier) {
        const auto found = forms({{"VXExtensionIdentifier", identifier}});
        return found.size() == 1 ? ZRPlugInCore::initWithForm(found[0]) : nullptr;
    }
    std::string ready(const ZRPlugInCore& plugIn) {
        return errorOf(ask(
            [&](auto& client, auto& reply) { client.readyPlugIns({plugIn.uuid()}, 0, reply); }));
    }
    ZRDaemonClient::Reply hold(const std::string& path, std::uint64_t flags) {
        return ask([&](auto& client, auto& reply) { client.holdPlugins({path}, flags, reply); });
    }
};

TEST_F(Examples, PlugInsTransformText) {
    EXPECT_THAT(textTool("")->out(), HasSubstr("com.example.scribe.title-case"));
    EXPECT_EQ(transform("shout", "Hello there.\nYou, too.\n"), "HELLO THERE!\nYOU, TOO!\n");
    EXPECT_EQ(transform("courier.reverse", "abc\nde\n"), "cba\ned\n");
    EXPECT_EQ(transform("scribe.word-count", "one two\nthree\n"), "3\n");
    EXPECT_EQ(transform("scribe.title-case", "don't \xc3\xa4ndern a-b\n"),
              "Don't \xc3\xa4ndern A-B\n");
    // More than the connection holds, both ways at once.
    EXPECT_EQ(transform("scribe.title-case", std::string(3'000'000, 'a')),
              "A" + std::string(2'999'999, 'a'));
    EXPECT_EQ(transform("shout", ""), "");
}

TEST_F(Examples, PlugInsReadNoFilesOfTheUser) {
    const std::string letter = home_.write("letter", "private\n");
    home_.write("data/zorvan/Containers/com.example.courier.quote/note", "its own\n");
    EXPECT_EQ(transform("courier.quote", "Dear\n@note\n"), "Dear\nits own\n");
    for (const std::string& file :
         {letter, std::string("../../../../letter"), std::string(ZR_SOURCE_DIR "/README.md"),
          std::string("/etc/passwd")})
        EXPECT_EQ(transform("courier.quote", "@" + file + "\n"), "(cannot read " + file + ")\n");
}

TEST_F(Examples, WhatIsHeldIsNeitherFoundNorStarted) {
    const auto shout = find("com.example.shout");
    ASSERT_TRUE(shout);
    const auto reply = hold(shout->path(), zorvan::ZRHoldPlugIns);
    ASSERT_EQ(errorOf(reply), "");
    EXPECT_THAT(match({{"com.orbel.uuid", shout->uuid().string()}}), IsEmpty());
    EXPECT_EQ(ready(*shout),
              "11 access to plugin com.example.shout denied: the plug-in is on hold");
    const auto& token = *std::get<platform::Message>(reply).find(zorvan::message::kUuids);
    EXPECT_EQ(errorOf(ask([&](auto& client, auto& callback) {
                  client.releaseHold(*token.uuid(), callback);
              })),
              "");
    EXPECT_EQ(ready(*shout), "");
}

TEST_F(Examples, AnApplicationWhosePlugInWorksIsNotHeld) {
    const auto plugIn = find("com.example.scribe.title-case");
    ASSERT_TRUE(plugIn);
    ASSERT_EQ(ready(*plugIn), "");
    std::optional<zorvan::ZRError> error;
    const auto process = ZRPlugInProcess::start(nullptr, *plugIn, {}, error);
    ASSERT_TRUE(process) << describe(*error);
    char letter = 'a';
    ASSERT_EQ(::write(process->connection(), &letter, 1), 1);
    ASSERT_EQ(::read(process->connection(), &letter, 1), 1);
    EXPECT_EQ(letter, 'A');
    const std::string scribe = home_.path(kApps) + "Scribe.app";
    const auto refusal = hold(scribe, zorvan::ZRHoldApplications);
    EXPECT_EQ(errorOf(refusal), "14 plug-ins are busy");
    const auto& conflicts =
        *std::get<platform::Message>(refusal).find(zorvan::message::kConflicts)->array();
    ASSERT_THAT(conflicts, SizeIs(1));
    EXPECT_EQ(conflicts[0], Value(Dictionary{{"bundle-identifier", plugIn->identifier()}}));
    ::shutdown(process->connection(), SHUT_WR);
    EXPECT_EQ(process->wait(), 0);
    EXPECT_EQ(errorOf(hold(scribe, zorvan::ZRHoldApplications)), "");
    EXPECT_FALSE(find("com.example.scribe.title-case"));
}

}  // namespace

}  // namespace test
