// The request processor: one Conduit event of a peer connection in, at most
// one reply out. Runs on the peer connection's serial queue; requests of
// different peers run concurrently.
#pragma once

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

}  // namespace tarn
