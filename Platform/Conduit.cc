#include "Platform/Conduit.h"

#include <fcntl.h>
#include <pthread.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <map>
#include <system_error>
#include <thread>

#include "Platform/ConduitSocket.h"
#include "Platform/ConduitWire.h"
#include "Platform/Format.h"
#include "Platform/ListeningSocket.h"
#include "Platform/PlatformLog.h"
#include "Platform/RootPrefix.h"

namespace tarn::conduit {

namespace {

// Messages read ahead of a connection's queue; past this the I/O thread stops
// reading that socket until the queue catches up, so a flooding peer only
// fills its own socket buffer.
constexpr size_t kMaxQueuedMessages = 16;
// Requests that may wait for their reply at once on one connection.
constexpr size_t kMaxUnansweredRequests = 1024;
// Open connections one user id may hold at once; past it new ones are closed
// at accept, so that one user cannot take every descriptor of the daemon.
constexpr size_t kMaxConnectionsPerUid = 256;
// How long a send may wait for a peer that does not read.
constexpr std::chrono::milliseconds kSendTimeout{5000};

constexpr uint64_t kWakeKey = 0;
constexpr uint64_t kListenKey = 1;

void put32(uint8_t* p, uint32_t v) {
    for (int i = 0; i < 4; ++i) p[i] = static_cast<uint8_t>(v >> (8 * i));
}
uint32_t get32(const uint8_t* p) {
    return uint32_t{p[0]} | (uint32_t{p[1]} << 8) | (uint32_t{p[2]} << 16) | (uint32_t{p[3]} << 24);
}

}  // namespace

AuditToken MakeAuditToken(const AuditTokenFields& f) {
    AuditToken t{};
    put32(t.data(), f.euid);
    put32(t.data() + 4, f.egid);
    put32(t.data() + 8, static_cast<uint32_t>(f.pid));
    put32(t.data() + 16, static_cast<uint32_t>(f.startTime));
    put32(t.data() + 20, static_cast<uint32_t>(f.startTime >> 32));
    return t;
}

AuditTokenFields ParseAuditToken(const AuditToken& t) {
    AuditTokenFields f;
    f.euid = get32(t.data());
    f.egid = get32(t.data() + 4);
    f.pid = static_cast<pid_t>(get32(t.data() + 8));
    f.startTime = uint64_t{get32(t.data() + 16)} | (uint64_t{get32(t.data() + 20)} << 32);
    return f;
}

std::string ServiceSocketPath(const std::string& serviceName) {
    return RootPath("/run/" + serviceName + ".socket");
}

// ---------------------------------------------------------------------------
// Message

Message::Message(PrivateTag, std::weak_ptr<Connection> connection, uint64_t id, uint64_t replyTo,
                 bool request, PlistValue body)
    : connection_(std::move(connection)),
      id_(id),
      replyTo_(replyTo),
      request_(request),
      body_(std::move(body)) {}

MessageRef Message::createDictionary() {
    return std::make_shared<Message>(PrivateTag{}, std::weak_ptr<Connection>{}, /*id=*/0,
                                     /*replyTo=*/0,
                                     /*request=*/false, PlistValue(PlistDict{}));
}

bool Message::expectsReply() const { return request_ && !replyCreated_.load(); }

MessageRef Message::createReply() const {
    if (!request_ || replyCreated_.exchange(true)) return nullptr;
    return std::make_shared<Message>(PrivateTag{}, connection_, /*id=*/0, /*replyTo=*/id_,
                                     /*request=*/false, PlistValue(PlistDict{}));
}

// ---------------------------------------------------------------------------
// The I/O thread of a listener: accepts, reads every resumed connection and
// hands complete messages to the connections' queues.

// Threads poll one epoll set together; each connection's socket is armed
// one-shot, so at most one thread reads a given peer at a time. The thread
// that reads a complete request runs it itself, on the connection's queue,
// when that queue is idle: no other thread has to be woken (across CPUs, the
// dearest part of a round trip). Before it does, it makes sure another thread
// is polling, starting one if none is, so that other peers keep being served.
// A thread "in the I/O part" is polling, accepting or reading; one running a
// request is not, and cancel() waits only for the former.
//
// After running a request, the thread stays with that peer for a while,
// blocked in recv as a bare socket server would be: a client that sends its
// next request soon is served without a trip through epoll (a wake-up and a
// re-arm per request). The peer's socket is not armed meanwhile, so it still
// has one reader at a time. At most kMaxLingering threads do this at once.
constexpr int kMaxIoThreads = 16;
constexpr int kMaxLingering = kMaxIoThreads - 4;
constexpr std::chrono::milliseconds kLinger{50};
// A polling thread idle this long exits when another one polls.
constexpr int kIdleIoThreadMs = 10000;

struct Listener::IoLoop : std::enable_shared_from_this<Listener::IoLoop> {
    int listenFd = -1;
    int epollFd = -1;
    int wakeFd = -1;
    std::weak_ptr<Listener> owner;

