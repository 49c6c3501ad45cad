#pragma once

#include <string>

#include "platform/values/Value.h"

namespace zorvan {

/// The code-signature facts of a plug-in bundle. Bundles are not signed on this platform: the facts
/// are placeholders, a hash that no two records share and a text that says so. A plain value.
class ZRDPlugInSignature {
  public:
    /// The location is not read; this cannot fail.
    explicit ZRDPlugInSignature(const std::string& path);

    /// 20 bytes.
    const platform::Data& cdhash() const { return cdhash_; }
    const std::string& requirement() const { return requirement_; }

  private:
    platform::Data cdhash_;
    std::string requirement_ = "dummy requirement";
};

}  // namespace zorvan
