#include "platform/spawnerd/SystemCallFilter.h"

#include <fcntl.h>
#include <linux/sched.h>
#include <netinet/in.h>
#include <seccomp.h>
#include <sys/ioctl.h>
#include <sys/mman.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <initializer_list>
#include <memory>
#include <mutex>
#include <set>
#include <span>
#include <utility>
#include <vector>

#include "platform/system/Files.h"
#include "platform/system/UniqueFd.h"

namespace platform::spawnerd {

namespace {

/// Refused with EPERM, whatever the arguments. Names that a library or a machine does not know are
/// left out: the library is as old as the kernel's headers, or the machine lacks the call.
constexpr const char* kRefused[] = {
    // Other processes, also the sandbox's first one, whose end is the end of all.
    "ptrace", "process_vm_readv", "process_vm_writev", "process_madvise", "kcmp", "pidfd_getfd",
    // Keys.
    "add_key", "request_key", "keyctl",
    // Ways into the kernel that have been broken often and that plug-ins have no need of.
    "bpf", "perf_event_open", "userfaultfd", "io_uring_setup", "io_uring_enter",
    "io_uring_register", "fanotify_init", "lookup_dcookie", "uselib", "modify_ldt", "vm86",
    "vm86old", "iopl", "ioperm",
    // Mounts and namespaces: without them a plug-in cannot make itself privileges.
    "mount", "umount", "umount2", "pivot_root", "chroot", "fsopen", "fsmount", "fsconfig", "fspick",
    "move_mount", "open_tree", "mount_setattr", "unshare", "setns", "open_by_handle_at",
    // The machine's own business.
    "kexec_load", "kexec_file_load", "create_module", "init_module", "finit_module",
    "delete_module", "get_kernel_syms", "query_module", "syslog", "acct", "quotactl", "quotactl_fd",
    "swapon", "swapoff", "reboot", "nfsservctl", "vhangup",
    // While anybody has such memory the machine does not hibernate.
    "memfd_secret"};

/// Its flags lie in memory, where no filter sees them. Programs take this for an old kernel and
/// use "clone".
constexpr const char* kMissing[] = {"clone3"};

constexpr std::uint32_t kNewNamespaces[] = {CLONE_NEWNS,  CLONE_NEWCGROUP, CLONE_NEWUTS,
                                            CLONE_NEWIPC, CLONE_NEWUSER,   CLONE_NEWPID,
                                            CLONE_NEWNET};

/// They put input into a terminal as if it were typed.
constexpr std::uint32_t kTyping[] = {TIOCSTI, TIOCLINUX};

/// With a lease on a file that it reads, the system's own ones too, a process holds up everybody
/// who opens that file; notifications of a directory come from the same place.
constexpr std::uint32_t kHoldingUp[] = {F_SETLEASE, F_NOTIFY};

/// No netlink: it is a wide road into the kernel, and tells of the machine's network also those who
/// have none. Resolvers ask it which kinds of addresses there are, and without it try them all.
constexpr std::uint32_t kFamilies[] = {AF_UNSPEC, AF_UNIX, AF_INET, AF_INET6};

/// Of internet sockets: what a program chooses that names none, ICMP, TCP, UDP and ICMPv6. Others
/// (SCTP, L2TP, ...) would be loaded into the kernel for whoever asks.
constexpr std::uint32_t kProtocols[] = {IPPROTO_IP, IPPROTO_ICMP, IPPROTO_TCP, IPPROTO_UDP,
                                        IPPROTO_ICMPV6};

/// Of Unix sockets: senders that wait for a full queue of datagrams can have more descriptors on
/// their way than a user may have, and then nobody of the user's passes any.
constexpr std::uint32_t kPiling[] = {SOCK_DGRAM, SOCK_RAW};
constexpr std::uint32_t kSocketTypes = 0xf;

/// The question which one is set. Others change how memory is laid out, or what is executable.
constexpr std::uint32_t kPersonalities[] = {0xffffffff};

constexpr std::uint32_t kAllBits = 0xffffffff;

/// A filter that is being written. After the first failure nothing more happens.
class Rules {
  public:
    Rules() : context_(::seccomp_init(SCMP_ACT_ALLOW), &::seccomp_release) {
        if (!context_) failure_ = -ENOMEM;
        if (failure_ != 0) return;
        fail(::seccomp_attr_set(context_.get(), SCMP_FLTATR_ACT_BADARCH, kNo));
        for (const std::uint32_t architecture : foreignArchitectures()) {
            const int result = ::seccomp_arch_add(context_.get(), architecture);
            if (result != -EEXIST) fail(result);
        }
    }

