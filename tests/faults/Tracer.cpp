#include "tests/faults/Tracer.h"

#include <algorithm>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <map>
#include <set>
#include <stdexcept>

namespace test {

namespace {

const std::set<std::string> kFileCalls{
    "access",     "faccessat", "faccessat2", "fallocate", "fchmod",    "fchown",     "fcntl",
    "fdatasync",  "flock",     "fstat",      "fsync",     "ftruncate", "getdents64", "getrandom",
    "link",       "linkat",    "lseek",      "lstat",     "mkdir",     "mkdirat",    "newfstatat",
    "open",       "openat",    "openat2",    "pread64",   "pwrite64",  "read",       "readlink",
    "readlinkat", "rename",    "renameat",   "renameat2", "stat",      "statx",      "unlink",
    "unlinkat",   "write"};

/// The system call that a line of notes begins, behind the number of its thread; empty for other
/// lines. One that was going on when the notes began is none.
std::string callIn(const std::string& line, std::string& thread) {
    const std::size_t name = line.find_first_not_of("0123456789 ");
    const std::size_t end = line.find('(');
    if (name == line.npos || end == line.npos || name >= end) return {};
    const std::string call = line.substr(name, end - name);
    if (call == "restart_syscall" || call.find_first_of(" <+-=.") != call.npos) return {};
    thread = line.substr(0, name);
    return call;
}

/// What the kernel says of a thread under a key.
std::string statusOf(const std::filesystem::path& thread, const std::string& key) {
    std::ifstream status(thread / "status");
    for (std::string line; std::getline(status, line);)
        if (line.starts_with(key + ":\t")) return line.substr(key.size() + 2);
    return {};
}

bool isTraced(const std::filesystem::path& thread) {
    return statusOf(thread, "TracerPid") != "0";
}

std::filesystem::directory_iterator threadsOf(pid_t process) {
    return std::filesystem::directory_iterator("/proc/" + std::to_string(process) + "/task");
}

}  // namespace

bool waitUntilIdle(pid_t process) {
    constexpr int kMuch = 10;
    std::string before;
    int still = 0;
    return waitUntil([&] {
        std::string now;
        for (const auto& thread : threadsOf(process))
            now += thread.path().filename().string() + statusOf(thread, "State") +
                   statusOf(thread, "voluntary_ctxt_switches");
        still = now == before && now.find('R') == now.npos ? still + 1 : 0;
        before = now;
        return still == kMuch;
    });
}

Tracer::Tracer(pid_t process, Scope scope, std::string log, const Fault* fault)
    : log_(std::move(log)) {
    std::vector<std::string> arguments;
    if (scope == All) arguments.push_back("-f");
    std::vector<std::filesystem::path> threads;
    for (const auto& thread : threadsOf(process)) {
        const std::string id = thread.path().filename();
        if (scope == Others && id == std::to_string(process)) continue;
        arguments.insert(arguments.end(), {"-p", id});
        threads.push_back(thread);
    }
    start(fault, std::move(arguments));
    if (!waitUntil([&] { return !strace_->isRunning() || std::ranges::all_of(threads, isTraced); }))
        throw std::runtime_error("strace follows nothing");
}

Tracer::Tracer(std::vector<std::string> command, std::string log, const Fault* fault)
    : log_(std::move(log)) {
    start(fault, std::move(command));
}

void Tracer::start(const Fault* fault, std::vector<std::string> arguments) {
    std::vector<std::string> all{"-q", "-o", log_};
    if (fault) {
        const std::string when = ":when=" + std::to_string(fault->number);
        all.insert(all.end(), {"-e", "trace=" + fault->call, "-e",
                               "inject=" + fault->call + ":" + fault->what + when});
    }
    all.insert(all.end(), arguments.begin(), arguments.end());
    strace_ = std::make_unique<Process>("/usr/bin/strace", std::move(all), log_);
}

void Tracer::stop() {
    strace_->signal(SIGTERM);
    strace_->wait();
}

std::vector<Fault> Tracer::faults(const std::string& marker) const {
    std::map<std::string, int> counts;  // by call and thread
    std::set<std::pair<std::string, int>> seen;
    std::vector<Fault> faults;
    std::ifstream notes(log_);
    bool marked = marker.empty();
    for (std::string line, thread; std::getline(notes, line);) {
        const std::string call = callIn(line, thread);
        if (call.empty()) continue;
        const int number = ++counts[call + ' ' + thread];
        marked = marked || line.find(marker) != line.npos;
        if (!marked || call.starts_with("exit") || !seen.emplace(call, number).second) continue;
        faults.push_back({call, number, Fault::kKill});
        if (!kFileCalls.contains(call)) continue;
        for (const char* error : {"ENOSPC", "EIO", "EMFILE", "EINTR"})
            faults.push_back({call, number, std::string("error=") + error});
    }
    return faults;
}

}  // namespace test
