#include "platform/sandbox/SandboxExtension.h"

#include <fcntl.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <pthread.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <thread>
#include <vector>

#include "platform/sandbox/MountProcess.h"
#include "platform/sandbox/Sandbox.h"
#include "platform/sandbox/SandboxTokens.h"
#include "platform/system/Files.h"
#include "tests/platform/lum/LumFixture.h"
#include "tests/support/KnownDirectory.h"
#include "tests/support/TemporaryDirectory.h"

namespace platform {
namespace {

namespace fs = std::filesystem;

/// Access, given back at the end.
struct Handle {
    explicit Handle(const std::string& token) : fd(static_cast<int>(consumeExtension(token))) {}
    Handle(const Handle&) = delete;
    ~Handle() { releaseExtension(fd); }
    const int fd;
};

/// The errno of opening below a directory; 0 when that works.
int openError(int directory, const std::string& name, int flags) {
    const UniqueFd file(::openat(directory, name.c_str(), flags | O_CLOEXEC, 0600));
    return file ? 0 : errno;
}

std::string procPath(int fd) {
    return "/proc/self/fd/" + std::to_string(fd);
}

/// What must hold for access to a directory with the file "in/file", wherever it is used.
void expectReadOnly(int directory) {
    const auto text = readFileAt(directory, "in/file", 100);
    ASSERT_TRUE(text) << text.error().text;
    EXPECT_EQ(*text, "text");
    EXPECT_EQ(openError(directory, "in/file", O_WRONLY), EROFS);
    EXPECT_EQ(openError(directory, "new", O_WRONLY | O_CREAT), EROFS);
    EXPECT_EQ(::mkdirat(directory, "new", 0700) != 0 ? errno : 0, EROFS);
    EXPECT_EQ(::unlinkat(directory, "in/file", 0) != 0 ? errno : 0, EROFS);
    const UniqueFd file(::openat(directory, "in/file", O_RDONLY | O_CLOEXEC));
    EXPECT_EQ(openError(AT_FDCWD, procPath(file.get()), O_WRONLY), EROFS);
    EXPECT_EQ(openError(AT_FDCWD, procPath(directory) + "/in/file", O_RDWR), EROFS);
    EXPECT_EQ(openError(directory, "../secret", O_RDONLY), ENOENT);
    EXPECT_EQ(openError(directory, "in/../../secret", O_RDONLY), ENOENT);
    struct stat here {
    }, above{};
    ASSERT_EQ(::fstat(directory, &here), 0);
    ASSERT_EQ(::fstatat(directory, "../..", &above, 0), 0);
    EXPECT_EQ(here.st_ino, above.st_ino);

    // Not even with rights to mount.
    mount_attr writable{};
    writable.attr_clr = MOUNT_ATTR_RDONLY;
    EXPECT_NE(::mount_setattr(directory, "", AT_EMPTY_PATH, &writable, sizeof writable), 0);
    EXPECT_LT(::open_tree(directory, "", OPEN_TREE_CLONE | OPEN_TREE_CLOEXEC | AT_EMPTY_PATH), 0);
}

/// A bundle, and a service for it with a run loop on a thread of its own.
class SandboxExtension : public testing::Test {
  protected:
    SandboxExtension() {
        directories_.runtime = home_.path("run");
        ::setenv("XDG_RUNTIME_DIR", directories_.runtime.c_str(), 1);
        home_.write("bundle/in/file", "text");
        home_.write("secret", "secret");
    }
    ~SandboxExtension() override { stop(); }

    void start() {
        loop_ = std::make_unique<RunLoop>();
        sandbox_ = makeKernelSandbox(directories_, "test", *loop_);
        thread_ = std::thread([this] { loop_->run(); });
    }
    void stop() {
        if (!loop_) return;
        loop_->stop();
        thread_.join();
        sandbox_.reset();
        loop_.reset();
    }
    void tryMounts();
    void tryMountsThatHang();
    std::string issue(const std::string& relative = "bundle") const {
        const auto token =
            sandbox_->issueReadExtension(test::known(home_.path()), relative, Wait::Allowed);
        EXPECT_TRUE(token) << token.error().text;
        return token ? *token : "";
    }

