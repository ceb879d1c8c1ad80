#include "platform/linux/SandboxToken.h"

#include <array>
#include <charconv>
#include <openssl/core_names.h>
#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/params.h>
#include <openssl/rand.h>

namespace platform::linux_ {

namespace {

constexpr std::size_t macSize = 32;
constexpr std::size_t macTextSize = 2 * macSize;
constexpr char digits[] = "0123456789abcdef";

void appendEscaped(std::string& out, std::string_view text) {
    for (char character : text) {
        auto byte = static_cast<unsigned char>(character);
        if (byte > ' ' && byte < 0x7f && character != '%' && character != ';') {
            out += character;
        } else {
            out += '%';
            out += digits[byte >> 4];
            out += digits[byte & 15];
        }
    }
}

template <class Integer> void appendNumber(std::string& out, Integer value) {
    std::array<char, 24> buffer;
    out.append(buffer.data(), std::to_chars(buffer.data(), buffer.data() + buffer.size(), value).ptr);
    out += ';';
}

/// Takes fields off the front of a text that `sign` wrote; what it does not expect cannot come.
class FieldReader {
public:
    explicit FieldReader(std::string_view text) : _rest(text) {}

    std::string_view next() {
        std::size_t end = _rest.find(';');
        std::string_view field = _rest.substr(0, end);
        _rest.remove_prefix(end == std::string_view::npos ? _rest.size() : end + 1);
        return field;
    }

    std::string nextText() {
        std::string_view field = next();
        std::string text;
        for (std::size_t index = 0; index < field.size(); ++index) {
            if (field[index] == '%') {
                std::string_view escape = field.substr(index + 1, 2);
                unsigned byte = 0;
                std::from_chars(escape.data(), escape.data() + escape.size(), byte, 16);
                text += static_cast<char>(byte);
                index += 2;
            } else {
                text += field[index];
            }
        }
        return text;
    }

    template <class Integer> void nextNumber(Integer& value) {
        std::string_view field = next();
        std::from_chars(field.data(), field.data() + field.size(), value);
    }

private:
    std::string_view _rest;
};

} // namespace

TokenSigner::TokenSigner() {
    std::array<unsigned char, macSize> key;
    EVP_MAC* algorithm = EVP_MAC_fetch(nullptr, "HMAC", nullptr);
    if (algorithm != nullptr && RAND_bytes(key.data(), static_cast<int>(key.size())) == 1) {
        char digest[] = "SHA256";
        std::array parameters{OSSL_PARAM_construct_utf8_string(OSSL_MAC_PARAM_DIGEST, digest, 0),
                              OSSL_PARAM_construct_end()};
        _context = EVP_MAC_CTX_new(algorithm);
        if (_context != nullptr && EVP_MAC_init(_context, key.data(), key.size(), parameters.data()) != 1) {
            EVP_MAC_CTX_free(_context);
            _context = nullptr;
        }
    }
    EVP_MAC_free(algorithm);
    OPENSSL_cleanse(key.data(), key.size());
}

TokenSigner::~TokenSigner() { EVP_MAC_CTX_free(_context); }

std::string TokenSigner::macOf(std::string_view text) {
    std::array<unsigned char, macSize> mac;
    std::size_t size = 0;
    {
        std::lock_guard lock(_mutex);
        // Without a key, init starts anew with the one it has and saves hashing it again.
        if (_context == nullptr || EVP_MAC_init(_context, nullptr, 0, nullptr) != 1 ||
            EVP_MAC_update(_context, reinterpret_cast<const unsigned char*>(text.data()), text.size()) != 1 ||
            EVP_MAC_final(_context, mac.data(), &size, mac.size()) != 1 || size != mac.size())
            return {};
    }
    std::string result;
    result.reserve(macTextSize);
    for (unsigned char byte : mac) {
        result += digits[byte >> 4];
        result += digits[byte & 15];
    }
    return result;
}

std::optional<std::string> TokenSigner::sign(const SandboxGrant& grant) {
    std::string text;
    text.reserve(128 + grant.extensionClass.size() + grant.name.size());
    text += grant.kind == SandboxGrant::Kind::file ? ";f;" : ";s;";
    appendEscaped(text, grant.extensionClass);
    text += ';';
    appendEscaped(text, grant.name);
    text += ';';
    if (grant.kind == SandboxGrant::Kind::file) {
        text += grant.canonical ? "c;" : "n;";
        appendNumber(text, grant.identity.device);
        appendNumber(text, grant.identity.inode);
        appendNumber(text, grant.identity.bornSeconds);
        appendNumber(text, grant.identity.bornNanoseconds);
    }
    std::string mac = macOf(text);
    if (mac.empty()) return std::nullopt;
    return text.insert(0, mac);
}

std::optional<SandboxGrant> TokenSigner::verify(std::string_view token) {
    if (token.size() <= macTextSize) return std::nullopt;
    std::string_view text = token.substr(macTextSize);
    std::string mac = macOf(text);
    if (mac.empty() || CRYPTO_memcmp(mac.data(), token.data(), macTextSize) != 0) return std::nullopt;

    FieldReader reader(text.substr(1));
    SandboxGrant grant;
    grant.kind = reader.next() == "f" ? SandboxGrant::Kind::file : SandboxGrant::Kind::service;
    grant.extensionClass = reader.nextText();
    grant.name = reader.nextText();
    if (grant.kind == SandboxGrant::Kind::file) {
        grant.canonical = reader.next() == "c";
        reader.nextNumber(grant.identity.device);
        reader.nextNumber(grant.identity.inode);
        reader.nextNumber(grant.identity.bornSeconds);
        reader.nextNumber(grant.identity.bornNanoseconds);
    }
    return grant;
}

} // namespace platform::linux_