    void refuse(const char* call, std::uint32_t action = kNo) { add(call, action, {}); }
    /// Compares as the kernel does for arguments of type "int": bits above the 32nd do not count.
    void refuseValue(const char* call, unsigned argument, std::uint32_t value) {
        refuseBits(call, argument, kAllBits, value);
    }
    void refuseFlag(const char* call, unsigned argument, std::uint32_t flag) {
        refuseBits(call, argument, flag, flag);
    }
    void refusePair(const char* call, std::uint32_t first, scmp_arg_cmp second) {
        add(call, kNo, {scmp_arg_cmp{0, SCMP_CMP_MASKED_EQ, kAllBits, first}, second});
    }
    /// Rules only say what is refused. A value that is not allowed agrees with an allowed one down
    /// to some bit and not in that one: so each rule names a bit, and what is above it.
    void refuseOthers(const char* call, unsigned argument, std::span<const std::uint32_t> allowed) {
        std::set<std::pair<std::uint32_t, std::uint32_t>> written;
        for (const std::uint32_t value : allowed)
            for (int bit = 31; bit >= 0; --bit) {
                const std::uint32_t mask = kAllBits << bit;
                const std::uint32_t other = (value ^ (1u << bit)) & mask;
                const bool isBegun = std::ranges::any_of(
                    allowed, [&](std::uint32_t one) { return (one & mask) == other; });
                if (!isBegun && written.emplace(mask, other).second)
                    refuseBits(call, argument, mask, other);
            }
    }

    /// The program as the kernel loads it.
    Result<std::string> compile() {
        const UniqueFd file(::memfd_create("filter", MFD_CLOEXEC));
        if (!file) return Error::posix(errno, kText);
        if (failure_ == 0) fail(::seccomp_export_bpf(context_.get(), file.get()));
        if (failure_ != 0) return Error::posix(-failure_, kText);
        return readFile("/proc/self/fd/" + std::to_string(file.get()), kMostBytes);
    }

  private:
    static constexpr std::uint32_t kNo = SCMP_ACT_ERRNO(EPERM);
    static constexpr const char* kText = "the filter of system calls";
    static constexpr std::size_t kMostBytes = 8u * 4096;  // the kernel's own limit

    /// Besides the one that this program is of.
    static std::vector<std::uint32_t> foreignArchitectures() {
        switch (::seccomp_arch_native()) {
            case SCMP_ARCH_X86_64:
                return {SCMP_ARCH_X86, SCMP_ARCH_X32};
            case SCMP_ARCH_AARCH64:
                return {SCMP_ARCH_ARM};
            default:
                return {};
        }
    }

    void refuseBits(const char* call, unsigned argument, std::uint32_t mask, std::uint32_t value) {
        add(call, kNo, {scmp_arg_cmp{argument, SCMP_CMP_MASKED_EQ, mask, value}});
    }
    void add(const char* name, std::uint32_t action,
             std::initializer_list<scmp_arg_cmp> arguments) {
        const int call = ::seccomp_syscall_resolve_name(name);
        if (call == __NR_SCMP_ERROR || failure_ != 0) return;
        fail(::seccomp_rule_add_array(context_.get(), action, call,
                                      static_cast<unsigned>(arguments.size()), arguments.begin()));
    }
    void fail(int result) {
        if (result < 0 && failure_ == 0) failure_ = result;
    }

    const std::unique_ptr<void, void (*)(scmp_filter_ctx)> context_;
    int failure_ = 0;
};

Result<std::string> compile() {
    Rules rules;
    for (const char* call : kRefused) rules.refuse(call);
    for (const char* call : kMissing) rules.refuse(call, SCMP_ACT_ERRNO(ENOSYS));
    for (const std::uint32_t flag : kNewNamespaces) rules.refuseFlag("clone", 0, flag);
    for (const std::uint32_t request : kTyping) rules.refuseValue("ioctl", 1, request);
    for (const char* call : {"fcntl", "fcntl64"})
        for (const std::uint32_t command : kHoldingUp) rules.refuseValue(call, 1, command);
    for (const char* call : {"socket", "socketpair"}) {
        rules.refuseOthers(call, 0, kFamilies);
        rules.refuseOthers(call, 2, kProtocols);
        for (const std::uint32_t type : kPiling)
            rules.refusePair(call, AF_UNIX,
                             scmp_arg_cmp{1, SCMP_CMP_MASKED_EQ, kSocketTypes, type});
    }
    rules.refuseOthers("personality", 0, kPersonalities);
    return rules.compile();
}

}  // namespace

Result<std::string> systemCallFilter() {
    static std::mutex mutex;
    static std::string filter;  // guarded by the mutex; empty until it could be compiled
    const std::lock_guard lock(mutex);
    if (filter.empty()) {
        Result<std::string> compiled = compile();
        if (!compiled) return compiled;
        filter = std::move(*compiled);
    }
    return filter;
}

}  // namespace platform::spawnerd