    static std::size_t openDescriptors() {
        return static_cast<std::size_t>(
            std::distance(fs::directory_iterator("/proc/self/fd"), fs::directory_iterator()));
    }
    static std::size_t mounts() {
        std::ifstream file("/proc/self/mountinfo");
        return static_cast<std::size_t>(std::count(std::istreambuf_iterator<char>(file), {}, '\n'));
    }

    test::TemporaryDirectory home_;
    Directories directories_;
    std::unique_ptr<RunLoop> loop_;
    std::unique_ptr<Sandbox> sandbox_;
    std::thread thread_;
};

TEST_F(SandboxExtension, TokensCannotBeForgedOrAltered) {
    const auto tokens = SandboxTokens::make("odd. service\n"), others = SandboxTokens::make("test");
    ASSERT_TRUE(tokens && others);
    EXPECT_FALSE(SandboxTokens::make("../test"));
    fs::create_symlink("bundle", home_.path("link"));
    home_.write("bundle/a.b\n", "");
    const KnownDirectory home = test::known(home_.path());
    for (const char* given : {"link/in/file", "bundle/a.b\n", ".", "/bundle"}) {
        const std::string token = *tokens->issue(home, given);
        EXPECT_NE(token, *tokens->issue(home, given));
        EXPECT_EQ(tokens->check(token)->path, *canonicalPath(home_.path(given)));
        EXPECT_EQ(SandboxTokens::serviceOf(token), "odd. service\n");
        EXPECT_FALSE(others->check(token));
        for (std::size_t i = 0; i < token.size(); ++i) {
            for (const char change : {1, 0x20}) {
                std::string altered = token;
                altered[i] ^= change;
                EXPECT_FALSE(tokens->check(altered)) << altered;
            }
            EXPECT_FALSE(tokens->check(token.substr(0, i)));
        }
        EXPECT_FALSE(tokens->check(token + "0"));
    }
    for (const char* none : {"", ".", "....."}) EXPECT_FALSE(tokens->check(none));
    ASSERT_EQ(::mkfifo(home_.path("pipe").c_str(), 0600), 0);
    EXPECT_EQ(tokens->issue(home, "missing").error().code, ENOENT);
    EXPECT_EQ(tokens->issue(home, "pipe").error().code, EINVAL);
    EXPECT_EQ(tokens->issue(home, std::string("bundle\0", 7)).error().code, EINVAL);
}

TEST_F(SandboxExtension, GrantsReadingAndNothingElse) {
    start();
    const Handle bundle(issue());
    ASSERT_GT(bundle.fd, 2);
    expectReadOnly(bundle.fd);
    const Handle file(issue("bundle/in/file"));
    char text[8];
    ASSERT_EQ(::read(file.fd, text, sizeof text), 4);
    EXPECT_EQ(openError(AT_FDCWD, procPath(file.fd), O_WRONLY), EROFS);

    const std::string token = issue();
    std::string altered = token;
    altered.back() ^= 1;
    for (const std::string& bad : {altered, std::string(), token + "\n", std::string("74657374.x"),
                                   std::string("2e2e2f74657374.x"), std::string(20000, 'a')})
        EXPECT_EQ(Handle(bad).fd, 0) << bad;

    RunLoop loop;
    const auto second = makeKernelSandbox(directories_, "test", loop);
    EXPECT_EQ(
        second->issueReadExtension(test::known(home_.path()), ".", Wait::Allowed).error().code,
        EADDRINUSE);

    stop();
    EXPECT_EQ(Handle(token).fd, 0);
    expectReadOnly(bundle.fd);
    start();
    EXPECT_EQ(Handle(token).fd, 0) << "of an earlier start";
    EXPECT_GT(Handle(issue()).fd, 0);
}

TEST_F(SandboxExtension, SignalsOfItsOwnCostAProcessNothing) {
    static std::atomic<int> handled;
    ::signal(SIGUSR1, [](int) { ++handled; });
    start();
    const std::string token = issue();
    std::atomic<bool> isDone = false;
    std::thread disturber([&, disturbed = pthread_self()] {
        while (!isDone) {
            const int before = handled;
            pthread_kill(disturbed, SIGUSR1);
            while (handled == before && !isDone) std::this_thread::yield();
        }
    });
    for (int i = 0; i < 20; ++i) EXPECT_GT(Handle(token).fd, 0);
    isDone = true;
    disturber.join();
    ::signal(SIGUSR1, SIG_DFL);
}

TEST_F(SandboxExtension, MeansTheVeryFile) {
    start();
    const std::string bundle = issue(), file = issue("bundle/in/file");
    home_.write("elsewhere/file", "text");
    fs::rename(home_.path("bundle/in"), home_.path("bundle/moved"));
    fs::create_directory_symlink(home_.path("bundle/moved"), home_.path("bundle/in"));
    EXPECT_EQ(Handle(file).fd, 0) << "the same file, through a link";
    fs::remove(home_.path("bundle/in"));
    fs::create_directory_symlink(home_.path("elsewhere"), home_.path("bundle/in"));
    EXPECT_EQ(Handle(file).fd, 0);
    fs::remove(home_.path("bundle/in"));
    EXPECT_EQ(Handle(file).fd, 0);
    home_.write("bundle/in/file", "text");
    EXPECT_EQ(Handle(file).fd, 0) << "another file";
    EXPECT_GT(Handle(bundle).fd, 0);
}

TEST_F(SandboxExtension, OnlyTheVeryBundleInItsPlaceHasTokens) {
    start();
    const KnownDirectory bundle = test::known(home_.makeDirectory("way/bundle"));
    const auto failure = [&](const std::string& resource = ".") {
        const auto token = sandbox_->issueReadExtension(bundle, resource, Wait::Allowed);
        return token ? 0 : token.error().code;
    };
    EXPECT_EQ(failure(), 0);
    for (const char* link : {"../../secret", "/proc/self/cwd", "/", "..", "../bundle"}) {
        fs::create_symlink(link, bundle.path + "/link");
        EXPECT_EQ(failure("link"), EACCES) << link;
        fs::remove(bundle.path + "/link");
    }
    EXPECT_EQ(failure("../../secret"), EACCES);

    fs::rename(home_.path("way"), home_.path("moved"));
    EXPECT_EQ(failure(), ENOENT);
    fs::create_directory_symlink("moved", home_.path("way"));
    EXPECT_EQ(failure(), ELOOP) << "the same, through a link above it";
    fs::remove(home_.path("way"));
    home_.makeDirectory("way");
    fs::create_directory_symlink(home_.path(), bundle.path);
    EXPECT_EQ(failure(), ELOOP);
    fs::remove(bundle.path);
    home_.makeDirectory("way/bundle");
    EXPECT_EQ(failure(), ESTALE) << "another directory";
}

/// Exchanges two names over and over while it lives.
class Exchanger {
  public:
    Exchanger(std::string one, std::string other)
        : thread_([this, one = std::move(one), other = std::move(other)] {
              while (!ended_)
                  ::renameat2(AT_FDCWD, one.c_str(), AT_FDCWD, other.c_str(), RENAME_EXCHANGE);
          }) {}
    ~Exchanger() {
        ended_ = true;
        thread_.join();
    }

