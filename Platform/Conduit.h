// Conduit: the message IPC between the daemon and its clients.
//
// A Listener owns a SOCK_SEQPACKET Unix socket (or the one systemd hands over)
// and turns each accepted peer into a Connection. Each Connection delivers its
// events on its own serial queue, in the order the peer sent them, one at a
// time; different connections run concurrently. Messages are dictionaries of
// typed values (ConduitWire.h describes the bytes); a request carries a reply
// context and gets at most one reply.
//
// Who the peer is comes from the kernel only: SO_PEERCRED at connect time and
// the peer's pidfd, held for the connection's lifetime. Nothing inside a
// message is ever read as identity.
//
// Malformed or oversized input from a peer cancels that peer's connection with
// an error line in the platform log (category "conduit"); other peers are not
// affected.
//
// Threads: a Listener's I/O threads read the sockets. Event handlers always
// run as items of the connections' queues: on the I/O thread that read the
// message when that queue is idle (no thread hand-off), otherwise on the
// queue's own turn. After such a request the thread waits on that peer for a
// few tens of milliseconds, as a thread-per-client server would, while
// others poll the rest. All member functions are thread-safe.
#pragma once

#include <sys/types.h>

#include <array>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Platform/ConduitWire.h"
#include "Platform/Dispatch.h"
#include "Platform/PropertyList.h"
#include "Platform/ThreadAnnotations.h"

namespace tarn::conduit {

// 32 bytes that name one process for its lifetime. Little-endian fields:
//   0..3 effective uid, 4..7 effective gid, 8..11 pid, 12..15 zero,
//   16..23 process start time (clock ticks after boot), 24..31 zero.
// A recycled PID has a different start time, so two tokens are equal only for
// the same process (and credentials).
using AuditToken = std::array<uint8_t, 32>;

struct AuditTokenFields {
    uid_t euid = 0;
    gid_t egid = 0;
    pid_t pid = 0;
    uint64_t startTime = 0;
};
AuditToken MakeAuditToken(const AuditTokenFields& fields);
AuditTokenFields ParseAuditToken(const AuditToken& token);

// The socket of a named service: RootPath("/run/" + serviceName + ".socket").
std::string ServiceSocketPath(const std::string& serviceName);

class Connection;
using ConnectionRef = std::shared_ptr<Connection>;
class Message;
using MessageRef = std::shared_ptr<Message>;
class Listener;

// A message: a dictionary body plus routing. A received request remembers its
// connection and id so that createReply() can route the answer back.
class Message {
    struct PrivateTag {};

public:
    static MessageRef createDictionary();

    PlistValue& body() { return body_; }
    const PlistValue& body() const { return body_; }

    // A request carrying a reply context that has not been used yet.
    bool expectsReply() const;
    // The reply to this request, routed to its sender. nullptr when the
    // message has no reply context or a reply was already created.
    MessageRef createReply() const;
    // The connection a received message came from (or a reply goes to).
    ConnectionRef remoteConnection() const { return connection_.lock(); }

    uint64_t messageId() const { return id_; }
    uint64_t replyTo() const { return replyTo_; }
    bool isReply() const { return replyTo_ != 0; }

    Message(PrivateTag, std::weak_ptr<Connection> connection, uint64_t id, uint64_t replyTo,
            bool request, PlistValue body);

private:
    friend class Connection;

    const std::weak_ptr<Connection> connection_;
    const uint64_t id_;       // id on the wire; 0 for a message made here
    const uint64_t replyTo_;  // request answered; 0 unless a reply
    const bool request_;
    mutable std::atomic<bool> replyCreated_{false};
    PlistValue body_;
};

struct Event {
    enum class Kind { Message, ConnectionInvalid, ConnectionInterrupted } kind;
    MessageRef message;  // set for Kind::Message
};

// A peer connection, server side. Made by the Listener; delivers nothing until
// resume(). The event handler runs on the connection's serial queue. After
// the connection ends (peer gone, cancel(), bad input) the handler gets one
// ConnectionInvalid event and is then dropped, which breaks the cycle of a
// handler that captures its own connection.
class Connection : public std::enable_shared_from_this<Connection> {
    struct PrivateTag {};

public:
    struct Credentials {
        uid_t euid = 0;
        gid_t egid = 0;
        pid_t pid = 0;
        uint64_t startTime = 0;
    };

