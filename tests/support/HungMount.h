#pragma once

#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <unistd.h>

#include <string>

#include "platform/system/UniqueFd.h"

namespace test {

/// A file system that does not answer: no program is behind it.
class HungMount {
  public:
    /// Gives this process mounts of its own; false when it may not have such.
    static bool isPossible() {
        return ::geteuid() == 0 && ::access("/dev/fuse", R_OK | W_OK) == 0 &&
               ::unshare(CLONE_NEWNS) == 0 &&
               ::mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0;
    }
    ~HungMount() { end(); }

    /// From now on whoever looks beneath the path waits.
    bool begin(const std::string& path) {
        path_ = path;
        fuse_.reset(::open("/dev/fuse", O_RDWR | O_CLOEXEC));
        const std::string options =
            "rootmode=40000,user_id=0,group_id=0,fd=" + std::to_string(fuse_.get());
        return ::mount("hung", path.c_str(), "fuse", MS_NOSUID | MS_NODEV, options.c_str()) == 0;
    }
    /// Those who wait get an error, and what was there before is there again.
    void end() {
        if (!fuse_) return;
        fuse_.reset();
        ::umount2(path_.c_str(), MNT_DETACH);
    }

  private:
    std::string path_;
    platform::UniqueFd fuse_;
};

}  // namespace test
