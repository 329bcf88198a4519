#include "platform/plist/PlistFromValue.h"

#include <cmath>
#include <cstdint>
#include <limits>
#include <string>

#include "platform/value/Utf8.h"

namespace qm::plist {

namespace {

class PlistWriter {
public:
    qm::Result<PlistPtr> write(const qm::Value& value) {
        switch (value.type()) {
            case qm::ValueType::boolean: return made(plist_new_bool(*value.asBool() ? 1 : 0));
            case qm::ValueType::signedInteger:
                // Two's complement: libplist's only integer type holds negatives this way.
                return made(plist_new_uint(static_cast<std::uint64_t>(*value.asSigned())));
            case qm::ValueType::unsignedInteger: {
                std::uint64_t number = *value.asUnsigned();
                if (number > static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
                    return unsupported("unsigned integer above INT64_MAX (it would read back negative)");
                }
                return made(plist_new_uint(number));
            }
            case qm::ValueType::real: return made(plist_new_real(*value.asDouble()));
            case qm::ValueType::string: return writeString(*value.asString());
            case qm::ValueType::data: {
                const qm::Bytes& bytes = *value.asData();
                static const char kEmpty = 0;
                const char* begin = bytes.empty() ? &kEmpty : reinterpret_cast<const char*>(bytes.data());
                return made(plist_new_data(begin, bytes.size()));
            }
            case qm::ValueType::date: return writeDate(*value.asDate());
            case qm::ValueType::array: return writeArray(*value.asArray());
            case qm::ValueType::dictionary: return writeDictionary(*value.asDictionary());
            case qm::ValueType::null: return unsupported("null has no property-list form");
            case qm::ValueType::uuid: return unsupported("a UUID has no property-list form");
            case qm::ValueType::packed: return unsupported("a packed property list has no property-list form");
        }
        return unsupported("unknown value type");
    }

private:
    qm::Error unsupported(const std::string& what) const {
        return plistError(kErrorUnsupported, what + " at " + path_.text());
    }

    qm::Result<PlistPtr> made(plist_t node) const {
        if (!node) {
            return plistError(kErrorUnsupported, "libplist could not make a node at " + path_.text());
        }
        return PlistPtr(node);
    }

    // libplist takes C strings, so text must be free of NUL to survive.
    qm::MaybeError checkText(std::string_view text, const char* what) const {
        if (text.find('\0') != std::string_view::npos) {
            return unsupported(std::string(what) + " with a NUL character");
        }
        if (!qm::utf8::isValid(text)) {
            return unsupported(std::string(what) + " that is not UTF-8");
        }
        return std::nullopt;
    }

    qm::Result<PlistPtr> writeString(const std::string& text) const {
        if (auto error = checkText(text, "string")) {
            return *error;
        }
        return made(plist_new_string(text.c_str()));
    }

    qm::Result<PlistPtr> writeDate(qm::Date date) const {
        double sinceReference = date.secondsSince1970 - kSecondsFrom1970To2001;
        if (!std::isfinite(sinceReference)) {
            return unsupported("date that is not a finite number");
        }
        double whole = std::trunc(sinceReference);
        double micro = std::round((sinceReference - whole) * 1e6);
        if (std::fabs(micro) >= 1e6) {
            whole += micro > 0 ? 1 : -1;
            micro = 0;
        }
        if (whole < std::numeric_limits<std::int32_t>::min() || whole > std::numeric_limits<std::int32_t>::max()) {
            return unsupported("date outside 1932-12-13 to 2069-01-19");
        }
        // Seconds and microseconds share the sign, as libplist adds them.
        return made(plist_new_date(static_cast<std::int32_t>(whole), static_cast<std::int32_t>(micro)));
    }

    qm::MaybeError checkNesting() const {
        if (path_.depth() >= kMaxNesting) {
            return plistError(kErrorTooComplex, "value nested too deeply at " + path_.text());
        }
        return std::nullopt;
    }

    qm::Result<PlistPtr> writeArray(const qm::Array& array) {
        if (auto error = checkNesting()) {
            return *error;
        }
        auto created = made(plist_new_array());
        if (!created) {
            return created;
        }
        PlistPtr node = std::move(created).value();
        for (std::size_t i = 0; i < array.size(); ++i) {
            path_.push(std::to_string(i));
            auto item = write(array[i]);
            path_.pop();
            if (!item) {
                return std::move(item).error();
            }
            plist_array_append_item(node.get(), item->release());
        }
        return node;
    }

    qm::Result<PlistPtr> writeDictionary(const qm::Dictionary& dictionary) {
        if (auto error = checkNesting()) {
            return *error;
        }
        auto created = made(plist_new_dict());
        if (!created) {
            return created;
        }
        PlistPtr node = std::move(created).value();
        for (const auto& [key, value] : dictionary) {
            path_.push(key);
            qm::MaybeError keyError = checkText(key, "key");
            auto item = keyError ? qm::Result<PlistPtr>(*keyError) : write(value);
            path_.pop();
            if (!item) {
                return std::move(item).error();
            }
            plist_dict_set_item(node.get(), key.c_str(), item->release());
        }
        return node;
    }

    TreePath path_;
};

}  // namespace

qm::Result<PlistPtr> plistFromValue(const qm::Value& value) {
    return PlistWriter().write(value);
}

}  // namespace qm::plist
