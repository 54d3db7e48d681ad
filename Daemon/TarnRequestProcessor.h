// The request processor: one Conduit event of a peer connection in, at most
// one reply out. Runs on the peer connection's serial queue; requests of
// different peers run concurrently.
#pragma once

#include <exception>
#include <memory>
#include <optional>

#include "Daemon/TarnClientIdentity.h"
#include "Daemon/TarnError.h"
#include "Platform/PropertyList.h"

namespace tarn {

namespace conduit {
class Connection;
struct Event;
}  // namespace conduit

class TarnClientIdentity;
struct TarnCommandTableRow;

// What the entitlement gate decided for one caller and one command row.
struct TarnEntitlementGate {
    bool entitled = false;
    bool unrestricted = false;
    bool allowOtherIdLookup = false;
    bool admitted = false;  // a client connection is built
    std::optional<PlistValue> lookup;
    std::optional<PlistValue> wipeList;
};
TarnEntitlementGate TarnCheckEntitlements(const std::shared_ptr<const TarnClientIdentity>& identity,
                                          const TarnCommandTableRow& row);

// `reuse`: the peer connection's identity slot (see TarnClientIdentity), or
// nullptr to build the identity afresh.
void TarnProcessConduitEvent(const std::shared_ptr<conduit::Connection>& peer,
                             const conduit::Event& event,
                             TarnClientIdentity::Reuse* reuse = nullptr);

// Turns an exception caught at an operation boundary into a code: on internal
// builds it ends the process with the fatal report; otherwise it logs
// "Got exception: %@ : %@" and answers 40.
uint64_t TarnHandleCaughtException(const char* function, const std::exception* exception);
// The same, answering the error value for operations that hand one back.
TarnErrorRef TarnCaughtExceptionError(const char* function, const std::exception* exception);

// Builds the report text, stores it in the crash message slot and aborts.
[[noreturn]] void TarnFatalExceptionReport(const std::exception* exception);

}  // namespace tarn
