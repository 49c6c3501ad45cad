#include "platform/spawnerd/InstanceNetwork.h"

#include <fcntl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <csignal>
#include <sstream>
#include <utility>

namespace platform::spawnerd {

namespace {

constexpr std::chrono::seconds kPatience{3};
constexpr std::size_t kMostText = 16u << 10;
constexpr const char* kDevice = "/dev/net/tun";
/// Nobody's: queries to it go to the first of the machine's resolvers.
constexpr const char* kResolver = "169.254.1.1";

/// It has standard descriptors alone, as later versions close all others: the namespaces, and what
/// it writes to: a line with its number when it is done, before that what it has to complain of.
std::vector<std::string> wordsFor(const std::string& program) {
    const std::string self = "/proc/self/fd/";
    const std::string user = std::to_string(::geteuid()) + ":" + std::to_string(::getegid());
    return {program, "--foreground", "--quiet", "--runas", user, "--userns",
            self + std::to_string(STDIN_FILENO), "--netns", self + std::to_string(STDOUT_FILENO),
            "--no-netns-quit", "--pid", self + std::to_string(STDERR_FILENO), "--config-net",
            "--no-dhcp", "--no-dhcpv6", "--no-ra", "--no-icmp", "--dns-forward", kResolver,
            // Nothing comes in, and nothing goes to the machine itself.
            "--tcp-ports", "none", "--udp-ports", "none", "--tcp-ns", "none", "--udp-ns", "none",
            "--no-map-gw"};
}

bool isNumber(std::string_view line) {
    return !line.empty() && line.find_first_not_of("0123456789") == line.npos;
}

std::string_view lastLineOf(std::string_view text) {
    while (text.ends_with('\n')) text.remove_suffix(1);
    return text.substr(text.rfind('\n') + 1);
}

}  // namespace

Result<std::unique_ptr<InstanceNetwork>> InstanceNetwork::connect(
    RunLoop& loop, const Keeper& keeper, const std::string& program,
    const SandboxNamespaces& namespaces, Done done) {
    for (const auto& [path, use] : {std::pair(program.c_str(), X_OK), {kDevice, R_OK | W_OK}})
        if (::access(path, use) != 0) return Error::posix(errno, path);
    int ends[2];
    if (::pipe2(ends, O_CLOEXEC | O_NONBLOCK) != 0) return Error::posix(errno, program);
    UniqueFd told(ends[0]);
    const UniqueFd theirEnd(ends[1]);
    Result<Keeper::Child> child =
        keeper.run({.words = wordsFor(program),
                    .descriptors = {{namespaces.user.get(), STDIN_FILENO},
                                    {namespaces.network.get(), STDOUT_FILENO},
                                    {theirEnd.get(), STDERR_FILENO}}});
    if (!child) return child.error();
    return std::unique_ptr<InstanceNetwork>(
        new InstanceNetwork(loop, std::move(*child), std::move(told), std::move(done)));
}

InstanceNetwork::InstanceNetwork(RunLoop& loop, Keeper::Child child, UniqueFd told, Done done)
    : child_(std::move(child)),
      told_(std::move(told)),
      done_(std::move(done)),
      watch_(loop, told_.get()),
      patience_(loop) {
    watch_.awaitReadable([this] { read(); });
    patience_.start(kPatience, [this] { finish(Error::posix(ETIMEDOUT, kPasta)); });
}

InstanceNetwork::~InstanceNetwork() {
    ::syscall(SYS_pidfd_send_signal, child_.pidFd.get(), SIGKILL, nullptr, 0);
}

void InstanceNetwork::read() {
    char buffer[1024];
    const ssize_t count = ::read(told_.get(), buffer, sizeof buffer);
    if (count > 0) text_.append(buffer, static_cast<std::size_t>(count));
    const std::string_view last = lastLineOf(text_);
    if (text_.ends_with('\n') && isNumber(last)) return finish(std::nullopt);
    const bool goesOn = count > 0 || (count < 0 && (errno == EAGAIN || errno == EINTR));
    if (!goesOn || text_.size() > kMostText)
        return finish(Error{.domain = "POSIX", .code = EIO, .text = std::string(last)});
    watch_.awaitReadable([this] { read(); });
}

void InstanceNetwork::finish(std::optional<Error> error) {
    patience_.cancel();
    // The last that is done: it may be the end of this object.
    if (const auto done = std::exchange(done_, nullptr)) done(std::move(error));
}

std::string resolverSettings(std::string_view machine) {
    std::istringstream lines{std::string(machine)};
    std::string settings;
    bool hasOwn = false, hasResolver = false;
    for (std::string line; std::getline(lines, line);) {
        std::istringstream words(line);
        std::string key, address;
        words >> key >> address;
        const bool isLocal = address.starts_with("127.") || address == "::1";
        if (key != "nameserver" || !isLocal) settings += line + "\n";
        hasOwn |= key == "nameserver" && isLocal;
        hasResolver |= key == "nameserver" && !isLocal;
    }
    // Without any, programs ask the machine they are on.
    if (hasOwn || !hasResolver) settings += std::string("nameserver ") + kResolver + "\n";
    return settings;
}

}  // namespace platform::spawnerd
