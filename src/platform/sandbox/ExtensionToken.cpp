#include "platform/sandbox/ExtensionToken.h"

#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>

#include <cassert>

namespace qm {

namespace {

constexpr std::string_view kVersion = "qm1";
constexpr char kSeparator = ';';
constexpr std::size_t kSignatureHexLength = 64;  // SHA-256, two digits a byte

std::string lowerHex(std::string_view bytes) {
    static const char kDigits[] = "0123456789abcdef";
    std::string hex;
    hex.reserve(bytes.size() * 2);
    for (char c : bytes) {
        auto byte = static_cast<unsigned char>(c);
        hex += kDigits[byte >> 4];
        hex += kDigits[byte & 0x0F];
    }
    return hex;
}

int lowerHexDigit(char c) {
    if (c >= '0' && c <= '9') {
        return c - '0';
    }
    if (c >= 'a' && c <= 'f') {
        return c - 'a' + 10;
    }
    return -1;
}

std::optional<std::string> fromLowerHex(std::string_view hex) {
    if (hex.size() % 2 != 0) {
        return std::nullopt;
    }
    std::string bytes;
    bytes.reserve(hex.size() / 2);
    for (std::size_t i = 0; i < hex.size(); i += 2) {
        int high = lowerHexDigit(hex[i]);
        int low = lowerHexDigit(hex[i + 1]);
        if (high < 0 || low < 0) {
            return std::nullopt;
        }
        bytes += static_cast<char>(high << 4 | low);
    }
    return bytes;
}

std::string signatureOf(std::string_view signedText, const TokenKeyBytes& key) {
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int length = 0;
    const auto* data = reinterpret_cast<const unsigned char*>(signedText.data());
    bool made = ::HMAC(EVP_sha256(), key.data(), static_cast<int>(key.size()), data, signedText.size(), digest,
                       &length) != nullptr;
    assert(made && length * 2 == kSignatureHexLength);
    (void)made;
    return lowerHex(std::string_view(reinterpret_cast<const char*>(digest), length));
}

}  // namespace

std::string signToken(const TokenGrant& grant, const TokenKeyBytes& key) {
    assert(!grant.tokenClass.empty() && grant.tokenClass.find(kSeparator) == std::string::npos);
    std::string token(kVersion);
    token += kSeparator;
    token += grant.tokenClass;
    token += kSeparator;
    token += lowerHex(grant.path);
    std::string signature = signatureOf(token, key);
    token += kSeparator;
    token += signature;
    return token;
}

std::optional<TokenGrant> openToken(std::string_view token, const TokenKeyBytes& key) {
    auto lastSeparator = token.rfind(kSeparator);
    if (lastSeparator == std::string_view::npos) {
        return std::nullopt;
    }
    std::string_view signedText = token.substr(0, lastSeparator);
    std::string_view signature = token.substr(lastSeparator + 1);
    if (signature.size() != kSignatureHexLength) {
        return std::nullopt;
    }
    std::string expected = signatureOf(signedText, key);
    if (::CRYPTO_memcmp(expected.data(), signature.data(), kSignatureHexLength) != 0) {
        return std::nullopt;
    }
    // Signed by this key, so written by signToken; still checked field by field.
    auto versionEnd = signedText.find(kSeparator);
    auto classEnd = versionEnd == std::string_view::npos ? versionEnd : signedText.find(kSeparator, versionEnd + 1);
    if (classEnd == std::string_view::npos || signedText.substr(0, versionEnd) != kVersion ||
        classEnd == versionEnd + 1) {
        return std::nullopt;
    }
    auto path = fromLowerHex(signedText.substr(classEnd + 1));
    if (!path || path->empty() || path->front() != '/' || path->find('\0') != std::string::npos) {
        return std::nullopt;
    }
    return TokenGrant{std::string(signedText.substr(versionEnd + 1, classEnd - versionEnd - 1)), std::move(*path)};
}

}  // namespace qm
