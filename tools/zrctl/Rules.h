#pragma once

#include <string>
#include <vector>

#include "platform/Error.h"
#include "platform/Value.h"

namespace zrctl {

/// The rules dictionary of texts KEY=PATTERN. The first "=" splits, so a pattern may begin with an
/// operator. "true" and "false" are the booleans; every other pattern is one string. A key given
/// more than once gets the list of its patterns, in order. The error says which text is no rule.
platform::Result<platform::Dictionary> parseRules(const std::vector<std::string>& texts);

/// The rules dictionary that a property-list file holds. The error names the file.
platform::Result<platform::Dictionary> readRulesFile(const std::string& path);

/// `base` with the rules of `over` in it, which replace those of the same key.
platform::Dictionary mergeRules(platform::Dictionary base, const platform::Dictionary& over);

}  // namespace zrctl
