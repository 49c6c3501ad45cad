#include "platform/spawnerd/SandboxProfile.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <initializer_list>
#include <iterator>
#include <utility>

#include "platform/lum/Listener.h"
#include "platform/sandbox/BusyFolder.h"
#include "platform/sandbox/SandboxTokens.h"
#include "platform/spawnerd/Grant.h"
#include "platform/spawnerd/InstanceNetwork.h"
#include "platform/spawnerd/Protocol.h"
#include "platform/spawnerd/SandboxedProcess.h"
#include "platform/system/Directories.h"
#include "platform/system/Files.h"

namespace platform::spawnerd {

namespace {

/// Names are resolved and certificates checked only where there is a network.
constexpr const char* kNetworkFiles[] = {"/etc/hosts", "/etc/nsswitch.conf", "/etc/services",
                                         "/etc/ssl/certs", "/etc/ssl/openssl.cnf"};
constexpr const char* kResolverSettings = "/etc/resolv.conf";
constexpr std::size_t kMostResolverSettings = 64u << 10;
constexpr const char* kFonts[] = {"/etc/fonts"};

/// What a keyboard sees is typed, what a filter or a preview sees is the user's data: nothing of it
/// may leave the machine.
constexpr SandboxProfile kProfiles[] = {
    {.name = "plugin", .network = true, .files = {}, .limits = kWorkLimits},
    {.name = "keyboard", .network = false, .files = {}, .limits = kSmallLimits},
    {.name = "network-filter", .network = false, .files = {}, .limits = kSmallLimits},
    {.name = "glimsed", .network = false, .files = kFonts, .limits = kWorkLimits},
};

/// The system, read-only: programs and libraries, and the few settings that the loader and the
/// system's programs need. Nothing here tells who uses the machine.
constexpr const char* kSystem[] = {"/usr", "/bin", "/sbin", "/lib", "/lib32", "/lib64", "/libx32"};
constexpr const char* kSystemFiles[] = {"/etc/alternatives", "/etc/ld.so.cache", "/etc/ld.so.conf",
                                        "/etc/ld.so.conf.d", "/etc/localtime"};

constexpr const char* kConfinement[] = {
    "--unshare-user",
    "--disable-userns",
    "--unshare-pid",
    "--unshare-ipc",
    "--unshare-uts",
    "--unshare-net",
    "--unshare-cgroup",
    "--new-session",
    "--die-with-parent",
    "--cap-drop",
    "ALL",
    "--hostname",
    "plugin",
};

using Arguments = std::vector<std::string>;

void append(Arguments& arguments, std::initializer_list<std::string_view> more) {
    arguments.insert(arguments.end(), more.begin(), more.end());
}

void bindSystem(Arguments& arguments, const SandboxProfile& profile, const InstanceLimits& limits) {
    for (const char* path : kSystem) {
        char target[PATH_MAX];
        const ssize_t length = ::readlink(path, target, sizeof target);
        if (length > 0)
            append(arguments, {"--symlink", {target, static_cast<std::size_t>(length)}, path});
        else
            append(arguments, {"--ro-bind-try", path, path});
    }
    for (const char* path : kSystemFiles) append(arguments, {"--ro-bind-try", path, path});
    for (const char* path : profile.files) append(arguments, {"--ro-bind-try", path, path});
    // Root owns the kernel's settings below /proc, also without any privileges.
    append(arguments, {"--proc", "/proc", "--remount-ro", "/proc"});
    // Everything in /dev that can be written to lies in memory.
    append(arguments, {"--dev", "/dev", "--size", std::to_string(limits.sharedMemory), "--tmpfs",
                       "/dev/shm", "--remount-ro", "/dev"});
    // The machine has so many pseudo terminals, which all its sandboxes would share.
    append(arguments, {"--tmpfs", "/dev/pts", "--remount-ro", "/dev/pts"});
    append(arguments, {"--size", std::to_string(limits.temporary), "--tmpfs", "/tmp"});
}

/// Where tokens are traded for access. The daemon itself and its launcher serve hosts, which a
/// plug-in is not. The socket alone: its directory holds locks, which would be anybody's to take.
std::optional<Error> bindTokenBroker(Arguments& arguments, const Directories& directories,
                                     const std::string& daemonService) {
    const auto path = lum::socketPath(directories, sandboxServiceName(daemonService));
    if (!path) return path.error();
    append(arguments, {"--ro-bind-try", *path, *path});
    return std::nullopt;
}

void bindDescriptor(SandboxSetup& setup, std::string_view how, UniqueFd descriptor,
                    std::string_view place) {
    const auto number = static_cast<int>(setup.descriptors.size()) + kFirstSetupDescriptor;
    append(setup.arguments, {how, std::to_string(number), place});
    setup.descriptors.push_back(std::move(descriptor));
}

std::optional<Error> bindNetworkFiles(SandboxSetup& setup) {
    for (const char* path : kNetworkFiles) append(setup.arguments, {"--ro-bind-try", path, path});
    const auto machine = readFile(kResolverSettings, kMostResolverSettings);
    UniqueFd settings = memoryFile(resolverSettings(machine ? *machine : std::string()));
    if (!settings) return Error::posix(errno, kResolverSettings);
    append(setup.arguments, {"--perms", "0444"});
    bindDescriptor(setup, "--ro-bind-data", std::move(settings), kResolverSettings);
    return std::nullopt;
}

/// The plug-in's own variables may replace the first ones, not the last.
void setEnvironment(Arguments& arguments, const Grant& grant, const Directories& directories,
                    const std::string& daemonService) {
    const auto set = [&](std::string_view name, std::string_view value) {
        append(arguments, {"--setenv", name, value});
    };
    append(arguments, {"--clearenv"});
    set("PATH", "/usr/local/bin:/usr/bin:/bin");
    for (const char* name : {"LANG", "LANGUAGE", "LC_ALL", "LC_MESSAGES", "TZ"})
        if (const char* value = std::getenv(name)) set(name, value);
    for (const auto& [name, value] : grant.environment) set(name, value);
    set("XDG_RUNTIME_DIR", directories.runtime);
    set(kConnectionVariable, std::to_string(kConnectionDescriptor));
    set(kIdentifierVariable, grant.bundleIdentifier);
    set(kServiceVariable, daemonService);
}

}  // namespace

const SandboxProfile* findSandboxProfile(std::string_view name) {
    const auto found = std::ranges::find(kProfiles, name, &SandboxProfile::name);
    return found == std::end(kProfiles) ? nullptr : &*found;
}

Result<SandboxSetup> sandboxSetup(const Grant& grant, GrantedPlaces places,
                                  const Directories& directories, const std::string& daemonService,
                                  const Surroundings& surroundings) {
    SandboxSetup setup;
    Arguments& arguments = setup.arguments;
    arguments.assign(std::begin(kConfinement), std::end(kConfinement));
    bindSystem(arguments, *grant.profile, surroundings.allowance.limits);
    if (surroundings.allowance.network)
        if (auto error = bindNetworkFiles(setup)) return *error;
    if (auto error = bindTokenBroker(arguments, directories, daemonService)) return *error;
    append(arguments, {"--ro-bind", surroundings.busyFolder,
                       BusyFolder::ofBundle(directories, grant.bundleIdentifier)});
    if (places.container)
        bindDescriptor(setup, "--bind-fd", std::move(places.container), grant.container);
    bindDescriptor(setup, "--ro-bind-fd", std::move(places.bundle), grant.bundle.path);
    append(arguments, {"--remount-ro", "/"});
    append(arguments, {"--chdir", grant.container.empty() ? "/" : grant.container});
    setEnvironment(arguments, grant, directories, daemonService);
    return setup;
}

}  // namespace platform::spawnerd
