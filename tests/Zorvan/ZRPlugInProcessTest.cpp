#include "Zorvan/ZRPlugInProcess.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <csignal>
#include <future>

#include "Zorvan/ZRPlugInCore.h"
#include "Zorvan/ZRPlugInHost.h"
#include "platform/plist/PropertyList.h"
#include "platform/spawnerd/ProcessLauncher.h"
#include "platform/system/Directories.h"
#include "platform/threads/RunLoop.h"
#include "tests/support/KnownDirectory.h"
#include "tests/support/TemporaryDirectory.h"

namespace zorvan {

namespace {

using platform::Dictionary;

/// A launcher on a thread of its own, and a plug-in.
class PlugInProcess : public testing::Test {
  protected:
    PlugInProcess() {
        ::setenv("XDG_RUNTIME_DIR", home_.makeDirectory("run").c_str(), 1);
        ::setenv("XDG_DATA_HOME", home_.path("data").c_str(), 1);
        run([this] {
            launcher_.emplace(platform::Directories::fromEnvironment(), "com.test.zrd", loop());
        });
        run([] {});  // it listens from the loop's next turn
        home_.write("upper.appex/Info.plist", *platform::writeXmlPropertyList(info_));
        std::filesystem::copy_file(TEST_PLUGIN, executable_);
    }
    ~PlugInProcess() override {
        run([this] { launcher_.reset(); });
    }

    std::shared_ptr<platform::RunLoop> loop() {
        return {&queue_.runLoop(), [](platform::RunLoop*) {}};
    }
    void run(const std::function<void()>& work) {
        std::promise<void> done;
        queue_.async([&] {
            work();
            done.set_value();
        });
        done.get_future().get();
    }
    void ready() {
        const Dictionary overlay{{"LUMService", Dictionary{{"_SandboxProfile", "plugin"}}},
                                 {"QFBundlePackageType", "LUM!"}};
        const auto self = *platform::AuditToken::ofSelf();
        const platform::ExternalService service{executable_, test::known(home_.path("upper.appex")),
                                                ""};
        EXPECT_EQ(launcher_->addExternalService(self, service, overlay), 0);
    }
    std::unique_ptr<ZRPlugInProcess> start() {
        std::optional<ZRError> error;
        auto process = ZRPlugInProcess::start("com.test.zrd", executable_, {}, error);
        EXPECT_EQ(process == nullptr, error.has_value());
        if (error) error_ = *error;
        return process;
    }
    static std::string transform(const ZRPlugInProcess& process, const std::string& text) {
        std::string answer(text.size(), ' ');
        EXPECT_EQ(::write(process.connection(), text.data(), text.size()),
                  static_cast<ssize_t>(text.size()));
        ::recv(process.connection(), answer.data(), answer.size(), MSG_WAITALL);
        return answer;
    }
    std::size_t busy() {
        return platform::makeFileAssertions(platform::Directories::fromEnvironment())
            ->busyInstancesForBundleIdentifiers({"com.test.upper"}, home_.path("upper.appex"))
            .size();
    }

    const Dictionary info_{{"QFBundleIdentifier", "com.test.upper"},
                           {"QFBundleExecutable", "upper"},
                           {"VXExtension", Dictionary()}};
    test::TemporaryDirectory home_;
    const std::string executable_ = home_.path("upper.appex/upper");
    platform::SerialQueue queue_{"launcher"};
    std::optional<platform::spawnerd::ProcessLauncher> launcher_;
    ZRError error_;
};

TEST_F(PlugInProcess, AHostUsesAPlugInThatIsBusyMeanwhile) {
    EXPECT_FALSE(start());
    EXPECT_EQ(error_.domain, "POSIX");
    EXPECT_EQ(error_.code, EPERM);
    ready();
    const auto process = start();
    ASSERT_TRUE(process);
    EXPECT_EQ(busy(), 0u);
    EXPECT_EQ(transform(*process, "hello"), "HELLO");
    EXPECT_EQ(busy(), 1u);
    std::promise<std::optional<int>> ended;
    process->setEndHandler([&](std::optional<int> status) { ended.set_value(status); });
    process->takeConnection();
    EXPECT_EQ(process->wait(), 5);
    EXPECT_EQ(ended.get_future().get(), 5);
    std::promise<std::optional<int>> known;
    process->setEndHandler([&](std::optional<int> status) { known.set_value(status); });
    EXPECT_EQ(known.get_future().get(), 5);
    EXPECT_EQ(busy(), 0u);
    process->terminate();
}

TEST_F(PlugInProcess, EndsWhenItIsTold) {
    ready();
    std::optional<ZRError> error;
    const auto core = ZRPlugInCore::initWithName("Upper", home_.path("upper.appex"), info_,
                                                 std::nullopt, std::nullopt);
    auto process = ZRPlugInProcess::start("com.test.zrd", *core, {}, error);
    ASSERT_TRUE(process) << describe(*error);
    EXPECT_EQ(transform(*process, "a"), "A");
    process->terminate();
    EXPECT_EQ(process->wait(), 128 + SIGKILL);
    EXPECT_EQ(busy(), 0u);

    process = start();
    EXPECT_EQ(transform(*process, "b"), "B");
    process.reset();
    EXPECT_EQ(busy(), 0u);

    // With the daemon, too.
    process = start();
    EXPECT_EQ(transform(*process, "c"), "C");
    run([this] { launcher_.reset(); });
    EXPECT_EQ(process->wait(), std::nullopt);
    EXPECT_EQ(busy(), 0u);
    EXPECT_FALSE(start());
    EXPECT_EQ(error_.domain, kZRErrorDomain);
}

TEST_F(PlugInProcess, WhatIsNoPlugInHasNoHost) {
    EXPECT_FALSE(ZRPlugInHost::take());
    ::setenv("ZORVAN_PLUGIN_FD", "1000000", 1);
    EXPECT_FALSE(ZRPlugInHost::take());
    EXPECT_EQ(::getenv("ZORVAN_PLUGIN_FD"), nullptr);
}

}  // namespace

}  // namespace zorvan
