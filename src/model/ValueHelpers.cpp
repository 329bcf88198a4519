#include "model/ValueHelpers.h"

namespace {

bool isDigit(char c) {
    return c >= '0' && c <= '9';
}

std::string_view digitRun(std::string_view text, std::size_t start) {
    std::size_t end = start;
    while (end < text.size() && isDigit(text[end])) {
        ++end;
    }
    return text.substr(start, end - start);
}

std::string_view withoutLeadingZeros(std::string_view run) {
    std::size_t first = run.find_first_not_of('0');
    return first == std::string_view::npos ? std::string_view() : run.substr(first);
}

// Numeric order of two digit runs of any length.
std::strong_ordering compareRunValues(std::string_view a, std::string_view b) {
    std::string_view significantA = withoutLeadingZeros(a);
    std::string_view significantB = withoutLeadingZeros(b);
    if (significantA.size() != significantB.size()) {
        return significantA.size() <=> significantB.size();
    }
    return significantA.compare(significantB) <=> 0;
}

}  // namespace

std::optional<qm::Value> dictionaryChanging(const std::optional<qm::Value>& dictionary, std::string_view key,
                                            std::optional<qm::Value> value) {
    const qm::Dictionary* entries = dictionary ? dictionary->asDictionary() : nullptr;
    if (!entries) {
        return std::nullopt;
    }
    return qm::Value(entries->changing(key, std::move(value)));
}

std::strong_ordering compareVersionString(std::string_view a, std::string_view b) {
    std::strong_ordering zerosTieBreak = std::strong_ordering::equal;
    std::size_t i = 0;
    std::size_t j = 0;
    while (i < a.size() && j < b.size()) {
        if (isDigit(a[i]) && isDigit(b[j])) {
            std::string_view runA = digitRun(a, i);
            std::string_view runB = digitRun(b, j);
            if (auto order = compareRunValues(runA, runB); order != 0) {
                return order;
            }
            if (zerosTieBreak == 0) {
                zerosTieBreak = runA.size() <=> runB.size();
            }
            i += runA.size();
            j += runB.size();
            continue;
        }
        auto byteA = static_cast<unsigned char>(a[i]);
        auto byteB = static_cast<unsigned char>(b[j]);
        if (byteA != byteB) {
            return byteA <=> byteB;
        }
        ++i;
        ++j;
    }
    if (auto order = (i < a.size()) <=> (j < b.size()); order != 0) {
        return order;
    }
    return zerosTieBreak;
}

const qm::Array* QMGetDuctArray(const qm::Value& message, std::string_view key) {
    const qm::Value* value = message.get(key);
    return value ? value->asArray() : nullptr;
}

const qm::Dictionary* QMGetDuctDictionary(const qm::Value& message, std::string_view key) {
    const qm::Value* value = message.get(key);
    return value ? value->asDictionary() : nullptr;
}

bool entitlementGranted(const std::optional<qm::Value>& value) {
    return value && !(*value == qm::Value(false)) && !(value->isNumber() && *value == qm::Value(0));
}
