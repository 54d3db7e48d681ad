// The kernel upcall service: the kernel sandbox asks, while it sets up a
// process, which containers that process has (data container and temporary
// directory, home directory, application groups, system container, system
// groups). The daemon creates what is missing and answers with the paths.
//
// Requests and answers are pack buffers (src/packbuff) carried in the upcall
// messages of Platform/UpcallSocket.h, which also documents the framing.
//
// Request items (value type: kind, meaning):
//   0 string  code-signing identifier       1 string  data container identifier
//   2 string  application identifier        3 uint32  user id
//   4 string* application group identifier  5 uint32  container type (0 app, 1 plug-in)
//   6 string  system container identifier   7 string* system group identifier
//   8 uint32  persona id (0xFFFFFFFF: none)                 (* repeatable)
// Answer items, in this order, each only when it has a value: 100 home
// directory, 1 data container, 2 temporary directory, 3/4 application group
// identifier and path (once per group), 101 system container, 102/103 system
// group identifier and path, then 0 the status (1 when every container was
// found or created; 0 otherwise, and then it is the only item).
//
// Return codes: 0 answered; 4 value type above 8, unknown persona or no user
// identity; 5 unreadable item, or a sender that is not the kernel; 9 no pack
// buffer could be made; -300, -304, -309 malformed message; -303 unknown id.
//
// Upcalls are served one at a time on the serial queue
// "com.ostrea.tarnkeeperd.upcall", which targets the listener queue, so none
// runs during start-up. They act through a privileged kernel client
// connection and take the identifier locks like any request.
#pragma once

#include "Platform/Dispatch.h"
#include "Platform/UpcallSocket.h"

namespace tarn {

// Checks the service in and starts serving on a new queue that targets
// `targetQueue`. Answers whether the service runs; call once.
bool TarnKernServerStart(DispatchQueueRef targetQueue);

// Whether the message was for this service; `reply` gets the answer to send
// (also for a refused id of this service). Runs on the upcall queue.
bool demux_server(const upcall::ReceivedMessage& request, upcall::ReplyMessage* reply);

// The routine of message id 322514900: fills `reply` with the success reply
// or the error reply.
void server_get_process_containers(const upcall::ReceivedMessage& request,
                                   upcall::ReplyMessage* reply);

}  // namespace tarn
