#include "platform/value/Json.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <cstdint>
#include <limits>
#include <optional>
#include <utility>
#include <vector>

#include "platform/value/Base64.h"
#include "platform/value/Rfc3339.h"
#include "platform/value/Utf8.h"

namespace qm::json {

namespace {

constexpr const char* kErrorDomain = "json";
constexpr std::string_view kReplacementCharacter = "\xEF\xBF\xBD";
constexpr std::string_view kUuidKey = "$uuid";
constexpr std::string_view kDataKey = "$data";
constexpr std::string_view kDateKey = "$date";

// ---------------------------------------------------------------------------
// Writing

template <class Number>
void appendNumber(std::string& out, Number number) {
    char buffer[32];
    auto [end, error] = std::to_chars(buffer, buffer + sizeof buffer, number);
    (void)error;  // 32 characters hold any 64-bit integer or shortest double
    out.append(buffer, end);
}

void appendDouble(std::string& out, double number) {
    if (!std::isfinite(number)) {
        out += "null";
        return;
    }
    std::size_t start = out.size();
    appendNumber(out, number);
    // Keep a whole double recognisable as one when the text is read back.
    if (out.find_first_of(".e", start) == std::string::npos) {
        out += ".0";
    }
}

void appendEscaped(std::string& out, std::string_view text) {
    static constexpr char kHexDigits[] = "0123456789abcdef";
    out += '"';
    std::size_t position = 0;
    while (position < text.size()) {
        std::size_t runEnd = position;
        while (runEnd < text.size()) {
            auto c = static_cast<unsigned char>(text[runEnd]);
            if (c < 0x20 || c >= 0x80 || c == '"' || c == '\\') {
                break;
            }
            ++runEnd;
        }
        out.append(text.substr(position, runEnd - position));
        position = runEnd;
        if (position == text.size()) {
            break;
        }
        auto c = static_cast<unsigned char>(text[position]);
        if (c >= 0x80) {
            std::size_t length = utf8::sequenceLength(text.substr(position));
            if (length == 0) {
                out += kReplacementCharacter;
                ++position;
            } else {
                out.append(text.substr(position, length));
                position += length;
            }
            continue;
        }
        switch (c) {
            case '"': out += "\\\""; break;
            case '\\': out += "\\\\"; break;
            case '\b': out += "\\b"; break;
            case '\f': out += "\\f"; break;
            case '\n': out += "\\n"; break;
            case '\r': out += "\\r"; break;
            case '\t': out += "\\t"; break;
            default:
                out += "\\u00";
                out += kHexDigits[c >> 4];
                out += kHexDigits[c & 0xF];
        }
        ++position;
    }
    out += '"';
}

class Writer {
public:
    explicit Writer(bool pretty) : pretty_(pretty) {}

    // Recursion is bounded by the depth of the value, which decoders and the
    // parser limit to a few hundred levels.
    void write(const Value& value, std::size_t level) {
        switch (value.type()) {
            case ValueType::null: out_ += "null"; return;
            case ValueType::boolean: out_ += *value.asBool() ? "true" : "false"; return;
            case ValueType::unsignedInteger: appendNumber(out_, *value.asUnsigned()); return;
            case ValueType::signedInteger: appendNumber(out_, *value.asSigned()); return;
            case ValueType::real: appendDouble(out_, *value.asDouble()); return;
            case ValueType::string: appendEscaped(out_, *value.asString()); return;
            case ValueType::data: appendEscaped(out_, base64::encode(*value.asData())); return;
            case ValueType::date: {
                Date date = *value.asDate();
                if (auto text = rfc3339::format(date)) {
                    appendEscaped(out_, *text);
                } else {
                    appendDouble(out_, date.secondsSince1970);  // no calendar spelling for it
                }
                return;
            }
            case ValueType::uuid: appendEscaped(out_, value.asUuid()->text()); return;
            case ValueType::packed: write(*value.packedContent(), level); return;
            case ValueType::array: {
                const Array& array = *value.asArray();
                out_ += '[';
                for (std::size_t i = 0; i < array.size(); ++i) {
                    startItem(i, level + 1);
                    write(array[i], level + 1);
                }
                endContainer(array.empty(), level, ']');
                return;
            }
            case ValueType::dictionary: {
                const Dictionary& dictionary = *value.asDictionary();
                std::size_t index = 0;
                out_ += '{';
                for (const auto& [key, item] : dictionary) {
                    startItem(index++, level + 1);
                    appendEscaped(out_, key);
                    out_ += pretty_ ? ": " : ":";
                    write(item, level + 1);
                }
                endContainer(dictionary.empty(), level, '}');
                return;
            }
        }
    }

