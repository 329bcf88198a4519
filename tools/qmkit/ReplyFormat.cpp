#include "ReplyFormat.h"

#include "platform/value/Json.h"
#include "platform/value/Rfc3339.h"

namespace {

bool isNonEmptyContainer(const qm::Value& value) {
    if (const qm::Value* content = value.packedContent()) {
        return isNonEmptyContainer(*content);
    }
    if (const qm::Array* array = value.asArray()) {
        return !array->empty();
    }
    if (const qm::Dictionary* dictionary = value.asDictionary()) {
        return !dictionary->empty();
    }
    return false;
}

std::string scalarText(const qm::Value& value) {
    switch (value.type()) {
        case qm::ValueType::string: return *value.asString();
        case qm::ValueType::uuid: return value.asUuid()->text();
        case qm::ValueType::date: return qm::rfc3339::format(*value.asDate()).value_or(value.description());
        case qm::ValueType::data: return "<" + std::to_string(value.asData()->size()) + " bytes>";
        case qm::ValueType::array: return "()";
        case qm::ValueType::dictionary: return "{}";
        case qm::ValueType::packed: return scalarText(*value.packedContent());
        case qm::ValueType::null:
        case qm::ValueType::boolean:
        case qm::ValueType::unsignedInteger:
        case qm::ValueType::signedInteger:
        case qm::ValueType::real: return value.description();
    }
    return value.description();
}

void appendLines(const qm::Value& value, int depth, std::string& out);

void appendEntry(const std::string& label, const qm::Value& value, int depth, std::string& out) {
    out.append(static_cast<std::size_t>(depth) * 2, ' ');
    out += label;
    if (isNonEmptyContainer(value)) {
        out += '\n';
        appendLines(value, depth + 1, out);
        return;
    }
    out += ' ';
    out += scalarText(value);
    out += '\n';
}

// Lines for the entries of a non-empty container.
void appendLines(const qm::Value& value, int depth, std::string& out) {
    if (const qm::Value* content = value.packedContent()) {
        appendLines(*content, depth, out);
        return;
    }
    if (const qm::Array* array = value.asArray()) {
        for (const qm::Value& element : *array) {
            appendEntry("-", element, depth, out);
        }
        return;
    }
    for (const auto& [key, entry] : *value.asDictionary()) {
        appendEntry(key + ":", entry, depth, out);
    }
}

}  // namespace

std::string replyAsJson(const qm::Value& value) {
    return qm::json::write(value, true) + "\n";
}

std::string replyAsText(const qm::Value& value) {
    if (!isNonEmptyContainer(value)) {
        return scalarText(value) + "\n";
    }
    std::string out;
    appendLines(value, 0, out);
    return out;
}
