// The example host and its plug-ins, in their sandbox.

#include <filesystem>

#include "tests/system/SystemTest.h"

namespace test {

namespace {

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
        auto tool = spawn("/bin/sh", {"-c", "exec '" TEXT_TOOL "' " + arguments + " < " + input});
        tool->wait();
        return tool;
    }
    std::string transform(const std::string& identifier, const std::string& text) {
        const auto tool = textTool("com.example." + identifier, text);
        EXPECT_EQ(tool->wait(), 0) << tool->err() << zrd_->err();
        return tool->out();
    }
};

TEST_F(Examples, PlugInsTransformText) {
    EXPECT_THAT(textTool("")->out(), testing::HasSubstr("com.example.scribe.title-case"));
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

TEST_F(Examples, TheHostDoesNotFindWhatIsHeld) {
    const std::string bundle =
        home_.path(kApps + std::string("Scribe.app/PlugIns/TitleCase.appex"));
    const auto reply = ask([&](auto& client, auto& callback) {
        client.holdPlugins({bundle}, zorvan::ZRHoldPlugIns, callback);
    });
    EXPECT_EQ(errorOf(reply), "");
    EXPECT_EQ(textTool("com.example.scribe.title-case")->wait(), 1);
    client_ = ZRDaemonClient::initWithServiceName(nullptr);  // the hold ends with its client
    EXPECT_TRUE(waitUntil([&] { return textTool("com.example.scribe.title-case")->wait() == 0; }));
}

}  // namespace

}  // namespace test
