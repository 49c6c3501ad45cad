#pragma once

#include <memory>
#include <string>
#include <string_view>

namespace platform::tandry {

using SharedText = std::shared_ptr<const std::string>;

/// Makes texts of which many in a row are the same, and are then one. Not synchronised.
class SharedTexts {
  public:
    SharedText of(std::string_view text) {
        if (!last_ || *last_ != text) last_ = std::make_shared<const std::string>(text);
        return last_;
    }

  private:
    SharedText last_;
};

}  // namespace platform::tandry
