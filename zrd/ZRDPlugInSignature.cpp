#include "zrd/ZRDPlugInSignature.h"

#include <openssl/sha.h>

#include "platform/values/Uuid.h"

namespace zorvan {

ZRDPlugInSignature::ZRDPlugInSignature(const std::string&) {
    const std::string text = platform::Uuid::random().string();
    std::string digest(SHA_DIGEST_LENGTH, '\0');
    SHA1(reinterpret_cast<const unsigned char*>(text.data()), text.size(),
         reinterpret_cast<unsigned char*>(digest.data()));
    cdhash_ = platform::Data(std::move(digest));
}

}  // namespace zorvan
