#pragma once
// printf-style formatting of the system's message and log formats, which use
// "%@" for any object (its description, or a string's own text) beside the C
// conversions %s %d %i %u %x %X %o %c %p %f %g %e with the usual flags, width,
// precision and length modifiers. A conversion without a length modifier
// takes the low 32 bits of an integer, as C's would. A null C string prints
// as "(null)".

#include <concepts>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <vector>

#include "platform/value/Value.h"

namespace qm {

struct FormatArg {
    enum class Kind { Signed, Unsigned, Double, Text, NullText, Pointer };
    Kind kind = Kind::NullText;
    std::int64_t i = 0;
    std::uint64_t u = 0;
    double d = 0;
    std::string text;
};

template <class T>
concept Describable = requires(const T& t) {
    { t.description() } -> std::convertible_to<std::string>;
};

template <class T>
FormatArg makeFormatArg(const T& value) {
    FormatArg arg;
    if constexpr (std::is_same_v<T, bool>) {
        arg.kind = FormatArg::Kind::Signed;
        arg.i = value ? 1 : 0;
    } else if constexpr (std::is_integral_v<T> && std::is_signed_v<T>) {
        arg.kind = FormatArg::Kind::Signed;
        arg.i = value;
    } else if constexpr (std::is_integral_v<T>) {
        arg.kind = FormatArg::Kind::Unsigned;
        arg.u = value;
    } else if constexpr (std::is_enum_v<T>) {
        arg.kind = FormatArg::Kind::Signed;
        arg.i = static_cast<std::int64_t>(value);
    } else if constexpr (std::is_floating_point_v<T>) {
        arg.kind = FormatArg::Kind::Double;
        arg.d = value;
    } else if constexpr (std::is_same_v<T, Value>) {
        arg.kind = FormatArg::Kind::Text;
        const std::string* s = value.asString();
        arg.text = s ? *s : value.description();
    } else if constexpr (std::is_convertible_v<T, std::string_view>) {
        if constexpr (std::is_pointer_v<T>) {
            if (value == nullptr) {
                arg.kind = FormatArg::Kind::NullText;
                return arg;
            }
        }
        arg.kind = FormatArg::Kind::Text;
        arg.text = std::string(std::string_view(value));
    } else if constexpr (std::is_same_v<T, std::optional<std::string>>) {
        if (value) {
            arg.kind = FormatArg::Kind::Text;
            arg.text = *value;
        }
    } else if constexpr (std::is_same_v<T, std::nullptr_t>) {
        arg.kind = FormatArg::Kind::NullText;
    } else if constexpr (std::is_pointer_v<T>) {
        arg.kind = FormatArg::Kind::Pointer;
        arg.u = reinterpret_cast<std::uintptr_t>(value);
    } else if constexpr (Describable<T>) {
        arg.kind = FormatArg::Kind::Text;
        arg.text = value.description();
    } else {
        static_assert(sizeof(T) == 0, "no format conversion for this type");
    }
    return arg;
}

std::string formatArgs(std::string_view format, const std::vector<FormatArg>& args);

template <class... Args>
std::string format(std::string_view fmt, const Args&... args) {
    return formatArgs(fmt, std::vector<FormatArg>{makeFormatArg(args)...});
}

// Log lines bound what a peer can make them carry: a text argument longer
// than this is cut (at a character boundary) and marked "…[N bytes]" with
// its whole size. Replies are never cut; only log lines.
inline constexpr std::size_t kMaxLoggedArgument = 1024;
void boundTextArgs(std::vector<FormatArg>& args);

template <class... Args>
std::string boundedFormat(std::string_view fmt, const Args&... args) {
    std::vector<FormatArg> bound{makeFormatArg(args)...};
    boundTextArgs(bound);
    return formatArgs(fmt, bound);
}

// A text logged in full, as lines of at most kMaxLoggedArgument bytes cut at
// character boundaries; every line after the first starts with "… ".
std::vector<std::string> splitForLog(std::string_view text);

}  // namespace qm
