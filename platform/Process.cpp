#include "platform/Process.h"

#include <sys/resource.h>
#include <sys/stat.h>
#include <systemd/sd-daemon.h>

#include <csignal>

namespace platform {

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
