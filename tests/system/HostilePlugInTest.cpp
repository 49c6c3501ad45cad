// What a plug-in tries that wants more than it was given. It fails at it, and others do not notice.

#include <fcntl.h>
#include <linux/sched.h>
#include <netinet/in.h>
#include <sys/ioctl.h>
#include <sys/ptrace.h>
#include <sys/socket.h>
#include <sys/syscall.h>

#include <csignal>
#include <cstdint>
#include <filesystem>

#include "Zorvan/ZRPlugInProcess.h"
#include "platform/plist/PropertyList.h"
#include "tests/system/PlugInTest.h"

namespace test {

namespace {

using namespace std::string_literals;
using testing::AllOf;
using testing::Gt;
using testing::IsEmpty;
using testing::Le;

/// A daemon, and one plug-in of an application that does what it is told
/// (tests/plugin/hostile.cpp).
class HostilePlugIn : public SystemTest {
  protected:
    void SetUp() override {
        NEEDS_BUBBLEWRAP();
        Dictionary hostile = info(kIdentifier);
        hostile.set("QFBundleExecutable", "run");
        writePlugIn(bundle_, hostile);
        home_.write(bundle_ + "/Entitlements.plist",
                    *platform::writeXmlPropertyList(
                        Dictionary{{"com.orbel.developer.network-client", true}}));
        std::filesystem::copy_file(HOSTILE_PLUGIN, home_.path(bundle_ + "/run"));
        ::setenv("ZR_LOG", "info", 1);
        start();
        ::unsetenv("ZR_LOG");
        const auto found = forms({{"VXExtensionIdentifier", kIdentifier}});
        const auto uuid = platform::Uuid::parse(*found.at(0).find("uuid")->string()).value();
        EXPECT_EQ(
            errorOf(ask([&](auto& client, auto& reply) { client.readyPlugIns({uuid}, 0, reply); })),
            "");
        plugIn_ = startPlugIn();
        ASSERT_TRUE(plugIn_) << zrd_->err();
    }
    void TearDown() override {
        plugIn_.reset();
        SystemTest::TearDown();
    }

    std::unique_ptr<zorvan::ZRPlugInProcess> startPlugIn() {
        std::optional<zorvan::ZRError> error;
        return zorvan::ZRPlugInProcess::start(nullptr, home_.path(bundle_ + "/run"), {}, error);
    }
    /// What the plug-in answers to a request.
    std::string tell(const std::string& request) {
        const std::string line = request + "\n";
        ::send(plugIn_->connection(), line.data(), line.size(), MSG_NOSIGNAL);
        std::string answer;
        for (char byte = 0; ::recv(plugIn_->connection(), &byte, 1, 0) == 1 && byte != '\0';)
            answer.push_back(byte);
        return answer;
    }
    std::string call(long number, std::vector<std::uint64_t> arguments = {}) {
        std::string request = "call " + std::to_string(number);
        for (const std::uint64_t argument : arguments) request += " " + std::to_string(argument);
        return tell(request);
    }
    std::filesystem::path busyFolder() const {
        return home_.path("run/zorvan/tenurd/") + kIdentifier;
    }

