#include "platform/value/Base64.h"

#include <openssl/evp.h>

#include <algorithm>

namespace qm::base64 {

namespace {

// OpenSSL takes int lengths: work in chunks of whole groups, so that no chunk
// boundary adds padding.
constexpr std::size_t kBytesPerChunk = 3 * (1u << 24);
constexpr std::size_t kCharactersPerChunk = kBytesPerChunk / 3 * 4;
constexpr std::string_view kAlphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

}  // namespace

std::string encode(const Bytes& data) {
    std::string out;
    for (std::size_t offset = 0; offset < data.size(); offset += kBytesPerChunk) {
        std::size_t chunk = std::min(kBytesPerChunk, data.size() - offset);
        std::size_t start = out.size();
        out.resize(start + (chunk + 2) / 3 * 4 + 1);  // EVP_EncodeBlock writes a NUL
        int written = EVP_EncodeBlock(reinterpret_cast<unsigned char*>(out.data() + start), data.data() + offset,
                                      static_cast<int>(chunk));
        out.resize(start + static_cast<std::size_t>(written));
    }
    return out;
}

std::optional<Bytes> decode(std::string_view text) {
    // EVP_DecodeBlock skips white space at the ends and reads "=" anywhere as
    // zero bits: only canonical text reaches it.
    std::size_t padding = text.size() - (text.find_last_not_of('=') + 1);  // npos + 1 is 0
    if (text.size() % 4 != 0 || padding > 2 ||
        text.substr(0, text.size() - padding).find_first_not_of(kAlphabet) != std::string_view::npos) {
        return std::nullopt;
    }
    Bytes out(text.size() / 4 * 3);
    for (std::size_t offset = 0; offset < text.size(); offset += kCharactersPerChunk) {
        std::size_t chunk = std::min(kCharactersPerChunk, text.size() - offset);
        if (EVP_DecodeBlock(out.data() + offset / 4 * 3, reinterpret_cast<const unsigned char*>(text.data() + offset),
                            static_cast<int>(chunk)) < 0) {
            return std::nullopt;
        }
    }
    // Padding decodes to whole zero bytes; bits of the last character that no
    // byte takes land there too and must be zero, so each data has one spelling.
    if (std::any_of(out.end() - static_cast<std::ptrdiff_t>(padding), out.end(), [](std::uint8_t b) { return b != 0; })) {
        return std::nullopt;
    }
    out.resize(out.size() - padding);
    return out;
}

}  // namespace qm::base64
