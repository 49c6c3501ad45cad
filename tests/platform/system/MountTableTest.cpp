#include "platform/system/MountTable.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "tests/support/HungMount.h"
#include "tests/support/TemporaryDirectory.h"

namespace platform {
namespace {

TEST(MountTableTest, TellsWhatAPathLeadsToAndWhatIsCovered) {
    if (!test::HungMount::isPossible()) GTEST_SKIP() << "only root mounts";
    test::TemporaryDirectory files;
    const std::string inner = files.makeDirectory("a b/c"), outer = files.path("a b");
    MountTable mounts;
    mounts.refresh();
    const auto before = mounts.of(inner)->place;
    const auto mounted = [&](const std::string& path) {
        EXPECT_EQ(::mount("none", path.c_str(), "tmpfs", 0, nullptr), 0);
        mounts.refresh();
    };
    mounted(inner);
    EXPECT_EQ(mounts.of(inner + "/x/y")->place, inner);
    EXPECT_EQ(mounts.of(inner + "x")->place, before);
    ASSERT_EQ(mounts.within(files.path()).size(), 1u);
    const int first = mounts.of(inner)->id;
    mounted(inner);
    EXPECT_NE(mounts.of(inner)->id, first) << "the later one covers the other";
    EXPECT_EQ(mounts.within(files.path()).size(), 1u);
    mounted(outer);
    EXPECT_EQ(mounts.of(inner)->place, outer) << "that lies beneath now";
    ASSERT_EQ(mounts.within(files.path()).size(), 1u);
    EXPECT_EQ(mounts.within(files.path())[0]->type, "tmpfs");
    ::umount2(outer.c_str(), MNT_DETACH);
    mounts.refresh();
    EXPECT_EQ(mounts.of(inner)->place, inner);
    for (int i = 0; i < 2; ++i) ::umount2(inner.c_str(), MNT_DETACH);
}

}  // namespace
}  // namespace platform
