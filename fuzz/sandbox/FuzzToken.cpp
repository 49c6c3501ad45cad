// Texts that are, or are made of, a token. Nothing but the token itself is one.
// Covers: platform/sandbox/SandboxTokens.cpp

#include "fuzz/Support.h"
#include "platform/sandbox/SandboxTokens.h"
#include "tests/support/KnownDirectory.h"

using namespace platform;

namespace {

std::string field(const std::string& token, std::size_t number) {
    std::string_view rest = token;
    for (; number > 0; --number) rest.remove_prefix(std::min(rest.find('.') + 1, rest.size()));
    return std::string(rest.substr(0, rest.find('.')));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const SandboxTokens tokens = *SandboxTokens::make("zrd");
    static const std::string bundle = fuzz::home().makeDirectory("A.appex");
    static const std::string token = *tokens.issue(test::known(bundle), ".");
    static const std::string resource = fuzz::home().write("A.appex/a", "");

    // "@" stands for the token, and a byte up to 5 for a field of it.
    std::string text;
    for (const char byte : fuzz::text(data, size)) {
        if (byte == '@')
            text += token;
        else if (byte >= 0 && byte <= 5)
            text += field(token, static_cast<std::size_t>(byte));
        else
            text += byte;
    }
    const auto file = tokens.check(text);
    fuzz::require(bool(file) == (text == token));
    if (file) fuzz::require(file->path == bundle);
    (void)SandboxTokens::serviceOf(text);
    // A resource's name is the bundle author's.
    (void)tokens.issue(test::known(bundle), std::string(fuzz::text(data, size)));
    return 0;
}
