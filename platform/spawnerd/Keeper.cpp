#include "platform/spawnerd/Keeper.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstring>

#include "platform/spawnerd/KeeperProcess.h"
#include "platform/spawnerd/SandboxNamespaces.h"
#include "platform/system/Parcel.h"

namespace platform::spawnerd {

Result<Keeper> Keeper::make() {
    // What could not be found again in the end is not started.
    if (::access(KeeperProcess::kChildren, R_OK) != 0)
        return Error::posix(errno, KeeperProcess::kChildren);
    int ends[2];
    if (::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends) != 0)
        return Error::posix(errno, "socketpair");
    UniqueFd ours(ends[0]), theirs(ends[1]);
    // Nothing that is meant for this process may reach the other, at no moment.
    sigset_t all, before;
    ::sigfillset(&all);
    ::pthread_sigmask(SIG_SETMASK, &all, &before);
    const pid_t pid = ::fork();
    if (pid == 0) KeeperProcess::main(theirs.get());
    const int failure = errno;
    ::pthread_sigmask(SIG_SETMASK, &before, nullptr);
    if (pid < 0) return Error::posix(failure, "fork");
    UniqueFd pidFd(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
    const int unwatched = pidFd ? 0 : errno;
    Keeper keeper(pid, std::move(pidFd), std::move(ours));
    if (unwatched != 0) return Error::posix(unwatched, "pidfd_open");
    return keeper;
}

Keeper::Keeper(Keeper&& other) noexcept
    : pid_(std::exchange(other.pid_, 0)),
      pidFd_(std::move(other.pidFd_)),
      socket_(std::move(other.socket_)) {}

Keeper::~Keeper() {
    if (pid_ == 0) return;
    // Also when somebody else that was forked from this process has the socket.
    ::shutdown(socket_.get(), SHUT_RDWR);
    while (::waitpid(pid_, nullptr, 0) < 0 && errno == EINTR) {
    }
}

Result<Parcel> Keeper::ask(const KeeperOrder& order, std::span<const int> descriptors) const {
    if (auto error = Parcel::send(socket_.get(), order.encode(), descriptors)) return *error;
    Result<Parcel> answer = Parcel::receive(socket_.get());
    if (!answer) return answer;
    KeeperAnswer told{.error = EPROTO, .pid = -1};
    if (answer->bytes.size() == sizeof told) std::memcpy(&told, answer->bytes.data(), sizeof told);
    if (told.error != 0) return Error::posix(told.error, "the process that keeps plug-ins");
    return answer;
}

Result<Keeper::Child> Keeper::run(const Order& order) const {
    int ends[2];
    if (::pipe2(ends, O_CLOEXEC | O_NONBLOCK) != 0) return Error::posix(errno, "pipe2");
    Child child;
    child.end.reset(ends[0]);
    const UniqueFd theirEnd(ends[1]);
    KeeperOrder parts{.targets = {}, .words = order.words};
    std::vector<int> descriptors{theirEnd.get()};
    for (const auto& [source, target] : order.descriptors) {
        descriptors.push_back(source);
        parts.targets.push_back(target);
    }
    Result<Parcel> answer = ask(parts, descriptors);
    if (!answer) return Error::posix(answer.error().code, order.words.front());
    KeeperAnswer told{};
    std::memcpy(&told, answer->bytes.data(), sizeof told);
    child.pid = told.pid;
    child.pidFd = std::move(answer->descriptors.at(0));
    return child;
}

std::optional<Error> Keeper::limit(const SandboxNamespaces& namespaces, bool isConnected) const {
    const int descriptors[] = {namespaces.user.get(), namespaces.network.get()};
    const Result<Parcel> answer = ask({}, std::span(descriptors, isConnected ? 2 : 1));
    return answer ? std::nullopt : std::optional(answer.error());
}

std::optional<int> Keeper::statusAt(const UniqueFd& end) {
    int raw = SIGKILL;
    const ssize_t count = ::read(end.get(), &raw, sizeof raw);
    if (count < 0) return std::nullopt;
    return WIFEXITED(raw) ? WEXITSTATUS(raw) : 128 + WTERMSIG(raw);
}

}  // namespace platform::spawnerd
