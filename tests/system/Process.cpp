#include "tests/system/Process.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <fstream>
#include <sstream>
#include <stdexcept>
#include <thread>

namespace test {

namespace {

std::string contents(const std::string& path) {
    std::ostringstream text;
    text << std::ifstream(path).rdbuf();
    return text.str();
}

int statusOf(int raw) {
    return WIFEXITED(raw) ? WEXITSTATUS(raw) : -WTERMSIG(raw);
}

}  // namespace

bool waitUntil(const std::function<bool()>& condition) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (!condition()) {
        if (std::chrono::steady_clock::now() > deadline) return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    return true;
}

Process::Process(const std::string& program, std::vector<std::string> arguments, std::string output)
    : output_(std::move(output)) {
    std::vector<char*> argv{const_cast<char*>(program.c_str())};
    for (std::string& argument : arguments) argv.push_back(argument.data());
    argv.push_back(nullptr);
    posix_spawn_file_actions_t files;
    posix_spawn_file_actions_init(&files);
    const int flags = O_WRONLY | O_CREAT | O_TRUNC | O_APPEND;
    posix_spawn_file_actions_addopen(&files, 1, (output_ + ".out").c_str(), flags, 0600);
    posix_spawn_file_actions_addopen(&files, 2, (output_ + ".err").c_str(), flags, 0600);
    const int failed = posix_spawn(&pid_, program.c_str(), &files, nullptr, argv.data(), environ);
    posix_spawn_file_actions_destroy(&files);
    if (failed) throw std::runtime_error("cannot start " + program);
}

Process::~Process() {
    signal(SIGKILL);
    wait();
}

bool Process::isRunning() {
    int raw = 0;
    if (!ended_ && ::waitpid(pid_, &raw, WNOHANG) == pid_) {
        ended_ = true;
        status_ = statusOf(raw);
    }
    return !ended_;
}

void Process::signal(int number) const {
    if (!ended_) ::kill(pid_, number);
}

int Process::wait() {
    if (!waitUntil([this] { return !isRunning(); })) throw std::runtime_error("it does not end");
    return status_;
}

std::string Process::out() const {
    return contents(output_ + ".out");
}
std::string Process::err() const {
    return contents(output_ + ".err");
}

std::size_t Process::errLines(const std::string& text) const {
    std::istringstream lines(err());
    std::size_t count = 0;
    for (std::string line; std::getline(lines, line);)
        count += line.find(text) != std::string::npos;
    return count;
}

}  // namespace test
