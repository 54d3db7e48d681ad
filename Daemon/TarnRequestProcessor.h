// The request processor: one Conduit event of a peer connection in, at most
// one reply out. Runs on the peer connection's serial queue; requests of
// different peers run concurrently.
#pragma once

#include <exception>
#include <memory>

namespace tarn {

namespace conduit {
class Connection;
struct Event;
}  // namespace conduit

void TarnProcessConduitEvent(const std::shared_ptr<conduit::Connection>& peer,
                             const conduit::Event& event);

// Turns an exception caught at an operation boundary into a code: on internal
// builds it ends the process with the fatal report; otherwise it logs
// "Got exception: %@ : %@" and answers 40.
uint64_t TarnHandleCaughtException(const char* function, const std::exception* exception);

// Builds the report text, stores it in the crash message slot and aborts.
[[noreturn]] void TarnFatalExceptionReport(const std::exception* exception);

}  // namespace tarn
