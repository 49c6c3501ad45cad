#include "platform/system/OpenBeneath.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>

#include <cerrno>
#include <cstddef>
#include <filesystem>
#include <functional>
#include <iterator>

#include "platform/system/Files.h"
#include "tests/support/TemporaryDirectory.h"

namespace platform {
namespace {

namespace fs = std::filesystem;

/// Has the kernel not know openat2 any more, for this process.
bool forgetOpenat2() {
    sock_filter program[] = {
        BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_openat2, 0, 1),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | ENOSYS),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
    };
    const sock_fprog filter{std::size(program), program};
    return ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
           ::prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &filter) == 0;
}

class OpenBeneath : public testing::Test {
  protected:
    OpenBeneath() {
        files_.write("out", "secret");
        files_.write("top/in/file", "text");
        fs::create_symlink("in/../in/file", files_.path("top/inner"));
        fs::create_directory_symlink("in", files_.path("top/way"));
        fs::create_symlink("../out", files_.path("top/outer"));
        fs::create_symlink(files_.path("top/in/file"), files_.path("top/absolute"));
        fs::create_directory_symlink("top", files_.path("link"));
    }
    /// What holds in any case; `follows` says whether links that stay inside are followed.
    void look(bool follows) {
        const UniqueFd top(::open(files_.path("top").c_str(), O_PATH | O_CLOEXEC));
        const auto beneath = [&](const std::string& path) {
            const auto text = readFileBeneath(top.get(), path, 100);
            if (!text) return text.error().code;
            EXPECT_EQ(*text, "text") << path;
            return 0;
        };
        for (const char* good : {"in/file", "./in/file", ".//in//file"})
            EXPECT_EQ(beneath(good), 0) << good;
        for (const char* link : {"inner", "way/file"})
            EXPECT_EQ(beneath(link), follows ? 0 : EXDEV) << link;
        for (const char* bad : {"outer", "absolute", "../out", "..", "/etc/passwd"})
            EXPECT_EQ(beneath(bad), EXDEV) << bad;
        EXPECT_EQ(beneath("in/none"), ENOENT);
        EXPECT_EQ(beneath("in"), EINVAL);
        EXPECT_EQ(beneath(std::string("in\0", 3)), EINVAL);
        EXPECT_TRUE(openBeneath(top.get(), ".", O_PATH));

        const auto direct = [&](const std::string& path, int flags = O_PATH) {
            const auto file = openWithoutLinks(top.get(), path, flags);
            return file ? 0 : file.error().code;
        };
        EXPECT_EQ(direct("in/file"), 0);
        EXPECT_EQ(direct(files_.path("top/in/file")), 0);
        EXPECT_EQ(direct(files_.path("link/in/file")), ELOOP);
        EXPECT_EQ(direct("way/file"), ELOOP);
        EXPECT_NE(direct("way", O_PATH | O_DIRECTORY), 0);
        EXPECT_EQ(direct("in/file/more"), ENOTDIR);
        EXPECT_EQ(direct("../top/in/file"), follows ? EXDEV : ELOOP);
    }
    /// Works in a process of its own, once that is prepared.
    static void inChild(const std::function<bool()>& prepare, const std::function<void()>& work) {
        const pid_t child = ::fork();
        if (child == 0) {
            if (!prepare()) ::_exit(77);
            work();
            ::_exit(HasFailure() ? 1 : 0);
        }
        int status = -1;
        ASSERT_EQ(::waitpid(child, &status, 0), child);
        if (WIFEXITED(status) && WEXITSTATUS(status) == 77) GTEST_SKIP() << "not permitted here";
        EXPECT_EQ(status, 0);
    }

    test::TemporaryDirectory files_;
};

TEST_F(OpenBeneath, NothingLeadsOut) {
    look(true);
}

TEST_F(OpenBeneath, NothingLeadsOutWhereTheKernelCannotWatchTheWay) {
    inChild(forgetOpenat2, [this] { look(false); });
}

TEST_F(OpenBeneath, MountsLeadOut) {
    const std::string inner = files_.path("top/in");
    const auto mount = [&] {
        return ::unshare(CLONE_NEWUSER | CLONE_NEWNS) == 0 &&
               ::mount(inner.c_str(), inner.c_str(), nullptr, MS_BIND, nullptr) == 0;
    };
    const auto lookAtMount = [&] {
        const auto from = [](const std::string& directory, const std::string& path) {
            const UniqueFd top(::open(directory.c_str(), O_PATH | O_CLOEXEC));
            const auto file = openBeneath(top.get(), path, O_PATH);
            return file ? 0 : file.error().code;
        };
        for (const char* path : {"in", "in/file", "./in/file"})
            EXPECT_EQ(from(files_.path("top"), path), EXDEV) << path;
        EXPECT_EQ(from(inner, "file"), 0);
        EXPECT_EQ(from(inner, "."), 0);
    };
    inChild(mount, [&] {
        lookAtMount();
        if (forgetOpenat2()) lookAtMount();
    });
}

}  // namespace
}  // namespace platform