    uid_t euid() const { return creds_.euid; }
    gid_t egid() const { return creds_.egid; }
    pid_t pid() const { return creds_.pid; }
    const AuditToken& auditToken() const { return auditToken_; }
    // Real path of the peer's executable, read through the held pidfd so that a
    // recycled PID can never lend its identity: empty when the process is gone
    // or unreadable.
    std::optional<std::string> executablePath() const;

    // Set before resume(); replacing it later is allowed and takes effect for
    // the next event.
    void setEventHandler(std::function<void(const Event&)> handler);
    // Events run at least at this QoS. Effective when called before resume().
    void setQoSFloor(QoS qos);
    // false when the connection was cancelled first: it then never hears an
    // event, so whoever set up state for it cleans up now.
    bool resume();
    // Stops delivery and closes the socket. The handler gets ConnectionInvalid
    // if the connection had been resumed. Idempotent.
    void cancel();

    // Sends a message to the peer. A reply (made by createReply()) is sent at
    // most once per request; a second reply to the same request is refused.
    // false when the connection is gone, the body cannot be encoded, or the
    // reply was already sent.
    bool send(const MessageRef& message);

    const DispatchQueueRef& queue() const { return queue_; }

    // Internal: made by the Listener's I/O thread.
    Connection(PrivateTag, int fd, int pidfd, int exeLinkFd, const Credentials& creds,
               uint64_t serial);
    ~Connection();
    Connection(const Connection&) = delete;
    Connection& operator=(const Connection&) = delete;

private:
    friend class Listener;

    // On the queue: decodes and hands one message to the handler. `handedOver`
    // when the I/O part queued it (and counted it in queued_) rather than
    // running it on the thread that read it.
    void deliver(const std::vector<uint8_t>& body, uint16_t flags, uint64_t id, uint64_t replyTo,
                 bool handedOver);
    void fail(const std::string& reason);
    void finish();  // on the queue: ConnectionInvalid, drop the handler
    void onDelivered();

    // Constant after construction.
    const int fd_;
    const int pidfd_;
    const int exeLinkFd_;  // the peer's /proc/PID/exe link, or -1 (see sock::PeerCredentials)
    const Credentials creds_;
    const AuditToken auditToken_;
    const uint64_t serial_;  // key in the Listener's I/O table
    const DispatchQueueRef queue_;

    mutable Mutex mu_;
    using EventHandler = std::function<void(const Event&)>;
    // Shared, so that taking it for each message copies no closure.
    std::shared_ptr<const EventHandler> handler_ GUARDED_BY(mu_);
    std::weak_ptr<Listener> listener_ GUARDED_BY(mu_);
    bool resumed_ GUARDED_BY(mu_) = false;
    bool cancelled_ GUARDED_BY(mu_) = false;
    bool finished_ GUARDED_BY(mu_) = false;  // ConnectionInvalid delivered
    bool paused_ GUARDED_BY(mu_) = false;    // reading stopped for backpressure
    size_t queued_ GUARDED_BY(mu_) = 0;      // messages handed to the queue, not yet run
    // Requests received whose reply has not been sent; bounded by the peer's
    // own pacing (at most kMaxQueuedMessages unanswered at the reader).
    std::vector<uint64_t> awaitingReply_ GUARDED_BY(mu_);

    Mutex sendMu_ ACQUIRED_AFTER(mu_);  // keeps the records of one message together
    std::atomic<uint64_t> nextId_{1};

    // The last executablePath() answer, reused while the peer still runs the
    // same link (and, without exeLinkFd_, the same file): resolving it again costs
    // a start-time read and a realpath walk.
    struct ExecutableCache {
        std::string link;
        uint64_t dev = 0;
        uint64_t ino = 0;
        std::string realPath;
    };
    mutable Mutex exeMu_;
    mutable std::optional<ExecutableCache> exe_ GUARDED_BY(exeMu_);

