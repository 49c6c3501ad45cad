#include "platform/spawnerd/SandboxProfile.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <initializer_list>
#include <iterator>

#include "platform/Directories.h"
#include "platform/Files.h"
#include "platform/lum/Listener.h"
#include "platform/spawnerd/Grant.h"
#include "platform/spawnerd/Protocol.h"

namespace platform::spawnerd {

namespace {

/// Names are resolved and certificates checked only where there is a network.
constexpr const char* kNetworkFiles[] = {"/etc/resolv.conf",   "/etc/hosts",
                                         "/etc/nsswitch.conf", "/etc/services",
                                         "/etc/ssl/certs",     "/etc/ssl/openssl.cnf"};
constexpr const char* kFonts[] = {"/etc/fonts"};

/// What a keyboard sees is typed, what a filter or a preview sees is the user's data: nothing of it
/// may leave the machine.
constexpr SandboxProfile kProfiles[] = {
    {.name = "plugin", .network = true, .files = kNetworkFiles},
    {.name = "keyboard", .network = false, .files = {}},
    {.name = "network-filter", .network = false, .files = {}},
    {.name = "glimsed", .network = false, .files = kFonts},
};

/// The system, read-only: programs and libraries, and the few settings that the loader and the
/// system's programs need. Nothing here tells who uses the machine.
constexpr const char* kSystem[] = {"/usr", "/bin", "/sbin", "/lib", "/lib32", "/lib64", "/libx32"};
constexpr const char* kSystemFiles[] = {"/etc/alternatives", "/etc/ld.so.cache", "/etc/ld.so.conf",
                                        "/etc/ld.so.conf.d", "/etc/localtime"};

constexpr const char* kConfinement[] = {
    "--unshare-user",   "--disable-userns", "--unshare-pid",     "--unshare-ipc", "--unshare-uts",
    "--unshare-cgroup", "--new-session",    "--die-with-parent", "--cap-drop",    "ALL",
    "--hostname",       "plugin",
};

/// Bytes that a plug-in may put into memory as files.
constexpr const char* kMostTemporary = "67108864";

using Arguments = std::vector<std::string>;

void append(Arguments& arguments, std::initializer_list<std::string_view> more) {
    arguments.insert(arguments.end(), more.begin(), more.end());
}

void bindSystem(Arguments& arguments, const SandboxProfile& profile) {
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
    append(arguments, {"--dev", "/dev", "--size", kMostTemporary, "--tmpfs", "/tmp"});
}

/// The sockets themselves: their directory holds locks, too, which would be anybody's to take.
std::optional<Error> bindServices(Arguments& arguments, const Directories& directories,
                                  const std::string& daemonService) {
    for (const char* suffix : {"", ".sandbox", ".spawnerd"}) {
        const auto path = lum::socketPath(directories, daemonService + suffix);
        if (!path) return path.error();
        append(arguments, {"--ro-bind-try", *path, *path});
    }
    return std::nullopt;
}

/// Where the plug-in states that it is busy.
std::optional<Error> bindAssertions(Arguments& arguments, const Directories& directories,
                                    const std::string& bundleIdentifier) {
    const std::string path = joinPath(directories.zorvanRuntime() + "/tenurd", bundleIdentifier);
    if (auto error = makeDirectories(path, 0700)) return error;
    if (auto error = checkOwnDirectory(path)) return error;
    append(arguments, {"--bind", path, path});
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

Result<std::vector<std::string>> sandboxArguments(const Grant& grant,
                                                  const Directories& directories,
                                                  const std::string& daemonService) {
    Arguments arguments(std::begin(kConfinement), std::end(kConfinement));
    if (!grant.profile->network) append(arguments, {"--unshare-net"});
    bindSystem(arguments, *grant.profile);
    if (auto error = bindServices(arguments, directories, daemonService)) return *error;
    if (auto error = bindAssertions(arguments, directories, grant.bundleIdentifier)) return *error;
    if (!grant.container.empty()) {
        // It was checked when the grant was made. Whoever is confined cannot exchange it: of a
        // container's place a plug-in sees nothing but what is inside.
        if (auto error = checkOwnDirectory(grant.container)) return *error;
        append(arguments, {"--bind", grant.container, grant.container});
    }
    append(arguments, {"--ro-bind", grant.bundle, grant.bundle, "--remount-ro", "/"});
    append(arguments, {"--chdir", grant.container.empty() ? "/" : grant.container});
    setEnvironment(arguments, grant, directories, daemonService);
    return arguments;
}

}  // namespace platform::spawnerd
