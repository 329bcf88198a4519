#include "platform/text/Format.h"

#include <cinttypes>
#include <cstdio>

#include "platform/value/Utf8.h"

namespace qm {

namespace {

struct Directive {
    std::string flags;   // flags, width and precision as written
    std::string length;  // hh h l ll z j t L q
    char conversion = 0;
};

bool isFlagOrWidth(char c) {
    return c == '-' || c == '+' || c == ' ' || c == '#' || c == '0' || (c >= '1' && c <= '9') || c == '.';
}

bool isLength(char c) {
    return c == 'h' || c == 'l' || c == 'z' || c == 'j' || c == 't' || c == 'L' || c == 'q';
}

std::string printfOne(const std::string& directive, auto value) {
    char buffer[128];
    int n = std::snprintf(buffer, sizeof buffer, directive.c_str(), value);
    if (n < 0) {
        return {};
    }
    if (static_cast<std::size_t>(n) < sizeof buffer) {
        return std::string(buffer, static_cast<std::size_t>(n));
    }
    std::string big(static_cast<std::size_t>(n) + 1, '\0');
    std::snprintf(big.data(), big.size(), directive.c_str(), value);
    big.resize(static_cast<std::size_t>(n));
    return big;
}

std::int64_t signedValue(const FormatArg& arg) {
    return arg.kind == FormatArg::Kind::Signed ? arg.i : static_cast<std::int64_t>(arg.u);
}

std::uint64_t unsignedValue(const FormatArg& arg) {
    return arg.kind == FormatArg::Kind::Signed ? static_cast<std::uint64_t>(arg.i) : arg.u;
}

bool isInteger(const FormatArg& arg) {
    return arg.kind == FormatArg::Kind::Signed || arg.kind == FormatArg::Kind::Unsigned ||
           arg.kind == FormatArg::Kind::Pointer;
}

std::string textOf(const FormatArg& arg) {
    switch (arg.kind) {
        case FormatArg::Kind::Text: return arg.text;
        case FormatArg::Kind::NullText: return "(null)";
        case FormatArg::Kind::Signed: return std::to_string(arg.i);
        case FormatArg::Kind::Unsigned: return std::to_string(arg.u);
        case FormatArg::Kind::Double: return printfOne("%g", arg.d);
        case FormatArg::Kind::Pointer: return printfOne("%p", reinterpret_cast<void*>(arg.u));
    }
    return {};
}

std::string convert(const Directive& directive, const FormatArg& arg) {
    const bool wide = !directive.length.empty() && directive.length != "h" && directive.length != "hh";
    std::string base = "%" + directive.flags;
    switch (directive.conversion) {
        case '@':
        case 's': {
            std::string text = textOf(arg);
            return directive.flags.empty() ? text : printfOne(base + "s", text.c_str());
        }
        case 'd':
        case 'i':
            if (!isInteger(arg)) {
                return textOf(arg);
            }
            if (wide) {
                return printfOne(base + PRId64, signedValue(arg));
            }
            return printfOne(base + "d", static_cast<std::int32_t>(static_cast<std::uint32_t>(unsignedValue(arg))));
        case 'u':
        case 'x':
        case 'X':
        case 'o':
            if (!isInteger(arg)) {
                return textOf(arg);
            }
            if (wide) {
                const char* c = directive.conversion == 'u'   ? PRIu64
                                : directive.conversion == 'x' ? PRIx64
                                : directive.conversion == 'X' ? PRIX64
                                                         : PRIo64;
                return printfOne(base + c, unsignedValue(arg));
            }
            return printfOne(base + directive.conversion, static_cast<std::uint32_t>(unsignedValue(arg)));
        case 'c':
            return isInteger(arg) ? std::string(1, static_cast<char>(unsignedValue(arg))) : textOf(arg);
        case 'p':
            return printfOne("%p", reinterpret_cast<void*>(unsignedValue(arg)));
        case 'f':
        case 'F':
        case 'g':
        case 'G':
        case 'e':
        case 'E': {
            double d = arg.kind == FormatArg::Kind::Double     ? arg.d
                       : arg.kind == FormatArg::Kind::Signed   ? static_cast<double>(arg.i)
                       : arg.kind == FormatArg::Kind::Unsigned ? static_cast<double>(arg.u)
                                                               : 0.0;
            return printfOne(base + directive.conversion, d);
        }
        default:
            return textOf(arg);
    }
}

}  // namespace

std::string formatArgs(std::string_view format, const std::vector<FormatArg>& args) {
    std::string out;
    out.reserve(format.size() + 32);
    std::size_t next = 0;
    for (std::size_t i = 0; i < format.size(); ++i) {
        char c = format[i];
        if (c != '%') {
            out += c;
            continue;
        }
        if (i + 1 < format.size() && format[i + 1] == '%') {
            out += '%';
            ++i;
            continue;
        }
        std::size_t j = i + 1;
        Directive directive;
        while (j < format.size() && isFlagOrWidth(format[j])) {
            directive.flags += format[j++];
        }
        while (j < format.size() && isLength(format[j])) {
            directive.length += format[j++];
        }
        if (j >= format.size()) {
            out.append(format.substr(i));  // a dangling '%' prints as written
            break;
        }
        directive.conversion = format[j];
        static const FormatArg missing;
        const FormatArg& arg = next < args.size() ? args[next] : missing;
        ++next;
        out += convert(directive, arg);
        i = j;
    }
    return out;
}

namespace {

// The longest prefix of text within limit bytes that ends on a character boundary.
std::size_t characterBoundaryWithin(std::string_view text, std::size_t limit) {
    std::size_t end = 0;
    while (end < text.size()) {
        std::size_t length = utf8::sequenceLength(text.substr(end));
        length = length == 0 ? 1 : length;  // a stray byte is cut like a character
        if (end + length > limit) {
            break;
        }
        end += length;
    }
    return end;
}

}  // namespace

void boundTextArgs(std::vector<FormatArg>& args) {
    for (FormatArg& arg : args) {
        if (arg.kind != FormatArg::Kind::Text || arg.text.size() <= kMaxLoggedArgument) {
            continue;
        }
        std::size_t whole = arg.text.size();
        arg.text.resize(characterBoundaryWithin(arg.text, kMaxLoggedArgument));
        arg.text += "…[" + std::to_string(whole) + " bytes]";
    }
}

std::vector<std::string> splitForLog(std::string_view text) {
    static constexpr std::string_view kContinuation = "… ";
    std::vector<std::string> lines;
    std::size_t end = characterBoundaryWithin(text, kMaxLoggedArgument);
    lines.emplace_back(text.substr(0, end));
    text.remove_prefix(end);
    while (!text.empty()) {
        end = characterBoundaryWithin(text, kMaxLoggedArgument - kContinuation.size());
        end = end == 0 ? 1 : end;
        lines.emplace_back(kContinuation).append(text.substr(0, end));
        text.remove_prefix(end);
    }
    return lines;
}

}  // namespace qm
