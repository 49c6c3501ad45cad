#include "platform/lum/Origin.h"

#include <fcntl.h>
#include <linux/nsfs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <optional>
#include <string>
#include <utility>

#include "platform/system/FileIdentity.h"
#include "platform/system/UniqueFd.h"

namespace platform {

namespace {

/// A kind of namespaces that lie one within the other.
struct Kind {
    const char* link;  // of a process's directory below /proc
    FileIdentity own;

    static Kind make(const char* link) {
        struct stat status {};
        ::stat((std::string("/proc/self/") + link).c_str(), &status);
        return {link, FileIdentity::of(status)};
    }
};

const Kind& processKind() {
    static const Kind kind = Kind::make("ns/pid");
    return kind;
}

const Kind& userKind() {
    static const Kind kind = Kind::make("ns/user");
    return kind;
}

struct Namespace {
    FileIdentity identity;
    UniqueFd descriptor;  // none when there are none left
};

/// Goes out to the last that is not ours: whoever is in a sandbox can make more inside it. False
/// when it lies in none of ours.
bool goOutermost(Namespace& space, const Kind& kind) {
    for (;;) {
        UniqueFd outer(::ioctl(space.descriptor.get(), NS_GET_PARENT));
        const auto identity = outer ? FileIdentity::ofOpen(outer.get()) : std::nullopt;
        if (!identity) return !space.descriptor;
        if (*identity == kind.own) return true;
        space = {*identity, std::move(outer)};
    }
}

/// The outermost one around a process, if that is not in ours.
std::optional<Namespace> sandboxOf(const AuditToken& token, const Kind& kind) {
    struct stat status {};
    if (::fstatat(token.procDirectory(), kind.link, &status, 0) != 0) return std::nullopt;
    Namespace space{FileIdentity::of(status), UniqueFd()};
    if (space.identity == kind.own) return std::nullopt;
    space.descriptor.reset(::openat(token.procDirectory(), kind.link, O_RDONLY | O_CLOEXEC));
    if (!goOutermost(space, kind)) return std::nullopt;
    return space;
}

/// What stands for the sandbox of a process, if it is in one. Of a sandbox with a user namespace it
/// is that: its processes may be in any number of others, of either kind, within.
std::optional<FileIdentity> sandboxOf(const AuditToken& token) {
    const auto processes = sandboxOf(token, processKind());
    if (!processes) {
        const auto users = sandboxOf(token, userKind());
        return users ? std::optional(users->identity) : std::nullopt;
    }
    Namespace owner{{}, UniqueFd(::ioctl(processes->descriptor.get(), NS_GET_USERNS))};
    const auto identity =
        owner.descriptor ? FileIdentity::ofOpen(owner.descriptor.get()) : std::nullopt;
    if (!identity || *identity == userKind().own) return processes->identity;
    owner.identity = *identity;
    return goOutermost(owner, userKind()) ? owner.identity : processes->identity;
}

}  // namespace

Origin Origin::of(const AuditToken& token) {
    if (const auto sandbox = sandboxOf(token)) return {sandbox->device, sandbox->inode, 0};
    // A process that has just ended, or may not be asked about, stands for itself. All that are in
    // sessions from outside our namespace are one: such sessions have no number here.
    const pid_t session = ::getsid(token.pid());
    return {0, 0, session >= 0 ? session : token.pid()};
}

}  // namespace platform
