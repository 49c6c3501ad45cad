#include "platform/system/Process.h"

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <csignal>

namespace platform {

void openStandardDescriptors() {
    // The lowest free number is given out: one of these three until all are open.
    int fd = -1;
    do {
        fd = ::open("/dev/null", O_RDWR);
    } while (fd >= 0 && fd <= STDERR_FILENO);
    if (fd > STDERR_FILENO) ::close(fd);
}

void prepareDaemonProcess() {
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