    std::string take() { return std::move(out_); }

private:
    void newLine(std::size_t level) {
        out_ += '\n';
        out_.append(2 * level, ' ');
    }

    void startItem(std::size_t index, std::size_t level) {
        if (index > 0) {
            out_ += ',';
        }
        if (pretty_) {
            newLine(level);
        }
    }

    void endContainer(bool empty, std::size_t level, char close) {
        if (pretty_ && !empty) {
            newLine(level);
        }
        out_ += close;
    }

    bool pretty_;
    std::string out_;
};

// ---------------------------------------------------------------------------
// Parsing

bool isWhitespace(char c) {
    return c == ' ' || c == '\t' || c == '\n' || c == '\r';
}

bool isDigit(char c) {
    return c >= '0' && c <= '9';
}

std::optional<unsigned> hexValue(char c) {
    if (c >= '0' && c <= '9') {
        return static_cast<unsigned>(c - '0');
    }
    if (c >= 'a' && c <= 'f') {
        return static_cast<unsigned>(c - 'a' + 10);
    }
    if (c >= 'A' && c <= 'F') {
        return static_cast<unsigned>(c - 'A' + 10);
    }
    return std::nullopt;
}

// Recursive descent, depth-limited so that hostile input cannot exhaust the
// stack. Each parse function leaves position_ after what it read, or records
// the first error and returns false.
class Parser {
public:
    explicit Parser(std::string_view text) : text_(text) {}

    Result<Value> run() {
        Value value;
        if (!parseValue(value, 0)) {
            return takeError();
        }
        skipWhitespace();
        if (position_ != text_.size()) {
            fail("unexpected characters after the value");
            return takeError();
        }
        return value;
    }

private:
    bool fail(std::string reason) { return failAt(position_, std::move(reason)); }

    bool failAt(std::size_t position, std::string reason) {
        if (!error_) {
            error_ = std::move(reason);
            errorPosition_ = position;
        }
        return false;
    }

    Error takeError() const {
        std::size_t line = 1;
        std::size_t lineStart = 0;
        for (std::size_t i = 0; i < errorPosition_ && i < text_.size(); ++i) {
            if (text_[i] == '\n') {
                ++line;
                lineStart = i + 1;
            }
        }
        std::size_t column = errorPosition_ - lineStart + 1;
        return Error{kErrorDomain, 0,
                     *error_ + " at line " + std::to_string(line) + ", column " + std::to_string(column)};
    }

    void skipWhitespace() {
        while (position_ < text_.size() && isWhitespace(text_[position_])) {
            ++position_;
        }
    }

    bool atEnd() const { return position_ >= text_.size(); }

    bool parseValue(Value& out, std::size_t depth) {
        skipWhitespace();
        if (atEnd()) {
            return fail("unexpected end of text");
        }
        char c = text_[position_];
        switch (c) {
            case '{': return parseObject(out, depth + 1);
            case '[': return parseArray(out, depth + 1);
            case '"': {
                std::string text;
                if (!parseString(text)) {
                    return false;
                }
                out = Value(std::move(text));
                return true;
            }
            case 't': return parseLiteral("true", Value(true), out);
            case 'f': return parseLiteral("false", Value(false), out);
            case 'n': return parseLiteral("null", Value(), out);
            default:
                if (c == '-' || isDigit(c)) {
                    return parseNumber(out);
                }
                return fail("unexpected character");
        }
    }

    bool parseLiteral(std::string_view word, Value value, Value& out) {
        if (text_.substr(position_, word.size()) != word) {
            return fail("unexpected character");
        }
        position_ += word.size();
        out = std::move(value);
        return true;
    }

    bool checkDepth(std::size_t depth) {
        if (depth > kMaxNestingDepth) {
            return fail("nesting deeper than " + std::to_string(kMaxNestingDepth) + " levels");
        }
        return true;
    }

    bool parseArray(Value& out, std::size_t depth) {
        if (!checkDepth(depth)) {
            return false;
        }
        ++position_;  // '['
        Array items;
        skipWhitespace();
        if (!atEnd() && text_[position_] == ']') {
            ++position_;
            out = Value(std::move(items));
            return true;
        }
        while (true) {
            Value item;
            if (!parseValue(item, depth)) {
                return false;
            }
            items.push_back(std::move(item));
            skipWhitespace();
            if (atEnd()) {
                return fail("unexpected end of text");
            }
            char c = text_[position_++];
            if (c == ']') {
                break;
            }
            if (c != ',') {
                return failAt(position_ - 1, "expected ',' or ']'");
            }
        }
        out = Value(std::move(items));
        return true;
    }

