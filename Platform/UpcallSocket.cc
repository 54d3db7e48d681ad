#include "Platform/UpcallSocket.h"

#include <endian.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <thread>

#include "Platform/Conduit.h"
#include "Platform/ConduitSocket.h"
#include "Platform/Format.h"
#include "Platform/ListeningSocket.h"
#include "Platform/PlatformLog.h"
#include "Platform/ThreadAnnotations.h"

namespace tarn::upcall {

namespace {

constexpr const char* kCategory = "upcall";
// More peers than this at once are turned away: the only legitimate sender is
// the launcher acting for the kernel.
constexpr size_t kMaxPeers = 64;
// Requests of one peer waiting for the queue; more are left unread until the
// queue catches up, so a flood cannot pile up in memory.
constexpr int kMaxPendingPerPeer = 8;
// A peer that does not read its replies gives up its reply after this long.
constexpr auto kReplySendTimeout = std::chrono::milliseconds(200);

}  // namespace

uint32_t LoadU32(const uint8_t* at) {
    uint32_t v;
    std::memcpy(&v, at, sizeof v);
    return le32toh(v);
}

uint64_t LoadU64(const uint8_t* at) {
    uint64_t v;
    std::memcpy(&v, at, sizeof v);
    return le64toh(v);
}

void StoreU32(uint8_t* at, uint32_t value) {
    value = htole32(value);
    std::memcpy(at, &value, sizeof value);
}

void StoreU64(uint8_t* at, uint64_t value) {
    value = htole64(value);
    std::memcpy(at, &value, sizeof value);
}

void StoreDataRepresentation(uint8_t* at) {
    // Version 0, little-endian integers, ASCII characters, IEEE floats.
    static constexpr uint8_t kRecord[8] = {0, 0, 0, 0, 1, 0, 0, 0};
    std::memcpy(at, kRecord, sizeof kRecord);
}

ReplyMessage MakeErrorReply(const uint8_t* request, int32_t returnCode) {
    ReplyMessage reply;
    reply.header.assign(kErrorReplySize, 0);
    uint8_t* h = reply.header.data();
    StoreU32(h + kOffsetBits, LoadU32(request + kOffsetBits) & kRemoteDispositionMask);
    StoreU32(h + kOffsetSize, kErrorReplySize);
    StoreU32(h + kOffsetRemotePort, LoadU32(request + kOffsetRemotePort));
    StoreU32(h + kOffsetID, LoadU32(request + kOffsetID) + kReplyIDOffset);
    StoreDataRepresentation(h + kOffsetErrorDataRepresentation);
    StoreU32(h + kOffsetErrorReturnCode, static_cast<uint32_t>(returnCode));
    return reply;
}

std::optional<ReceivedMessage> DecodeRequestDatagram(std::span<uint8_t> datagram,
                                                     const SenderCredentials& sender) {
    if (datagram.size() < kRequestMessageSize) return std::nullopt;
    ReceivedMessage m;
    std::memcpy(m.bytes.data(), datagram.data(), kRequestMessageSize);
    const uint8_t* h = m.bytes.data();
    // Out-of-line memory is handed over only where the header says there is
    // some; the service judges everything else about the header itself.
    if ((LoadU32(h + kOffsetBits) & kComplexBit) && LoadU32(h + kOffsetDescriptorCount) >= 1 &&
        h[kOffsetDescriptorType] == kOutOfLineDescriptor) {
        const uint64_t offset = LoadU64(h + kOffsetDescriptorAddress);
        const uint64_t size = LoadU32(h + kOffsetDescriptorSize);
        if (offset > datagram.size() || size > datagram.size() - offset) return std::nullopt;
        m.outOfLine = datagram.data() + offset;
        m.outOfLineSize = static_cast<size_t>(size);
    }
    uint8_t* t = m.bytes.data();
    StoreU32(t + kOffsetTrailerType, 0);
    StoreU32(t + kOffsetTrailerSize, kTrailerSize);
    StoreU32(t + kOffsetTrailerSequence, 0);
    StoreU32(t + kOffsetTrailerSecurityToken, sender.uid);
    StoreU32(t + kOffsetTrailerSecurityToken + 4, sender.gid);
    const conduit::AuditToken token = conduit::MakeAuditToken({
        .euid = sender.uid,
        .egid = sender.gid,
        .pid = sender.uid == 0 ? 0 : sender.pid,
        .startTime = sender.startTime,
    });
    std::memcpy(t + kOffsetTrailerAuditToken, token.data(), token.size());
    return m;
}

std::vector<uint8_t> EncodeReplyDatagram(const ReplyMessage& reply) {
    std::vector<uint8_t> out;
    out.reserve(reply.header.size() + reply.outOfLine.size());
    out = reply.header;
    if (out.size() >= kSuccessReplySize && (LoadU32(out.data() + kOffsetBits) & kComplexBit)) {
        StoreU64(out.data() + kOffsetDescriptorAddress, out.size());
        out.insert(out.end(), reply.outOfLine.begin(), reply.outOfLine.end());
    }
    return out;
}

std::vector<uint8_t> EncodeRequestDatagram(std::span<const uint8_t> packBuffer, int32_t id) {
    // Sized once: an insert after the header trips a false array-bounds
    // warning of GCC 12 at -O2.
    std::vector<uint8_t> out(kRequestMessageSize + packBuffer.size(), 0);
    uint8_t* h = out.data();
    const auto size = static_cast<uint32_t>(packBuffer.size());
    StoreU32(h + kOffsetBits, kComplexBit);
    StoreU32(h + kOffsetSize, kRequestMessageSize);
    StoreU32(h + kOffsetID, static_cast<uint32_t>(id));
    StoreU32(h + kOffsetDescriptorCount, 1);
    StoreU64(h + kOffsetDescriptorAddress, kRequestMessageSize);
    h[kOffsetDescriptorCopy] = kVirtualCopy;
    h[kOffsetDescriptorType] = kOutOfLineDescriptor;
    StoreU32(h + kOffsetDescriptorSize, size);
    StoreDataRepresentation(h + kOffsetDataRepresentation);
    StoreU32(h + kOffsetDataCount, size);
    if (!packBuffer.empty()) std::memcpy(h + kRequestMessageSize, packBuffer.data(), size);
    return out;
}

std::optional<DecodedReply> DecodeReplyDatagram(std::span<const uint8_t> datagram,
                                                std::string* why) {
    auto fail = [why](std::string reason) -> std::optional<DecodedReply> {
        if (why) *why = std::move(reason);
        return std::nullopt;
    };
    if (datagram.size() < kErrorReplySize)
        return fail(Format("reply of %zu bytes is too short", datagram.size()));
    const uint8_t* h = datagram.data();
    DecodedReply out;
    out.id = static_cast<int32_t>(LoadU32(h + kOffsetID));
    if (!(LoadU32(h + kOffsetBits) & kComplexBit)) {
        if (LoadU32(h + kOffsetSize) != kErrorReplySize)
            return fail("error reply with a size other than 36");
        out.returnCode = static_cast<int32_t>(LoadU32(h + kOffsetErrorReturnCode));
        return out;
    }
    if (datagram.size() < kSuccessReplySize || LoadU32(h + kOffsetSize) != kSuccessReplySize ||
        LoadU32(h + kOffsetDescriptorCount) != 1 ||
        h[kOffsetDescriptorType] != kOutOfLineDescriptor)
        return fail("malformed success reply");
    const uint64_t offset = LoadU64(h + kOffsetDescriptorAddress);
    const uint64_t size = LoadU32(h + kOffsetDescriptorSize);
    if (size != LoadU32(h + kOffsetDataCount) || offset > datagram.size() ||
        size > datagram.size() - offset)
        return fail("success reply whose answer lies outside it");
    out.answer.assign(h + offset, h + offset + size);
    return out;
}

// ---- UpcallClient ----

std::unique_ptr<UpcallClient> UpcallClient::connect(const std::string& socketPath,
                                                    std::string* why) {
    const int fd = ConnectUnixSocket(socketPath, SOCK_SEQPACKET, why);
    if (fd < 0) return nullptr;
    return std::unique_ptr<UpcallClient>(new UpcallClient(fd));
}

UpcallClient::~UpcallClient() { ::close(fd_); }

std::optional<std::vector<uint8_t>> UpcallClient::call(std::span<const uint8_t> datagram,
                                                       std::chrono::milliseconds timeout,
                                                       std::string* why) {
    if (!conduit::sock::SendRecord(fd_, datagram.data(), datagram.size(), timeout, why))
        return std::nullopt;
    if (!conduit::sock::WaitReadable(fd_, timeout, why)) return std::nullopt;
    std::vector<uint8_t> reply;
    // A reply is at most the header and an answer of about the request's size;
    // 16 MiB is far beyond any container list.
    switch (conduit::sock::ReceiveRecord(fd_, 16 << 20, &reply, why)) {
        case conduit::sock::RecvResult::Record:
            return reply;
        case conduit::sock::RecvResult::Closed:
            if (why) *why = "connection closed";
            return std::nullopt;
        case conduit::sock::RecvResult::WouldBlock:
            if (why) *why = "timed out";
            return std::nullopt;
        case conduit::sock::RecvResult::Error:
            return std::nullopt;
    }
    return std::nullopt;
}

// ---- UpcallPort ----

std::string UpcallSocketPath(const std::string& serviceName) {
    return conduit::ServiceSocketPath(serviceName);
}

struct UpcallPort::Loop : std::enable_shared_from_this<UpcallPort::Loop> {
    struct Peer {
        int fd = -1;
        SenderCredentials sender;
        std::atomic<int> pending{0};
        ~Peer() { ::close(fd); }
    };

