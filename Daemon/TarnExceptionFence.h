// The one fence between exceptions and the daemon's error values.
//
// Nothing in the daemon throws on purpose; what can throw is the standard
// library (allocation, a container's at()) and the libraries it wraps. Such an
// exception stops at the nearest boundary that needs it stopped: a request's
// handler and queue run, a queued command, a queue item, start-up. There
// TarnFenceExceptions turns it into the caught-exception error
// (TarnErrorException, "Got exception: %@ : %@") on customer builds and into
// the fatal report on internal builds, so a fault is loud where it can be
// fixed and contained where it cannot. Everything between the boundaries
// relies on RAII.
#pragma once

#include <exception>
#include <type_traits>

#include "Daemon/TarnError.h"
#include "Daemon/TarnResult.h"

namespace tarn {

// On internal builds ends the process with the fatal report; otherwise logs
// "Got exception: %@ : %@" under `function` and answers TarnErrorException.
TarnErrorRef TarnCaughtExceptionError(const char* function, const std::exception* exception);

// Builds the report text, stores it in the crash message slot and aborts.
[[noreturn]] void TarnFatalExceptionReport(const std::exception* exception);

namespace detail {
template <class R>
struct FenceResult {
    using type = TarnResult<R>;
};
template <class T>
struct FenceResult<TarnResult<T>> {
    using type = TarnResult<T>;
};
}  // namespace detail

// Runs `body` at an exception boundary named `function`. `body` returns
// nothing, a value, or a TarnResult; the fence answers the matching
// TarnResult, holding the caught-exception error when `body` threw.
template <class Body>
auto TarnFenceExceptions(const char* function, Body&& body) ->
    typename detail::FenceResult<std::invoke_result_t<Body&>>::type {
    try {
        if constexpr (std::is_void_v<std::invoke_result_t<Body&>>) {
            body();
            return {};
        } else {
            return body();
        }
    } catch (const std::exception& e) {
        return TarnCaughtExceptionError(function, &e);
    } catch (...) {
        return TarnCaughtExceptionError(function, nullptr);
    }
}

}  // namespace tarn
