#include "platform/services/CodeSigning.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>

#include <csignal>
#include <cstring>
#include <functional>

#include "platform/plist/PropertyList.h"
#include "platform/sandbox/Sandbox.h"
#include "platform/system/PinnedDirectory.h"
#include "tests/support/TemporaryDirectory.h"

namespace platform {
namespace {

constexpr const char* kPrivate = "com.orbel.private.zorvan.manager";
constexpr const char* kRestriction = "com.orbel.developer.zorvan.allowedplugins";
constexpr const char* kPlain = "com.example.plain";

constexpr uid_t kUser = 1000;
constexpr uid_t kStranger = 54321;

/// A process that runs `executable` (a copy of cat), has connected to us and waits for input. It
/// ends with this object. `confine` runs in it before; it may answer false when that is not
/// permitted here: then there is no token.
class Peer {
  public:
    using Confine = std::function<bool()>;

    Peer(const test::TemporaryDirectory& files, const std::string& executable,
         const Confine& confine) {
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::strncpy(address.sun_path, files.path("socket").c_str(), sizeof address.sun_path - 1);
        ::unlink(address.sun_path);
        const auto* name = reinterpret_cast<const sockaddr*>(&address);
        const UniqueFd listener(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        int ends[2];
        if (::bind(listener.get(), name, sizeof address) != 0 || ::listen(listener.get(), 1) != 0 ||
            ::pipe2(ends, O_CLOEXEC) != 0)
            return;
        pid_ = ::fork();
        if (pid_ == 0) {
            const int socket = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
            if (::connect(socket, name, sizeof address) == 0 && ::dup2(socket, 0) == 0 && confine())
                ::execl(executable.c_str(), executable.c_str(), nullptr);
            (void)!::write(ends[1], "x", 1);
            ::_exit(1);
        }
        const UniqueFd started(ends[0]);
        ::close(ends[1]);
        char failed;
        if (::read(started.get(), &failed, 1) != 0) return;  // the pipe closes when cat starts
        socket_ = UniqueFd(::accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
        token_ = AuditToken::ofPeer(socket_.get());
    }
    Peer(const Peer&) = delete;
    ~Peer() { end(); }

    void end() {
        if (pid_ <= 0) return;
        ::kill(pid_, SIGKILL);
        ::waitpid(pid_, nullptr, 0);
        pid_ = 0;
    }

    const std::optional<AuditToken>& token() const { return token_; }

  private:
    pid_t pid_ = 0;
    UniqueFd socket_;
    std::optional<AuditToken> token_;
};

bool unconfined() {
    return true;
}

bool inMountNamespace() {
    return ::unshare(CLONE_NEWNS) == 0;
}

bool inUserNamespace() {
    return ::unshare(CLONE_NEWUSER) == 0;
}

bool withoutNewPrivileges() {
    return ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0;
}

/// A filter that allows everything is a filter.
bool withFilter() {
    sock_filter allow{BPF_RET | BPF_K, 0, 0, SECCOMP_RET_ALLOW};
    sock_fprog program{1, &allow};
    return ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
           ::prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program) == 0;
}

class Tool : public testing::Test {
  protected:
    static void SetUpTestSuite() { ::umask(022); }

    Tool() : tool_(files_.makeDirectory("bin") + "/tool") {
        std::filesystem::copy_file("/bin/cat", tool_);
    }

    void writeEntitlements(const std::string& relative, const Value& plain = "yes") const {
        files_.write(relative,
                     *writeXmlPropertyList(Dictionary{
                         {kPrivate, true}, {kRestriction, Dictionary()}, {kPlain, plain}}));
    }

    /// The entitlements that a new process of the tool holds: p(rivate), r(estriction), n(ormal).
    /// None when it could not be started so.
    std::optional<std::string> held(const Peer::Confine& confine = unconfined) const {
        const Peer peer(files_, tool_, confine);
        if (!peer.token()) return std::nullopt;
        const auto task = makeFileCodeSigning()->makeTask(*peer.token());
        std::string result;
        for (const char* name : {kPrivate, kRestriction, kPlain}) {
            const CodeSigningTask::Answer answer = task->entitlement(name);
            EXPECT_FALSE(answer.error);
            if (answer.value) result += name == kPrivate ? 'p' : name == kRestriction ? 'r' : 'n';
        }
        return result;
    }

