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
    /// Whether these bytes are what was packed.
    friend bool operator==(const PackedBytes& packed, std::string_view bytes) {
        return packed.holds(bytes);
    }

  private:
    bool holds(std::string_view bytes) const;

    std::string packed_;  // behind each zero stands how many more follow it
};

}  // namespace platform::tandry
