#include "platform/spawnerd/InstanceGroups.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>

#include "platform/system/Files.h"
#include "tests/support/TemporaryDirectory.h"

namespace platform::spawnerd {

namespace {

/// Plain files in the places of the kernel's.
class Groups : public testing::Test {
  protected:
    Groups() {
        write("cgroup.controllers", "cpu memory pids\n");
        write("cgroup.procs", self_ + "\n");
        write("cgroup.subtree_control", "");
        write("daemon/cgroup.procs", "");
        for (const char* name : {"cgroup.procs", "cgroup.kill", "memory.max", "pids.max",
                                 "cpu.weight", "memory.swap.max", "memory.oom.group"})
            write(std::string("instance-7/") + name, "");
    }
    void write(const std::string& name, const std::string& text) {
        tree_.write("user.slice/zrd.service/" + name, text);
    }
    std::string read(const std::string& name) {
        return *readFile(tree_.path("user.slice/zrd.service/" + name), 1000);
    }
    InstanceGroups find() { return InstanceGroups::find(tree_.path(), membership_); }

    const std::string self_ = std::to_string(::getpid());
    test::TemporaryDirectory tree_;
    const std::string membership_ =
        tree_.write("membership", "4:memory:/old\n0::/user.slice/zrd.service\n");
};

TEST_F(Groups, AnInstanceHasOneWithItsLimits) {
    const std::string old = tree_.makeDirectory("user.slice/zrd.service/instance-3");
    const InstanceGroups groups = find();
    ASSERT_TRUE(groups.areThere());
    EXPECT_FALSE(std::filesystem::exists(old)) << "an earlier daemon's";
    EXPECT_EQ(read("daemon/cgroup.procs"), self_);
    EXPECT_EQ(read("cgroup.subtree_control"), "+cpu") << "the last that was written";
    const auto group = groups.make(7, kSmallLimits);
    ASSERT_TRUE(group);
    EXPECT_EQ(read("instance-7/memory.max"), "536870912");
    EXPECT_EQ(read("instance-7/pids.max"), "131");
    EXPECT_EQ(read("instance-7/cpu.weight"), "100");
    EXPECT_TRUE(group->add(1234));
    EXPECT_EQ(read("instance-7/cgroup.procs"), "1234");
    EXPECT_EQ(read("instance-7/cgroup.kill"), "");
    group->kill();
    EXPECT_EQ(read("instance-7/cgroup.kill"), "1");
    std::filesystem::remove(tree_.path("user.slice/zrd.service/instance-7/pids.max"));
    EXPECT_FALSE(groups.make(7, kSmallLimits)) << "without limits there is no instance";
}

TEST_F(Groups, WhatIsNotDelegatedStaysAsItIs) {
    const auto refused = [&] {
        return !find().areThere() && read("daemon/cgroup.procs").empty() &&
               read("cgroup.subtree_control").empty();
    };
    write("cgroup.procs", std::to_string(::getppid()) + "\n" + self_ + "\n");
    EXPECT_TRUE(refused()) << "others are there too";
    write("cgroup.procs", self_ + "\n");
    write("cgroup.controllers", "cpu\n");
    EXPECT_TRUE(refused());
    tree_.write("membership", "4:memory:/user.slice/zrd.service\n");
    EXPECT_TRUE(refused()) << "no unified tree";
    const auto none = InstanceGroups().make(7, kSmallLimits);
    ASSERT_TRUE(none);
    EXPECT_TRUE(none->add(1234));
    EXPECT_EQ(read("instance-7/cgroup.procs"), "");
}

}  // namespace

}  // namespace platform::spawnerd
