// TarnResult<T>: an operation's value or its error value, in one object.
//
// How errors travel in the daemon (the one convention):
//   - Below the handlers every operation that can fail returns TarnResult<T>
//     (TarnStatus when there is no value). A caller cannot use the value
//     without deciding what a failure means: TARN_TRY passes the error up
//     unchanged, anything else looks at ok() first.
//   - The error is a TarnErrorRef (Daemon/TarnError.h): TarnErrorDomain code,
//     description, underlying error, "FunctionName" and "SourceFileLine". It
//     is logged once, when made; passing it on never logs it again.
//   - The numeric code is read off only where the protocol needs a number: a
//     handler copies code(fallback) into the request's error slot (uint64_t,
//     TarnSuccess until something fails), and the request processor writes
//     that slot as "ReplyError". The fallback answers for a foreign (POSIX)
//     error or a failure without an error value, so a failure never reads as
//     success.
//   - Exceptions do not travel: they are fenced once, at the boundaries that
//     need it (a handler, a queued command, a queue item, start-up), by
//     TarnFenceExceptions (Daemon/TarnExceptionFence.h). Cleanup is RAII.
#pragma once

#include <cstdint>
#include <type_traits>
#include <utility>
#include <variant>

#include "Daemon/TarnError.h"

namespace tarn {

template <class T>
class [[nodiscard]] TarnResult {
    static_assert(!std::is_same_v<std::remove_cv_t<T>, TarnErrorRef>,
                  "an error value is not a result value");

  public:
    using ValueType = T;

    // Success.
    TarnResult(T value) : state_(std::in_place_index<0>, std::move(value)) {}
    // Failure. A null error still fails (code() then answers the fallback).
    TarnResult(TarnErrorRef error) : state_(std::in_place_index<1>, std::move(error)) {}
    // A value convertible to T (a string literal for std::string, a derived
    // pointer), never an error value.
    template <class U>
    requires(std::is_convertible_v<U&&, T> && !std::is_convertible_v<U&&, TarnErrorRef> &&
             !std::is_same_v<std::remove_cvref_t<U>, TarnResult>) TarnResult(U&& value)
        : state_(std::in_place_index<0>, std::forward<U>(value)) {}

    bool ok() const { return state_.index() == 0; }
    explicit operator bool() const { return ok(); }

    T& value() & { return std::get<0>(state_); }
    const T& value() const& { return std::get<0>(state_); }
    T&& value() && { return std::get<0>(std::move(state_)); }
    T* operator->() { return &value(); }
    const T* operator->() const { return &value(); }
    T& operator*() & { return value(); }
    const T& operator*() const& { return value(); }
    T&& operator*() && { return std::move(*this).value(); }

    // The value, or `fallback` after a failure.
    T valueOr(T fallback) const& { return ok() ? value() : std::move(fallback); }

    // The error value; null after success.
    TarnErrorRef error() const { return ok() ? TarnErrorRef() : std::get<1>(state_); }
    // The wire code: TarnSuccess after success, else the error's domain code or
    // `fallback` (see the convention above).
    uint64_t code(uint64_t fallback) const {
        return ok() ? uint64_t{TarnSuccess} : TarnErrorCodeOf(std::get<1>(state_), fallback);
    }

  private:
    std::variant<T, TarnErrorRef> state_;
};

template <>
class [[nodiscard]] TarnResult<void> {
  public:
    using ValueType = void;

    TarnResult() = default;
    TarnResult(TarnErrorRef error) : failed_(true), error_(std::move(error)) {}

    bool ok() const { return !failed_; }
    explicit operator bool() const { return ok(); }
    void value() const {}
    const TarnErrorRef& error() const { return error_; }
    uint64_t code(uint64_t fallback) const {
        return ok() ? uint64_t{TarnSuccess} : TarnErrorCodeOf(error_, fallback);
    }

  private:
    bool failed_ = false;
    TarnErrorRef error_;
};

using TarnStatus = TarnResult<void>;

// Writes a failed result's code into a handler's error slot; a success
// leaves the slot alone (it holds TarnSuccess until something fails).
// Answers ok().
template <class T>
bool TarnReport(const TarnResult<T>& result, uint64_t* slot, uint64_t fallback) {
    if (!result.ok()) TarnSetError(slot, result.code(fallback));
    return result.ok();
}

}  // namespace tarn

// Evaluates a TarnResult expression; on failure returns its error from the
// enclosing function (whose result type must accept a TarnErrorRef), else
// yields the value.
#define TARN_TRY(expr)                                           \
    ({                                                           \
        auto&& tarnTryResult_ = (expr);                          \
        if (!tarnTryResult_.ok()) return tarnTryResult_.error(); \
        std::move(tarnTryResult_).value();                       \
    })