    static constexpr const char* kIdentifier = "com.test.hostile";
    const std::string bundle_ = plugInPath("A", "hostile");
    std::unique_ptr<zorvan::ZRPlugInProcess> plugIn_;
};

TEST_F(HostilePlugIn, SeesOfTheDaemonsSocketsTheTokenBrokersAlone) {
    EXPECT_EQ(tell("sh cd $XDG_RUNTIME_DIR/zorvan/services && echo *"),
              "com.orbel.zorvan.zrd.sandbox\n");
}

TEST_F(HostilePlugIn, IsRefusedSystemCallsThatNoPlugInNeeds) {
    const std::pair<const char*, long> calls[] = {
        {"ptrace", SYS_ptrace},
        {"process_vm_readv", SYS_process_vm_readv},
        {"process_vm_writev", SYS_process_vm_writev},
        {"kcmp", SYS_kcmp},
        {"pidfd_getfd", SYS_pidfd_getfd},
        {"add_key", SYS_add_key},
        {"request_key", SYS_request_key},
        {"keyctl", SYS_keyctl},
        {"bpf", SYS_bpf},
        {"perf_event_open", SYS_perf_event_open},
        {"userfaultfd", SYS_userfaultfd},
        {"io_uring_setup", SYS_io_uring_setup},
        {"io_uring_enter", SYS_io_uring_enter},
        {"io_uring_register", SYS_io_uring_register},
        {"kexec_load", SYS_kexec_load},
        {"init_module", SYS_init_module},
        {"finit_module", SYS_finit_module},
        {"mount", SYS_mount},
        {"umount2", SYS_umount2},
        {"pivot_root", SYS_pivot_root},
        {"fsopen", SYS_fsopen},
        {"fsmount", SYS_fsmount},
        {"fsconfig", SYS_fsconfig},
        {"fspick", SYS_fspick},
        {"move_mount", SYS_move_mount},
        {"open_tree", SYS_open_tree},
        {"mount_setattr", SYS_mount_setattr},
        {"unshare", SYS_unshare},
        {"setns", SYS_setns},
        {"syslog", SYS_syslog},
        {"acct", SYS_acct},
        {"quotactl", SYS_quotactl},
        {"swapon", SYS_swapon},
        {"reboot", SYS_reboot},
        {"memfd_secret", SYS_memfd_secret},
#ifdef SYS_modify_ldt
        {"modify_ldt", SYS_modify_ldt},
#endif
    };
    // Some of them would be refused for want of rights, too.
    EXPECT_EQ(tell("sh grep Seccomp: /proc/self/status"), "Seccomp:\t2\n");
    for (const auto& [name, number] : calls) EXPECT_EQ(call(number), "EPERM") << name;
    EXPECT_EQ(call(SYS_clone3), "ENOSYS") << "so that programs fall back";
}

/// Arguments count at 32 bits where the kernel takes no more of them.
TEST_F(HostilePlugIn, IsRefusedArgumentsOfOtherSystemCalls) {
    constexpr std::uint64_t kHigh = 0x100000000;
    for (const std::uint64_t flag :
         {CLONE_NEWUSER, CLONE_NEWNS, CLONE_NEWPID, CLONE_NEWNET, CLONE_NEWIPC, CLONE_NEWUTS,
          CLONE_NEWCGROUP, CLONE_NEWUSER | CLONE_NEWNS})
        EXPECT_EQ(call(SYS_clone, {flag | SIGCHLD}), "EPERM") << flag;
    for (const std::uint64_t high : {std::uint64_t{0}, kHigh}) {
        EXPECT_EQ(call(SYS_ioctl, {0, TIOCSTI | high}), "EPERM");
        EXPECT_EQ(call(SYS_fcntl, {0, F_SETLEASE | high, F_RDLCK}), "EPERM");
        EXPECT_EQ(call(SYS_ioctl, {0, TIOCLINUX | high}), "EPERM");
        for (const std::uint64_t family : {AF_NETLINK, AF_PACKET, AF_KEY, AF_ALG, AF_VSOCK, AF_TIPC,
                                           AF_BLUETOOTH, 45, 64, 1 << 20}) {
            EXPECT_EQ(call(SYS_socket, {family | high, SOCK_DGRAM}), "EPERM") << family;
            EXPECT_EQ(call(SYS_socketpair, {family | high, SOCK_DGRAM}), "EPERM") << family;
        }
        for (const std::uint64_t persona : {0x0040000, 0x0400000, 8, 0x7fffffff})
            EXPECT_EQ(call(SYS_personality, {persona | high}), "EPERM") << persona;
    }
    EXPECT_EQ(call(SYS_personality, {0xffffffff}), "ok") << "the question";
    for (const std::uint64_t family : {AF_INET, AF_INET6})
        EXPECT_EQ(call(SYS_socket, {family, SOCK_DGRAM}), "ok") << family;
    for (const std::uint64_t protocol : {IPPROTO_MPTCP, IPPROTO_SCTP, IPPROTO_UDPLITE})
        EXPECT_EQ(call(SYS_socket, {AF_INET, SOCK_STREAM, protocol}), "EPERM") << protocol;
    EXPECT_EQ(call(SYS_socket, {AF_INET, SOCK_STREAM, IPPROTO_TCP}), "ok");
    EXPECT_EQ(call(SYS_socket, {AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC}), "ok");
    EXPECT_EQ(call(SYS_socket, {AF_UNIX, SOCK_SEQPACKET}), "ok");
    for (const std::uint64_t type : {SOCK_DGRAM | SOCK_CLOEXEC, SOCK_RAW | SOCK_NONBLOCK}) {
        EXPECT_EQ(call(SYS_socket, {AF_UNIX, type}), "EPERM") << type;
        EXPECT_EQ(call(SYS_socketpair, {AF_UNIX, type}), "EPERM") << type;
    }
    EXPECT_EQ(call(SYS_ioctl, {0, TIOCGWINSZ}), "ENOTTY");
}

TEST_F(HostilePlugIn, IsRefusedThemInOtherArchitecturesToo) {
#ifdef __x86_64__
    if (tell("call32 20") == "none") GTEST_SKIP() << "this kernel runs no programs for 32 bits";
    EXPECT_EQ(tell("call32 20"), "ok") << "getpid";
    for (const int number : {26 /* ptrace */, 286 /* add_key */, 310 /* unshare */, 21 /* mount */,
                             425 /* io_uring_setup */, 123 /* modify_ldt */})
        EXPECT_EQ(tell("call32 " + std::to_string(number)), "EPERM") << number;
    EXPECT_EQ(tell("call32 435"), "ENOSYS") << "clone3";
    EXPECT_EQ(tell("call32 359 16 2"), "EPERM") << "socket, netlink";
    EXPECT_EQ(tell("call32 359 1 1"), "ok") << "socket, unix, stream";
    EXPECT_EQ(tell("call32 359 1 2"), "EPERM") << "socket, unix, datagrams";
    // Many calls in one, whose arguments lie in memory: 1 is "socket", 9 is "send".
    EXPECT_EQ(tell("call32 102 1"), "EPERM");
    EXPECT_EQ(tell("call32 102 9"), "EFAULT");
    constexpr long kX32 = 0x40000000;
    EXPECT_EQ(call(kX32 + 521), "EPERM") << "ptrace";
    EXPECT_EQ(call(kX32 + 250), "EPERM") << "keyctl";
#endif
}

TEST_F(HostilePlugIn, DoesNotOutliveTheDaemon) {
    EXPECT_EQ(tell("trace-first"), "EPERM");
    EXPECT_EQ(tell("write-first"), "EROFS");
    EXPECT_EQ(tell("sh grep -c Seccomp:.2 /proc/1/status"), "1\n");
    EXPECT_EQ(tell("sh setsid sh -c 'trap \"\" TERM HUP; sleep 1000' >/dev/null 2>&1 & echo"),
              "\n");
    stop(SIGKILL);
    // All that it started holds the connection open.
    EXPECT_TRUE(hasClosed(*plugIn_));
}

TEST_F(HostilePlugIn, HasSoManyProcessesAndDescriptorsAndNoMore) {
    EXPECT_EQ(tell("descriptors"), "512");
    EXPECT_EQ(tell("watch-queues"), "16");
    EXPECT_EQ(tell("sh ls /dev/pts"), "") << "terminals, of which all sandboxes share so many";
    EXPECT_EQ(tell("sh ulimit -c; ulimit -Hc; ulimit -n"), "0\n0\n512\n");
    if (::geteuid() == 0) GTEST_SKIP() << "without a group, root has as many processes as it likes";
    EXPECT_THAT(std::stoi(tell("fork-bomb 2000")), AllOf(Gt(100), Le(512)));
    EXPECT_EQ(tell("sh echo still here"), "still here\n");
}

TEST_F(HostilePlugIn, FillsNeitherMemoryWithFilesNorTheRuntimeDirectory) {
    for (const std::string folder : {"/dev/shm", "/tmp"}) {
        const std::string file = folder + "/much";
        EXPECT_EQ(tell("sh head -c 200000000 /dev/zero >" + file + " 2>/dev/null; wc -c <" + file +
                       "; rm " + file),
                  "67108864\n");
    }
    for (const std::string folder :
         {"/", "/dev", "/run", "/proc", "$XDG_RUNTIME_DIR/zorvan/tenurd/com.test.hostile"})
        EXPECT_EQ(tell("sh echo >" + folder + "/x && echo wrote"), "") << folder;
}

TEST_F(HostilePlugIn, WritesSoMuchIntoTheLogAndNoMore) {
    EXPECT_EQ(tell("sh timeout 20 yes >&2; echo $?"), "141\n") << "SIGPIPE";
    EXPECT_EQ(tell("sh timeout 20 yes >&2; echo $?"), "141\n");
    EXPECT_EQ(zrd_->errLines("writes more than is logged"), 1u);
    EXPECT_THAT(match(), testing::ElementsAre("com.test.hostile 1"));
}

TEST_F(HostilePlugIn, HasItsAssertionsToItself) {
    auto other = startPlugIn();
    ASSERT_TRUE(other);
    const std::string folder = "$XDG_RUNTIME_DIR/zorvan/tenurd/";
    EXPECT_EQ(tell("sh cd " + folder + " && find . -type f"), "./com.test.hostile/busy\n");
    EXPECT_EQ(tell("sh rm -f " + folder + "com.test.hostile/busy; ls " + folder + kIdentifier),
              "busy\n");
    const auto folders = [&] {
        return std::distance(std::filesystem::directory_iterator(busyFolder()), {});
    };
    EXPECT_EQ(folders(), 2);
    other.reset();
    EXPECT_EQ(folders(), 1);
    stop(SIGKILL);
    EXPECT_EQ(folders(), 1) << "nobody was there to remove it";
    start();
    EXPECT_TRUE(waitUntil([&] { return !std::filesystem::exists(busyFolder()); }));
}

/// Its entitlements ask for one, and its profile may have it.
TEST_F(HostilePlugIn, HasNoNetworkWhenItsHostIsConfinedOrHasNone) {
    const std::string ours = std::filesystem::read_symlink("/proc/self/ns/net").string() + "\n";
    EXPECT_NE(tell("sh readlink /proc/self/ns/net"), ours);
    const std::string input = home_.write("input", "sh ls /etc/resolv.conf && echo prepared\n");
    const auto seenFor = [&](const std::string& confine) {
        auto host = spawn("/bin/sh", {"-c", "exec " + confine + zrctlProgram_ + " run " +
                                                kIdentifier + " <" + input});
        host->wait();
        return host->out();
    };
    EXPECT_EQ(seenFor(""), "/etc/resolv.conf\nprepared\n\0"s);
    EXPECT_EQ(seenFor("unshare --map-root-user --net "), "\0"s);
    EXPECT_EQ(seenFor("setpriv --no-new-privs "), "\0"s);
}

}  // namespace

}  // namespace test
