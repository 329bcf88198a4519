#pragma once
// The one value type of the system: property lists, Duct messages, forms,
// rules and annotations are all trees of Value.
//
// A Value is immutable and cheap to copy: scalars are stored inline, strings,
// data, arrays and dictionaries behind a shared pointer. "Changing" a
// dictionary or array makes a new one whose untouched entries are shared with
// the old one; nothing is ever deep-copied. Empty strings, data, arrays and
// dictionaries all share one object per type, so they allocate nothing. Values
// may be handed between threads freely.

#include <cstdint>
#include <iosfwd>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "platform/value/Uuid.h"

namespace qm {

using Bytes = std::vector<std::uint8_t>;

class Value;
class Dictionary;
using Array = std::vector<Value>;

enum class ValueType : std::uint8_t {
    null,
    boolean,
    unsignedInteger,
    signedInteger,
    real,
    string,
    data,
    date,
    uuid,
    array,
    dictionary,
    packed,  // a whole property list carried as one message value
};

const char* valueTypeName(ValueType type);

// A date: seconds since 1970-01-01 00:00 UTC (may be fractional or negative).
struct Date {
    double secondsSince1970 = 0;
    bool operator==(const Date&) const = default;
};

class Value {
public:
    Value() noexcept = default;  // null

    // Implicit construction from the obvious C++ types keeps literals short:
    // Value("text"), Value(true), Value(uint64_t{3}).
    Value(bool b) noexcept : storage_(b) {}                                    // NOLINT
    Value(std::uint64_t u) noexcept : storage_(u) {}                           // NOLINT
    Value(std::int64_t i) noexcept : storage_(i) {}                            // NOLINT
    Value(int i) noexcept : storage_(static_cast<std::int64_t>(i)) {}          // NOLINT
    Value(unsigned u) noexcept : storage_(static_cast<std::uint64_t>(u)) {}    // NOLINT
    Value(double d) noexcept : storage_(d) {}                                  // NOLINT
    Value(Date d) noexcept : storage_(d) {}                                    // NOLINT
    Value(const Uuid& u) noexcept : storage_(u) {}                             // NOLINT
    Value(const char* s) : Value(std::string(s)) {}                            // NOLINT
    Value(std::string_view s) : Value(std::string(s)) {}                       // NOLINT
    Value(std::string s);                                                      // NOLINT
    Value(Bytes data);                                                         // NOLINT
    Value(Array array);                                                        // NOLINT
    Value(Dictionary dictionary);                                              // NOLINT

    static Value packed(Value propertyList);

    ValueType type() const noexcept;
    bool isNull() const noexcept { return type() == ValueType::null; }
    bool isNumber() const noexcept;
    bool isString() const noexcept { return type() == ValueType::string; }
    bool isArray() const noexcept { return type() == ValueType::array; }
    bool isDictionary() const noexcept { return type() == ValueType::dictionary; }

    // Typed reads: the value when it has that type, else nothing. Integers are
    // read by value: an unsigned read accepts a non-negative signed integer,
    // a signed read accepts an unsigned one up to INT64_MAX.
    std::optional<bool> asBool() const noexcept;
    std::optional<std::uint64_t> asUnsigned() const noexcept;
    std::optional<std::int64_t> asSigned() const noexcept;
    std::optional<double> asDouble() const noexcept;  // any number
    std::optional<Date> asDate() const noexcept;
    std::optional<Uuid> asUuid() const noexcept;
    const std::string* asString() const noexcept;
    const Bytes* asData() const noexcept;
    const Array* asArray() const noexcept;
    const Dictionary* asDictionary() const noexcept;
    const Value* packedContent() const noexcept;  // the property list of a packed value

    // Dictionary lookup; nothing when this is not a dictionary or has no such key.
    const Value* get(std::string_view key) const noexcept;

    // Equality by value: numbers compare by numeric value (a signed 5 equals an
    // unsigned 5 and the double 5.0), containers element by element.
    bool operator==(const Value& other) const noexcept;

    // A readable one-line rendering for log lines: {key = value; ...}, (a, b).
    std::string description() const;
    void appendDescription(std::string& out) const;

    // Identity of the shared storage: two values that share one array or
    // dictionary object. Scalars are never identical.
    bool isSameObject(const Value& other) const noexcept;

private:
    struct Packed;
    using Storage = std::variant<std::monostate, bool, std::uint64_t, std::int64_t, double, Date, Uuid,
                                 std::shared_ptr<const std::string>, std::shared_ptr<const Bytes>,
                                 std::shared_ptr<const Array>, std::shared_ptr<const Dictionary>,
                                 std::shared_ptr<const Packed>>;
    Storage storage_;
};

// A dictionary: string keys kept sorted, each once. Entries are Values, so a
// copy of a Dictionary shares every entry's storage.
class Dictionary {
public:
    using Entry = std::pair<std::string, Value>;
    using const_iterator = std::vector<Entry>::const_iterator;

    Dictionary() = default;
    Dictionary(std::initializer_list<Entry> entries);

    // Builds from entries in any order; nothing when a key appears twice.
    static std::optional<Dictionary> fromEntries(std::vector<Entry> entries);

    const Value* find(std::string_view key) const noexcept;
    bool contains(std::string_view key) const noexcept { return find(key) != nullptr; }
    std::size_t size() const noexcept { return entries_.size(); }
    bool empty() const noexcept { return entries_.empty(); }
    const_iterator begin() const noexcept { return entries_.begin(); }
    const_iterator end() const noexcept { return entries_.end(); }

    void set(std::string key, Value value);
    void remove(std::string_view key);
    // Room for this many entries, so that setting them allocates once.
    void reserve(std::size_t entries) { entries_.reserve(entries); }

    // A copy with one key set, or removed when the value is nothing.
    Dictionary changing(std::string_view key, std::optional<Value> value) const;

    bool operator==(const Dictionary& other) const noexcept;

private:
    std::vector<Entry> entries_;
};

// The string under key in a dictionary; nothing when the dictionary (null
// included) has no such key or its value is not a string.
std::optional<std::string> stringAt(const Value& dictionary, std::string_view key);
std::optional<std::string> stringAt(const Value* dictionary, std::string_view key);

// The description, for streams (test failures, debugging).
std::ostream& operator<<(std::ostream& out, const Value& value);
std::ostream& operator<<(std::ostream& out, const Dictionary& dictionary);

}  // namespace qm
