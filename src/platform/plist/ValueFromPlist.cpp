#include "platform/plist/ValueFromPlist.h"

#include <cmath>
#include <cstring>
#include <string>
#include <vector>

#include "platform/plist/LibplistSupport.h"
#include "platform/value/Utf8.h"

namespace qm::plist {

namespace {

// libplist 2.2's date getter truncates to 32-bit seconds and drops the sign of
// the fraction. The binary form of a lone date is exact: "bplist00", then the
// object, marker 0x33 and a big-endian IEEE 754 double of seconds since 2001.
std::optional<double> exactSecondsSince2001(plist_t date) {
    PlistPtr copy(plist_copy(date));
    if (!copy) {
        return std::nullopt;
    }
    char* raw = nullptr;
    std::uint32_t length = 0;
    plist_to_bin(copy.get(), &raw, &length);
    MallocPtr owner(raw);
    constexpr std::size_t kObject = 8;
    if (!raw || length < kObject + 9 || static_cast<std::uint8_t>(raw[kObject]) != 0x33) {
        return std::nullopt;
    }
    std::uint64_t bits = 0;
    for (std::size_t i = 1; i <= 8; ++i) {
        bits = (bits << 8) | static_cast<std::uint8_t>(raw[kObject + i]);
    }
    double seconds = 0;
    static_assert(sizeof seconds == sizeof bits);
    std::memcpy(&seconds, &bits, sizeof seconds);
    return seconds;
}

class PlistReader {
public:
    qm::Result<qm::Value> read(plist_t node) {
        if (!node) {
            return unsupported("missing node");
        }
        switch (plist_get_node_type(node)) {
            case PLIST_BOOLEAN: {
                std::uint8_t flag = 0;
                plist_get_bool_val(node, &flag);
                return qm::Value(flag != 0);
            }
            case PLIST_UINT: {
                std::uint64_t bits = 0;
                plist_get_uint_val(node, &bits);
                // Two's complement: this is how libplist holds negative numbers.
                return qm::Value(static_cast<std::int64_t>(bits));
            }
            case PLIST_REAL: {
                double real = 0;
                plist_get_real_val(node, &real);
                return qm::Value(real);
            }
            case PLIST_STRING: return readString(node);
            case PLIST_DATA: {
                std::uint64_t length = 0;
                const char* bytes = plist_get_data_ptr(node, &length);
                if (!bytes || length == 0) {
                    return qm::Value(qm::Bytes{});
                }
                auto* begin = reinterpret_cast<const std::uint8_t*>(bytes);
                return qm::Value(qm::Bytes(begin, begin + length));
            }
            case PLIST_DATE: {
                auto seconds = exactSecondsSince2001(node);
                if (!seconds || !std::isfinite(*seconds)) {
                    return malformed("unreadable date");
                }
                return qm::Value(qm::Date{*seconds + kSecondsFrom1970To2001});
            }
            case PLIST_ARRAY: return readArray(node);
            case PLIST_DICT: return readDictionary(node);
            case PLIST_UID: return unsupported("UID values are not supported");
            case PLIST_KEY:
            case PLIST_NONE: break;
        }
        return unsupported("unknown node type");
    }

private:
    qm::Error malformed(const std::string& what) const {
        return plistError(kErrorMalformed, "not a property list: " + what + " at " + path_.text());
    }
    qm::Error unsupported(const std::string& what) const {
        return plistError(kErrorUnsupported, what + " at " + path_.text());
    }

    qm::Result<qm::Value> readString(plist_t node) const {
        std::uint64_t length = 0;
        const char* text = plist_get_string_ptr(node, &length);
        if (!text) {
            return malformed("unreadable string");
        }
        std::size_t size = std::strlen(text);
        if (size != length) {
            return malformed("string with a NUL character");
        }
        std::string_view view(text, size);
        if (!qm::utf8::isValid(view)) {
            return malformed("string that is not UTF-8");
        }
        return qm::Value(std::string(view));
    }

    qm::MaybeError checkNesting() const {
        if (path_.depth() >= kMaxNesting) {
            return plistError(kErrorTooComplex, "property list nested too deeply at " + path_.text());
        }
        return std::nullopt;
    }

    qm::Result<qm::Value> readArray(plist_t node) {
        if (auto error = checkNesting()) {
            return *error;
        }
        plist_array_iter rawIterator = nullptr;
        plist_array_new_iter(node, &rawIterator);
        MallocPtr iterator(rawIterator);
        if (!iterator) {
            return malformed("unreadable array");
        }
        qm::Array array;
        for (;;) {
            plist_t item = nullptr;
            plist_array_next_item(node, rawIterator, &item);
            if (!item) {
                break;
            }
            path_.push(std::to_string(array.size()));
            auto value = read(item);
            path_.pop();
            if (!value) {
                return std::move(value).error();
            }
            array.push_back(std::move(value).value());
        }
        return qm::Value(std::move(array));
    }

    qm::Result<qm::Value> readDictionary(plist_t node) {
        if (auto error = checkNesting()) {
            return *error;
        }
        plist_dict_iter rawIterator = nullptr;
        plist_dict_new_iter(node, &rawIterator);
        MallocPtr iterator(rawIterator);
        if (!iterator) {
            return malformed("unreadable dictionary");
        }
        std::vector<qm::Dictionary::Entry> entries;
        for (;;) {
            char* rawKey = nullptr;
            plist_t item = nullptr;
            plist_dict_next_item(node, rawIterator, &rawKey, &item);
            MallocPtr keyOwner(rawKey);
            if (!item) {
                break;
            }
            if (!rawKey) {
                return malformed("dictionary entry without a key");
            }
            std::string key(rawKey);
            if (!qm::utf8::isValid(key)) {
                return malformed("key that is not UTF-8");
            }
            path_.push(key);
            auto value = read(item);
            path_.pop();
            if (!value) {
                return std::move(value).error();
            }
            entries.emplace_back(std::move(key), std::move(value).value());
        }
        auto dictionary = qm::Dictionary::fromEntries(std::move(entries));
        if (!dictionary) {
            return malformed("duplicate key in a dictionary");
        }
        return qm::Value(std::move(*dictionary));
    }

    TreePath path_;
};

}  // namespace

qm::Result<qm::Value> valueFromPlist(plist_t root) {
    return PlistReader().read(root);
}

}  // namespace qm::plist
