// A plug-in that does what its host tells it, to see what it gets away with. A request is a line,
// the answer a text and a zero byte. What can be said in one line of shell, or is one system call,
// needs nothing here; for other attempts add a function to `kAttempts`.

#include <fcntl.h>
#include <sys/inotify.h>
#include <sys/ioctl.h>
#include <sys/ptrace.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <sstream>
#include <string>

namespace {

/// "ok", or the errno's name.
std::string outcome(long result) {
    return result >= 0 ? "ok" : strerrorname_np(errno);
}

/// The numbers in a text, decimal or, after "0x", hexadecimal; 0 for those that are missing.
std::array<long, 7> numbersIn(const std::string& text) {
    std::array<long, 7> numbers{};
    std::istringstream words(text);
    std::string word;
    for (std::size_t i = 0; i < numbers.size() && words >> word; ++i)
        numbers[i] = static_cast<long>(std::strtoul(word.c_str(), nullptr, 0));
    return numbers;
}

/// A line of shell, and what it writes to its standard output.
std::string shell(const std::string& line) {
    std::string output;
    FILE* pipe = ::popen(line.c_str(), "r");
    char buffer[4096];
    while (const std::size_t count = std::fread(buffer, 1, sizeof buffer, pipe))
        output.append(buffer, count);
    ::pclose(pipe);
    return output;
}

/// A system call: its number and arguments. In a child: some change the caller.
std::string call(const std::string& text) {
    const auto [number, a, b, c, d, e, f] = numbersIn(text);
    const pid_t child = ::fork();
    if (child == 0) ::_exit(::syscall(number, a, b, c, d, e, f) >= 0 ? 0 : errno);
    int status = 0;
    ::waitpid(child, &status, 0);
    if (!WIFEXITED(status)) return "killed";
    errno = WEXITSTATUS(status);
    return outcome(errno == 0 ? 0 : -1);
}

/// A system call as programs for 32 bits make it.
std::string call32(const std::string& text) {
#ifdef __x86_64__
    const auto numbers = numbersIn(text);
    const pid_t child = ::fork();
    if (child == 0) {
        long result = numbers[0];
        asm volatile("int $0x80"
                     : "+a"(result)
                     : "b"(numbers[1]), "c"(numbers[2]), "d"(numbers[3])
                     : "memory", "r8", "r9", "r10", "r11");
        const int code = static_cast<int>(result);
        ::_exit(code >= 0 ? 0 : -code);
    }
    int status = 0;
    ::waitpid(child, &status, 0);
    if (!WIFEXITED(status)) return "none";  // the kernel has no such calls
    errno = WEXITSTATUS(status);
    return outcome(errno == 0 ? 0 : -1);
#else
    return text.empty() ? "" : "none";
#endif
}

/// How many processes it can have, of so many that it tries to.
std::string forkBomb(const std::string& text) {
    const long most = numbersIn(text)[0];
    long count = 0;
    for (pid_t child = 0; count < most && (child = ::fork()) >= 0; ++count)
        if (child == 0)
            for (;;) ::pause();
    ::kill(-1, SIGKILL);
    while (::wait(nullptr) > 0) {
    }
    return std::to_string(count);
}

/// How many descriptors it can have, after asking for as many as it may.
std::string descriptors(const std::string&) {
    rlimit limit{};
    ::getrlimit(RLIMIT_NOFILE, &limit);
    limit.rlim_cur = limit.rlim_max;
    ::setrlimit(RLIMIT_NOFILE, &limit);
    int last = 0;
    for (int next = 0; (next = ::dup(0)) >= 0;) last = next;
    ::close_range(4, ~0U, 0);
    return std::to_string(last + 1);
}

/// How many queues for watches on files it can have, which the kernel counts by user.
std::string watchQueues(const std::string&) {
    int count = 0;
    while (::inotify_init1(IN_CLOEXEC) >= 0) ++count;
    ::close_range(4, ~0U, 0);
    return std::to_string(count);
}

/// Attaches to the sandbox's first process, whose death with the launcher's is what ends us.
std::string traceFirst(const std::string&) {
    return outcome(::ptrace(PTRACE_SEIZE, 1, nullptr, nullptr));
}

std::string writeFirst(const std::string&) {
    return outcome(::open("/proc/1/mem", O_RDWR | O_CLOEXEC));
}

using Attempt = std::string (*)(const std::string& rest);
const std::map<std::string, Attempt> kAttempts{
    {"sh", shell},
    {"call", call},
    {"call32", call32},
    {"fork-bomb", forkBomb},
    {"descriptors", descriptors},
    {"watch-queues", watchQueues},
    {"trace-first", traceFirst},
    {"write-first", writeFirst},
};

std::string answer(const std::string& request) {
    const std::size_t end = std::min(request.find(' '), request.size());
    const auto attempt = kAttempts.find(request.substr(0, end));
    if (attempt == kAttempts.end()) return "what?";
    return attempt->second(request.substr(std::min(end + 1, request.size())));
}

}  // namespace

int main() {
    constexpr int kConnection = 3;
    std::string request;
    for (char byte = 0; ::read(kConnection, &byte, 1) == 1;) {
        if (byte != '\n') {
            request.push_back(byte);
            continue;
        }
        const std::string text = answer(request);
        request.clear();
        if (::send(kConnection, text.c_str(), text.size() + 1, MSG_NOSIGNAL) < 0) return 1;
    }
}
