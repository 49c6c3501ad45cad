#include <netinet/in.h>
#include <sys/socket.h>

#include "platform/system/Files.h"
#include "tests/platform/spawnerd/LauncherFixture.h"

namespace platform::spawnerd {

namespace {

using namespace std::string_literals;

/// A program in the place of the one that connects instances, which notes that it was started and
/// goes on as told.
class NetworkTest : public LauncherTest {
  protected:
    void usePasta(const std::string& rest) {
        std::filesystem::permissions(home.write("pasta", "#!/bin/sh\necho $$ \"$@\" >>" +
                                                             home.path("started") + "\n" + rest),
                                     std::filesystem::perms::owner_all);
        useLauncher({.pasta = home.path("pasta")});
    }
    std::string start(const std::string& executable, const std::string& profile = "plugin") {
        EXPECT_EQ(grant(executable, overlay(Dictionary(), profile)), 0);
        return talk(LauncherTest::start(executable).takeDescriptor());
    }
    std::size_t started() const {
        const auto text = readFile(home.path("started"), 1u << 20);
        return text ? static_cast<std::size_t>(std::ranges::count(*text, '\n')) : 0;
    }
    static bool hasDevice() { return ::access("/dev/net/tun", R_OK | W_OK) == 0; }
    void wantNetwork(const Value& wanted = true) {
        home.write("one.appex/Entitlements.plist",
                   *writeXmlPropertyList(Dictionary{{kNetworkEntitlement, wanted}}));
    }

    const std::string executable_ =
        plugIn("one", "tail -n+2 /proc/net/route | wc -l; ls /etc/resolv.conf 2>/dev/null");
    static constexpr const char* kAlone = "0\n";  // no way leads anywhere
};

TEST_F(NetworkTest, IsForThoseThatAskForItAndMayHaveIt) {
    usePasta("echo $$ >&2\nexec sleep 1000");
    EXPECT_EQ(start(executable_), kAlone) << "did not ask";
    wantNetwork("yes");
    EXPECT_EQ(start(executable_), kAlone);
    wantNetwork();
    for (const char* profile : {"keyboard", "network-filter", "glimsed"})
        EXPECT_EQ(start(executable_, profile), kAlone) << profile;
    settings.set("plug-ins", Dictionary{{"one", Dictionary{{"network", false}}}});
    EXPECT_EQ(start(executable_), kAlone) << "the administrator is against it";
    EXPECT_EQ(started(), 0u);
    settings.set("plug-ins", Dictionary());
    EXPECT_EQ(start(executable_), kAlone + "/etc/resolv.conf\n"s);
    EXPECT_EQ(started(), hasDevice() ? 1u : 0u);
    EXPECT_TRUE(stepUntil([&] { return processesWith(home.path("pasta")).empty(); }));
}

TEST_F(NetworkTest, AProgramThatFailsLeavesThePlugInWithoutOne) {
    wantNetwork();
    usePasta("echo no route >&2");
    EXPECT_EQ(start(executable_), kAlone + "/etc/resolv.conf\n"s);
    EXPECT_EQ(errorLines(hasDevice() ? "no route" : "/dev/net/tun"), 1u);
    useLauncher({.pasta = home.path("missing")});
    EXPECT_EQ(start(executable_), kAlone + "/etc/resolv.conf\n"s);
    EXPECT_EQ(errorLines("starts without a network"), 2u);
}

/// A datagram leaves from the machine's port of the number that it left the sandbox from.
TEST_F(NetworkTest, TakesNoPortThatIsAServicesOrAClientsOfTheMachine) {
    usePasta("echo $$ >&2\nexec sleep 1000");
    const std::string executable =
        plugIn("one",
               "exec perl -MIO::Socket::INET -e '$, = \" \"; print map { "
               "IO::Socket::INET->new(Proto => \"udp\", LocalPort => $_) ? \"yes\" : \"no\""
               "} 53, 5353, 60999, 61000; print \"\", IO::Socket::INET->new(Proto => \"udp\","
               "PeerAddr => \"127.0.0.1:9\")->sockport < 61000 ? \"low\" : \"high\"'");
    EXPECT_EQ(start(executable), "no yes yes yes low") << "in there alone";
    wantNetwork();
    EXPECT_EQ(start(executable), "no no no yes high");
}

/// What listens on the machine's loopback interface, or without a name in the file system, is not
/// there for a plug-in.
TEST_F(NetworkTest, DoesNotLeadToTheMachineItself) {
    if (::access(kPasta, X_OK) != 0 || !hasDevice())
        GTEST_SKIP() << "there is no pasta, or no device for it";
    const UniqueFd listening(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t size = sizeof address;
    ASSERT_EQ(::bind(listening.get(), reinterpret_cast<sockaddr*>(&address), size), 0);
    ASSERT_EQ(::listen(listening.get(), 8), 0);
    ::getsockname(listening.get(), reinterpret_cast<sockaddr*>(&address), &size);
    const std::string port = std::to_string(ntohs(address.sin_port));
    const std::string executable = plugIn(
        "one",
        "tail -n+2 /proc/net/route | wc -l\n"
        "gateway=$(perl -ane 'print join \".\", reverse map hex, unpack \"(A2)4\", $F[2]"
        " if $F[1] eq \"00000000\"' /proc/net/route)\n"
        "for host in 127.0.0.1 $gateway 169.254.1.1; do\n"
        "perl -MIO::Socket::INET -e 'print IO::Socket::INET->new(PeerAddr => $ARGV[0], PeerPort =>"
        " $ARGV[1], Timeout => 1) ? \"in\" : \"out\", \"\\n\"' $host " +
            port + "\ndone");
    wantNetwork();
    if (start(executable).substr(0, 2) == kAlone) GTEST_SKIP() << "there is no network here";
    EXPECT_TRUE(start(executable).ends_with("\nout\nout\nout\n"));
}

}  // namespace

}  // namespace platform::spawnerd