    // Constant after construction.
    std::string path;
    bool ownsPath = false;
    int listenFd = -1;
    int wakeFd = -1;

    Mutex mu;
    DispatchQueueRef queue GUARDED_BY(mu);
    Handler handler GUARDED_BY(mu);
    bool started GUARDED_BY(mu) = false;
    bool stopped GUARDED_BY(mu) = false;
    std::thread thread;  // set by resume(), joined by cancel()

    // The I/O thread's own.
    std::vector<std::shared_ptr<Peer>> peers;

    ~Loop() {
        if (listenFd >= 0) ::close(listenFd);
        if (wakeFd >= 0) ::close(wakeFd);
    }

    void wake() {
        const uint64_t one = 1;
        (void)!::write(wakeFd, &one, sizeof one);  // a full counter still wakes the loop
    }

    bool isStopped() {
        MutexLock l(mu);
        return stopped;
    }

    void run();
    void accept();
    // False when the peer is to be dropped.
    bool read(const std::shared_ptr<Peer>& peer);
    void deliver(const std::shared_ptr<Peer>& peer, std::vector<uint8_t> datagram);
    static void send(const Peer& peer, const ReplyMessage& reply);
};

void UpcallPort::Loop::run() {
    std::vector<struct pollfd> fds;
    std::vector<std::shared_ptr<Peer>> polled;
    while (!isStopped()) {
        fds.assign({{wakeFd, POLLIN, 0}, {listenFd, POLLIN, 0}});
        polled.clear();
        for (const auto& p : peers) {
            if (p->pending.load() >= kMaxPendingPerPeer) continue;
            fds.push_back({p->fd, POLLIN, 0});
            polled.push_back(p);
        }
        if (::poll(fds.data(), fds.size(), -1) < 0) {
            if (errno == EINTR) continue;
            PlatformLog(kCategory, PlatformLogType::Fault, "poll on %s: %s", path,
                        std::strerror(errno));
            return;
        }
        if (fds[0].revents) {
            uint64_t count;
            (void)!::read(wakeFd, &count, sizeof count);  // only empties the counter
        }
        if (fds[1].revents) accept();
        for (size_t i = 0; i < polled.size(); ++i) {
            if (!fds[i + 2].revents) continue;
            if (!read(polled[i])) std::erase(peers, polled[i]);
        }
    }
}

void UpcallPort::Loop::accept() {
    for (;;) {
        const int fd = ::accept4(listenFd, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
        if (fd < 0) {
            if (errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR)
                PlatformLog(kCategory, PlatformLogType::Error, "accept on %s: %s", path,
                            std::strerror(errno));
            return;
        }
        auto peer = std::make_shared<Peer>();
        peer->fd = fd;
        struct ucred cred;
        socklen_t len = sizeof cred;
        if (::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0 || cred.pid <= 0) {
            PlatformLog(kCategory, PlatformLogType::Error, "Upcall peer without credentials");
            continue;  // the peer closes with it
        }
        if (peers.size() >= kMaxPeers) {
            PlatformLog(kCategory, PlatformLogType::Error,
                        "Upcall peer pid %d turned away: %zu peers connected", cred.pid,
                        peers.size());
            continue;
        }
        peer->sender = {.uid = cred.uid,
                        .gid = cred.gid,
                        .pid = cred.pid,
                        .startTime = conduit::sock::ProcessStartTime(cred.pid).value_or(0)};
        peers.push_back(std::move(peer));
    }
}

bool UpcallPort::Loop::read(const std::shared_ptr<Peer>& peer) {
    std::vector<uint8_t> datagram;
    std::string why;
    switch (conduit::sock::ReceiveRecord(peer->fd, kMaxRequestDatagram, &datagram, &why)) {
        case conduit::sock::RecvResult::Record:
            deliver(peer, std::move(datagram));
            return true;
        case conduit::sock::RecvResult::WouldBlock:
            return true;
        case conduit::sock::RecvResult::Closed:
            return false;
        case conduit::sock::RecvResult::Error:
            PlatformLog(kCategory, PlatformLogType::Error, "Upcall from pid %d dropped: %s",
                        peer->sender.pid, why);
            return false;
    }
    return false;
}

void UpcallPort::Loop::deliver(const std::shared_ptr<Peer>& peer, std::vector<uint8_t> datagram) {
    if (datagram.size() < kRequestMessageSize || !DecodeRequestDatagram(datagram, peer->sender)) {
        // Nothing the service could be handed: answer for it, as the kernel
        // refuses a message it cannot carry.
        uint8_t header[kRequestMessageSize] = {};
        std::memcpy(header, datagram.data(), std::min(datagram.size(), sizeof header));
        send(*peer, MakeErrorReply(header, kUpcallBadArguments));
        return;
    }
    DispatchQueueRef queue;
    {
        MutexLock l(mu);
        queue = this->queue;
    }
    peer->pending.fetch_add(1);
    auto shared = std::make_shared<std::vector<uint8_t>>(std::move(datagram));
    auto work = [self = shared_from_this(), peer, shared] {
        Handler handler;
        {
            MutexLock l(self->mu);
            if (!self->stopped) handler = self->handler;
        }
        if (handler) {
            // Decoded again here: the message points into the datagram this item owns.
            std::optional<ReceivedMessage> message = DecodeRequestDatagram(*shared, peer->sender);
            send(*peer, handler(*message));
        }
        if (peer->pending.fetch_sub(1) == kMaxPendingPerPeer) self->wake();
    };
    if (!queue->runHereIfIdle(work)) queue->async(std::move(work));
}

void UpcallPort::Loop::send(const Peer& peer, const ReplyMessage& reply) {
    const std::vector<uint8_t> bytes = EncodeReplyDatagram(reply);
    std::string why;
    if (!conduit::sock::SendRecord(peer.fd, bytes.data(), bytes.size(), kReplySendTimeout, &why))
        PlatformLog(kCategory, PlatformLogType::Error, "Upcall reply to pid %d not sent: %s",
                    peer.sender.pid, why);
}

UpcallPort::UpcallPort(std::shared_ptr<Loop> loop) : loop_(std::move(loop)) {}

UpcallPort::~UpcallPort() { cancel(); }

std::shared_ptr<UpcallPort> UpcallPort::checkIn(const std::string& serviceName, std::string* why) {
    auto loop = std::make_shared<Loop>();
    loop->path = UpcallSocketPath(serviceName);
    loop->listenFd = TakeActivatedSocket(loop->path, SOCK_SEQPACKET);
    if (loop->listenFd < 0) {
        // Anyone may send; the service decides who is the kernel.
        loop->listenFd = BindListeningSocket(loop->path, SOCK_SEQPACKET, 0666, why);
        if (loop->listenFd < 0) return nullptr;
        loop->ownsPath = true;
    }
    loop->wakeFd = ::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    if (loop->wakeFd < 0) {
        if (why) *why = Format("eventfd: %s", std::strerror(errno));
        if (loop->ownsPath) (void)::unlink(loop->path.c_str());  // ours, just made
        return nullptr;
    }
    return std::shared_ptr<UpcallPort>(new UpcallPort(std::move(loop)));
}

bool UpcallPort::setReceiveHandler(DispatchQueueRef queue, Handler handler, std::string* why) {
    MutexLock l(loop_->mu);
    if (!queue || !handler || loop_->started || loop_->stopped) {
        if (why) *why = "no queue or handler, or the port already runs";
        return false;
    }
    loop_->queue = std::move(queue);
    loop_->handler = std::move(handler);
    return true;
}

void UpcallPort::resume() {
    MutexLock l(loop_->mu);
    if (loop_->started || loop_->stopped || !loop_->handler) return;
    loop_->started = true;
    loop_->thread = std::thread([loop = loop_] { loop->run(); });
}

void UpcallPort::cancel() {
    {
        MutexLock l(loop_->mu);
        if (loop_->stopped) return;
        loop_->stopped = true;
        loop_->handler = nullptr;
    }
    loop_->wake();
    if (loop_->thread.joinable()) loop_->thread.join();
    loop_->peers.clear();  // the I/O thread is gone; queued replies keep theirs
    // The loop (and the peers queued work still holds) may outlive this; the
    // socket path goes now so that new senders fail at once.
    if (loop_->ownsPath) (void)::unlink(loop_->path.c_str());  // gone already is fine
    ::shutdown(loop_->listenFd, SHUT_RDWR);
}

const std::string& UpcallPort::socketPath() const { return loop_->path; }

}  // namespace tarn::upcall
