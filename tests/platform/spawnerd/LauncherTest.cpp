#include <poll.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cstddef>
#include <fstream>

#include "platform/system/Files.h"
#include "tests/platform/spawnerd/LauncherFixture.h"

namespace platform::spawnerd {

namespace {

using namespace std::string_literals;

TEST_F(LauncherTest, APlugInTalksToItsHostAndSeesNothingElse) {
    const std::string secret = home.write("secret.txt", "secret");
    const std::string place = container("one");
    std::ofstream(path("test.sandbox")) << "the token broker's socket";
    const std::string executable = plugIn(
        "one",
        "read -r word\n"
        "echo $word-$1-$GREETING-$ZORVAN_BUNDLE_IDENTIFIER\n"
        "cat " +
            secret +
            "\n"
            "touch $HOME/mine && echo wrote\n"
            "touch ${0%/*}/mine || touch /mine || echo may not\n"
            "(: >>/proc/sys/kernel/core_pattern) && echo may set the kernel\n"
            "echo $XDG_RUNTIME_DIR/zorvan/services/*\n"
            "for n in 4 5 6 7 8 9 11 12 13; do test -e /proc/$$/fd/$n && echo leak $n; done\n"
            "ls /root /home /run/user\n"
            "tr '\\0' '\\n' < /proc/1/environ | grep GREETING");
    EXPECT_EQ(grant(executable, overlay(Dictionary{{"GREETING", "hi there"}, {"HOME", place}})), 0);
    const Message reply = start(executable, Array{"argument"});
    const UniqueFd plugIn = reply.takeDescriptor();
    ASSERT_TRUE(plugIn);
    // Outside: what the overlay sets is in no environment and in no command line.
    const auto outside = processesWith(executable);
    ASSERT_FALSE(outside.empty());
    for (const std::string& process : outside) {
        EXPECT_EQ(readFile(process + "/cmdline", 1u << 20)->find("GREETING"), std::string::npos);
        const auto environment = readFile(process + "/environ", 1u << 20);
        const bool isBubblewrap = readFile(process + "/comm", 64)->starts_with("bwrap");
        EXPECT_TRUE(!isBubblewrap || *environment == "PATH=/usr/bin:/bin\0"s) << process;
    }
    EXPECT_EQ(talk(plugIn, "word\n"),
              "word-argument-hi there-one\nwrote\nmay not\n" + path("test.sandbox") + "\n");
    EXPECT_TRUE(std::filesystem::exists(place + "/mine"));
    EXPECT_EQ(number(askAbout(kWait, reply), kStatus), 1);
}

TEST_F(LauncherTest, NamesOutsideTheFilesAreOutOfReach) {
    const std::string name = "zorvan-test-" + std::to_string(::getpid());
    const UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{AF_UNIX, {}};
    std::ranges::copy(name, address.sun_path + 1);
    const auto size = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + 1 + name.size());
    ASSERT_EQ(::bind(socket.get(), reinterpret_cast<sockaddr*>(&address), size), 0);
    ASSERT_EQ(::listen(socket.get(), 1), 0);
    const std::string executable =
        plugIn("one",
               "exec perl -MSocket -e 'socket(S, AF_UNIX, SOCK_STREAM, 0);"
               "print connect(S, pack(\"S a*\", AF_UNIX, \"\\0" +
                   name + "\")) ? \"in\" : \"$!\"'");
    EXPECT_EQ(grant(executable), 0);
    EXPECT_EQ(talk(start(executable).takeDescriptor()), "Connection refused");
}

TEST_F(LauncherTest, TheAdministratorWidensAndNarrowsLimits) {
    const std::string executable = plugIn("one", "ulimit -n; df -m /tmp | awk 'END { print $2 }'");
    writeInfo("one", {{"QFBundleIdentifier", "one"},
                      {"VXExtension", Dictionary{{"VXExtensionPointIdentifier", "point"}}}});
    EXPECT_EQ(grant(executable), 0);
    const auto seen = [&] { return talk(start(executable).takeDescriptor()); };
    EXPECT_EQ(seen(), "512\n64\n");
    settings.set("extension-points",
                 Dictionary{{"point", Dictionary{{"descriptors", 100}, {"temporary", 200}}},
                            {"other", Dictionary{{"descriptors", 50}}}});
    EXPECT_EQ(seen(), "100\n200\n");
    settings.set("plug-ins", Dictionary{{"one", Dictionary{{"descriptors", 600}}}});
    EXPECT_EQ(seen(), "600\n200\n") << "the plug-in counts over its point";
    for (const Value& bad : {Value(-1), Value("600"), Value(0), Value(std::uint64_t{1} << 40)}) {
        settings.set("plug-ins", Dictionary{{"one", Dictionary{{"descriptors", bad}}}});
        EXPECT_EQ(seen(), "100\n200\n") << describe(bad);
    }
    settings.set("plug-ins", Dictionary{{"one", Dictionary{{"speed", 1}}}});
    EXPECT_EQ(seen(), "100\n200\n");
    settings.set("plug-ins", Array());
    EXPECT_EQ(seen(), "100\n200\n");
    EXPECT_EQ(errorLines("ignoring the limit"), 6u);
}

TEST_F(LauncherTest, WhatTheUserMayDoToTheSchedulerIsNotThePlugIns) {
    constexpr rlimit kMuch{20, 20};
    for (const auto resource : {RLIMIT_RTPRIO, RLIMIT_NICE})
        if (::setrlimit(resource, &kMuch) != 0) GTEST_SKIP() << "may not raise its own limits";
    useLauncher({});
    const std::string executable = plugIn("one", "grep priority /proc/self/limits | tr -s ' '");
    EXPECT_EQ(grant(executable), 0);
    EXPECT_EQ(talk(start(executable).takeDescriptor()),
              "Max nice priority 0 0 \nMax realtime priority 0 0 \n");
}

TEST_F(LauncherTest, BadGrantsAreRefused) {
    const std::string good = plugIn("one", "");
    const std::string bare = home.write("bare/run", "");
    std::filesystem::permissions(bare, std::filesystem::perms::owner_all);
    EXPECT_EQ(grant(home.path("one.appex/missing")), ENOENT);
    EXPECT_EQ(grant(home.path("one.appex/Info.plist")), EACCES);
    EXPECT_EQ(grant(home.path("one.appex")), EACCES);
    EXPECT_EQ(grant("run"), EINVAL);
    EXPECT_EQ(grant(bare), EINVAL);
    for (const Dictionary& wrong :
         {Dictionary(), Dictionary{{"LUMService", Array()}, {"QFBundlePackageType", "LUM!"}},
          overlay(Array()), overlay(Dictionary{{"A", 1}}), overlay(Dictionary{{"A=B", "c"}}),
          overlay(Dictionary(), "other"), overlay(Dictionary(), 1),
          Dictionary{{"LUMService", *overlay().find("LUMService")}}})
        EXPECT_EQ(grant(good, wrong), EINVAL) << describe(wrong);
    EXPECT_EQ(grant(good, overlay(Dictionary{{"A", std::string(kMaxStringBytes, 'x')}})), E2BIG);
    writeInfo("one", {{"QFBundleIdentifier", "../../one"}});
    EXPECT_EQ(grant(good), EINVAL);
}

/// Hosts would find it as what it is not confined as.
TEST_F(LauncherTest, APlugInServesOneExtensionPoint) {
    constexpr const char* kPoint = "VXExtensionPointIdentifier";
    const std::string executable = plugIn("one", "");
    const auto grantFor = [&](const Value& own, const Dictionary& attributes,
                              Dictionary info = {{"QFBundleIdentifier", "one"}}) {
        info.set("VXExtension", Dictionary{{kPoint, own}, {"VXExtensionAttributes", attributes}});
        writeInfo("one", info);
        return grant(executable);
    };
    const Dictionary keyboard{{kPoint, "keyboard"}};
    EXPECT_EQ(grantFor("keyboard", keyboard, {{"QFBundleIdentifier", "one"}, {kPoint, "keyboard"}}),
              0);
    EXPECT_EQ(grantFor("other", keyboard), EINVAL);
    EXPECT_EQ(grantFor("other", {}, {{"QFBundleIdentifier", "one"}, {kPoint, "keyboard"}}), EINVAL);
    EXPECT_EQ(grantFor("keyboard", {{kPoint, Array{"keyboard", "other"}}}), EINVAL);
    EXPECT_EQ(grantFor(Array{"keyboard"}, Dictionary()), EINVAL);
}

TEST_F(LauncherTest, AContainerThatLeadsElsewhereIsRefusedAlsoLater) {
    const std::string executable = plugIn("one", "echo $HOME");
    const std::string place = container("one");
    EXPECT_EQ(grant(executable), 0);
    std::filesystem::remove(place);
    std::filesystem::create_directory_symlink(home.path(), place);
    EXPECT_EQ(grant(executable), ENOTDIR);
    EXPECT_EQ(number(start(executable), kErrorCode), ENOTDIR);
    const std::string busy = directories.zorvanRuntime() + "/tenurd";
    std::filesystem::remove(place);
    container("one");
    std::filesystem::remove_all(busy);
    std::filesystem::create_directories(busy);
    std::filesystem::create_directory_symlink(home.path(), busy + "/one");
    EXPECT_EQ(number(start(executable), kErrorCode), ENOTDIR);
}

TEST_F(LauncherTest, OnlyTheVeryBundleInItsPlaceIsGrantedAndStarted) {
    const std::string executable = plugIn("one", "echo fine");
    const ExternalService good = service(executable);
    const auto add = [&](const ExternalService& service) {
        return launcher->addExternalService(*AuditToken::ofSelf(), service, overlay());
    };
    EXPECT_EQ(add(good), 0);
    EXPECT_EQ(talk(start(executable).takeDescriptor()), "fine\n");
    const std::string moved = home.path("moved.appex");
    std::filesystem::rename(good.bundle.path, moved);
    EXPECT_EQ(number(start(executable), kErrorCode), ENOENT);
    std::filesystem::create_directory_symlink(moved, good.bundle.path);
    EXPECT_EQ(number(start(executable), kErrorCode), ELOOP) << "the same, through a link";
    EXPECT_EQ(add(good), ELOOP);
    std::filesystem::remove(good.bundle.path);
    plugIn("one", "echo another");
    EXPECT_EQ(number(start(executable), kErrorCode), ESTALE);
    EXPECT_EQ(add(good), ESTALE);
    std::filesystem::remove_all(good.bundle.path);
    std::filesystem::rename(moved, good.bundle.path);
    EXPECT_EQ(talk(start(executable).takeDescriptor()), "fine\n");
}

TEST_F(LauncherTest, WhatWasCheckedIsRenewedWhileAllIsAsItWas) {
    namespace fs = std::filesystem;
    const std::string executable = plugIn("one", "echo $WORD");
    writeInfo("one", {{"QFBundleIdentifier", "one"}, {"QFBundleExecutable", "run"}});
    const std::string place = container("one");
    fs::create_directory(place + "/tmp");
    const ExternalService one = service(executable);
    const Dictionary later = overlay(Dictionary{{"WORD", "later"}});
    const auto check = [&] { return *launcher->checkExternalService(one, overlay()); };
    // Files that have just been written may be written again without another stamp.
    ASSERT_TRUE(stepUntil([&] { return launcher->renewExternalService(*check(), later); }));
    const auto holdsAfter = [&](const auto& change, const auto& undo) {
        EXPECT_TRUE(stepUntil([&] { return launcher->renewExternalService(*check(), later); }));
        const auto before = check();
        change();
        const bool holds = launcher->renewExternalService(*before, later) != nullptr;
        undo();
        return holds;
    };
    const auto renamed = [&](const std::string& path) {
        return holdsAfter([&] { fs::rename(path, home.path("away")); },
                          [&] { fs::rename(home.path("away"), path); });
    };
    const auto nothing = [] {};
    for (const std::string& path : {one.bundle.path, executable, place, place + "/tmp"})
        EXPECT_FALSE(renamed(path)) << path;
    EXPECT_FALSE(holdsAfter([&] { fs::permissions(executable, fs::perms::owner_read); },
                            [&] { fs::permissions(executable, fs::perms::owner_all); }));
    const std::string entitlements = "one.appex/Entitlements.plist";
    EXPECT_FALSE(holdsAfter([&] { home.write(entitlements, ""); }, nothing));
    const Dictionary other{{"QFBundleIdentifier", "two"}, {"QFBundleExecutable", "run"}};
    EXPECT_FALSE(holdsAfter([&] { writeInfo("one", other); }, nothing));
    const auto before = check();
    EXPECT_FALSE(launcher->renewExternalService(*before, {}));
    // The kernel may have to look anew at any time.
    std::shared_ptr<const CheckedService> renewed;
    ASSERT_TRUE(stepUntil([&] {
        renewed = launcher->renewExternalService(*check(), later);
        return renewed != nullptr;
    }));
    ASSERT_EQ(launcher->grantExternalService(*AuditToken::ofSelf(), renewed), 0);
    EXPECT_EQ(talk(start(executable).takeDescriptor()), "later\n");
    // The name of the executable was read at another time.
    writeInfo("one", {{"QFBundleIdentifier", "one"}, {"QFBundleExecutable", "Info.plist"}});
    while (!FileStamp::of(one.bundle.path + "/Info.plist").settled) loop.poll();
    EXPECT_FALSE(launcher->renewExternalService(*check(), later));
}

TEST_F(LauncherTest, WhatABundleLinksToOutsideIsNotUsed) {
    const std::string inside = plugIn("one", "echo fine"), outside = plugIn("two", "echo other");
    std::filesystem::create_symlink("run", home.path("one.appex/link"));
    EXPECT_EQ(grant(home.path("one.appex/link")), 0);
    EXPECT_EQ(talk(start(home.path("one.appex/link")).takeDescriptor()), "fine\n");
    for (const std::string& target : {outside, std::string("../two.appex/run")}) {
        std::filesystem::remove(home.path("one.appex/link"));
        std::filesystem::create_symlink(target, home.path("one.appex/link"));
        EXPECT_EQ(grant(home.path("one.appex/link")), EXDEV);
    }
    ExternalService stranger = service(inside);
    stranger.executable = outside;
    const AuditToken self = *AuditToken::ofSelf();
    EXPECT_EQ(launcher->addExternalService(self, stranger, overlay()), EINVAL);
    ExternalService elsewhere = service(inside);
    for (const std::string& place :
         {home.makeDirectory("private"), home.path("data/zorvan/Containers/../../../private")}) {
        container("any");
        elsewhere.container = place;
        EXPECT_NE(launcher->addExternalService(self, elsewhere, overlay()), 0) << place;
    }
    std::filesystem::remove(home.path("one.appex/Info.plist"));
    std::filesystem::create_symlink(home.path("two.appex/Info.plist"),
                                    home.path("one.appex/Info.plist"));
    EXPECT_EQ(grant(inside), EINVAL);
}

TEST_F(LauncherTest, BadRequestsAreAnsweredAndTheConnectionGoesOn) {
    const std::string executable = plugIn("one", "echo fine");
    EXPECT_EQ(number(start(executable), kErrorCode), EPERM);
    EXPECT_EQ(grant(executable), 0);
    EXPECT_EQ(number(ask({}), kErrorCode), EINVAL);
    EXPECT_EQ(number(ask({{"request", "stop"}}), kErrorCode), ENOSYS);
    EXPECT_EQ(number(ask({{"request", "start"}}), kErrorCode), EINVAL);
    EXPECT_EQ(number(ask({{"request", "wait"}, {"instance", -1}}), kErrorCode), EINVAL);
    EXPECT_EQ(number(ask({{"request", "terminate"}, {"instance", 1}}), kErrorCode), ESRCH);
    EXPECT_EQ(number(start(executable, "text"), kErrorCode), EINVAL);
    EXPECT_EQ(number(start(executable, Array{1}), kErrorCode), EINVAL);
    EXPECT_TRUE(start(executable, Array{"a\0b"s}).contents().empty()) << "it is not even sent";
    EXPECT_EQ(number(start(executable, Array{std::string(kMaxStringBytes + 1, 'x')}), kErrorCode),
              E2BIG);
    EXPECT_EQ(number(start(home.path("one.appex/other")), kErrorCode), EPERM);
    EXPECT_EQ(talk(start(executable).takeDescriptor()), "fine\n");
}

TEST_F(LauncherTest, NothingRunsWithoutBubblewrap) {
    useLauncher({.bubblewrap = home.path("bwrap")});
    const std::string executable = plugIn("one", "touch $HOME/ran");
    EXPECT_EQ(grant(executable, overlay(Dictionary{{"HOME", home.path()}})), 0);
    const Message reply = start(executable);
    EXPECT_EQ(number(reply, kErrorCode), ENOENT);
    EXPECT_NE(reply.find(kError)->string()->view().find(home.path("bwrap")), std::string::npos);
    EXPECT_EQ(errorLines("cannot confine plug-ins without"), 1u);

    useLauncher({.bubblewrap = "/bin/false"});
    EXPECT_EQ(grant(executable), 0);
    EXPECT_EQ(number(start(executable), kErrorCode), EIO);
    EXPECT_FALSE(std::filesystem::exists(home.path("ran")));
}

/// As where the kernel refuses a limit: this sandbox has no user namespace to set it in.
TEST_F(LauncherTest, WhatCannotBeLimitedIsNotStarted) {
    const std::string sandbox =
        home.write("bwrap",
                   "#!/bin/sh\n"
                   "space=$(stat -Lc %i /proc/$$/ns/pid)\n"
                   "echo \"{ \\\"child-pid\\\": $$, \\\"pid-namespace\\\": $space }\" >&5\n"
                   "exec 5>&-\n"
                   "head -c 1 <&6 >/dev/null\n"
                   "while [ \"$1\" != -- ]; do shift; done\n"
                   "shift\n"
                   "exec \"$@\"\n");
    std::filesystem::permissions(sandbox, std::filesystem::perms::owner_all);
    useLauncher({.bubblewrap = sandbox});
    const std::string executable = plugIn("one", "touch " + home.path("ran"));
    EXPECT_EQ(grant(executable), 0);
    EXPECT_EQ(number(start(executable), kErrorCode), EIO);
    EXPECT_EQ(errorLines("cannot limit plug-in one"), 1u);
    EXPECT_TRUE(processesWith(sandbox).empty());
    EXPECT_FALSE(std::filesystem::exists(home.path("ran")));
}

/// At whatever point of the start there is no further descriptor.
TEST_F(LauncherTest, AStartWithoutDescriptorsFailsAndLeavesNothing) {
    const std::string executable = plugIn("one", "cat");
    EXPECT_EQ(grant(executable), 0);
    askAbout(kTerminate, start(executable));
    const auto open = [] {
        return std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {});
    };
    const auto before = open();
    rlimit usual{};
    ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &usual), 0);
    std::size_t failed = 0;
    for (bool succeeded = false; !succeeded;) {
        const rlimit narrow{before - 1 + failed, usual.rlim_max};
        ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &narrow), 0);
        const Message reply = start(executable);
        ::setrlimit(RLIMIT_NOFILE, &usual);
        succeeded = static_cast<bool>(reply.takeDescriptor());
        if (number(reply, kInstance) > 0) askAbout(kTerminate, reply);
        failed += succeeded ? 0 : 1;
        ASSERT_LT(failed, 100u);
        EXPECT_TRUE(stepUntil([&] { return processesWith(executable).empty(); })) << failed;
        EXPECT_TRUE(stepUntil([&] { return open() == before; })) << failed;
    }
    EXPECT_GT(failed, 5u);
}