    // Read state, used by whichever I/O thread holds the socket's one-shot
    // readiness: the lock only orders those threads, it is never contended.
    Mutex readMu_;
    RecordAssembler assembler_ GUARDED_BY(readMu_);
};

// The server socket. Accepts and reads on its own I/O thread once resumed;
// new connections are handed to the handler on `queue`.
class Listener : public std::enable_shared_from_this<Listener> {
    struct PrivateTag {};

public:
    // Socket at ServiceSocketPath(serviceName), or the socket systemd hands
    // over for that path when present. nullptr + reason on failure.
    static std::shared_ptr<Listener> create(const std::string& serviceName,
                                            DispatchQueueRef queue, std::string* why = nullptr);
    // Same on an explicit socket path (tests, tools).
    static std::shared_ptr<Listener> createAtPath(const std::string& socketPath,
                                                  DispatchQueueRef queue,
                                                  std::string* why = nullptr);

    void setNewConnectionHandler(std::function<void(const ConnectionRef&)> handler);
    // Starts accepting. Nothing is accepted or delivered before.
    void resume();
    // Stops accepting, cancels every connection it made, stops the I/O threads
    // and removes the socket file it created. Idempotent; also run by the
    // destructor. Waits only for I/O threads that are polling, accepting or
    // reading, never for event handlers (even one running on an I/O thread),
    // so it may be called from a handler.
    void cancel();

    const std::string& socketPath() const { return socketPath_; }
    // Number of live peer connections (tests).
    size_t TEST_connectionCount() const;

    struct IoLoop;
    Listener(PrivateTag, int fd, std::string socketPath, bool ownsPath, DispatchQueueRef queue);
    ~Listener();
    Listener(const Listener&) = delete;
    Listener& operator=(const Listener&) = delete;

private:
    friend class Connection;

    void accepted(int fd);
    void forget(const Connection& connection);
    void rearm(const Connection& connection);

    const std::string socketPath_;
    const bool ownsPath_;
    const DispatchQueueRef queue_;
    // Shared with the I/O thread, which keeps it alive until it has stopped.
    const std::shared_ptr<IoLoop> io_;
};

// The client side of a connection (tarnctl, tests, benchmarks). Not shared
// between threads without external locking.
class Client {
    struct PrivateTag {};

public:
    struct Received {
        uint64_t messageId = 0;
        uint64_t replyTo = 0;
        uint16_t flags = 0;
        PlistValue body;
    };

    static std::unique_ptr<Client> connect(const std::string& socketPath, std::string* why);

    // Sends `request` (a dictionary) and waits for its reply.
    std::optional<PlistValue> sendSync(const PlistValue& request,
                                       std::chrono::milliseconds timeout, std::string* why);
    // Sends a request and returns its id without waiting (pipelining).
    std::optional<uint64_t> sendRequest(const PlistValue& request, std::string* why);
    // Sends a message that carries no reply context.
    bool sendOneWay(const PlistValue& message, std::string* why);
    // Waits for the reply to request `id`; replies to other requests that
    // arrive first are kept for their own waitForReply.
    std::optional<PlistValue> waitForReply(uint64_t id, std::chrono::milliseconds timeout,
                                           std::string* why);
    // Next message of any kind; empty on timeout (why = "timed out"), close or bad input.
    std::optional<Received> receive(std::chrono::milliseconds timeout, std::string* why);
    // One raw record, exactly these bytes (tests: garbage).
    bool sendRaw(const void* bytes, size_t n);

    Client(PrivateTag, int fd);
    ~Client();
    Client(const Client&) = delete;
    Client& operator=(const Client&) = delete;

private:
    bool sendMessage(const PlistValue& body, uint16_t flags, uint64_t id, std::string* why);
    std::optional<Received> receiveUntil(std::chrono::steady_clock::time_point deadline,
                                         std::string* why);

    const int fd_;
    uint64_t nextId_ = 1;
    std::vector<Received> stash_;  // replies received while waiting for another
    // The socket's SO_RCVTIMEO, set again only when a wait's time left moves
    // away from it: one blocking recv per reply, as a bare socket user does.
    std::chrono::milliseconds receiveTimeout_{-1};
    struct Assembly;
    std::unique_ptr<Assembly> assembly_;
};

}  // namespace tarn::conduit
