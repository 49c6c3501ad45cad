#include "platform/spawnerd/Instance.h"

#include <poll.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <string_view>
#include <utility>

#include "platform/log/OpsLog.h"

namespace platform::spawnerd {

namespace {

constexpr std::size_t kMaxInfo = 4096;
constexpr int kPatience = 1000;  // milliseconds
/// Of the program that connects an instance: it takes one for each flow, and a port of the
/// machine's for each port that a datagram has come from.
constexpr rlimit kNetworkDescriptors{2048, 2048};
constexpr std::string_view kFirstProcess = "\"child-pid\":";

void sendKill(const UniqueFd& pidFd) {
    if (pidFd) ::syscall(SYS_pidfd_send_signal, pidFd.get(), SIGKILL, nullptr, 0);
}

void awaitEnd(const UniqueFd& pidFd) {
    pollfd state{pidFd.get(), POLLIN, 0};
    if (pidFd) ::poll(&state, 1, kPatience);
}

/// A number in what bubblewrap tells, a JSON object of numbers; 0 when it is not there.
unsigned long numberIn(const std::string& info, std::string_view key) {
    const std::size_t place = info.find(key);
    if (place == std::string::npos) return 0;
    return std::strtoul(info.c_str() + place + key.size(), nullptr, 10);
}

/// The pidfd of the sandbox's first process; none when that is gone. Its number is only a number:
/// the process must be in the sandbox's pid namespace, which does not outlive the first process.
UniqueFd firstProcessOf(const std::string& info) {
    const unsigned long pid = numberIn(info, kFirstProcess);
    UniqueFd first(static_cast<int>(::syscall(SYS_pidfd_open, static_cast<pid_t>(pid), 0)));
    struct stat status;
    const std::string path = "/proc/" + std::to_string(pid) + "/ns/pid";
    if (!first || ::stat(path.c_str(), &status) != 0 ||
        status.st_ino != numberIn(info, "\"pid-namespace\":"))
        return UniqueFd();
    return first;
}

}  // namespace

Instance::Instance(RunLoop& loop, const Keeper& keeper, std::string pasta, SandboxedProcess process,
                   std::string name, const Allowance& allowance, InstanceGroup group,
                   std::function<void()> runs, std::function<void(int)> ended)
    : loop_(loop),
      keeper_(keeper),
      pasta_(std::move(pasta)),
      process_(std::move(process)),
      name_(std::move(name)),
      allowance_(allowance),
      group_(std::move(group)),
      runs_(std::move(runs)),
      ended_(std::move(ended)),
      output_(loop, std::move(process_.output), name_) {
    endWatch_.emplace(loop_, process_.child.end.get());
    endWatch_->awaitReadable([this] { takeStatus(); });
    infoWatch_.emplace(loop_, process_.info.get());
    infoWatch_->awaitReadable([this] { awaitInfo(); });
}

Instance::~Instance() {
    if (status_ && !process_.info && !first_) return;
    takeInfoNow();
    sendKill(first_);
    if (!status_) sendKill(process_.child.pidFd);
    awaitEnd(process_.child.pidFd);
    awaitEnd(first_);
}

/// Before its first process is known, killing bubblewrap would leave that one without the tie
/// that it has to it later: it waits at the gate until it is known, and never passes then.
void Instance::kill() {
    isDoomed_ = true;
    if (!first_ && process_.info) return;
    group_.kill();
    sendKill(first_);
    if (!status_) sendKill(process_.child.pidFd);
}

bool Instance::readInfo() {
    char buffer[1024];
    const ssize_t count = ::read(process_.info.get(), buffer, sizeof buffer);
    if (count < 0 && (errno == EAGAIN || errno == EINTR)) return false;
    if (count > 0) infoText_.append(buffer, static_cast<std::size_t>(count));
    const bool isWhole = infoText_.find('}') != std::string::npos;
    if (count > 0 && !isWhole && infoText_.size() < kMaxInfo) return false;
    infoWatch_.reset();
    process_.info.reset();
    if (isWhole) first_ = firstProcessOf(infoText_);
    return true;
}

void Instance::takeInfoNow() {
    while (process_.info) {
        pollfd state{process_.info.get(), POLLIN, 0};
        if (::poll(&state, 1, kPatience) <= 0) return;
        readInfo();
    }
}

void Instance::awaitInfo() {
    if (!readInfo()) return infoWatch_->awaitReadable([this] { awaitInfo(); });
    if (first_) watchFirst();
    if (isDoomed_ || !first_) {
        kill();
        return endedPartly();
    }
    const auto namespaces = SandboxNamespaces::of(firstPid(), first_);
    if (!limit(namespaces)) return kill();
    if (allowance_.network) return connect(*namespaces);
    pass();
}

pid_t Instance::firstPid() const {
    return static_cast<pid_t>(numberIn(infoText_, kFirstProcess));
}

bool Instance::limit(const Result<SandboxNamespaces>& namespaces) const {
    auto failure =
        namespaces ? keeper_.limit(*namespaces, allowance_.network) : Error(namespaces.error());
    if (!failure && !(setProcessLimits(firstPid(), allowance_.limits) &&
                      group_.add(process_.child.pid) && group_.add(firstPid())))
        failure = Error::posix(errno, name_);
    if (failure) EVLOG_ERROR(ops(), "cannot limit plug-in {}: {}", name_, pub(*failure));
    return !failure;
}

void Instance::connect(const SandboxNamespaces& namespaces) {
    auto network = InstanceNetwork::connect(loop_, keeper_, pasta_, namespaces,
                                            [this](const auto& error) { connected(error); });
    if (!network) return connected(network.error());
    network_ = std::move(*network);
    // What it takes counts as the instance's, and ends with it.
    group_.add(network_->pid());
    ::prlimit(network_->pid(), RLIMIT_NOFILE, &kNetworkDescriptors, nullptr);
}

void Instance::connected(const std::optional<Error>& error) {
    if (error) {
        network_.reset();
        EVLOG_ERROR(ops(),
                    "plug-in {} starts without a network: {} (it takes the program pasta, of the"
                    " package passt, and a /dev/net/tun that this user may open)",
                    name_, pub(*error));
    }
    pass();
}

void Instance::pass() {
    if (isDoomed_) return;
    const bool passed = ::write(process_.gate.get(), "", 1) == 1;
    process_.gate.reset();
    if (!passed) return kill();
    runs_();
}

void Instance::watchFirst() {
    firstWatch_.emplace(loop_, first_.get());
    firstWatch_->awaitReadable([this] {
        firstWatch_.reset();
        first_.reset();
        endedPartly();
    });
}

void Instance::takeStatus() {
    status_ = Keeper::statusAt(process_.child.end);
    if (!status_) return endWatch_->awaitReadable([this] { takeStatus(); });
    endWatch_.reset();
    // What is left in the sandbox has lost what it was for.
    kill();
    endedPartly();
}

/// As long as something may come of `info`, there may be a first process.
void Instance::endedPartly() {
    if (!status_ || process_.info || first_) return;
    network_.reset();
    output_.finish();
    // The last that is done: it may be the end of this object.
    const auto ended = ended_;
    ended(*status_);
}

}  // namespace platform::spawnerd