    test::TemporaryDirectory files_;
    const std::string tool_;
};

TEST_F(Tool, SandboxIsWhatConfinesAProcess) {
    EXPECT_FALSE(isSandboxed(*AuditToken::ofSelf()));
    Peer free(files_, tool_, unconfined);
    ASSERT_TRUE(free.token());
    EXPECT_FALSE(isSandboxed(*free.token()));
    free.end();
    EXPECT_TRUE(isSandboxed(*free.token())) << "it is gone";

    const bool filtered = ::prctl(PR_GET_SECCOMP) != 0;
    for (bool (*confine)() : {inMountNamespace, inUserNamespace, withFilter}) {
        const Peer peer(files_, tool_, confine);
        if (!peer.token()) continue;  // not permitted here
        const bool counts = confine != withFilter || !filtered;
        EXPECT_EQ(isSandboxed(*peer.token()), counts);
    }
}

TEST_F(Tool, EntitlementsLieBesideABareToolOrInItsBundle) {
    EXPECT_EQ(held(), "") << "without a file";
    writeEntitlements("bin/tool.entitlements");
    EXPECT_EQ(held(), "prn");
    writeEntitlements("bin/Info.plist");
    EXPECT_EQ(held(), "") << "the bundle has none";
    std::filesystem::remove(files_.path("bin/Info.plist"));
    std::filesystem::create_symlink("/nowhere", files_.path("bin/Info.plist"));
    EXPECT_EQ(held(), "") << "a bundle wherever its list leads";
    writeEntitlements("bin/Entitlements.plist");
    EXPECT_EQ(held(), "prn");

    const Peer peer(files_, tool_, unconfined);
    const auto task = makeFileCodeSigning()->makeTask(*peer.token());
    EXPECT_EQ(task->entitlement(kPlain).value, Value("yes"));
    writeEntitlements("bin/Entitlements.plist", "later");
    EXPECT_EQ(task->entitlement(kPlain).value, Value("yes")) << "read once";
    EXPECT_EQ(task->entitlement("com.example.other").value, std::nullopt);
}

TEST_F(Tool, WithoutEntitlementsItIsLookedAtAtOnce) {
    const auto isAtOnce = [&] {
        const Peer peer(files_, tool_, unconfined);
        const auto folder = peer.token()->openFolderAtOnce();
        return folder && makeFileCodeSigning()->makeTaskAtOnce(*peer.token(), folder->get());
    };
    writeEntitlements("bin/Entitlements.plist");
    EXPECT_TRUE(isAtOnce()) << "it is in no bundle";
    writeEntitlements("bin/Info.plist");
    EXPECT_FALSE(isAtOnce());
    std::filesystem::remove(files_.path("bin/Entitlements.plist"));
    writeEntitlements("bin/tool.entitlements");
    EXPECT_TRUE(isAtOnce()) << "it is in a bundle";
    std::filesystem::remove(files_.path("bin/Info.plist"));
    EXPECT_FALSE(isAtOnce());

    const Peer peer(files_, tool_, unconfined);
    const std::string folder = files_.path("bin"), away = files_.path("away");
    std::filesystem::rename(folder, away);
    std::filesystem::create_directory_symlink(away, folder);
    EXPECT_FALSE(peer.token()->openFolderAtOnce()) << "a link may lead anywhere";
    std::filesystem::remove(folder);
    files_.write("bin/tool", "another");
    EXPECT_FALSE(peer.token()->openFolderAtOnce());
    EXPECT_EQ(peer.token()->executablePath(), std::nullopt);
}

TEST_F(Tool, OnlyTheRestrictionCountsInFilesThatOthersMayWrite) {
    writeEntitlements("bin/tool.entitlements");
    const std::string file = files_.path("bin/tool.entitlements");
    const std::string folder = files_.path("bin");
    for (const auto& [path, mode] : {std::pair{file, 0620},
                                     {file, 0602},
                                     {folder, 0775},
                                     {folder, 0757},
                                     {files_.path(), 0770}}) {
        ::chmod(path.c_str(), static_cast<mode_t>(mode));
        EXPECT_EQ(held(), "r") << path;
        ::chmod(path.c_str(), 0700);
        EXPECT_EQ(held(), "prn") << path;
    }
    ::chmod(folder.c_str(), 01777);
    EXPECT_EQ(held(), "prn") << "sticky";
    if (::geteuid() != 0) return;
    for (const std::string& path : {file, folder}) {
        ASSERT_EQ(::chown(path.c_str(), kStranger, 0), 0);
        EXPECT_EQ(held(), "r") << path;
        ASSERT_EQ(::chown(path.c_str(), 0, 0), 0);
    }
}

TEST_F(Tool, ConfinedProcessesHoldNothingPrivateAndOnlyWhatRootGave) {
    writeEntitlements("bin/tool.entitlements");
    const bool root = ::geteuid() == 0;
    for (bool (*confine)() : {inMountNamespace, inUserNamespace}) {
        const std::string expected = root ? "rn" : "r";
        EXPECT_EQ(held(confine).value_or(expected), expected);
    }
    if (::prctl(PR_GET_SECCOMP) == 0) {
        EXPECT_EQ(held(withFilter), root ? "rn" : "r");
    }
    if (::prctl(PR_GET_NO_NEW_PRIVS, 0, 0, 0, 0) == 0) {
        EXPECT_EQ(held(withoutNewPrivileges), "rn") << "rules that do not show need that";
    }
}

TEST_F(Tool, UnreadableEntitlementsAreAnErrorAndDenyEverything) {
    const auto expectError = [this](const char* what) {
        const Peer peer(files_, tool_, unconfined);
        ASSERT_TRUE(peer.token());
        const auto task = makeFileCodeSigning()->makeTask(*peer.token());
        EXPECT_TRUE(task->entitlement(kPlain).error) << what;
        for (const char* name : {kPrivate, kPlain}) {
            const CodeSigningTask::Answer answer = task->entitlement(name);
            EXPECT_EQ(answer.value, std::nullopt) << what;
            EXPECT_FALSE(answer.error) << "told once";
        }
        const CodeSigningTask::Answer restriction = task->entitlement(kRestriction);
        ASSERT_TRUE(restriction.value) << what;
        EXPECT_EQ(restriction.value->dictionary(), nullptr) << what;
    };
    const std::string file = files_.write("bin/tool.entitlements", "garbage");
    expectError("garbage");
    files_.write("bin/tool.entitlements", *writeXmlPropertyList(Array{kPlain}));
    expectError("a list");
    std::filesystem::remove(file);
    writeEntitlements("elsewhere");
    std::filesystem::create_symlink("../elsewhere", file);
    expectError("a link");
    std::filesystem::remove(file);
    ASSERT_EQ(::mkfifo(file.c_str(), 0600), 0);
    expectError("a pipe");
}

TEST_F(Tool, AnExecutableThatIsAnotherOneAtItsPathHoldsNothing) {
    writeEntitlements("bin/tool.entitlements");
    const auto covered = [this] {
        const std::string other = files_.path("other");
        std::filesystem::copy_file("/bin/cat", other);
        return inMountNamespace() && ::mount("", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
               ::mount(other.c_str(), tool_.c_str(), nullptr, MS_BIND, nullptr) == 0;
    };
    EXPECT_EQ(held(covered).value_or(""), "");
}

TEST(PinnedDirectory, TrustsOwnersUnlessOthersMayWrite) {
    struct Case {
        uid_t owner;
        mode_t mode;
        FileTrust trust;
    };
    for (const auto& [owner, mode, trust] : {
             Case{0, S_IFDIR | 0755, FileTrust::Root},
             {0, S_IFDIR | 01777, FileTrust::Root},
             {0, S_IFDIR | 0775, FileTrust::Others},
             {kUser, S_IFDIR | 0700, FileTrust::User},
             {kUser, S_IFDIR | 01777, FileTrust::User},
             {kUser, S_IFREG | 0644, FileTrust::User},
             {kUser, S_IFREG | 01664, FileTrust::Others},
             {kUser, S_IFREG | 0646, FileTrust::Others},
             {kStranger, S_IFDIR | 01755, FileTrust::Others},
             {kStranger, S_IFREG | 0600, FileTrust::Others},
         }) {
        struct stat status {};
        status.st_uid = owner;
        status.st_mode = mode;
        EXPECT_EQ(trustOf(status, kUser), trust) << owner << " " << std::oct << mode;
    }
}

TEST(PinnedDirectory, KeepsToTheVeryFileAndFollowsNoLinks) {
    const test::TemporaryDirectory files;
    files.write("a/b/file", "old");
    const auto directory = PinnedDirectory::open(files.path("a/b"), ::geteuid());
    ASSERT_TRUE(directory);
    const auto file = directory->file("file");
    ASSERT_TRUE(file);
    std::filesystem::rename(files.path("a/b/file"), files.path("a/b/moved"));
    files.write("a/b/file", "new");
    EXPECT_EQ(*file->read(100), "old");
    EXPECT_EQ(file->read(2).error().code, EFBIG);
    std::filesystem::rename(files.path("a"), files.path("c"));
    EXPECT_EQ(*directory->file("file")->read(100), "new");

    std::filesystem::create_directory_symlink("c", files.path("a"));
    EXPECT_EQ(PinnedDirectory::open(files.path("a/b"), ::geteuid()).error().code, ENOTDIR);
    EXPECT_EQ(PinnedDirectory::open(files.path("a/none"), ::geteuid()).error().code, ENOTDIR);
    EXPECT_EQ(PinnedDirectory::open(files.path("c/none"), ::geteuid()).error().code, ENOENT);
    EXPECT_EQ(directory->file("none").error().code, ENOENT);
    EXPECT_EQ(directory->file("..").error().code, EINVAL);

    ::chmod(files.path("c").c_str(), 0777);
    const auto open = PinnedDirectory::open(files.path("c/b"), ::geteuid());
    EXPECT_EQ(open->file("file")->trust, FileTrust::Others);
    EXPECT_EQ(open->file("file")->weakest, files.path("c"));
}

}  // namespace
}  // namespace platform
