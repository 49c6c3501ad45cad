#include "platform/spawnerd/KeeperProcess.h"

#include <fcntl.h>
#include <poll.h>
#include <sched.h>
#include <sys/prctl.h>
#include <sys/signalfd.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstring>
#include <sstream>
#include <utility>

#include "platform/spawnerd/ChildProcess.h"
#include "platform/system/Parcel.h"

namespace platform::spawnerd {

namespace {

/// A file of the kernel's, which shows each namespace its own, and what is written there.
using Setting = std::pair<const char*, std::string_view>;

/// What the kernel counts by user, with bounds that leave the user the greater part.
constexpr Setting kUserLimits[] = {
    {"/proc/sys/user/max_inotify_instances", "16"},
    {"/proc/sys/user/max_inotify_watches", "8192"},
};

/// The ports that a connected sandbox may take, and is given when it does not say which: what it
/// sends from one goes out from the machine's port of that number. No service has one of these by
/// assignment, and by default no client of the machine's is given one. The second may not exceed
/// the beginning of the first.
constexpr Setting kPorts[] = {
    {"/proc/sys/net/ipv4/ip_local_port_range", "61000 65535"},
    {"/proc/sys/net/ipv4/ip_unprivileged_port_start", "61000"},
};

/// What the kernel does not have needs no bound. Answers 0 or an errno.
int apply(std::span<const Setting> settings) {
    for (const auto& [path, value] : settings) {
        const UniqueFd file(::open(path, O_WRONLY | O_CLOEXEC));
        if (!file && errno == ENOENT) continue;
        if (!file || ::write(file.get(), value.data(), value.size()) < 0) return errno;
    }
    return 0;
}

int enterAndLimit(std::span<const UniqueFd> namespaces) {
    if (::setns(namespaces[0].get(), CLONE_NEWUSER) != 0) return errno;
    const int error = apply(kUserLimits);
    if (error != 0 || namespaces.size() == 1) return error;
    if (::setns(namespaces[1].get(), CLONE_NEWNET) != 0) return errno;
    return apply(kPorts);
}

/// In a child: who has entered a user namespace does not come back. Not by the library's fork, in
/// which threads may be started: who has more than one cannot enter. Answers 0 or an errno.
int limit(std::span<const UniqueFd> namespaces) {
    const auto pid = static_cast<pid_t>(::syscall(SYS_clone, SIGCHLD, 0, 0, 0, 0));
    if (pid == 0) ::_exit(enterAndLimit(namespaces));
    int status = 0;
    if (pid < 0 || ::waitpid(pid, &status, 0) != pid) return errno;
    return WIFEXITED(status) ? WEXITSTATUS(status) : EIO;
}

}  // namespace

std::string KeeperOrder::encode() const {
    const auto count = static_cast<std::uint32_t>(targets.size());
    std::string bytes(reinterpret_cast<const char*>(&count), sizeof count);
    if (count > 0) bytes.append(reinterpret_cast<const char*>(targets.data()), count * sizeof(int));
    for (const std::string& word : words) bytes.append(word).push_back('\0');
    return bytes;
}

std::optional<KeeperOrder> KeeperOrder::decode(std::string_view bytes) {
    KeeperOrder order;
    std::uint32_t count = 0;
    if (bytes.size() < sizeof count) return std::nullopt;
    std::memcpy(&count, bytes.data(), sizeof count);
    bytes.remove_prefix(sizeof count);
    if (count > Parcel::kMostDescriptors || bytes.size() < count * sizeof(int)) return std::nullopt;
    order.targets.resize(count);
    if (count > 0) std::memcpy(order.targets.data(), bytes.data(), count * sizeof(int));
    bytes.remove_prefix(count * sizeof(int));
    for (std::size_t end = 0; (end = bytes.find('\0')) != bytes.npos; bytes.remove_prefix(end + 1))
        order.words.emplace_back(bytes.substr(0, end));
    return order;
}

void KeeperProcess::main(int socket) {
    ::prctl(PR_SET_NAME, "zrd-keeper");
    // Whatever of the daemon's it had open beyond the daemon's end, others would wait for.
    constexpr int kSocket = STDERR_FILENO + 1;
    const int null = ::open("/dev/null", O_RDWR);
    for (int fd = STDIN_FILENO; fd <= STDERR_FILENO; ++fd) ::dup2(null, fd);
    if (::dup3(socket, kSocket, O_CLOEXEC) < 0 && socket != kSocket) ::_exit(1);
    ::close_range(kSocket + 1, ~0U, 0);
    sigset_t children;
    ::sigemptyset(&children);
    ::sigaddset(&children, SIGCHLD);
    ::signal(SIGCHLD, SIG_DFL);
    UniqueFd childSignals(::signalfd(-1, &children, SFD_CLOEXEC | SFD_NONBLOCK));
    UniqueFd list(::open(kChildren, O_RDONLY | O_CLOEXEC));
    if (!childSignals || !list || ::prctl(PR_SET_CHILD_SUBREAPER, 1, 0, 0, 0) != 0) ::_exit(1);
    KeeperProcess keeper(UniqueFd(kSocket), std::move(childSignals), std::move(list));
    keeper.serve();
    keeper.endAll();
    ::_exit(0);
}

void KeeperProcess::serve() {
    std::vector<pollfd> states;
    for (;;) {
        states.assign({{socket_.get(), POLLIN, 0}, {childSignals_.get(), POLLIN, 0}});
        for (const auto& [pid, end] : ends_) states.push_back({end.get(), 0, 0});
        if (::poll(states.data(), states.size(), -1) < 0) continue;
        endForgotten(std::span(states).subspan(2));
        if (states[1].revents != 0) reap();
        if (states[0].revents != 0 && !obey()) return;
    }
}

bool KeeperProcess::obey() {
    Result<Parcel> parcel = Parcel::receive(socket_.get());
    if (!parcel && parcel.error().code == EPIPE) return false;
    UniqueFd pidFd;
    const KeeperAnswer answer =
        parcel ? answerTo(*parcel, pidFd) : KeeperAnswer{.error = parcel.error().code, .pid = -1};
    const int borrowed = pidFd.get();
    const std::string_view bytes(reinterpret_cast<const char*>(&answer), sizeof answer);
    const auto failure = Parcel::send(socket_.get(), bytes, std::span(&borrowed, pidFd ? 1 : 0));
    if (!failure) return true;
    if (failure->code == EPIPE || failure->code == ECONNRESET) return false;
    // Whoever hears this waits for no child.
    const KeeperAnswer instead{.error = failure->code, .pid = -1};
    return !Parcel::send(socket_.get(), {reinterpret_cast<const char*>(&instead), sizeof instead},
                         {});
}

KeeperAnswer KeeperProcess::answerTo(Parcel& parcel, UniqueFd& pidFd) {
    const auto order = KeeperOrder::decode(parcel.bytes);
    const std::size_t count = parcel.descriptors.size();
    if (!order || count == 0) return {.error = EPROTO, .pid = -1};
    if (order->words.empty()) return {.error = limit(parcel.descriptors), .pid = -1};
    if (count != order->targets.size() + 1) return {.error = EPROTO, .pid = -1};
    return start(*order, parcel.descriptors, pidFd);
}

KeeperAnswer KeeperProcess::start(const KeeperOrder& order, std::vector<UniqueFd>& descriptors,
                                  UniqueFd& pidFd) {
    ChildProcess child;
    for (std::size_t i = 0; i < order.targets.size(); ++i)
        if (!child.give(descriptors[i + 1].get(), order.targets[i]))
            return {.error = errno, .pid = -1};
    const Result<pid_t> pid = child.run(order.words);
    if (!pid) return {.error = pid.error().code, .pid = -1};
    // It may have ended, but is not reaped before this returns: the number is its own.
    pidFd.reset(static_cast<int>(::syscall(SYS_pidfd_open, *pid, 0)));
    const int error = pidFd ? 0 : errno;
    if (!pidFd) ::kill(*pid, SIGKILL);
    ends_[*pid] = std::move(descriptors.front());
    return {.error = error, .pid = *pid};
}

void KeeperProcess::endForgotten(std::span<const pollfd> states) {
    for (auto state = states.begin(); auto& [pid, end] : ends_) {
        if (((state++)->revents & POLLERR) == 0) continue;
        ::kill(pid, SIGKILL);
        end.reset();  // it is ended once, however long that takes
    }
}

void KeeperProcess::reap() {
    signalfd_siginfo signal;
    while (::read(childSignals_.get(), &signal, sizeof signal) > 0) {
    }
    int status = 0;
    const std::size_t before = ends_.size();
    for (pid_t pid = 0; (pid = ::waitpid(-1, &status, WNOHANG)) > 0;) {
        const auto found = ends_.find(pid);
        if (found == ends_.end()) continue;  // an orphan
        (void)!::write(found->second.get(), &status, sizeof status);
        ends_.erase(found);
    }
    if (ends_.size() < before) endOrphans();
}

void KeeperProcess::endOrphans() const {
    std::string list;
    char buffer[4096];
    for (ssize_t count = 0; (count = ::pread(children_.get(), buffer, sizeof buffer,
                                             static_cast<off_t>(list.size()))) > 0;)
        list.append(buffer, static_cast<std::size_t>(count));
    std::istringstream numbers(list);
    // Only this process reaps them: until then their numbers are their own, and none leaves the
    // list while it is read.
    for (pid_t pid = 0; numbers >> pid;)
        if (!ends_.contains(pid)) ::kill(pid, SIGKILL);
}

/// As this process reaps orphans, what a child leaves when it ends is a child of this one by the
/// time that it can be waited for.
void KeeperProcess::endAll() {
    ends_.clear();  // nobody waits for any of them now
    do {
        endOrphans();
    } while (::waitpid(-1, nullptr, 0) > 0);
}

}  // namespace platform::spawnerd