/// As after a failure between the start of a process and the word of it.
TEST(KeeperTest, WhatNobodyWaitsForIsEndedWithWhatItLeavesBehind) {
    const Result<Keeper> keeper = Keeper::make();
    ASSERT_TRUE(keeper);
    int ends[2];
    ASSERT_EQ(::pipe2(ends, O_CLOEXEC), 0);
    const UniqueFd readEnd(ends[0]);
    UniqueFd writeEnd(ends[1]);
    for (const char* script : {"sleep 1000", "sleep 1000 & exit"}) {
        auto child = keeper->run(
            {.words = {"/bin/sh", "-c", script}, .descriptors = {{writeEnd.get(), STDOUT_FILENO}}});
        ASSERT_TRUE(child);
        if (script == std::string("sleep 1000")) continue;
        pollfd ended{child->end.get(), POLLIN, 0};
        EXPECT_EQ(::poll(&ended, 1, 10000), 1);
    }
    writeEnd.reset();
    pollfd state{readEnd.get(), 0, 0};
    EXPECT_EQ(::poll(&state, 1, 10000), 1) << "somebody has the other end";
}

TEST_F(LauncherTest, AHostLearnsHowItsPlugInsEnd) {
    const std::string executable = plugIn("one", "read -r status\nexit $status");
    EXPECT_EQ(grant(executable), 0);
    const Message first = start(executable), second = start(executable);
    talk(first.takeDescriptor(), "7\n");
    EXPECT_EQ(number(askAbout(kWait, first), kStatus), 7);
    EXPECT_EQ(number(askAbout(kTerminate, second), kStatus), 128 + SIGKILL);
    EXPECT_EQ(number(askAbout(kWait, first), kStatus), 7);
    EXPECT_EQ(number(askAbout(kTerminate, second), kStatus), 128 + SIGKILL);
}

