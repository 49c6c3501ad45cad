#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "platform/system/Directories.h"
#include "platform/values/Value.h"
#include "tests/support/TemporaryDirectory.h"

/// What the fuzzers share. Everything that is logged is put into words, and then dropped.
namespace fuzz {

/// Stops the process, which the fuzzer takes for a fault, unless the condition holds.
void require(bool condition);

/// An input as text.
std::string_view text(const std::uint8_t* data, std::size_t size);

/// An input that stands for several files or messages, cut at its lines "====" into `count` parts;
/// those that it does not have are empty.
std::vector<std::string_view> parts(std::string_view input, std::size_t count);

/// The dictionary in a property list or, for what is none, in an encoded item; an empty one when it
/// is neither.
platform::Dictionary dictionaryIn(std::string_view bytes);

/// A directory of this process, gone at its end, and the places of a user who has nothing else.
const test::TemporaryDirectory& home();
platform::Directories directories();

}  // namespace fuzz
