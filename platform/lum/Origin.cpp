#include "platform/lum/Origin.h"

#include <fcntl.h>
#include <linux/nsfs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <utility>

#include "platform/system/UniqueFd.h"

namespace platform {

namespace {

constexpr const char* kPidNamespace = "ns/pid";

const struct stat& ownNamespace() {
    static const struct stat own = [] {
        struct stat status {};
        ::stat("/proc/self/ns/pid", &status);
        return status;
    }();
    return own;
}

bool isOwn(const struct stat& status) {
    return status.st_ino == ownNamespace().st_ino && status.st_dev == ownNamespace().st_dev;
}

/// The outermost namespace around a peer's, its own included, that is not ours: whoever is in a
/// sandbox can make more inside it.
void findOutermost(int procDirectory, struct stat& status) {
    UniqueFd inner(::openat(procDirectory, kPidNamespace, O_RDONLY | O_CLOEXEC));
    while (inner) {
        UniqueFd outer(::ioctl(inner.get(), NS_GET_PARENT));
        struct stat parent {};
        if (!outer || ::fstat(outer.get(), &parent) != 0 || isOwn(parent)) return;
        status = parent;
        inner = std::move(outer);
    }
}

}  // namespace

Origin Origin::of(const AuditToken& token) {
    struct stat status {};
    const bool isKnown = ::fstatat(token.procDirectory(), kPidNamespace, &status, 0) == 0;
    if (isKnown && !isOwn(status)) {
        findOutermost(token.procDirectory(), status);
        return {status.st_dev, status.st_ino, 0};
    }
    // A process that has just ended, or may not be asked about, stands for itself. All that are in
    // sessions from outside our namespace are one: such sessions have no number here.
    const pid_t session = ::getsid(token.pid());
    return {0, 0, session >= 0 ? session : token.pid()};
}

}  // namespace platform
