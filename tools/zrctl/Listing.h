#pragma once

#include <string>
#include <vector>

#include "platform/values/Value.h"

namespace zrctl {

/// The plug-ins of a match, as texts for people and programs. The daemon gives no order; here they
/// are in the order of identifier, version and path.
class Listing {
  public:
    /// Elements that are not forms (not dictionaries) are left out.
    explicit Listing(const platform::Array& forms);

    bool empty() const { return forms_.empty(); }

    /// One line a plug-in, under a heading.
    std::string table() const;
    /// A paragraph a plug-in, with one fact a line.
    std::string paragraphs() const;
    /// The forms themselves.
    platform::Array forms() const { return platform::Array(forms_); }

  private:
    std::vector<platform::Value> forms_;
};

/// The name of an annotation's election: "default", "use" or "ignore", else its number. No
/// annotation, or one without an election, is "default".
std::string electionName(const platform::Value* annotations);

}  // namespace zrctl
