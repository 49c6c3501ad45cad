#include "platform/sandbox/MountProcess.h"

#include <fcntl.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstring>
#include <string>
#include <utility>

#include "platform/log/OpsLog.h"
#include "platform/sandbox/ReadOnlyMount.h"
#include "platform/system/Parcel.h"

namespace platform {

namespace {

constexpr int kSocket = STDERR_FILENO + 1;

/// In a child of the process: what the parcel asks for, until it takes too long.
[[noreturn]] void obey(const Parcel& parcel, pid_t parent, std::chrono::seconds patience) {
    // With it, orders would go on being taken, and lost, when the process is gone.
    ::close(kSocket);
    sigset_t alarm;
    ::sigemptyset(&alarm);
    ::sigaddset(&alarm, SIGALRM);
    ::sigprocmask(SIG_UNBLOCK, &alarm, nullptr);
    ::alarm(static_cast<unsigned>(patience.count()));
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (::getppid() != parent) ::_exit(1);
    const std::string path = parcel.bytes.substr(FileIdentity::kStoredSize);
    const int outcome = sendReadOnlyMount(path.c_str(), FileIdentity::from(parcel.bytes),
                                          parcel.descriptors.at(0).get(), MountProcess::kGranted);
    (void)!::write(parcel.descriptors.at(1).get(), &outcome, sizeof outcome);
    ::_exit(0);
}

/// What the process does from its fork to its end.
[[noreturn]] void serve(int socket, std::chrono::seconds patience) {
    ::prctl(PR_SET_NAME, "zrd-mounts");
    // Nothing of the daemon's stays open here: locks and connections must not outlive it.
    const int null = ::open("/dev/null", O_RDWR);
    if (::dup2(socket, kSocket) < 0) ::_exit(1);
    for (int fd = STDIN_FILENO; fd <= STDERR_FILENO; ++fd) ::dup2(null, fd);
    ::close_range(kSocket + 1, ~0U, 0);
    ::signal(SIGCHLD, SIG_IGN);  // children say themselves how it went
    ::signal(SIGALRM, SIG_DFL);
    const pid_t self = ::getpid();
    for (;;) {
        const Result<Parcel> parcel = Parcel::receive(kSocket);
        if (!parcel && parcel.error().code == EPIPE) ::_exit(0);
        if (!parcel || parcel->descriptors.size() != 2) continue;
        const pid_t pid = ::fork();
        if (pid == 0) obey(*parcel, self, patience);
        const int failure = errno;
        if (pid < 0) (void)!::write(parcel->descriptors[1].get(), &failure, sizeof failure);
    }
}

}  // namespace

Result<MountProcess> MountProcess::make(std::chrono::seconds patience) {
    int ends[2];
    if (::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends) != 0)
        return Error::posix(errno, "socketpair");
    UniqueFd ours(ends[0]), theirs(ends[1]);
    if (::fcntl(ours.get(), F_SETFL, O_NONBLOCK) != 0) return Error::posix(errno, "fcntl");
    // Nothing that is meant for this process may reach the other, at no moment.
    sigset_t all, before;
    ::sigfillset(&all);
    ::pthread_sigmask(SIG_SETMASK, &all, &before);
    const pid_t pid = ::fork();
    if (pid == 0) serve(theirs.get(), patience);
    const int failure = errno;
    ::pthread_sigmask(SIG_SETMASK, &before, nullptr);
    if (pid < 0) return Error::posix(failure, "fork");
    return MountProcess(pid, std::move(ours), patience);
}

MountProcess::MountProcess(MountProcess&& other) noexcept
    : pid_(std::exchange(other.pid_, 0)),
      socket_(std::move(other.socket_)),
      patience_(other.patience_) {}

MountProcess& MountProcess::operator=(MountProcess&& other) noexcept {
    if (this == &other) return *this;
    end();
    pid_ = std::exchange(other.pid_, 0);
    socket_ = std::move(other.socket_);
    patience_ = other.patience_;
    return *this;
}

MountProcess::~MountProcess() {
    end();
}

void MountProcess::end() {
    if (pid_ == 0) return;
    // Also when somebody else that was forked from this process has the socket.
    ::shutdown(socket_.get(), SHUT_RDWR);
    while (::waitpid(pid_, nullptr, 0) < 0 && errno == EINTR) {
    }
    pid_ = 0;
}

std::optional<Error> MountProcess::order(const SandboxTokens::File& file, int socket,
                                         int end) const {
    std::string bytes;
    file.identity.appendTo(bytes);
    bytes.append(file.path);
    const int descriptors[] = {socket, end};
    return Parcel::send(socket_.get(), bytes, descriptors);
}

Result<UniqueFd> MountProcess::grant(const SandboxTokens::File& file, int socket) {
    int ends[2];
    if (::pipe2(ends, O_CLOEXEC | O_NONBLOCK) != 0) return Error::posix(errno, "pipe2");
    UniqueFd ours(ends[0]);
    const UniqueFd theirs(ends[1]);
    auto failure = order(file, socket, theirs.get());
    if (failure && (failure->code == EPIPE || failure->code == ECONNRESET)) {
        EVLOG_ERROR(ops(), "the process that makes mounts has ended; there will be another");
        auto another = make(patience_);
        if (!another) return another.error();
        *this = std::move(*another);
        failure = order(file, socket, theirs.get());
    }
    if (failure) return *failure;
    return ours;
}

int MountProcess::outcomeAt(const UniqueFd& end) {
    int outcome = 0;
    return ::read(end.get(), &outcome, sizeof outcome) == sizeof outcome ? outcome : ETIMEDOUT;
}

}  // namespace platform
