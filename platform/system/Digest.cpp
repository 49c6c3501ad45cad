#include "platform/system/Digest.h"

#include <fmt/format.h>
#include <openssl/evp.h>

namespace platform {

std::string sha256Text(std::string_view bytes) {
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned size = 0;
    EVP_Digest(bytes.data(), bytes.size(), digest, &size, EVP_sha256(), nullptr);
    std::string text;
    for (unsigned i = 0; i < size; ++i) text += fmt::format("{:02x}", digest[i]);
    return text;
}

}  // namespace platform
