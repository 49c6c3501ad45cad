#include "platform/services/Assertions.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <filesystem>

#include "platform/system/Directories.h"
#include "platform/system/Files.h"
#include "tests/support/TemporaryDirectory.h"

namespace platform {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

TEST(Assertions, AnInstanceIsBusyWhileItHoldsOneOrLives) {
    test::TemporaryDirectory home;
    Directories directories;
    directories.runtime = home.path("run");
    const auto assertions = makeFileAssertions(directories);
    const auto busy = [&] {
        return assertions->busyInstancesForBundleIdentifiers({"a", "b"}, "/A.appex");
    };
    const Dictionary a{{kAssertionBundleIdentifier, "a"}}, b{{kAssertionBundleIdentifier, "b"}};
    EXPECT_THAT(busy(), IsEmpty());
    {
        const auto one = BusyAssertion::take(directories, "a"),
                   other = BusyAssertion::take(directories, "b"),
                   outside = BusyAssertion::take(directories, "c");
        ASSERT_TRUE(one && other && outside);
        EXPECT_THAT(busy(), ElementsAre(a, b));
        EXPECT_THAT(busy(), ElementsAre(a, b)) << "looking disturbs nobody";
    }
    EXPECT_THAT(busy(), IsEmpty());
    EXPECT_FALSE(BusyAssertion::take(directories, "../a"));

    // Whoever was killed leaves a folder, which is cleared away later.
    const std::string left = home.write("run/zorvan/tenurd/a/left/busy", "x");
    EXPECT_THAT(busy(), IsEmpty());
    int ready[2];
    ASSERT_EQ(::pipe(ready), 0);
    const pid_t child = ::fork();
    if (child == 0) {
        const auto taken = BusyAssertion::take(directories, "a");
        ::write(ready[1], "x", 1);
        for (;;) ::pause();
    }
    char byte;
    ASSERT_EQ(::read(ready[0], &byte, 1), 1);
    BusyFolder::sweep(directories);
    EXPECT_THAT(busy(), ElementsAre(a));
    EXPECT_FALSE(std::filesystem::exists(left));
    ::kill(child, SIGKILL);
    ::waitpid(child, nullptr, 0);
    EXPECT_THAT(busy(), IsEmpty());
    BusyFolder::sweep(directories);
    EXPECT_TRUE(std::filesystem::is_empty(home.path("run/zorvan/tenurd")));

    // A report that cannot be read is one all the same.
    const auto unreadable = BusyAssertion::take(directories, "b");
    for (const auto& folder : std::filesystem::directory_iterator(home.path("run/zorvan/tenurd/b")))
        std::filesystem::resize_file(folder.path() / "busy", 0);
    EXPECT_THAT(busy(), ElementsAre(Dictionary()));
}

TEST(Assertions, AnInstanceOfANamesakeIsAnothers) {
    test::TemporaryDirectory home;
    Directories directories;
    directories.runtime = home.path("run");
    const auto assertions = makeFileAssertions(directories);
    const auto own = BusyFolder::make(directories, "a", "/One.appex");
    ASSERT_TRUE(own);
    const UniqueFd file(::open((own->path() + "/busy").c_str(), O_RDWR | O_CLOEXEC));
    struct flock lock {};
    lock.l_type = F_RDLCK;
    ASSERT_EQ(::fcntl(file.get(), F_OFD_SETLK, &lock), 0);
    const auto busyAt = [&](const char* place) {
        return assertions->busyInstancesForBundleIdentifiers({"a"}, place).size();
    };
    EXPECT_EQ(busyAt("/One.appex"), 1u);
    EXPECT_EQ(busyAt("/Other.appex"), 0u);
}

}  // namespace
}  // namespace platform