  private:
    std::atomic<bool> ended_ = false;
    std::thread thread_;
};

TEST_F(SandboxExtension, NoExchangeOfNamesLeadsOutOfTheBundle) {
    const auto tokens = SandboxTokens::make("test");
    const KnownDirectory bundle = test::known(home_.path("bundle"));
    home_.makeDirectory("private");
    const FileIdentity inside = test::known(home_.path("bundle/in")).identity;
    fs::create_directory_symlink("../private", home_.path("bundle/link"));
    fs::create_directory_symlink(home_.path("private"), home_.path("other"));
    const auto run = [&](const std::string& one, const std::string& other, const char* resource,
                         const FileIdentity& only) {
        const Exchanger exchanger(home_.path(one), home_.path(other));
        int issued = 0, refused = 0;
        for (int i = 0; i < 200'000 && (i < 5'000 || issued < 10 || refused < 10); ++i) {
            const auto token = tokens->issue(bundle, resource);
            ++(token ? issued : refused);
            if (!token) continue;
            const auto file = tokens->check(*token);
            ASSERT_TRUE((file->path + "/").starts_with(bundle.path + "/")) << file->path;
            ASSERT_EQ(file->identity, only) << file->path;
        }
        EXPECT_TRUE(issued >= 10 && refused >= 10) << issued << " " << refused;
    };
    run("bundle/in", "bundle/link", "in", inside);
    run("bundle", "other", ".", bundle.identity);
}

void SandboxExtension::tryMounts() {
    if (::unshare(CLONE_NEWNS) != 0) GTEST_SKIP() << "may not mount";
    ASSERT_EQ(::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr), 0);
    const std::string root = home_.path("bundle"), inner = home_.makeDirectory("bundle/inner"),
                      later = home_.makeDirectory("bundle/later");
    ASSERT_EQ(::mount(root.c_str(), root.c_str(), nullptr, MS_BIND, nullptr), 0);
    ASSERT_EQ(::mount(nullptr, root.c_str(), nullptr, MS_SHARED, nullptr), 0);
    ASSERT_EQ(::mount("none", inner.c_str(), "tmpfs", 0, nullptr), 0);
    home_.write("bundle/inner/file", "text");
    start();
    {
        const auto token = [&](const char* resource) {
            return sandbox_->issueReadExtension(test::known(root), resource, Wait::Allowed);
        };
        for (const char* mounted : {"inner", "inner/file"}) {
            const auto refused = token(mounted);
            EXPECT_EQ(refused ? 0 : refused.error().code, EACCES) << mounted;
        }
        const Handle bundle(*token("."));
        expectReadOnly(bundle.fd);
        EXPECT_EQ(openError(bundle.fd, "inner/file", O_RDONLY), 0);
        EXPECT_EQ(openError(bundle.fd, "inner/file", O_RDWR), EROFS);
        mount_attr writable{};
        writable.attr_clr = MOUNT_ATTR_RDONLY;
        EXPECT_NE(::mount_setattr(bundle.fd, "inner", 0, &writable, sizeof writable), 0);
        ASSERT_EQ(::mount("none", later.c_str(), "tmpfs", 0, nullptr), 0);
        home_.write("bundle/later/file", "text");
        EXPECT_EQ(openError(bundle.fd, "later/file", O_RDONLY), ENOENT);
        EXPECT_EQ(openError(bundle.fd, "later/new", O_RDWR | O_CREAT), EROFS);
    }
    stop();
    EXPECT_EQ(::umount2(root.c_str(), MNT_DETACH), 0);
}