    bool parseObject(Value& out, std::size_t depth) {
        if (!checkDepth(depth)) {
            return false;
        }
        std::size_t start = position_;
        ++position_;  // '{'
        std::vector<Dictionary::Entry> entries;
        skipWhitespace();
        if (!atEnd() && text_[position_] == '}') {
            ++position_;
            out = Value(Dictionary());
            return true;
        }
        while (true) {
            skipWhitespace();
            if (atEnd() || text_[position_] != '"') {
                return atEnd() ? fail("unexpected end of text") : fail("expected a string key");
            }
            std::string key;
            if (!parseString(key)) {
                return false;
            }
            skipWhitespace();
            if (atEnd() || text_[position_] != ':') {
                return atEnd() ? fail("unexpected end of text") : fail("expected ':'");
            }
            ++position_;
            Value item;
            if (!parseValue(item, depth)) {
                return false;
            }
            entries.emplace_back(std::move(key), std::move(item));
            skipWhitespace();
            if (atEnd()) {
                return fail("unexpected end of text");
            }
            char c = text_[position_++];
            if (c == '}') {
                break;
            }
            if (c != ',') {
                return failAt(position_ - 1, "expected ',' or '}'");
            }
        }
        if (entries.size() == 1) {
            const auto& [key, item] = entries.front();
            if (key == kUuidKey || key == kDataKey || key == kDateKey) {
                return makeTyped(key, item, start, out);
            }
        }
        return makeDictionary(std::move(entries), start, out);
    }

    bool makeDictionary(std::vector<Dictionary::Entry> entries, std::size_t start, Value& out) {
        auto byKey = [](const Dictionary::Entry& a, const Dictionary::Entry& b) { return a.first < b.first; };
        std::sort(entries.begin(), entries.end(), byKey);
        auto duplicate = std::adjacent_find(entries.begin(), entries.end(),
                                            [](const Dictionary::Entry& a, const Dictionary::Entry& b) {
                                                return a.first == b.first;
                                            });
        if (duplicate != entries.end()) {
            std::string quoted;
            appendEscaped(quoted, duplicate->first);
            return failAt(start, "duplicate key " + quoted + " in object");
        }
        out = Value(*Dictionary::fromEntries(std::move(entries)));
        return true;
    }

    // {"$uuid": text}, {"$data": base64}, {"$date": RFC 3339}.
    bool makeTyped(const std::string& key, const Value& item, std::size_t start, Value& out) {
        const std::string* text = item.asString();
        if (key == kUuidKey) {
            auto uuid = text ? Uuid::parse(*text) : std::nullopt;
            if (!uuid) {
                return failAt(start, "\"$uuid\" needs a UUID in canonical text");
            }
            out = Value(*uuid);
        } else if (key == kDataKey) {
            auto data = text ? base64::decode(*text) : std::nullopt;
            if (!data) {
                return failAt(start, "\"$data\" needs base64 text");
            }
            out = Value(std::move(*data));
        } else {
            auto date = text ? rfc3339::parse(*text) : std::nullopt;
            if (!date) {
                return failAt(start, "\"$date\" needs an RFC 3339 date-time");
            }
            out = Value(*date);
        }
        return true;
    }

    bool parseHexQuad(char32_t& out) {
        if (text_.size() - position_ < 4) {
            return fail("bad \\u escape");
        }
        char32_t value = 0;
        for (std::size_t i = 0; i < 4; ++i) {
            auto digit = hexValue(text_[position_ + i]);
            if (!digit) {
                return fail("bad \\u escape");
            }
            value = value * 16 + *digit;
        }
        position_ += 4;
        out = value;
        return true;
    }

    // position_ is just after "\u".
    bool parseUnicodeEscape(std::string& out) {
        std::size_t escapeStart = position_ - 2;
        char32_t unit = 0;
        if (!parseHexQuad(unit)) {
            return false;
        }
        if (unit >= 0xDC00 && unit <= 0xDFFF) {
            return failAt(escapeStart, "lone surrogate in \\u escape");
        }
        if (unit >= 0xD800 && unit <= 0xDBFF) {
            if (text_.substr(position_, 2) != "\\u") {
                return failAt(escapeStart, "lone surrogate in \\u escape");
            }
            position_ += 2;
            char32_t low = 0;
            if (!parseHexQuad(low)) {
                return false;
            }
            if (low < 0xDC00 || low > 0xDFFF) {
                return failAt(escapeStart, "lone surrogate in \\u escape");
            }
            unit = 0x10000 + ((unit - 0xD800) << 10) + (low - 0xDC00);
        }
        utf8::appendCodePoint(out, unit);
        return true;
    }

