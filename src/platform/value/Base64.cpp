#include "platform/value/Base64.h"

#include <openssl/evp.h>

#include <algorithm>
#include <array>
#include <cstdint>

namespace qm::base64 {

namespace {

constexpr std::uint8_t kNotInAlphabet = 0xFF;

constexpr std::array<std::uint8_t, 256> makeDecodingTable() {
    std::array<std::uint8_t, 256> table{};
    table.fill(kNotInAlphabet);
    constexpr std::string_view alphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    for (std::size_t i = 0; i < alphabet.size(); ++i) {
        table[static_cast<unsigned char>(alphabet[i])] = static_cast<std::uint8_t>(i);
    }
    return table;
}

constexpr auto kDecodingTable = makeDecodingTable();

}  // namespace

std::string encode(const Bytes& data) {
    // EVP_EncodeBlock takes an int length: feed it whole groups of three bytes
    // at a time so no chunk boundary adds padding.
    constexpr std::size_t kChunk = 3 * (1u << 24);
    std::string out;
    out.reserve((data.size() + 2) / 3 * 4 + 1);
    std::size_t offset = 0;
    do {
        std::size_t chunk = std::min(kChunk, data.size() - offset);
        std::size_t start = out.size();
        out.resize(start + (chunk + 2) / 3 * 4 + 1);  // EVP_EncodeBlock writes a NUL
        int written = EVP_EncodeBlock(reinterpret_cast<unsigned char*>(out.data() + start), data.data() + offset,
                                      static_cast<int>(chunk));
        out.resize(start + static_cast<std::size_t>(written));
        offset += chunk;
    } while (offset < data.size());
    return out;
}

std::optional<Bytes> decode(std::string_view text) {
    if (text.size() % 4 != 0) {
        return std::nullopt;
    }
    std::size_t padding = 0;
    if (!text.empty() && text.back() == '=') {
        padding = text[text.size() - 2] == '=' ? 2 : 1;
    }
    Bytes out;
    out.reserve(text.size() / 4 * 3);
    for (std::size_t group = 0; group < text.size(); group += 4) {
        bool last = group + 4 == text.size();
        std::size_t symbols = last ? 4 - padding : 4;
        std::uint32_t bits = 0;
        for (std::size_t i = 0; i < 4; ++i) {
            std::uint8_t sextet = 0;
            if (i < symbols) {
                sextet = kDecodingTable[static_cast<unsigned char>(text[group + i])];
                if (sextet == kNotInAlphabet) {
                    return std::nullopt;
                }
            }
            bits = (bits << 6) | sextet;
        }
        std::size_t bytes = symbols - 1;
        // Bits that no byte takes must be zero, so each data has one spelling.
        if (bytes < 3 && (bits & ((1u << (8 * (3 - bytes))) - 1)) != 0) {
            return std::nullopt;
        }
        for (std::size_t i = 0; i < bytes; ++i) {
            out.push_back(static_cast<std::uint8_t>(bits >> (16 - 8 * i)));
        }
    }
    return out;
}

}  // namespace qm::base64