TEST_F(LauncherTest, AHostHasSoManyPlugInsAndNoMore) {
    const std::string executable = plugIn("one", "read -r line");
    EXPECT_EQ(grant(executable), 0);
    std::vector<Message> started;
    for (std::size_t i = 0; i < kMaxInstancesPerHost; ++i) started.push_back(start(executable));
    EXPECT_GT(number(started.back(), kInstance), 0);
    EXPECT_EQ(number(start(executable), kErrorCode), EAGAIN);
    askAbout(kTerminate, started.front());
    EXPECT_GT(number(start(executable), kInstance), 0);
    // The launcher takes along what still runs.
    launcher.reset();
    EXPECT_TRUE(processesWith(executable).empty());
}

TEST_F(LauncherTest, RemovalEndsInstancesOfThatVersionAndTakesTheirGrantsBack) {
    const std::string one = plugIn("one", "sleep 1000 &\nread -r line");
    const std::string two = plugIn("two", "cat", "1");
    writeInfo("two", {{"QFBundleIdentifier", "one"}, {"QFBundleVersion", "1"}});
    EXPECT_EQ(grant(one), 0);
    EXPECT_EQ(grant(two), 0);
    const Message first = start(one), second = start(one), other = start(two);
    std::optional<Launcher::Status> status;
    const auto terminate = [&](const char* version) {
        status.reset();
        launcher->terminatePlugInInstances("one", version, service(one).bundle, queue,
                                           [&](auto s) { status = s; });
        EXPECT_FALSE(status);
        EXPECT_TRUE(stepUntil([&] { return status.has_value(); }));
    };
    terminate("2");
    EXPECT_EQ(status, Launcher::kNoneOnRecord);
    terminate("1");
    EXPECT_EQ(status, Launcher::kDone);
    EXPECT_TRUE(processesWith(one).empty());
    EXPECT_EQ(number(start(one), kErrorCode), EPERM);
    terminate("1");
    EXPECT_EQ(status, Launcher::kNoneOnRecord);
    EXPECT_EQ(talk(other.takeDescriptor(), "still here"), "still here") << "only its name is one";
    EXPECT_GT(number(start(two), kInstance), 0);
}

