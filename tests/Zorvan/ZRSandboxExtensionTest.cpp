#include "Zorvan/ZRSandboxExtension.h"

#include <fcntl.h>
#include <gtest/gtest.h>

#include <cstdlib>
#include <thread>

#include "platform/sandbox/Sandbox.h"
#include "platform/system/Directories.h"
#include "platform/system/UniqueFd.h"
#include "platform/threads/RunLoop.h"
#include "tests/support/KnownDirectory.h"
#include "tests/support/TemporaryDirectory.h"

namespace zorvan {
namespace {

TEST(ZRSandboxExtension, ConsumesOnceUntilExpelled) {
    test::TemporaryDirectory home;
    home.write("bundle/file", "text");
    ::setenv("XDG_RUNTIME_DIR", home.path().c_str(), 1);
    platform::RunLoop loop;
    const auto sandbox =
        platform::makeKernelSandbox(platform::Directories::fromEnvironment(), "test", loop);
    const std::string token = *sandbox->issueReadExtension(test::known(home.path("bundle")), ".",
                                                           platform::Wait::Allowed);
    std::thread thread([&] { loop.run(); });

    auto extension = ZRSandboxExtension::initWithExtension(token);
    extension->expel();
    EXPECT_EQ(extension->handle(), 0);
    extension->consume();
    std::int64_t handle = extension->handle();
    const auto readable = [&] {
        const auto directory = static_cast<int>(handle);
        return bool(platform::UniqueFd(::openat(directory, "file", O_RDONLY | O_CLOEXEC)));
    };
    EXPECT_TRUE(readable());
    extension->consume();
    EXPECT_EQ(extension->handle(), handle) << "consumed already";
    extension->expel();
    EXPECT_EQ(extension->handle(), 0);
    EXPECT_FALSE(readable());
    extension->setToken(token + "0");
    extension->consume();
    EXPECT_EQ(extension->handle(), 0) << "refused";
    extension->setToken(token);
    extension->consume();
    handle = extension->handle();
    EXPECT_TRUE(readable());
    extension.reset();
    EXPECT_FALSE(readable());

    loop.stop();
    thread.join();
}

}  // namespace
}  // namespace zorvan