    Mutex mu;
    CondVar ioIdle;  // inIo dropped to zero
    std::map<uint64_t, ConnectionRef> connections GUARDED_BY(mu);
    std::function<void(const ConnectionRef&)> handler GUARDED_BY(mu);
    uint64_t nextSerial GUARDED_BY(mu) = 2;  // 0 and 1 are the wake and listen keys
    bool started GUARDED_BY(mu) = false;
    bool stopped GUARDED_BY(mu) = false;
    int threads GUARDED_BY(mu) = 0;
    int polling GUARDED_BY(mu) = 0;  // threads in (or on their way to) epoll_wait
    int inIo GUARDED_BY(mu) = 0;     // threads in the I/O part
    int lingering GUARDED_BY(mu) = 0;  // threads waiting on one peer after its request

    ~IoLoop() {
        sock::CloseFd(listenFd);
        sock::CloseFd(epollFd);
        sock::CloseFd(wakeFd);
    }

    // Starts a thread that begins by polling; false when the OS refused one.
    bool spawn() REQUIRES(mu);
    void run();
    void exitThread() REQUIRES(mu);
    // Called before running a request: true when the thread may, with some
    // other thread polling meanwhile; it then leaves the I/O part.
    bool leaveForRequest() EXCLUDES(mu);
    // After the request: false when the loop stopped meanwhile and the thread
    // must end without touching the loop's descriptors again.
    bool returnFromRequest() EXCLUDES(mu);
    // True when the thread may stay with its peer, some other thread polling
    // meanwhile; endLinger() when it stops.
    bool startLinger() EXCLUDES(mu);
    void endLinger() EXCLUDES(mu);
    void acceptAll();
    // false when the thread must end (see returnFromRequest).
    bool readConnection(const ConnectionRef& c);
    ConnectionRef find(uint64_t serial) {
        MutexLock l(mu);
        auto it = connections.find(serial);
        return it == connections.end() ? nullptr : it->second;
    }
    void arm(int fd, uint64_t key, bool add) {
        struct epoll_event ev = {};
        ev.events = EPOLLIN | EPOLLONESHOT;
        ev.data.u64 = key;
        // Fails only for a connection already removed; nothing is left to read then.
        (void)::epoll_ctl(epollFd, add ? EPOLL_CTL_ADD : EPOLL_CTL_MOD, fd, &ev);
    }
};

namespace {
// The loop whose I/O part the calling thread is in, if any.
thread_local const Listener::IoLoop* tInIoOf = nullptr;
}  // namespace

bool Listener::IoLoop::spawn() {
    if (threads >= kMaxIoThreads) return false;
    try {
        std::thread([io = shared_from_this()] { io->run(); }).detach();
    } catch (const std::system_error&) {
        return false;
    }
    ++threads;
    ++inIo;
    ++polling;
    return true;
}

void Listener::IoLoop::exitThread() {
    --threads;
    if (--inIo == 0) ioIdle.notifyAll();
    tInIoOf = nullptr;
}

bool Listener::IoLoop::leaveForRequest() {
    MutexLock l(mu);
    if (stopped || (polling == 0 && !spawn())) return false;
    tInIoOf = nullptr;
    if (--inIo == 0) ioIdle.notifyAll();
    return true;
}

bool Listener::IoLoop::returnFromRequest() {
    MutexLock l(mu);
    if (stopped) {
        --threads;
        return false;
    }
    ++inIo;
    tInIoOf = this;
    return true;
}

bool Listener::IoLoop::startLinger() {
    MutexLock l(mu);
    if (stopped || lingering >= kMaxLingering || (polling == 0 && !spawn())) return false;
    ++lingering;
    return true;
}

void Listener::IoLoop::endLinger() {
    MutexLock l(mu);
    --lingering;
}

void Listener::IoLoop::run() {
    (void)pthread_setname_np(pthread_self(), "tarn-conduit-io");  // for ps and debuggers only
    tInIoOf = this;
    bool counted = true;  // spawn() counted this thread as polling
    for (;;) {
        {
            MutexLock l(mu);
            if (!counted) ++polling;
            counted = false;
            if (stopped) {
                --polling;
                exitThread();
                return;
            }
        }
        struct epoll_event event;
        const int n = ::epoll_wait(epollFd, &event, 1, kIdleIoThreadMs);
        const int savedErrno = errno;
        {
            MutexLock l(mu);
            --polling;
            if ((n == 0 && polling > 0) || (n < 0 && savedErrno != EINTR)) {
                if (n < 0)
                    PlatformLog("conduit", PlatformLogType::Fault, "epoll_wait failed: %s",
                                std::strerror(savedErrno));
                exitThread();
                return;
            }
        }
        if (n <= 0) continue;
        const uint64_t key = event.data.u64;
        if (key == kWakeKey) continue;  // stopping: seen at the top of the loop
        if (key == kListenKey) {
            acceptAll();
        } else if (ConnectionRef c = find(key)) {
            if (!readConnection(c)) return;
        }
    }
}

void Listener::IoLoop::acceptAll() {
    for (;;) {
        // Blocking, for the linger's recv; every other read and send says MSG_DONTWAIT.
        const int fd = ::accept4(listenFd, nullptr, nullptr, SOCK_CLOEXEC);
        if (fd < 0) {
            if (errno == EINTR || errno == ECONNABORTED) continue;
            if (errno != EAGAIN && errno != EWOULDBLOCK)
                PlatformLog("conduit", PlatformLogType::Error, "accept failed: %s",
                            std::strerror(errno));
            break;
        }
        std::string why;
        if (!sock::SetReceiveTimeout(fd, kLinger)) {
            PlatformLog("conduit", PlatformLogType::Error, "Refusing connection: SO_RCVTIMEO: %s",
                        std::strerror(errno));
            sock::CloseFd(fd);
            continue;
        }
        auto creds = sock::ReadPeerCredentials(fd, &why);
        if (!creds) {
            PlatformLog("conduit", PlatformLogType::Error, "Refusing connection: %s", why);
            sock::CloseFd(fd);
            continue;
        }
        Connection::Credentials cc{creds->euid, creds->egid, creds->pid, creds->startTime};
        std::function<void(const ConnectionRef&)> h;
        ConnectionRef c;
        bool overLimit = false;
        {
            MutexLock l(mu);
            size_t ofUid = 0;
            for (const auto& [serial, open] : connections)
                if (open->euid() == creds->euid) ++ofUid;
            overLimit = ofUid >= kMaxConnectionsPerUid;
            if (!overLimit) {
                c = std::make_shared<Connection>(Connection::PrivateTag{}, fd, creds->pidfd,
                                                 creds->exeLinkFd, cc, nextSerial++);
                connections.emplace(c->serial_, c);
                h = handler;
            }
        }
        if (overLimit) {
            PlatformLog("conduit", PlatformLogType::Error,
                        "Refusing connection from pid %d: uid %u has %zu connections open",
                        creds->pid, creds->euid, kMaxConnectionsPerUid);
            if (creds->pidfd >= 0) sock::CloseFd(creds->pidfd);
            if (creds->exeLinkFd >= 0) sock::CloseFd(creds->exeLinkFd);
            sock::CloseFd(fd);
            continue;
        }
        {
            MutexLock l(c->mu_);
            c->listener_ = owner;
        }
        auto o = owner.lock();
        if (!o || !h) {
            // Nobody to take it: the peer sees its connection closed.
            c->cancel();
            continue;
        }
        o->queue_->async([h = std::move(h), c] { h(c); });
    }
    arm(listenFd, kListenKey, false);
}

bool Listener::IoLoop::readConnection(const ConnectionRef& c) {
    // Per thread, reused for every message it reads: no allocation per message.
    thread_local std::vector<uint8_t> record;
    thread_local std::vector<uint8_t> body;
    bool linger = false;
    struct EndLinger {
        IoLoop* io;
        const bool& linger;
        ~EndLinger() {
            if (linger) io->endLinger();
        }
    } endLinger{this, linger};
    // A bounded batch per wake-up keeps one busy peer from starving the
    // others; a lingering thread starves nobody, someone else polls.
    for (int batch = 0; linger || batch < 16; ++batch) {
        RecordHeader h;
        {
            MutexLock r(c->readMu_);
            std::string why;
            switch (sock::ReceiveRecord(c->fd_, kMaxRecordBytes, &record, &why, linger)) {
                case sock::RecvResult::WouldBlock:
                    arm(c->fd_, c->serial_, false);
                    return true;
                case sock::RecvResult::Closed:
                    c->cancel();
                    return true;
                case sock::RecvResult::Error:
                    c->fail(why);
                    return true;
                case sock::RecvResult::Record:
                    break;
            }
            switch (c->assembler_.add(record.data(), record.size(), &why)) {
                case RecordAssembler::Result::Malformed:
                    c->fail(why);
                    return true;
                case RecordAssembler::Result::NeedMore:
                    continue;
                case RecordAssembler::Result::Complete:
                    break;
            }
            h = c->assembler_.header();
            c->assembler_.takeInto(&body);
        }
        bool idle;
        {
            MutexLock l(c->mu_);
            if (c->cancelled_) return true;
            idle = c->queued_ == 0;  // nothing handed over earlier still waits to run
        }
        if (idle && leaveForRequest()) {
            auto work = [&] { c->deliver(body, h.flags, h.messageId, h.replyTo, false); };
            // By reference: a std::function holding a reference_wrapper never allocates.
            const bool ran = c->queue_->runHereIfIdle(std::ref(work));
            if (!returnFromRequest()) return false;
            if (ran) {
                if (linger || (linger = startLinger())) continue;
                // A peer waiting for its answer has sent nothing more yet:
                // re-arm rather than spend a read on finding the socket empty.
                // A message already there fires at once.
                arm(c->fd_, c->serial_, false);
                return true;
            }
        }
        bool pause;
        {
            MutexLock l(c->mu_);
            if (c->cancelled_) return true;
            pause = ++c->queued_ >= kMaxQueuedMessages;
            if (pause) c->paused_ = true;
        }
        c->queue_->async([c, body = std::move(body), h]() mutable {
            c->deliver(body, h.flags, h.messageId, h.replyTo, true);
        });
        if (pause) return true;  // re-armed by the queue once it has caught up
    }
    arm(c->fd_, c->serial_, false);
    return true;
}

// ---------------------------------------------------------------------------
// Connection

Connection::Connection(PrivateTag, int fd, int pidfd, int exeLinkFd, const Credentials& creds,
                       uint64_t serial)
    : fd_(fd),
      pidfd_(pidfd),
      exeLinkFd_(exeLinkFd),
      creds_(creds),
      auditToken_(MakeAuditToken({creds.euid, creds.egid, creds.pid, creds.startTime})),
      serial_(serial),
      queue_(DispatchQueue::createSerial(Format("com.ostrea.conduit.peer.%d", creds.pid))) {}

Connection::~Connection() {
    sock::CloseFd(fd_);
    sock::CloseFd(pidfd_);
    sock::CloseFd(exeLinkFd_);
}

std::optional<std::string> Connection::executablePath() const {
    std::optional<std::string> path;
    std::optional<sock::FileIdentity> file;
    if (exeLinkFd_ >= 0) {
        // One system call per request. The peer's own /proc exe link, held
        // since connect, names what that process runs now, so an exec shows
        // at once, and it cannot be read once the process is gone, even if the
        // PID is reused. Identity follows the executable's path, so an
        // unchanged link means an unchanged answer.
        path = sock::ExecutableLinkAt(exeLinkFd_);
        if (!path) return std::nullopt;
        MutexLock l(exeMu_);
        if (exe_ && exe_->link == *path) return exe_->realPath;
    } else {
        path = sock::ProcessExecutable(creds_.pid);
        file = sock::ProcessExecutableFile(creds_.pid);
        // Alive after the reads: the PID still named our peer while we read it.
        if (!path || !file || !sock::PidfdAlive(pidfd_)) return std::nullopt;
        MutexLock l(exeMu_);
        if (exe_ && exe_->link == *path && exe_->dev == file->dev && exe_->ino == file->ino)
            return exe_->realPath;
    }
    // The start time guards against a pidfd of the wrong process, which cannot
    // happen with SO_PEERPIDFD but is cheap once per executable.
    auto start = sock::ProcessStartTime(creds_.pid);
    if (!start || *start != creds_.startTime || !sock::PidfdAlive(pidfd_)) return std::nullopt;
    std::error_code ec;
    auto real = std::filesystem::canonical(*path, ec);
    std::string result = ec ? *path : real.string();
    MutexLock l(exeMu_);
    exe_ = ExecutableCache{*path, file ? file->dev : 0, file ? file->ino : 0, result};
    return result;
}

void Connection::setEventHandler(std::function<void(const Event&)> handler) {
    MutexLock l(mu_);
    if (finished_ || cancelled_) return;
    handler_ = handler ? std::make_shared<const EventHandler>(std::move(handler)) : nullptr;
}

void Connection::setQoSFloor(QoS qos) {
    MutexLock l(mu_);
    // The queue's target is fixed once work was submitted; before resume() none was.
    if (!resumed_ && !cancelled_) queue_->setTarget(DispatchQueue::global(qos));
}

bool Connection::resume() {
    std::shared_ptr<Listener> listener;
    {
        MutexLock l(mu_);
        if (cancelled_) return false;
        if (resumed_) return true;
        resumed_ = true;
        listener = listener_.lock();
    }
    if (!listener) {
        cancel();  // resumed: the handler hears ConnectionInvalid
        return true;
    }
    listener->io_->arm(fd_, serial_, true);
    return true;
}

void Connection::cancel() {
    bool deliverInvalid;
    std::shared_ptr<Listener> listener;
    std::shared_ptr<const EventHandler> dropped;
    {
        MutexLock l(mu_);
        if (cancelled_) return;
        cancelled_ = true;
        deliverInvalid = resumed_;
        listener = listener_.lock();
        if (!deliverInvalid) {
            finished_ = true;
            dropped = std::move(handler_);
            handler_ = nullptr;
        }
    }
    // The peer sees end of stream at once; the descriptor itself stays open
    // until the last reference goes, so its number cannot be reused under the
    // I/O thread.
    (void)::shutdown(fd_, SHUT_RDWR);  // fails only when the peer is already gone
    if (listener) listener->forget(*this);
    if (deliverInvalid) {
        auto self = shared_from_this();
        queue_->async([self] { self->finish(); });
    }
}

void Connection::fail(const std::string& reason) {
    PlatformLog("conduit", PlatformLogType::Error,
                "Cancelling connection from pid %d (uid %u): %s", creds_.pid, creds_.euid, reason);
    cancel();
}

void Connection::finish() {
    std::shared_ptr<const EventHandler> h;
    {
        MutexLock l(mu_);
        if (finished_) return;
        finished_ = true;
        h = std::move(handler_);
        handler_ = nullptr;
    }
    if (h) (*h)(Event{Event::Kind::ConnectionInvalid, nullptr});
}

void Connection::deliver(const std::vector<uint8_t>& body, uint16_t flags, uint64_t id,
                         uint64_t replyTo, bool handedOver) {
    std::shared_ptr<const EventHandler> h;
    std::string why;
    auto value = DecodeBody(body.data(), body.size(), &why);
    bool tooMany = false;
    {
        MutexLock l(mu_);
        if (cancelled_) return;
        if (value && (flags & kFlagRequest)) {
            tooMany = awaitingReply_.size() >= kMaxUnansweredRequests;
            if (!tooMany) awaitingReply_.push_back(id);
        }
        h = handler_;
    }
    if (!value) {
        fail("malformed message: " + why);
        return;
    }
    if (tooMany) {
        fail("too many requests without a reply");
        return;
    }
    auto message = std::make_shared<Message>(Message::PrivateTag{}, weak_from_this(), id, replyTo,
                                              (flags & kFlagRequest) != 0, std::move(*value));
    if (h) (*h)(Event{Event::Kind::Message, message});
    if (handedOver) onDelivered();
}

void Connection::onDelivered() {
    bool rearm = false;
    std::shared_ptr<Listener> listener;
    {
        MutexLock l(mu_);
        --queued_;
        if (paused_ && !cancelled_ && queued_ <= kMaxQueuedMessages / 2) {
            paused_ = false;
            rearm = true;
            listener = listener_.lock();
        }
    }
    if (rearm && listener) listener->io_->arm(fd_, serial_, false);
}

bool Connection::send(const MessageRef& message) {
    if (!message) return false;
    // Per thread, so that a reply costs no allocation once the thread has sent one.
    thread_local std::vector<uint8_t> encoded;
    std::string why;
    if (!EncodeMessage(message->body(), &encoded, &why)) {
        PlatformLog("conduit", PlatformLogType::Error, "Cannot send message to pid %d: %s",
                    creds_.pid, why);
        return false;
    }
    RecordHeader h;
    {
        MutexLock l(mu_);
        if (cancelled_) return false;
        if (message->isReply()) {
            if (message->connection_.lock().get() != this) return false;
            auto it = std::find(awaitingReply_.begin(), awaitingReply_.end(), message->replyTo());
            if (it == awaitingReply_.end()) return false;  // already answered
            awaitingReply_.erase(it);
            h.flags = kFlagReply;
            h.replyTo = message->replyTo();
        }
    }
    h.messageId = nextId_.fetch_add(1);
    bool ok;
    {
        MutexLock l(sendMu_);
        ok = sock::SendEncodedMessage(fd_, h, &encoded, kSendTimeout, &why);
    }
    if (!ok) {
        PlatformLog("conduit", PlatformLogType::Error, "Send to pid %d failed: %s", creds_.pid,
                    why);
        cancel();
    }
    return ok;
}

// ---------------------------------------------------------------------------
// Listener

Listener::Listener(PrivateTag, int fd, std::string socketPath, bool ownsPath,
                   DispatchQueueRef queue)
    : socketPath_(std::move(socketPath)),
      ownsPath_(ownsPath),
      queue_(std::move(queue)),
      io_(std::make_shared<IoLoop>()) {
    io_->listenFd = fd;
}

Listener::~Listener() { cancel(); }

namespace {

std::shared_ptr<Listener> failCreate(std::string* why, std::string reason, int fd = -1) {
    sock::CloseFd(fd);
    if (why) *why = std::move(reason);
    return nullptr;
}

}  // namespace

std::shared_ptr<Listener> Listener::create(const std::string& serviceName, DispatchQueueRef queue,
                                           std::string* why) {
    // systemd may hand over the upcall socket too: take ours by its path.
    const std::string path = ServiceSocketPath(serviceName);
    if (const int fd = TakeActivatedSocket(path, SOCK_SEQPACKET); fd >= 0) {
        auto l = std::make_shared<Listener>(PrivateTag{}, fd, path, false, std::move(queue));
        l->io_->owner = l;
        return l;
    }
    return createAtPath(path, std::move(queue), why);
}

std::shared_ptr<Listener> Listener::createAtPath(const std::string& path, DispatchQueueRef queue,
                                                 std::string* why) {
    // Any local process may ask; what it may do is decided by its entitlements.
    std::string reason;
    const int fd = BindListeningSocket(path, SOCK_SEQPACKET, 0666, &reason);
    if (fd < 0) return failCreate(why, std::move(reason));
    auto l = std::make_shared<Listener>(PrivateTag{}, fd, path, true, std::move(queue));
    l->io_->owner = l;
    return l;
}

void Listener::setNewConnectionHandler(std::function<void(const ConnectionRef&)> handler) {
    MutexLock l(io_->mu);
    io_->handler = std::move(handler);
}

void Listener::resume() {
    {
        MutexLock l(io_->mu);
        if (io_->started || io_->stopped) return;
        io_->started = true;
    }
    io_->epollFd = ::epoll_create1(EPOLL_CLOEXEC);
    io_->wakeFd = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    if (io_->epollFd < 0 || io_->wakeFd < 0) {
        PlatformLog("conduit", PlatformLogType::Fault, "Cannot start the listener on %s: %s",
                    socketPath_, std::strerror(errno));
        return;
    }
    struct epoll_event ev = {};
    ev.events = EPOLLIN;
    ev.data.u64 = kWakeKey;
    (void)::epoll_ctl(io_->epollFd, EPOLL_CTL_ADD, io_->wakeFd, &ev);  // fresh fds: cannot fail
    io_->arm(io_->listenFd, kListenKey, true);
    MutexLock l(io_->mu);
    if (!io_->spawn())
        PlatformLog("conduit", PlatformLogType::Fault, "Cannot start the listener on %s: no thread",
                    socketPath_);
}

void Listener::cancel() {
    std::map<uint64_t, ConnectionRef> connections;
    bool started;
    {
        MutexLock l(io_->mu);
        if (io_->stopped) return;
        io_->stopped = true;
        started = io_->started;
        connections.swap(io_->connections);
        io_->handler = nullptr;
    }
    // Lingering readers wake up to end of stream and leave the I/O part.
    for (auto& [serial, c] : connections) (void)::shutdown(c->fd_, SHUT_RD);
    if (started && io_->wakeFd >= 0) {
        const uint64_t one = 1;
        // Never read, so it wakes every polling thread in turn; cannot fail here.
        (void)!::write(io_->wakeFd, &one, sizeof one);
    }
    // Threads running a request are not waited for: the request may be the
    // one calling this. A thread in the I/O part calling this (it dropped the
    // last reference) cannot wait for itself; it still uses the listening
    // socket, which the loop's destructor closes then.
    const bool self = tInIoOf == io_.get();
    {
        MutexLock l(io_->mu);
        while (io_->inIo > (self ? 1 : 0)) io_->ioIdle.wait(io_->mu);
    }
    if (!self) {
        // Close now so that late connects fail instead of waiting in the backlog.
        sock::CloseFd(io_->listenFd);
        io_->listenFd = -1;
    }
    for (auto& [serial, c] : connections) c->cancel();
    if (ownsPath_) (void)::unlink(socketPath_.c_str());  // gone already is fine
}

void Listener::forget(const Connection& c) {
    ConnectionRef keep;  // released outside the lock
    MutexLock l(io_->mu);
    auto it = io_->connections.find(c.serial_);
    if (it == io_->connections.end()) return;
    keep = std::move(it->second);
    io_->connections.erase(it);
    if (io_->epollFd >= 0) (void)::epoll_ctl(io_->epollFd, EPOLL_CTL_DEL, c.fd_, nullptr);
}

size_t Listener::TEST_connectionCount() const {
    MutexLock l(io_->mu);
    return io_->connections.size();
}

}  // namespace tarn::conduit