TEST_F(LauncherTest, WhatIsTakenBackIsNotStartedAgainButGoesOn) {
    const std::string one = plugIn("one", "cat"), two = plugIn("two", "cat");
    EXPECT_EQ(grant(one), 0);
    EXPECT_EQ(grant(two), 0);
    const Message running = start(one);
    launcher->removeExternalServices(home.path("one.appex"));
    EXPECT_EQ(number(start(one), kErrorCode), EPERM);
    EXPECT_EQ(talk(running.takeDescriptor(), "still here"), "still here");
    EXPECT_EQ(talk(start(two).takeDescriptor(), "two"), "two");
    EXPECT_EQ(grant(one), 0);
    EXPECT_EQ(talk(start(one).takeDescriptor(), "again"), "again");
}

TEST_F(LauncherTest, CountsWorkThatIsNotDone) {
    auto first = launcher->beginOutstandingWork(), second = launcher->beginOutstandingWork();
    EXPECT_EQ(launcher->outstandingWork(), 2);
    second.reset();
    EXPECT_EQ(launcher->outstandingWork(), 1);
}

TEST_F(LauncherTest, WithoutItsNameItGoesOnWithoutStarting) {
    ProcessLauncher second(directories, "test", std::shared_ptr<RunLoop>(&loop, [](RunLoop*) {}));
    loop.poll();
    EXPECT_EQ(errorLines("no plug-in will be started"), 1u);
    const std::string executable = plugIn("one", "echo fine");
    EXPECT_EQ(grant(executable), 0);
    EXPECT_EQ(talk(start(executable).takeDescriptor()), "fine\n");
}

}  // namespace

}  // namespace platform::spawnerd
