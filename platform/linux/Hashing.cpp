#include "platform/Hashing.h"

#include <cstdlib>
#include <openssl/evp.h>
#include <openssl/sha.h>

namespace platform {

std::string sha1(std::string_view bytes) {
    std::string digest(SHA_DIGEST_LENGTH, '\0');
    // A one-shot digest of memory fails only when there is no memory left.
    if (EVP_Digest(bytes.data(), bytes.size(), reinterpret_cast<unsigned char*>(digest.data()), nullptr, EVP_sha1(),
                   nullptr) != 1) {
        std::abort();
    }
    return digest;
}

} // namespace platform