TEST_F(SandboxExtension, CoversMountsInTheBundleAndNoneThatFollow) {
    std::thread([this] { tryMounts(); }).join();  // a thread with a namespace of its own
}

TEST_F(SandboxExtension, PeersThatSayNothingOrTooMuchHinderNobody) {
    start();
    const std::string path = *lum::socketPath(directories_, "test.sandbox");
    std::vector<lum::RawPeer> silent;
    for (int i = 0; i < 80; ++i) silent.emplace_back(lum::unixSocket(path, ::connect));
    EXPECT_GT(Handle(issue()).fd, 0);
    EXPECT_TRUE(silent.front().hasEnded()) << "it made room";

    const std::string token = issue();
    for (const std::string& said : {token + "\n\n", token + "\n" + token + "\n",
                                    std::string(100'000, 'a'), std::string("\0\n\xff", 3)}) {
        lum::RawPeer peer(path);
        peer.write(said);
        char answer[8];
        EXPECT_LE(::recv(peer.fd(), answer, sizeof answer, 0), 0) << said.size();
    }
    lum::RawPeer slow(path), gone(path);
    gone.write(token + "\n");
    gone.close();
    for (const char byte : token + "\n") slow.write({&byte, 1});
    char answer[8];
    ASSERT_EQ(::recv(slow.fd(), answer, sizeof answer, 0), 2);
    EXPECT_EQ(std::string_view(answer, 2), "0\n");
}

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr int kManyRounds = 100;  // with their memory, a fork takes long
#else
constexpr int kManyRounds = 1000;
#endif

TEST_F(SandboxExtension, LeavesNothingBehind) {
    std::size_t descriptors = 0, mounted = 0;
    for (const int rounds : {1, kManyRounds}) {
        start();
        const std::string token = issue();
        for (int i = 0; i < rounds; ++i) ASSERT_GT(Handle(token).fd, 0);
        for (int i = 0; i < rounds; i += 10) ASSERT_EQ(Handle(token + "0").fd, 0);
        stop();
        if (rounds > 1) {
            EXPECT_EQ(openDescriptors(), descriptors);
            EXPECT_EQ(mounts(), mounted);
        }
        descriptors = openDescriptors();
        mounted = mounts();
    }
}

TEST_F(SandboxExtension, WhatTakesTooLongEndsAndAKilledProcessIsReplaced) {
    const auto tokens = SandboxTokens::make("test");
    const auto file = tokens->check(*tokens->issue(test::known(home_.path()), "."));
    int ends[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
    const UniqueFd mine(ends[0]), other(ends[1]);
    auto process = MountProcess::make(std::chrono::seconds(20));
    ASSERT_TRUE(process);
    const auto outcomeOf = [&](const SandboxTokens::File& granted) {
        const auto outcome = process->grant(granted, mine.get());
        pollfd told{outcome ? outcome->get() : -1, POLLIN, 0};
        EXPECT_EQ(::poll(&told, 1, 20'000), 1);
        return MountProcess::outcomeAt(*outcome);
    };
    EXPECT_EQ(outcomeOf(*file), 0);
    EXPECT_EQ(outcomeOf({file->path, {}}), ESTALE);
    ::kill(process->pid(), SIGKILL);
    EXPECT_EQ(::waitid(P_PID, static_cast<id_t>(process->pid()), nullptr, WEXITED | WNOWAIT), 0);
    EXPECT_EQ(outcomeOf(*file), 0);

    // What does not answer, where that can be had.
    const UniqueFd fuse(::open("/dev/fuse", O_RDWR | O_CLOEXEC));
    home_.makeDirectory("hung");
    const std::string options =
        "rootmode=40000,user_id=0,group_id=0,fd=" + std::to_string(fuse.get());
    if (::unshare(CLONE_NEWNS) != 0 ||
        ::mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
        ::mount("hung", home_.path("hung").c_str(), "fuse", 0, options.c_str()) != 0)
        return;
    process = MountProcess::make(std::chrono::seconds(1));  // it sees the mount
    EXPECT_EQ(outcomeOf({home_.path("hung/a"), file->identity}), ETIMEDOUT);
    ::umount2(home_.path("hung").c_str(), MNT_DETACH);
}

/// Runs in a child: inside a sandbox, as another user, or in another session.
int runTests(const std::string& filter, std::vector<std::string> command, uid_t user) {
    command.insert(command.end(), {"--gtest_filter=" + filter, "--gtest_also_run_disabled_tests"});
    std::vector<char*> arguments;
    for (std::string& argument : command) arguments.push_back(argument.data());
    arguments.push_back(nullptr);
    const pid_t child = ::fork();
    if (child == 0) {
        if (user == ::geteuid() ||
            (::setgroups(0, nullptr) == 0 && ::setgid(user) == 0 && ::setuid(user) == 0))
            ::execvp(arguments[0], arguments.data());
        ::_exit(127);
    }
    int status = -1;
    ::waitpid(child, &status, 0);
    return status;
}

constexpr const char* kTokenVariable = "TEST_TOKEN";

TEST(SandboxedConsumer, DISABLED_ReadsTheBundle) {
    const std::string token = ::getenv(kTokenVariable);
    const Handle bundle(token);
    ASSERT_GT(bundle.fd, 0);
    EXPECT_EQ(::unshare(CLONE_NEWUSER | CLONE_NEWNS), 0);
    expectReadOnly(bundle.fd);
    EXPECT_EQ(Handle(token.substr(1)).fd, 0);
    EXPECT_FALSE(fs::exists("/tmp")) << "nothing but the sockets is there";
}

TEST_F(SandboxExtension, WorksFromInsideASandbox) {
    start();
    const std::string self = fs::read_symlink("/proc/self/exe");
    std::vector<std::string> command{"bwrap",
                                     "--unshare-all",
                                     "--die-with-parent",
                                     "--proc",
                                     "/proc",
                                     "--ro-bind",
                                     self,
                                     "/test",
                                     "--ro-bind",
                                     home_.path("run/zorvan/services"),
                                     "/run/zorvan/services",
                                     "--setenv",
                                     "XDG_RUNTIME_DIR",
                                     "/run",
                                     "--setenv",
                                     kTokenVariable,
                                     issue()};
    for (const char* libraries : {"/usr/lib", "/lib", "/lib64"})
        command.insert(command.end(), {"--ro-bind-try", libraries, libraries});
    const std::vector<std::string> nothing = {"--", "/test", "--gtest_list_tests"};
    std::vector<std::string> probe = command;
    probe.insert(probe.end(), nothing.begin(), nothing.end());
    if (runTests("none", probe, ::geteuid()) != 0) GTEST_SKIP() << "no sandbox can be made here";
    command.insert(command.end(), {"--", "/test"});
    EXPECT_EQ(runTests("SandboxedConsumer.*", command, ::geteuid()), 0);
}

TEST(SandboxedConsumer, DISABLED_HasItsTurn) {
    EXPECT_GT(Handle(::getenv(kTokenVariable)).fd, 0);
}

void SandboxExtension::tryMountsThatHang() {
    const UniqueFd fuse(::open("/dev/fuse", O_RDWR | O_CLOEXEC));
    if (!fuse || ::unshare(CLONE_NEWNS) != 0 ||
        ::mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0)
        GTEST_SKIP() << "may not mount";
    home_.write("hung/file", "text");
    start();
    const std::string hung = issue("hung/file") + "\n", token = issue();
    const std::string options =
        "rootmode=40000,user_id=0,group_id=0,fd=" + std::to_string(fuse.get());
    if (::mount("hung", home_.path("hung").c_str(), "fuse", 0, options.c_str()) != 0)
        GTEST_SKIP() << "may not mount";
    const std::string path = *lum::socketPath(directories_, "test.sandbox");
    std::vector<lum::RawPeer> waiting;
    for (int i = 0; i < 40; ++i) waiting.emplace_back(lum::unixSocket(path, ::connect)).write(hung);
    const auto begin = std::chrono::steady_clock::now();
    EXPECT_EQ(runTests("SandboxedConsumer.DISABLED_HasItsTurn",
                       {"env", std::string(kTokenVariable) + "=" + token, "setsid", "--wait",
                        fs::read_symlink("/proc/self/exe")},
                       ::geteuid()),
              0);
    EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(3));
    ::umount2(home_.path("hung").c_str(), MNT_DETACH);
    stop();
}

TEST_F(SandboxExtension, MountsThatHangHoldUpThoseOfOneOriginAlone) {
    std::thread([this] { tryMountsThatHang(); }).join();
}

TEST(SandboxExtensionAsUser, WorksToo) {
    if (::geteuid() != 0) GTEST_SKIP() << "this is a plain user already";
    EXPECT_EQ(runTests("SandboxExtension.*", {"/proc/self/exe"}, 65534), 0);
}

}  // namespace
}  // namespace platform
