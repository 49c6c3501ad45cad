#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "platform/system/Error.h"
#include "platform/system/FileIdentity.h"
#include "platform/system/OpenBeneath.h"

namespace platform {

struct KnownDirectory;

/// The name of the service that trades the tokens of a service for access.
std::string sandboxServiceName(const std::string& serviceName);

/// Makes and checks the tokens of one service. A token is text, made of printable ASCII without
/// spaces: fields in lower-case hexadecimal digits, joined by ".":
///
///     service . path . device . inode . nonce . mac
///
/// The mac is an HMAC-SHA256 over all the text before it, under a random key of this object: nobody
/// else can make a token or change one, and tokens end with the object. Immutable; from any thread.
class SandboxTokens {
  public:
    /// Longest text of a token.
    static constexpr std::size_t kMaxLength = 9216;

    /// Error: EIO, without random numbers for the key; EINVAL for what is no service's name.
    static Result<SandboxTokens> make(const std::string& serviceName);

    /// A file or directory as a token names it. What else comes to lie at its path is not meant.
    struct File {
        std::string path;  // canonical
        FileIdentity identity;
    };

    /// A new token for what a name leads to in a bundle, a regular file or a directory; "." is the
    /// bundle itself. What is looked at is opened once, and is what the token names. Errors: those
    /// of `KnownDirectory::open`, and the system's; EACCES when the name leads out of the bundle,
    /// EINVAL when something else is there.
    Result<std::string> issue(const KnownDirectory& bundle, const std::string& resource,
                              Wait wait = Wait::Allowed) const;
    /// What a token names, if it was issued here and is unchanged; else none.
    std::optional<File> check(std::string_view token) const;

    /// The service that a token says it is of, which anybody can have written; none when it is no
    /// token at all.
    static std::optional<std::string> serviceOf(std::string_view token);

  private:
    SandboxTokens(std::string serviceName, std::string key)
        : serviceName_(std::move(serviceName)), key_(std::move(key)) {}
    std::string macOf(std::string_view text) const;

    std::string serviceName_;
    std::string key_;
};

}  // namespace platform
