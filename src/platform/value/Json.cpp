#include "platform/value/Json.h"

#include <nlohmann/json.hpp>

#include <algorithm>
#include <iterator>
#include <utility>
#include <vector>

#include "platform/value/Base64.h"
#include "platform/value/Rfc3339.h"

namespace qm::json {

namespace {

using Json = nlohmann::json;

constexpr const char* kErrorDomain = "json";
constexpr std::string_view kUuidKey = "$uuid";
constexpr std::string_view kDataKey = "$data";
constexpr std::string_view kDateKey = "$date";
constexpr const char* kIntegerTooLarge = "integer does not fit in 64 bits";
// nlohmann's code for a number whose double is infinite.
constexpr int kNumberOverflow = 406;

// Recursion is bounded by the depth of the value, which decoders and the
// parser limit to a few hundred levels.
Json toJson(const Value& value) {
    switch (value.type()) {
        case ValueType::null: return nullptr;
        case ValueType::boolean: return *value.asBool();
        case ValueType::unsignedInteger: return *value.asUnsigned();
        case ValueType::signedInteger: return *value.asSigned();
        case ValueType::real: return *value.asDouble();
        case ValueType::string: return *value.asString();
        case ValueType::data: return base64::encode(*value.asData());
        case ValueType::date: {
            Date date = *value.asDate();
            if (auto text = rfc3339::format(date)) {
                return *text;
            }
            return date.secondsSince1970;  // no calendar spelling for it
        }
        case ValueType::uuid: return value.asUuid()->text();
        case ValueType::packed: return toJson(*value.packedContent());
        case ValueType::array: {
            Json array = Json::array();
            for (const Value& item : *value.asArray()) {
                array.push_back(toJson(item));
            }
            return array;
        }
        case ValueType::dictionary: {
            Json object = Json::object();
            for (const auto& [key, item] : *value.asDictionary()) {
                object.emplace(key, toJson(item));
            }
            return object;
        }
    }
    return nullptr;
}

bool isIntegerToken(std::string_view token) {
    return token.find_first_of(".eE") == std::string_view::npos;
}

// Walks the text for the parser and remembers how far it has read, so that
// refusals found while building values can say where they are.
struct TrackingIterator {
    using iterator_category = std::input_iterator_tag;
    using value_type = char;
    using difference_type = std::ptrdiff_t;
    using pointer = const char*;
    using reference = const char&;

    const char* at;
    const char** reached;

    reference operator*() const { return *at; }
    TrackingIterator& operator++() {
        *reached = ++at;
        return *this;
    }
    bool operator==(const TrackingIterator& other) const { return at == other.at; }
};

// Builds a Value from the parser's events and adds the refusals that JSON
// itself does not make: nesting deeper than kMaxNestingDepth, duplicate keys,
// integers beyond 64 bits and malformed "$" forms.
class ValueBuilder final : public nlohmann::json_sax<Json> {
public:
    explicit ValueBuilder(std::string_view text) : text_(text), reached_(text.data()) {}

    Result<Value> parse() {
        TrackingIterator first{text_.data(), &reached_};
        TrackingIterator last{text_.data() + text_.size(), &reached_};
        if (!Json::sax_parse(first, last, this, nlohmann::json::input_format_t::json, /*strict=*/true,
                             /*ignore_comments=*/false)) {
            return std::move(*error_);
        }
        return std::move(root_);
    }

    bool null() override { return add(Value()); }
    bool boolean(bool value) override { return add(Value(value)); }
    bool number_integer(number_integer_t value) override { return add(Value(std::int64_t{value})); }
    bool number_unsigned(number_unsigned_t value) override { return add(Value(std::uint64_t{value})); }
    bool number_float(number_float_t value, const string_t& token) override {
        if (isIntegerToken(token)) {
            // The lexer has read one character past the number unless the text ends there.
            std::size_t end = read();
            if (end > 0 && (text_[end - 1] < '0' || text_[end - 1] > '9')) {
                --end;
            }
            return failAt(end - token.size(), kIntegerTooLarge);
        }
        return add(Value(value));
    }
    bool string(string_t& value) override { return add(Value(std::move(value))); }
    bool binary(binary_t&) override { return failAt(read(), "binary value"); }  // JSON text has none

    bool start_object(std::size_t) override { return open(true); }
    bool key(string_t& key) override {
        open_.back().key = std::move(key);
        return true;
    }
    bool end_object() override;
    bool start_array(std::size_t) override { return open(false); }
    bool end_array() override {
        Container array = close();
        return add(Value(std::move(array.items)));
    }

