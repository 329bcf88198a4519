#pragma once
// Errors are values: (domain, code, description). Anything that input can
// cause is reported with one of these; assertions are for programming errors.

#include <cassert>
#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <variant>

namespace qm {

struct Error {
    std::string domain;
    std::int64_t code = 0;
    std::optional<std::string> description;  // the localized description, when there is one

    // The description, or "" when there is none.
    const std::string& text() const {
        static const std::string empty;
        return description ? *description : empty;
    }
    bool operator==(const Error&) const = default;
};

// The domain of operating-system failures; the code is an errno value.
inline constexpr const char* kPosixErrorDomain = "posix";
Error posixError(int errorNumber, std::string context);

// An expected-style result: a value or an error, never both.
template <class T, class E = Error>
class [[nodiscard]] Result {
public:
    Result(T value) : state_(std::in_place_index<0>, std::move(value)) {}  // NOLINT
    Result(E error) : state_(std::in_place_index<1>, std::move(error)) {}  // NOLINT

    bool ok() const noexcept { return state_.index() == 0; }
    explicit operator bool() const noexcept { return ok(); }

    T& value() & {
        assert(ok());
        return std::get<0>(state_);
    }
    const T& value() const& {
        assert(ok());
        return std::get<0>(state_);
    }
    T&& value() && {
        assert(ok());
        return std::get<0>(std::move(state_));
    }
    T* operator->() { return &value(); }
    const T* operator->() const { return &value(); }
    T& operator*() & { return value(); }
    const T& operator*() const& { return value(); }

    const E& error() const& {
        assert(!ok());
        return std::get<1>(state_);
    }
    E&& error() && {
        assert(!ok());
        return std::get<1>(std::move(state_));
    }

private:
    std::variant<T, E> state_;
};

// For operations that only succeed or fail: nothing on success.
using MaybeError = std::optional<Error>;

}  // namespace qm
