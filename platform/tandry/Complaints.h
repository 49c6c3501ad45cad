#pragma once

#include <cstdint>
#include <map>
#include <string>

namespace platform::tandry {

/// What walks over the disk found wrong. Each fault costs one error line, however many walks meet
/// it before it is mended. Belongs to the registry's thread.
class Complaints {
  public:
    /// Logs `text`, unless the last walk over the place said the same of it.
    void add(const std::string& path, const std::string& text);

    void beginWalk() { ++walk_; }
    /// Faults within `scope` that this walk did not meet are mended.
    void forgetUnmet(const std::string& scope);

  private:
    struct Complaint {
        std::string text;
        std::uint32_t walk = 0;
    };
    std::map<std::string, Complaint> complaints_;
    std::uint32_t walk_ = 0;
};

}  // namespace platform::tandry
