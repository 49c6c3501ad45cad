#include "platform/spawnerd/Instance.h"

#include <poll.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
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
constexpr std::string_view kFirstProcess = "\"child-pid\":";

void sendKill(const UniqueFd& pidFd) {
    if (pidFd) ::syscall(SYS_pidfd_send_signal, pidFd.get(), SIGKILL, nullptr, 0);
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

Instance::Instance(RunLoop& loop, SandboxedProcess process, std::string name,
                   const InstanceLimits& limits, InstanceGroup group, std::function<void()> runs,
                   std::function<void(int)> ended)
    : loop_(loop),
      process_(std::move(process)),
      name_(std::move(name)),
      limits_(limits),
      group_(std::move(group)),
      runs_(std::move(runs)),
      ended_(std::move(ended)),
      output_(loop, std::move(process_.output), name_) {
    childWatch_.emplace(loop_, process_.pidFd.get());
    childWatch_->awaitReadable([this] { reap(); });
    infoWatch_.emplace(loop_, process_.info.get());
    infoWatch_->awaitReadable([this] { awaitInfo(); });
}

Instance::~Instance() {
    if (status_ && !first_) return;
    takeInfoNow();
    sendKill(first_);
    if (!status_) {
        sendKill(process_.pidFd);
        ::waitpid(process_.pid, nullptr, 0);
    }
    pollfd first{first_.get(), POLLIN, 0};
    if (first_) ::poll(&first, 1, kPatience);
}

/// Before its first process is known, killing our child would leave that one without the tie that
/// it has to it later: it waits at the gate until it is known, and never passes then.
void Instance::kill() {
    isDoomed_ = true;
    if (!first_ && process_.info) return;
    group_.kill();
    sendKill(first_);
    if (!status_) sendKill(process_.pidFd);
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
    if (isDoomed_ || !first_ || !limit()) return kill();
    const bool passed = ::write(process_.gate.get(), "", 1) == 1;
    process_.gate.reset();
    if (!passed) return kill();
    runs_();
}

bool Instance::limit() const {
    const auto first = static_cast<pid_t>(numberIn(infoText_, kFirstProcess));
    if (setProcessLimits(first, limits_) && group_.add(process_.pid) && group_.add(first))
        return true;
    EVLOG_ERROR(ops(), "cannot limit a plug-in: {}", pub(Error::posix(errno, name_)));
    return false;
}

void Instance::watchFirst() {
    firstWatch_.emplace(loop_, first_.get());
    firstWatch_->awaitReadable([this] {
        firstWatch_.reset();
        first_.reset();
        endedPartly();
    });
}

void Instance::reap() {
    int raw = 0;
    if (::waitpid(process_.pid, &raw, WNOHANG) != process_.pid)
        return childWatch_->awaitReadable([this] { reap(); });
    childWatch_.reset();
    status_ = WIFEXITED(raw) ? WEXITSTATUS(raw) : 128 + WTERMSIG(raw);
    // What it wrote before it ended is there; nobody else writes it.
    if (process_.info) {
        takeInfoNow();
        if (first_) watchFirst();
    }
    // What is left in the sandbox has lost what it was for.
    kill();
    endedPartly();
}

void Instance::endedPartly() {
    if (!status_ || first_) return;
    output_.finish();
    // The last that is done: it may be the end of this object.
    const auto ended = ended_;
    ended(*status_);
}

}  // namespace platform::spawnerd
