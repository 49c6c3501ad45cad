#pragma once

#include <string>

namespace zrctl {

/// `text` as one word for a shell, quoted where it has to be, and as safe for a terminal as
/// `terminal::safe`: what is not is written as in $'\033', which bash and zsh read.
std::string shellWord(const std::string& text);

}  // namespace zrctl
