#include "platform/system/Process.h"

#include <fcntl.h>
#include <malloc.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <string>

#include "platform/system/Files.h"

namespace platform {

namespace {

constexpr int kMostKeptMemory = 1 << 20;  // free, at the end of each of the allocator's arenas

}  // namespace

pid_t parentOf(pid_t process) {
    constexpr std::size_t kMostStat = 4096;
    const auto text = readFile("/proc/" + std::to_string(process) + "/stat", kMostStat);
    // The name, in parentheses, may contain anything.
    const std::size_t place = text ? text->rfind(')') : std::string::npos;
    int parent = 0;
    if (place != std::string::npos) std::sscanf(text->c_str() + place, ") %*c %d", &parent);
    return parent;
}

void openStandardDescriptors() {
    // The lowest free number is given out: one of these three until all are open.
    int fd = -1;
    do {
        fd = ::open("/dev/null", O_RDWR);
    } while (fd >= 0 && fd <= STDERR_FILENO);
    if (fd > STDERR_FILENO) ::close(fd);
}

void prepareDaemonProcess() {
    // Left alone, the allocator keeps ever more for itself once something large has been freed.
    mallopt(M_MMAP_THRESHOLD, kMostKeptMemory);
    mallopt(M_TRIM_THRESHOLD, kMostKeptMemory);
    // Nor does it give back much of what each of many threads frees, if each has a heap of its own.
    mallopt(M_ARENA_MAX, 2);
    umask(077);
    std::signal(SIGPIPE, SIG_IGN);
    std::signal(SIGXFSZ, SIG_IGN);
    rlimit limit{};
    if (getrlimit(RLIMIT_NOFILE, &limit) == 0) {
        limit.rlim_cur = limit.rlim_max;
        setrlimit(RLIMIT_NOFILE, &limit);
    }
}

void notifyServiceManagerReady() {
    sd_notify(0, "READY=1");
}

}  // namespace platform
