#pragma once

#include <string>
#include <vector>

#include "platform/system/Error.h"
#include "platform/values/Value.h"

namespace zrctl {

/// The dictionary of texts KEY=VALUE. The first "=" splits. "true" and "false" are the booleans;
/// every other value is one string. A key given more than once gets the list of its values, in
/// order. The error says which text is no pair.
platform::Result<platform::Dictionary> parsePairs(const std::vector<std::string>& texts);

/// The rules dictionary of texts KEY=PATTERN: pairs, whose patterns may begin with an operator. The
/// error says which text is no rule.
platform::Result<platform::Dictionary> parseRules(const std::vector<std::string>& texts);

/// The texts that `parseRules` makes these rules of; at least one, which is empty for rules that
/// demand nothing. Patterns of kinds that no text gives are described.
std::vector<std::string> ruleTexts(const platform::Dictionary& rules);

/// `base` with the entries of `over` in it, which replace those of the same key.
platform::Dictionary merged(platform::Dictionary base, const platform::Dictionary& over);

}  // namespace zrctl
