#include "platform/value/Utf8.h"

#include <cassert>
#include <cstdint>
#include <cstring>

namespace qm::utf8 {

namespace {

bool isContinuation(unsigned char c) {
    return (c & 0xC0) == 0x80;
}

// Position of the first byte at or after from that is not ASCII, taking eight
// bytes at a time: almost every key and value on the wire is plain ASCII.
std::size_t skipAscii(std::string_view text, std::size_t from) {
    constexpr std::uint64_t kHighBits = 0x8080808080808080ull;
    while (from + 8 <= text.size()) {
        std::uint64_t chunk;
        std::memcpy(&chunk, text.data() + from, 8);
        if (chunk & kHighBits) {
            break;
        }
        from += 8;
    }
    while (from < text.size() && static_cast<unsigned char>(text[from]) < 0x80) {
        ++from;
    }
    return from;
}

}  // namespace

std::size_t sequenceLength(std::string_view text) noexcept {
    if (text.empty()) {
        return 0;
    }
    auto byte = [&](std::size_t i) { return static_cast<unsigned char>(text[i]); };
    unsigned char lead = byte(0);
    if (lead < 0x80) {
        return 1;
    }
    std::size_t length;
    // The bounds of the second byte are what exclude overlong forms (E0, F0),
    // surrogates (ED) and values above U+10FFFF (F4).
    unsigned char secondMin = 0x80;
    unsigned char secondMax = 0xBF;
    if (lead >= 0xC2 && lead <= 0xDF) {
        length = 2;
    } else if (lead >= 0xE0 && lead <= 0xEF) {
        length = 3;
        if (lead == 0xE0) {
            secondMin = 0xA0;
        } else if (lead == 0xED) {
            secondMax = 0x9F;
        }
    } else if (lead >= 0xF0 && lead <= 0xF4) {
        length = 4;
        if (lead == 0xF0) {
            secondMin = 0x90;
        } else if (lead == 0xF4) {
            secondMax = 0x8F;
        }
    } else {
        return 0;
    }
    if (text.size() < length || byte(1) < secondMin || byte(1) > secondMax) {
        return 0;
    }
    for (std::size_t i = 2; i < length; ++i) {
        if (!isContinuation(byte(i))) {
            return 0;
        }
    }
    return length;
}

bool isValid(std::string_view text) noexcept {
    std::size_t position = 0;
    while (true) {
        position = skipAscii(text, position);
        if (position == text.size()) {
            return true;
        }
        std::size_t length = sequenceLength(text.substr(position));
        if (length == 0) {
            return false;
        }
        position += length;
    }
}

void appendCodePoint(std::string& out, char32_t codePoint) {
    assert(codePoint <= 0x10FFFF && !(codePoint >= 0xD800 && codePoint <= 0xDFFF));
    auto put = [&](std::uint32_t byte) { out.push_back(static_cast<char>(byte)); };
    std::uint32_t c = codePoint;
    if (c < 0x80) {
        put(c);
    } else if (c < 0x800) {
        put(0xC0 | (c >> 6));
        put(0x80 | (c & 0x3F));
    } else if (c < 0x10000) {
        put(0xE0 | (c >> 12));
        put(0x80 | ((c >> 6) & 0x3F));
        put(0x80 | (c & 0x3F));
    } else {
        put(0xF0 | (c >> 18));
        put(0x80 | ((c >> 12) & 0x3F));
        put(0x80 | ((c >> 6) & 0x3F));
        put(0x80 | (c & 0x3F));
    }
}

}  // namespace qm::utf8
