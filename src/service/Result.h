#pragma once

#include <cstdint>
#include <string>
#include <utility>
#include <variant>

namespace kest {

// A failure as every layer reports it: an error number (negative, see
// Errors.h) and a description that names what failed and why.
struct Error {
    int32_t number = 0;
    std::string description;
};

struct Unit {};

// Either a value or an Error. The service and storage return these; only the
// GUI layer turns errors into message boxes.
template <class T>
class [[nodiscard]] Result {
public:
    Result(T value) : v_(std::move(value)) {}
    Result(Error error) : v_(std::move(error)) {}

    bool ok() const { return v_.index() == 0; }
    explicit operator bool() const { return ok(); }

    T& value() & { return std::get<0>(v_); }
    const T& value() const& { return std::get<0>(v_); }
    T&& value() && { return std::get<0>(std::move(v_)); }
    const Error& error() const { return std::get<1>(v_); }

private:
    std::variant<T, Error> v_;
};

using Status = Result<Unit>;
inline Status okStatus() {
    return Unit{};
}

}  // namespace kest

// Propagates an error from an expression returning a Result.
#define KEST_TRY(expr)                  \
    do {                                \
        auto kest_try_r_ = (expr);      \
        if (!kest_try_r_.ok())          \
            return kest_try_r_.error(); \
    } while (false)
