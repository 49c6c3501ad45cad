#include "platform/sandbox/SandboxTokens.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <openssl/rand.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <climits>
#include <cstdint>
#include <utility>

#include "platform/system/Files.h"
#include "platform/system/KnownDirectory.h"
#include "platform/system/OpenBeneath.h"

namespace platform {

namespace {

constexpr std::size_t kKeyBytes = 32;
constexpr std::size_t kNonceBytes = 16;
constexpr char kSeparator = '.';
constexpr std::string_view kDigits = "0123456789abcdef";

std::string hex(std::string_view bytes) {
    std::string text;
    text.reserve(2 * bytes.size());
    for (const unsigned char byte : bytes) {
        text += kDigits[byte >> 4];
        text += kDigits[byte & 15];
    }
    return text;
}

std::optional<std::string> unhex(std::string_view text) {
    if (text.size() % 2 != 0) return std::nullopt;
    std::string bytes;
    bytes.reserve(text.size() / 2);
    for (std::size_t i = 0; i < text.size(); i += 2) {
        const std::size_t high = kDigits.find(text[i]), low = kDigits.find(text[i + 1]);
        if (high == std::string_view::npos || low == std::string_view::npos) return std::nullopt;
        bytes += static_cast<char>(high << 4 | low);
    }
    return bytes;
}

std::optional<std::uint64_t> number(std::string_view text) {
    std::uint64_t value = 0;
    const auto [end, failure] = std::from_chars(text.data(), text.data() + text.size(), value, 16);
    if (failure != std::errc() || end != text.data() + text.size()) return std::nullopt;
    return value;
}

std::optional<std::string> randomBytes(std::size_t count) {
    std::string bytes(count, '\0');
    if (RAND_bytes(reinterpret_cast<unsigned char*>(bytes.data()), static_cast<int>(count)) != 1)
        return std::nullopt;
    return bytes;
}

/// Takes the text up to the next separator, and that, off `rest`.
std::string_view nextField(std::string_view& rest) {
    const std::string_view field = rest.substr(0, rest.find(kSeparator));
    rest.remove_prefix(std::min(field.size() + 1, rest.size()));
    return field;
}

/// Where what is open lies, as the kernel knows it.
Result<std::string> pathOf(const UniqueFd& file) {
    const std::string link = fmt::format("/proc/self/fd/{}", file.get());
    char path[PATH_MAX];
    const ssize_t length = ::readlink(link.c_str(), path, sizeof path);
    if (length < 0) return Error::posix(errno, link);
    if (length == sizeof path) return Error::posix(ENAMETOOLONG, link);
    return std::string(path, static_cast<std::size_t>(length));
}

bool liesIn(std::string_view path, std::string_view directory) {
    return path.starts_with(directory) &&
           (path.size() == directory.size() || path[directory.size()] == '/');
}

/// What a name leads to in a bundle. It may be moved out of there while it is looked at: it still
/// is what was in the bundle, but its new place is not the bundle's to share.
Result<SandboxTokens::File> lookUp(const KnownDirectory& bundle, const std::string& resource,
                                   Wait wait) {
    const Result<UniqueFd> directory = bundle.open(wait);
    if (!directory) return directory.error();
    const std::string name = joinPath(bundle.path, resource);
    const Result<UniqueFd> file =
        openBeneath(directory->get(), joinPath(".", resource), O_PATH, wait);
    if (!file) return Error::posix(leadsOutside(file.error()) ? EACCES : file.error().code, name);
    mode_t type = 0;
    const auto identity = FileIdentity::ofOpen(file->get(), &type);
    if (!identity) return Error::posix(errno, name);
    if (!S_ISREG(type) && !S_ISDIR(type)) return Error::posix(EINVAL, name);
    Result<std::string> path = pathOf(*file);
    if (!path) return path.error();
    if (!liesIn(*path, bundle.path)) return Error::posix(EACCES, name);
    return SandboxTokens::File{std::move(*path), *identity};
}

}  // namespace

std::string sandboxServiceName(const std::string& serviceName) {
    return serviceName + ".sandbox";
}

Result<SandboxTokens> SandboxTokens::make(const std::string& serviceName) {
    if (!isSafeName(serviceName))
        return Error::posix(EINVAL, "service name \"" + serviceName + "\"");
    auto key = randomBytes(kKeyBytes);
    if (!key) return Error::posix(EIO, "random numbers");
    return SandboxTokens(serviceName, std::move(*key));
}

std::string SandboxTokens::macOf(std::string_view text) const {
    std::array<unsigned char, EVP_MAX_MD_SIZE> mac{};
    unsigned int size = 0;
    HMAC(EVP_sha256(), key_.data(), static_cast<int>(key_.size()),
         reinterpret_cast<const unsigned char*>(text.data()), text.size(), mac.data(), &size);
    return hex({reinterpret_cast<const char*>(mac.data()), size});
}

Result<std::string> SandboxTokens::issue(const KnownDirectory& bundle, const std::string& resource,
                                         Wait wait) const {
    const Result<File> file = lookUp(bundle, resource, wait);
    if (!file) return file.error();
    const auto nonce = randomBytes(kNonceBytes);
    if (!nonce) return Error::posix(EIO, "random numbers");
    std::string token = fmt::format("{}.{}.{:x}.{:x}.{}", hex(serviceName_), hex(file->path),
                                    file->identity.device, file->identity.inode, hex(*nonce));
    token += kSeparator + macOf(token);
    return token;
}

std::optional<SandboxTokens::File> SandboxTokens::check(std::string_view token) const {
    const std::size_t end = token.rfind(kSeparator);
    if (token.size() > kMaxLength || end == std::string_view::npos) return std::nullopt;
    std::string_view rest = token.substr(0, end);
    // The mac is compared as text, so that one access has one token only.
    const std::string_view given = token.substr(end + 1);
    const std::string expected = macOf(rest);
    if (given.size() != expected.size() ||
        CRYPTO_memcmp(given.data(), expected.data(), expected.size()) != 0)
        return std::nullopt;

    nextField(rest);  // the service: this one's, as the key is
    auto path = unhex(nextField(rest));
    const auto device = number(nextField(rest));
    const auto inode = number(nextField(rest));
    if (!path || !device || !inode) return std::nullopt;
    return File{std::move(*path), {*device, *inode}};
}

std::optional<std::string> SandboxTokens::serviceOf(std::string_view token) {
    if (token.size() > kMaxLength || token.find(kSeparator) == std::string_view::npos)
        return std::nullopt;
    return unhex(nextField(token));
}

}  // namespace platform
