// Reading an operation's result the way a handler does at the wire: on
// failure its code goes into `*slot` (TarnErrorInvalidArgument for a foreign
// error or none); the result itself is handed back for the value.
#pragma once

#include <cstdint>
#include <utility>

#include "Daemon/TarnResult.h"

namespace tarn::test {

template <class T>
TarnResult<T> withCode(TarnResult<T> result, uint64_t* slot) {
    (void)TarnReport(result, slot, TarnErrorInvalidArgument);
    return result;
}

}  // namespace tarn::test
