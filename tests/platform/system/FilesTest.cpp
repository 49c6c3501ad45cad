#include "platform/system/Files.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sys/file.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <csignal>
#include <cstddef>
#include <filesystem>
#include <fstream>
#include <thread>

#include "platform/system/FileStamp.h"
#include "platform/system/UniqueFd.h"

namespace platform {
namespace {

namespace fs = std::filesystem;

class Files : public testing::Test {
  protected:
    Files() {
        std::string name = testing::TempDir() + "filesXXXXXX";
        directory = ::mkdtemp(name.data());
    }
    ~Files() override { fs::remove_all(directory); }

    std::string at(const std::string& name) const { return joinPath(directory, name); }
    void put(const std::string& name, const std::string& text) { std::ofstream(at(name)) << text; }
    std::string text(const std::string& name) { return *readFile(at(name), 1 << 20); }
    mode_t mode(const std::string& name) {
        struct stat status {};
        return ::lstat(at(name).c_str(), &status) == 0 ? status.st_mode & 07777 : 0;
    }
    auto count() { return std::distance(fs::directory_iterator(directory), {}); }

    std::string directory;
};

TEST_F(Files, ReadsRegularFilesWithinTheLimitOnly) {
    put("a", "12345");
    EXPECT_EQ(*readFile(at("a"), 5), "12345");
    EXPECT_EQ(readFile(at("a"), 4).error().code, EFBIG);
    EXPECT_EQ(readFile(at("b"), 4).error().code, ENOENT);
    EXPECT_EQ(readFile(directory, 4).error().code, EINVAL);
    EXPECT_EQ(readFile("/dev/null", 4).error().code, EINVAL);
    EXPECT_EQ(readFile(at("a") + std::string("\0b", 2), 9).error().code, EINVAL);
    ASSERT_EQ(::mkfifo(at("pipe").c_str(), 0600), 0);
    EXPECT_EQ(readFile(at("pipe"), 4).error().code, EINVAL);
    // Files of the kernel say that they are empty.
    EXPECT_FALSE(readFile("/proc/self/status", 1 << 20)->empty());
    EXPECT_EQ(readFile("/proc/self/status", 10).error().code, EFBIG);

    int dirfd = ::open(directory.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
    EXPECT_EQ(*readFileAt(dirfd, "a", 5), "12345");
    ::close(dirfd);
}

TEST_F(Files, ReplacesTheFileAndKeepsItsMode) {
    EXPECT_FALSE(writeFileAtomically(at("new"), "one"));
    EXPECT_EQ(mode("new"), 0600U);
    ::chmod(at("new").c_str(), 0440);
    std::ifstream old(at("new"));
    EXPECT_FALSE(writeFileAtomically(at("new"), std::string(100'000, 'x')));
    EXPECT_EQ(mode("new"), 0440U);
    EXPECT_EQ(text("new").size(), 100'000U);
    EXPECT_EQ(std::string(std::istreambuf_iterator<char>(old), {}), "one");

    // The temporary name owes nothing to the file's own.
    for (const auto& name :
         {std::string(255, 'n'), std::string(".hidden"), std::string("a b%{}\n")}) {
        EXPECT_FALSE(writeFileAtomically(at(name), name));
        EXPECT_EQ(text(name), name);
    }
    EXPECT_EQ(count(), 4);
}

TEST_F(Files, ReplacesWhatALinkLeadsTo) {
    fs::create_directory(at("sub"));
    fs::create_symlink("sub/target", at("link"));
    for (const char* content : {"new", "replaced"}) {
        EXPECT_FALSE(writeFileAtomically(at("link"), content));
        EXPECT_TRUE(fs::is_symlink(at("link")));
        EXPECT_EQ(text("sub/target"), content);
    }
    fs::create_symlink("loop", at("loop"));
    EXPECT_EQ(writeFileAtomically(at("loop"), "x")->code, ELOOP);
}

TEST_F(Files, AFailedWriteLeavesEverythingAsItWas) {
    put("a", "old");
    ASSERT_EQ(::mkfifo(at("pipe").c_str(), 0600), 0);
    fs::create_directory(at("sub"));
    EXPECT_EQ(writeFileAtomically(at("pipe"), "x")->code, EINVAL);
    EXPECT_EQ(writeFileAtomically(at("sub"), "x")->code, EINVAL);
    EXPECT_EQ(writeFileAtomically(at("absent/a"), "x")->code, ENOENT);
    EXPECT_EQ(writeFileAtomically(at("a/b"), "x")->code, ENOTDIR);
    EXPECT_TRUE(writeFileAtomically("", "x"));

    // A full disk, as a limit of this process.
    struct rlimit before {};
    ::getrlimit(RLIMIT_FSIZE, &before);
    auto handler = std::signal(SIGXFSZ, SIG_IGN);
    struct rlimit small = before;
    small.rlim_cur = 1000;
    ::setrlimit(RLIMIT_FSIZE, &small);
    auto error = writeFileAtomically(at("a"), std::string(5000, 'x'));
    ::setrlimit(RLIMIT_FSIZE, &before);
    std::signal(SIGXFSZ, handler);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code, EFBIG);
    EXPECT_EQ(text("a"), "old");
    EXPECT_EQ(count(), 3);
}

TEST_F(Files, ACrashWhileWritingLeavesNothingBehind) {
    // Not every file system has files without names.
    const UniqueFd nameless(::open(directory.c_str(), O_TMPFILE | O_WRONLY | O_CLOEXEC, 0600));
    if (!nameless) GTEST_SKIP();
    put("a", "old");
    struct rlimit small {};
    small.rlim_cur = small.rlim_max = 1000;
    EXPECT_EXIT(::setrlimit(RLIMIT_FSIZE, &small);
                writeFileAtomically(at("a"), std::string(5000, 'x'));
                , testing::KilledBySignal(SIGXFSZ), "");
    EXPECT_EQ(text("a"), "old");
    EXPECT_EQ(count(), 1);
}

TEST_F(Files, LeftoversOfACrashAreTold) {
    put("a", "old");
    // Ended between the moment that the new file has a name and the one that it has the right one.
    const auto writeAndDie = [this](const std::string& name) {
        sock_filter rules[] = {
            BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
            BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_renameat, 0, 1),
            BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_KILL_PROCESS),
            BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
        };
        const sock_fprog program{std::size(rules), rules};
        ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0);
        ::prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program);
        writeFileAtomically(at(name), "new");
    };
    const auto crash = [&](const std::string& name) {
        EXPECT_EXIT(writeAndDie(name), testing::KilledBySignal(SIGSYS), "");
    };
    crash("a");
    ASSERT_EQ(count(), 2);
    std::string leftover;
    for (const auto& entry : fs::directory_iterator(directory))
        if (entry.path().filename() != "a") leftover = entry.path().filename();
    put(leftover.substr(0, leftover.size() - 1), "another's");
    put(leftover + "0", "another's");
    crash("b");
    {
        const UniqueFd writer(::open(at(leftover).c_str(), O_WRONLY | O_CLOEXEC));
        ::flock(writer.get(), LOCK_EX);
        removeLeftovers(at("a"));
        EXPECT_EQ(count(), 5) << "somebody is writing it";
    }
    fs::create_symlink("a", at("link"));
    removeLeftovers(at("link"));
    EXPECT_FALSE(fs::exists(at(leftover)));
    EXPECT_EQ(count(), 5);
    EXPECT_EQ(text("a"), "old");
}

TEST_F(Files, WhatIsSyncedLaterLeavesWhatWasSynced) {
    const auto kept = [this] {
        const auto file = lastSyncedFile(at("a"));
        return file ? *readFile(*file, 9) : "none";
    };
    for (const char* content : {"1", "2", "3"})
        EXPECT_FALSE(writeFileAtomically(at("a"), content, Sync::Later));
    EXPECT_EQ(kept(), "1");
    fs::create_symlink("a", at("link"));
    EXPECT_TRUE(lastSyncedFile(at("link")));
    EXPECT_FALSE(syncFile(at("link")));
    EXPECT_EQ(kept(), "none");
    EXPECT_FALSE(writeFileAtomically(at("a"), "4", Sync::Later));
    EXPECT_EQ(kept(), "3");
    EXPECT_FALSE(writeFileAtomically(at("a"), "5"));
    EXPECT_EQ(kept(), "none");
    EXPECT_EQ(text("a"), "5");
    EXPECT_EQ(count(), 2);
}

TEST(FileStamps, VouchForNothingUntilTheyHaveSettled) {
    const std::string file = testing::TempDir() + "stamped";
    std::string fresh, again, settled;
    std::ofstream(file) << "text";
    FileStamp::of(file).appendTo(fresh);
    FileStamp::of(file).appendTo(again);
    EXPECT_NE(fresh, again);
    while (!FileStamp::of(file).settled) std::this_thread::yield();
    again.clear();
    FileStamp::of(file).appendTo(settled);
    FileStamp::of(file).appendTo(again);
    EXPECT_EQ(settled, again);
    EXPECT_NE(settled, fresh);
    EXPECT_TRUE(FileStamp::from(settled).isLike(FileStamp::from(fresh)));
    EXPECT_FALSE(FileStamp::from(settled).isLike(FileStamp::of("/")));
    fs::remove(file);
    EXPECT_FALSE(FileStamp::from(settled).isLike(FileStamp::of(file)));
}

TEST_F(Files, MakesMissingDirectories) {
    EXPECT_FALSE(makeDirectories(at("x/y//z/"), 0700));
    EXPECT_EQ(mode("x"), 0700U);
    EXPECT_EQ(mode("x/y/z"), 0700U);
    EXPECT_FALSE(makeDirectories(at("x/y/z"), 0700));
    EXPECT_FALSE(makeDirectories("/", 0700));
    put("file", "");
    EXPECT_EQ(makeDirectories(at("file"), 0700)->code, ENOTDIR);
    EXPECT_EQ(makeDirectories(at("file/sub"), 0700)->code, ENOTDIR);
    EXPECT_TRUE(makeDirectories("", 0700));
}

TEST_F(Files, PathsAndNames) {
    fs::create_symlink(directory, at("self"));
    EXPECT_EQ(canonicalPath(at("self/./self/..") + "/" + fs::path(directory).filename().string()),
              fs::canonical(directory).string());
    EXPECT_EQ(canonicalPath(at("absent")), std::nullopt);
    EXPECT_EQ(canonicalPath(directory, fs::canonical(directory).string().size()), std::nullopt);

    for (auto name : {"a", "a.b", "a b", "..a"})
        EXPECT_EQ(isSafeName(name), name[0] != '.') << name;
    EXPECT_TRUE(isSafeName(std::string(255, 'a')));
    for (const auto& name : {std::string(), std::string("."), std::string("a/b"),
                             std::string("a\0", 2), std::string(256, 'a')})
        EXPECT_FALSE(isSafeName(name)) << name;

    struct Case {
        const char* path;
        const char* parent;
        const char* last;
    };
    for (auto [path, parent, last] :
         {Case{"/a/b/", "/a", "b"}, Case{"/a", "/", "a"}, Case{"a", ".", "a"},
          Case{"a//b", "a", "b"}, Case{"/", "/", ""}, Case{"//a", "/", "a"}, Case{"", ".", ""}}) {
        EXPECT_EQ(parentPath(path), parent) << path;
        EXPECT_EQ(lastPathComponent(path), last) << path;
    }
    EXPECT_EQ(joinPath("/a/", "b"), "/a/b");
    EXPECT_EQ(joinPath("/a", "b"), "/a/b");
}

}  // namespace
}  // namespace platform