    bool parse_error(std::size_t position, const std::string& lastToken,
                     const nlohmann::detail::exception& exception) override {
        // position counts the characters read, the offending one included.
        if (exception.id == kNumberOverflow) {
            return failAt(position - lastToken.size(), isIntegerToken(lastToken) ? kIntegerTooLarge : "number out of range");
        }
        // "[json.exception.parse_error.101] parse error at line 1, column 4: <reason>; last read: '<token>'..."
        std::string reason = exception.what();
        reason.erase(0, reason.find(": ") + 2);
        // The token may be long or not UTF-8; the line and column say enough.
        const std::string lastRead = "; last read: '" + lastToken + "'";
        if (auto at = reason.find(lastRead); at != std::string::npos) {
            reason.erase(at, lastRead.size());
        }
        return failAt(position > 0 ? position - 1 : 0, reason);
    }

private:
    struct Container {
        bool isObject;
        std::size_t start;  // offset of its '{' or '['
        Array items;
        std::vector<Dictionary::Entry> entries;
        std::string key;  // of the entry being read
    };

    std::size_t read() const { return static_cast<std::size_t>(reached_ - text_.data()); }

    bool open(bool isObject) {
        std::size_t start = read() - 1;
        if (open_.size() == kMaxNestingDepth) {
            return failAt(start, "nesting deeper than " + std::to_string(kMaxNestingDepth) + " levels");
        }
        open_.push_back(Container{isObject, start, {}, {}, {}});
        return true;
    }

    Container close() {
        Container container = std::move(open_.back());
        open_.pop_back();
        return container;
    }

    bool add(Value value) {
        if (open_.empty()) {
            root_ = std::move(value);
        } else if (Container& top = open_.back(); top.isObject) {
            top.entries.emplace_back(std::move(top.key), std::move(value));
        } else {
            top.items.push_back(std::move(value));
        }
        return true;
    }

    bool typed(const std::string& key, const Value& item, std::size_t start);

    bool failAt(std::size_t offset, const std::string& reason) {
        std::string_view before = text_.substr(0, offset);
        std::size_t line = 1 + static_cast<std::size_t>(std::count(before.begin(), before.end(), '\n'));
        std::size_t lineStart = before.rfind('\n') + 1;  // npos + 1 is 0: the first line
        error_ = Error{kErrorDomain, 0,
                       reason + " at line " + std::to_string(line) + ", column " + std::to_string(offset - lineStart + 1)};
        return false;
    }

    std::string_view text_;
    const char* reached_;
    std::vector<Container> open_;
    Value root_;
    std::optional<Error> error_;
};

bool ValueBuilder::end_object() {
    Container object = close();
    if (object.entries.size() == 1) {
        const auto& [key, item] = object.entries.front();
        if (key == kUuidKey || key == kDataKey || key == kDateKey) {
            return typed(key, item, object.start);
        }
    }
    auto byKey = [](const Dictionary::Entry& a, const Dictionary::Entry& b) { return a.first < b.first; };
    std::sort(object.entries.begin(), object.entries.end(), byKey);
    auto duplicate = std::adjacent_find(object.entries.begin(), object.entries.end(),
                                        [](const auto& a, const auto& b) { return a.first == b.first; });
    if (duplicate != object.entries.end()) {
        return failAt(object.start, "duplicate key " + Json(duplicate->first).dump() + " in object");
    }
    return add(Value(*Dictionary::fromEntries(std::move(object.entries))));
}

// {"$uuid": text}, {"$data": base64}, {"$date": RFC 3339}.
bool ValueBuilder::typed(const std::string& key, const Value& item, std::size_t start) {
    const std::string* text = item.asString();
    if (key == kUuidKey) {
        auto uuid = text ? Uuid::parse(*text) : std::nullopt;
        return uuid ? add(Value(*uuid)) : failAt(start, "\"$uuid\" needs a UUID in canonical text");
    }
    if (key == kDataKey) {
        auto data = text ? base64::decode(*text) : std::nullopt;
        return data ? add(Value(std::move(*data))) : failAt(start, "\"$data\" needs base64 text");
    }
    auto date = text ? rfc3339::parse(*text) : std::nullopt;
    return date ? add(Value(*date)) : failAt(start, "\"$date\" needs an RFC 3339 date-time");
}

}  // namespace

std::string write(const Value& value, bool pretty) {
    return toJson(value).dump(pretty ? 2 : -1, ' ', false, Json::error_handler_t::replace);
}

Result<Value> parse(std::string_view text) {
    return ValueBuilder(text).parse();
}

}  // namespace qm::json
