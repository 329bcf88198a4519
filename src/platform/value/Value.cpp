#include "platform/value/Value.h"

#include <algorithm>
#include <cassert>
#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <limits>
#include <ostream>

namespace qm {

struct Value::Packed {
    Value content;
};

namespace {

template <class... Ts>
struct Overloaded : Ts... {
    using Ts::operator()...;
};
template <class... Ts>
Overloaded(Ts...) -> Overloaded<Ts...>;

bool entryKeyLess(const Dictionary::Entry& entry, std::string_view key) {
    return entry.first < key;
}

// Strings that read unambiguously without quotes stay bare in descriptions.
bool isBareWord(const std::string& s) {
    if (s.empty()) {
        return false;
    }
    return std::all_of(s.begin(), s.end(), [](char c) {
        return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '.' ||
               c == '_' || c == '-' || c == '/';
    });
}

void appendQuoted(std::string& out, const std::string& s) {
    if (isBareWord(s)) {
        out += s;
        return;
    }
    out += '"';
    for (char c : s) {
        switch (c) {
            case '"': out += "\\\""; break;
            case '\\': out += "\\\\"; break;
            case '\n': out += "\\n"; break;
            case '\t': out += "\\t"; break;
            default:
                if (static_cast<unsigned char>(c) < 0x20) {
                    char buffer[8];
                    std::snprintf(buffer, sizeof buffer, "\\%03o", static_cast<unsigned>(static_cast<unsigned char>(c)));
                    out += buffer;
                } else {
                    out += c;
                }
        }
    }
    out += '"';
}

}  // namespace

const char* valueTypeName(ValueType type) {
    switch (type) {
        case ValueType::null: return "null";
        case ValueType::boolean: return "bool";
        case ValueType::unsignedInteger: return "unsigned integer";
        case ValueType::signedInteger: return "signed integer";
        case ValueType::real: return "double";
        case ValueType::string: return "string";
        case ValueType::data: return "data";
        case ValueType::date: return "date";
        case ValueType::uuid: return "uuid";
        case ValueType::array: return "array";
        case ValueType::dictionary: return "dictionary";
        case ValueType::packed: return "packed property list";
    }
    return "unknown";
}

namespace {

// Every empty string, data, array and dictionary shares one object, so a tree
// of empty values costs its slots and nothing more. Never destroyed: values in
// other static objects may outlive any order of destruction.
template <class T>
const std::shared_ptr<const T>& sharedEmpty() {
    static const auto* empty = new std::shared_ptr<const T>(std::make_shared<const T>());
    return *empty;
}

template <class T>
std::shared_ptr<const T> shared(T&& content) {
    if (content.empty()) {
        return sharedEmpty<T>();
    }
    return std::make_shared<const T>(std::move(content));
}

}  // namespace

Value::Value(std::string s) : storage_(shared(std::move(s))) {}
Value::Value(Bytes data) : storage_(shared(std::move(data))) {}
Value::Value(Array array) : storage_(shared(std::move(array))) {}
Value::Value(Dictionary dictionary) : storage_(shared(std::move(dictionary))) {}

Value Value::packed(Value propertyList) {
    Value value;
    value.storage_ = std::make_shared<const Packed>(Packed{std::move(propertyList)});
    return value;
}

ValueType Value::type() const noexcept {
    return std::visit(Overloaded{
                          [](std::monostate) { return ValueType::null; },
                          [](bool) { return ValueType::boolean; },
                          [](std::uint64_t) { return ValueType::unsignedInteger; },
                          [](std::int64_t) { return ValueType::signedInteger; },
                          [](double) { return ValueType::real; },
                          [](Date) { return ValueType::date; },
                          [](const Uuid&) { return ValueType::uuid; },
                          [](const std::shared_ptr<const std::string>&) { return ValueType::string; },
                          [](const std::shared_ptr<const Bytes>&) { return ValueType::data; },
                          [](const std::shared_ptr<const Array>&) { return ValueType::array; },
                          [](const std::shared_ptr<const Dictionary>&) { return ValueType::dictionary; },
                          [](const std::shared_ptr<const Packed>&) { return ValueType::packed; },
                      },
                      storage_);
}

bool Value::isNumber() const noexcept {
    auto t = type();
    return t == ValueType::unsignedInteger || t == ValueType::signedInteger || t == ValueType::real;
}

std::optional<bool> Value::asBool() const noexcept {
    if (auto* b = std::get_if<bool>(&storage_)) {
        return *b;
    }
    return std::nullopt;
}

std::optional<std::uint64_t> Value::asUnsigned() const noexcept {
    if (auto* u = std::get_if<std::uint64_t>(&storage_)) {
        return *u;
    }
    if (auto* i = std::get_if<std::int64_t>(&storage_); i && *i >= 0) {
        return static_cast<std::uint64_t>(*i);
    }
    return std::nullopt;
}

std::optional<std::int64_t> Value::asSigned() const noexcept {
    if (auto* i = std::get_if<std::int64_t>(&storage_)) {
        return *i;
    }
    if (auto* u = std::get_if<std::uint64_t>(&storage_);
        u && *u <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
        return static_cast<std::int64_t>(*u);
    }
    return std::nullopt;
}

std::optional<double> Value::asDouble() const noexcept {
    if (auto* d = std::get_if<double>(&storage_)) {
        return *d;
    }
    if (auto* u = std::get_if<std::uint64_t>(&storage_)) {
        return static_cast<double>(*u);
    }
    if (auto* i = std::get_if<std::int64_t>(&storage_)) {
        return static_cast<double>(*i);
    }
    return std::nullopt;
}

std::optional<Date> Value::asDate() const noexcept {
    if (auto* d = std::get_if<Date>(&storage_)) {
        return *d;
    }
    return std::nullopt;
}

std::optional<Uuid> Value::asUuid() const noexcept {
    if (auto* u = std::get_if<Uuid>(&storage_)) {
        return *u;
    }
    return std::nullopt;
}

const std::string* Value::asString() const noexcept {
    auto* p = std::get_if<std::shared_ptr<const std::string>>(&storage_);
    return p ? p->get() : nullptr;
}

const Bytes* Value::asData() const noexcept {
    auto* p = std::get_if<std::shared_ptr<const Bytes>>(&storage_);
    return p ? p->get() : nullptr;
}

const Array* Value::asArray() const noexcept {
    auto* p = std::get_if<std::shared_ptr<const Array>>(&storage_);
    return p ? p->get() : nullptr;
}

const Dictionary* Value::asDictionary() const noexcept {
    auto* p = std::get_if<std::shared_ptr<const Dictionary>>(&storage_);
    return p ? p->get() : nullptr;
}

const Value* Value::packedContent() const noexcept {
    auto* p = std::get_if<std::shared_ptr<const Packed>>(&storage_);
    return p ? &(*p)->content : nullptr;
}

const Value* Value::get(std::string_view key) const noexcept {
    const Dictionary* dictionary = asDictionary();
    return dictionary ? dictionary->find(key) : nullptr;
}

namespace {

// Numbers compare by value across the three representations.
bool numbersEqual(const Value& a, const Value& b) {
    auto ta = a.type();
    auto tb = b.type();
    if (ta == ValueType::real || tb == ValueType::real) {
        return *a.asDouble() == *b.asDouble();
    }
    auto sa = a.asSigned();
    auto sb = b.asSigned();
    if (sa && sb) {
        return *sa == *sb;
    }
    auto ua = a.asUnsigned();
    auto ub = b.asUnsigned();
    return ua && ub && *ua == *ub;
}

}  // namespace

bool Value::operator==(const Value& other) const noexcept {
    if (isNumber() && other.isNumber()) {
        return numbersEqual(*this, other);
    }
    if (type() != other.type()) {
        return false;
    }
    if (isSameObject(other)) {
        return true;
    }
    return std::visit(Overloaded{
                          [](std::monostate) { return true; },
                          [&](bool b) { return b == *other.asBool(); },
                          [](std::uint64_t) { return false; },  // numbers handled above
                          [](std::int64_t) { return false; },
                          [](double) { return false; },
                          [&](Date d) { return d == *other.asDate(); },
                          [&](const Uuid& u) { return u == *other.asUuid(); },
                          [&](const std::shared_ptr<const std::string>& s) { return *s == *other.asString(); },
                          [&](const std::shared_ptr<const Bytes>& d) { return *d == *other.asData(); },
                          [&](const std::shared_ptr<const Array>& a) { return *a == *other.asArray(); },
                          [&](const std::shared_ptr<const Dictionary>& d) { return *d == *other.asDictionary(); },
                          [&](const std::shared_ptr<const Packed>& p) { return p->content == *other.packedContent(); },
                      },
                      storage_);
}

bool Value::isSameObject(const Value& other) const noexcept {
    return std::visit(
        [&](const auto& mine) -> bool {
            using T = std::decay_t<decltype(mine)>;
            if constexpr (std::is_same_v<T, std::shared_ptr<const std::string>> ||
                          std::is_same_v<T, std::shared_ptr<const Bytes>> ||
                          std::is_same_v<T, std::shared_ptr<const Array>> ||
                          std::is_same_v<T, std::shared_ptr<const Dictionary>> ||
                          std::is_same_v<T, std::shared_ptr<const Packed>>) {
                auto* theirs = std::get_if<T>(&other.storage_);
                return theirs && theirs->get() == mine.get();
            } else {
                return false;
            }
        },
        storage_);
}

std::string Value::description() const {
    std::string out;
    appendDescription(out);
    return out;
}

std::ostream& operator<<(std::ostream& out, const Value& value) {
    return out << value.description();
}

std::ostream& operator<<(std::ostream& out, const Dictionary& dictionary) {
    return out << Value(dictionary).description();
}

void Value::appendDescription(std::string& out) const {
    char buffer[64];
    std::visit(Overloaded{
                   [&](std::monostate) { out += "null"; },
                   [&](bool b) { out += b ? "true" : "false"; },
                   [&](std::uint64_t u) {
                       std::snprintf(buffer, sizeof buffer, "%" PRIu64, u);
                       out += buffer;
                   },
                   [&](std::int64_t i) {
                       std::snprintf(buffer, sizeof buffer, "%" PRId64, i);
                       out += buffer;
                   },
                   [&](double d) {
                       std::snprintf(buffer, sizeof buffer, "%.17g", d);
                       out += buffer;
                   },
                   [&](Date d) {
                       std::snprintf(buffer, sizeof buffer, "<date %.17g>", d.secondsSince1970);
                       out += buffer;
                   },
                   [&](const Uuid& u) { out += u.text(); },
                   [&](const std::shared_ptr<const std::string>& s) { appendQuoted(out, *s); },
                   [&](const std::shared_ptr<const Bytes>& d) {
                       out += '<';
                       for (std::size_t i = 0; i < d->size(); ++i) {
                           if (i && i % 4 == 0) {
                               out += ' ';
                           }
                           std::snprintf(buffer, sizeof buffer, "%02x", (*d)[i]);
                           out += buffer;
                       }
                       out += '>';
                   },
                   [&](const std::shared_ptr<const Array>& a) {
                       out += '(';
                       for (std::size_t i = 0; i < a->size(); ++i) {
                           if (i) {
                               out += ", ";
                           }
                           (*a)[i].appendDescription(out);
                       }
                       out += ')';
                   },
                   [&](const std::shared_ptr<const Dictionary>& d) {
                       out += '{';
                       for (const auto& [key, value] : *d) {
                           appendQuoted(out, key);
                           out += " = ";
                           value.appendDescription(out);
                           out += "; ";
                       }
                       if (!d->empty()) {
                           out.resize(out.size() - 2);  // the last "; "
                       }
                       out += '}';
                   },
                   [&](const std::shared_ptr<const Packed>& p) {
                       out += "<packed ";
                       p->content.appendDescription(out);
                       out += '>';
                   },
               },
               storage_);
}

Dictionary::Dictionary(std::initializer_list<Entry> entries) {
    for (const auto& entry : entries) {
        set(entry.first, entry.second);
    }
}

std::optional<Dictionary> Dictionary::fromEntries(std::vector<Entry> entries) {
    auto byKey = [](const Entry& a, const Entry& b) { return a.first < b.first; };
    // Our own encoder writes keys in order, so the common case needs no sort.
    if (!std::is_sorted(entries.begin(), entries.end(), byKey)) {
        std::sort(entries.begin(), entries.end(), byKey);
    }
    auto duplicate = std::adjacent_find(entries.begin(), entries.end(),
                                        [](const Entry& a, const Entry& b) { return a.first == b.first; });
    if (duplicate != entries.end()) {
        return std::nullopt;
    }
    Dictionary dictionary;
    dictionary.entries_ = std::move(entries);
    return dictionary;
}

const Value* Dictionary::find(std::string_view key) const noexcept {
    auto it = std::lower_bound(entries_.begin(), entries_.end(), key, entryKeyLess);
    if (it == entries_.end() || it->first != key) {
        return nullptr;
    }
    return &it->second;
}

void Dictionary::set(std::string key, Value value) {
    auto it = std::lower_bound(entries_.begin(), entries_.end(), key, entryKeyLess);
    if (it != entries_.end() && it->first == key) {
        it->second = std::move(value);
        return;
    }
    entries_.emplace(it, std::move(key), std::move(value));
}

void Dictionary::remove(std::string_view key) {
    auto it = std::lower_bound(entries_.begin(), entries_.end(), key, entryKeyLess);
    if (it != entries_.end() && it->first == key) {
        entries_.erase(it);
    }
}

Dictionary Dictionary::changing(std::string_view key, std::optional<Value> value) const {
    Dictionary copy = *this;
    if (value) {
        copy.set(std::string(key), std::move(*value));
    } else {
        copy.remove(key);
    }
    return copy;
}

bool Dictionary::operator==(const Dictionary& other) const noexcept {
    return entries_ == other.entries_;
}

std::optional<std::string> stringAt(const Value& dictionary, std::string_view key) {
    return stringAt(&dictionary, key);
}

std::optional<std::string> stringAt(const Value* dictionary, std::string_view key) {
    const Value* value = dictionary ? dictionary->get(key) : nullptr;
    const std::string* text = value ? value->asString() : nullptr;
    return text ? std::optional<std::string>(*text) : std::nullopt;
}

}  // namespace qm
