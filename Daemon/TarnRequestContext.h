// The state of one request, built by the request processor and handed down
// explicitly to the handler and whatever it calls. It stands in for what the
// platform keeps per thread (the calling thread's persona, the reply being
// answered): here nothing about a request lives in thread-local state.
//
// Lifetime: one request. The processor owns it; a handler may keep the
// command queue or the deferred reply (both shared) past its return.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "Platform/PropertyList.h"

namespace tarn {

class TarnCommandQueue;

// The reply of a request whose completion answers (rows with replyOnReturn
// 0): the completion calls send(code), which sets "ReplyError" and sends it.
// Safe to use from any thread, once.
class TarnDeferredReply {
  public:
    virtual ~TarnDeferredReply() = default;
    virtual PlistValue& body() = 0;
    virtual void send(uint64_t code) = 0;
};

struct TarnRequestContext {
    // The persona the peer runs under, when the code-signing registry names
    // one; empty for none. Requests act for this persona where the platform
    // would use the calling thread's.
    std::optional<std::string> personaUniqueString;
    // Deferred side effects of this request: run after the handler and
    // before the reply (TarnClientConnection::completeWithError).
    std::shared_ptr<TarnCommandQueue> commandQueue;
    // Set only for rows with replyOnReturn 0; null otherwise and outside a
    // request (a handler then has nobody to answer later).
    std::shared_ptr<TarnDeferredReply> deferredReply;
};

}  // namespace tarn