    bool parseEscape(std::string& out) {
        ++position_;  // '\\'
        if (atEnd()) {
            return fail("unexpected end of text");
        }
        char c = text_[position_++];
        switch (c) {
            case '"': out += '"'; return true;
            case '\\': out += '\\'; return true;
            case '/': out += '/'; return true;
            case 'b': out += '\b'; return true;
            case 'f': out += '\f'; return true;
            case 'n': out += '\n'; return true;
            case 'r': out += '\r'; return true;
            case 't': out += '\t'; return true;
            case 'u': return parseUnicodeEscape(out);
            default: return failAt(position_ - 2, "bad escape");
        }
    }

    bool parseString(std::string& out) {
        ++position_;  // '"'
        while (true) {
            std::size_t runStart = position_;
            while (position_ < text_.size()) {
                auto c = static_cast<unsigned char>(text_[position_]);
                if (c == '"' || c == '\\' || c < 0x20 || c >= 0x80) {
                    break;
                }
                ++position_;
            }
            out.append(text_.substr(runStart, position_ - runStart));
            if (atEnd()) {
                return fail("unterminated string");
            }
            auto c = static_cast<unsigned char>(text_[position_]);
            if (c == '"') {
                ++position_;
                return true;
            }
            if (c == '\\') {
                if (!parseEscape(out)) {
                    return false;
                }
            } else if (c < 0x20) {
                return fail("control character in string");
            } else {
                std::size_t length = utf8::sequenceLength(text_.substr(position_));
                if (length == 0) {
                    return fail("text is not UTF-8");
                }
                out.append(text_.substr(position_, length));
                position_ += length;
            }
        }
    }

    void skipDigits() {
        while (!atEnd() && isDigit(text_[position_])) {
            ++position_;
        }
    }

    bool parseNumber(Value& out) {
        std::size_t start = position_;
        bool negative = text_[position_] == '-';
        if (negative) {
            ++position_;
        }
        if (atEnd() || !isDigit(text_[position_])) {
            return fail("bad number");
        }
        if (text_[position_] == '0') {
            ++position_;
            if (!atEnd() && isDigit(text_[position_])) {
                return failAt(start, "bad number: leading zero");
            }
        } else {
            skipDigits();
        }
        bool integral = true;
        if (!atEnd() && text_[position_] == '.') {
            integral = false;
            ++position_;
            if (atEnd() || !isDigit(text_[position_])) {
                return fail("bad number");
            }
            skipDigits();
        }
        if (!atEnd() && (text_[position_] == 'e' || text_[position_] == 'E')) {
            integral = false;
            ++position_;
            if (!atEnd() && (text_[position_] == '+' || text_[position_] == '-')) {
                ++position_;
            }
            if (atEnd() || !isDigit(text_[position_])) {
                return fail("bad number");
            }
            skipDigits();
        }
        const char* first = text_.data() + start;
        const char* last = text_.data() + position_;
        if (!integral) {
            double number;
            auto [end, error] = std::from_chars(first, last, number);
            if (error != std::errc() || end != last || !std::isfinite(number)) {
                return failAt(start, "number out of range");
            }
            out = Value(number);
            return true;
        }
        std::uint64_t magnitude;
        auto [end, error] = std::from_chars(first + (negative ? 1 : 0), last, magnitude);
        if (error != std::errc() || end != last) {
            return failAt(start, "integer out of 64-bit range");
        }
        if (!negative) {
            out = Value(magnitude);
            return true;
        }
        constexpr auto kMinMagnitude = static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max()) + 1;
        if (magnitude > kMinMagnitude) {
            return failAt(start, "integer out of 64-bit range");
        }
        out = Value(magnitude == kMinMagnitude ? std::numeric_limits<std::int64_t>::min()
                                               : -static_cast<std::int64_t>(magnitude));
        return true;
    }

    std::string_view text_;
    std::size_t position_ = 0;
    std::optional<std::string> error_;
    std::size_t errorPosition_ = 0;
};

}  // namespace

std::string write(const Value& value, bool pretty) {
    Writer writer(pretty);
    writer.write(value, 0);
    return writer.take();
}

Result<Value> parse(std::string_view text) {
    return Parser(text).run();
}

}  // namespace qm::json
