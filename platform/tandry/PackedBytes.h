#pragma once

#include <string>
#include <string_view>

namespace platform::tandry {

/// Bytes most of which are zero, such as stamps of files, kept in less memory. Equal bytes are
/// packed alike.
class PackedBytes {
  public:
    PackedBytes() = default;
    explicit PackedBytes(std::string_view bytes);

    std::string unpacked() const;

    friend bool operator==(const PackedBytes&, const PackedBytes&) = default;

  private:
    std::string packed_;  // behind each zero stands how many more follow it
};

}  // namespace platform::tandry
