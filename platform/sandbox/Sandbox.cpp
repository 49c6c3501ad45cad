#include "platform/sandbox/Sandbox.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <optional>
#include <string>
#include <string_view>

#include "platform/log/OpsLog.h"
#include "platform/sandbox/Namespaces.h"
#include "platform/sandbox/SandboxBroker.h"
#include "platform/sandbox/SandboxTokens.h"
#include "platform/system/Files.h"
#include "platform/system/UniqueFd.h"

namespace platform {

namespace {

/// Far above a status file with the most supplementary groups that a process can have.
constexpr std::size_t kMaxStatusFile = 2u << 20;

/// What a process has laid upon itself, or was laid upon it, for good.
struct Bonds {
    bool filtersCalls;       // it has a seccomp filter
    bool barsNewPrivileges;  // no-new-privileges
};

/// Whether a field of a status file is there and not 0: a kernel that does not write it has nothing
/// of the kind.
bool isSet(const std::string& status, std::string_view field) {
    const std::size_t place = status.find(field);
    return place != std::string::npos && status.compare(place + field.size(), 2, "0\n") != 0;
}

/// When the status cannot be read, `unknown`.
Bonds bondsOf(int procDirectory, const Bonds& unknown) {
    const Result<std::string> status = readFileAt(procDirectory, "status", kMaxStatusFile);
    if (!status) return unknown;
    return {isSet(*status, "\nSeccomp:\t"), isSet(*status, "\nNoNewPrivs:\t")};
}

/// In doubt a peer has them, and we do not.
Bonds bondsOf(const AuditToken& token) {
    return bondsOf(token.procDirectory(), {true, true});
}

/// Looked at each time: a look that fails once must not count for as long as this process lives.
Bonds ownBonds() {
    const UniqueFd self(::open("/proc/self", O_PATH | O_DIRECTORY | O_CLOEXEC));
    return bondsOf(self.get(), {false, false});
}

/// Also true when the root of the process cannot be looked into.
bool mayHaveFlatpakInfo(int procDirectory) {
    struct stat status;
    if (::fstatat(procDirectory, "root/.flatpak-info", &status, AT_SYMLINK_NOFOLLOW) == 0)
        return true;
    return errno != ENOENT && errno != ENOTDIR;
}

Result<std::unique_ptr<SandboxBroker>> makeBroker(const Directories& directories,
                                                  const std::string& serviceName,
                                                  const Result<SandboxTokens>& tokens,
                                                  RunLoop& loop) {
    if (!tokens) return tokens.error();
    return SandboxBroker::make(directories, serviceName, *tokens, loop);
}

class KernelSandbox : public Sandbox {
  public:
    KernelSandbox(const Directories& directories, const std::string& serviceName, RunLoop& loop)
        : tokens_(SandboxTokens::make(serviceName)),
          broker_(makeBroker(directories, serviceName, tokens_, loop)) {
        if (!broker_)
            EVLOG_ERROR(ops(), "cannot issue sandbox extensions: {}", pub(broker_.error()));
    }

    bool isSandboxed(const AuditToken& token) override { return platform::isSandboxed(token); }
    bool isConfined(const AuditToken& token) override { return platform::isConfined(token); }

    Result<std::string> issueReadExtension(const KnownDirectory& bundle,
                                           const std::string& resource, Wait wait) override {
        if (!broker_) return broker_.error();
        return tokens_->issue(bundle, resource, wait);
    }

  private:
    const Result<SandboxTokens> tokens_;
    const Result<std::unique_ptr<SandboxBroker>> broker_;
};

}  // namespace

bool isSandboxed(const AuditToken& token) {
    // The namespaces come first: a process that shares ours did not build the root that the last
    // test looks into. Those of a process that is gone cannot be read.
    for (NamespaceKind kind : {NamespaceKind::User, NamespaceKind::Mount, NamespaceKind::Pid})
        if (!sharesNamespace(token, kind)) return true;
    if (bondsOf(token).filtersCalls && !ownBonds().filtersCalls) return true;
    return mayHaveFlatpakInfo(token.procDirectory());
}

bool isConfined(const AuditToken& token) {
    return isSandboxed(token) ||
           (bondsOf(token).barsNewPrivileges && !ownBonds().barsNewPrivileges);
}

std::unique_ptr<Sandbox> makeKernelSandbox(const Directories& directories,
                                           const std::string& serviceName, RunLoop& loop) {
    return std::make_unique<KernelSandbox>(directories, serviceName, loop);
}

}  // namespace platform
