#pragma once

#include <cstdint>
#include <map>
#include <string>

#include "platform/log/Log.h"

namespace platform::tandry {

/// What walks over the disk found wrong. Each fault costs one line, however many walks meet it
/// before it is mended. Belongs to the registry's thread.
class Complaints {
  public:
    /// Logs "<what> <which>", unless the last walk over the place said the same of it. `which`
    /// names files, and is private.
    void add(const std::string& path, const char* what, const std::string& which);
    /// Logs that, whatever was said before.
    void say(const char* what, const std::string& which) const;

    void beginWalk() { ++walk_; }
    /// Errors, unless a client asked about the place and is answered, which anybody may repeat.
    void setLevel(LogLevel level) { level_ = level; }
    /// Faults within `scope` that this walk did not meet are mended.
    void forgetUnmet(const std::string& scope);

  private:
    struct Complaint {
        std::string what;
        std::string which;
        std::uint32_t walk = 0;
    };
    std::map<std::string, Complaint> complaints_;
    std::uint32_t walk_ = 0;
    LogLevel level_ = LogLevel::Error;
};

}  // namespace platform::tandry
