// Client side of Conduit: one blocking socket, requests matched to replies by id.
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "Platform/Conduit.h"
#include "Platform/ConduitSocket.h"
#include "Platform/ConduitWire.h"
#include "Platform/Format.h"
#include "Platform/ListeningSocket.h"

namespace tarn::conduit {

namespace {

constexpr std::chrono::milliseconds kClientSendTimeout{30000};
// Replies kept for other waiters; a server that sends more than this unasked is misbehaving.
constexpr size_t kMaxStashedReplies = 256;
constexpr std::chrono::milliseconds kTimeoutSlack{10};

}  // namespace

struct Client::Assembly {
    RecordAssembler assembler;
    std::vector<uint8_t> record;
    std::vector<uint8_t> body;  // reused for every message
};

Client::Client(PrivateTag, int fd) : fd_(fd), assembly_(std::make_unique<Assembly>()) {}

Client::~Client() { sock::CloseFd(fd_); }

std::unique_ptr<Client> Client::connect(const std::string& socketPath, std::string* why) {
    const int fd = ConnectUnixSocket(socketPath, SOCK_SEQPACKET, why);
    if (fd < 0) return nullptr;
    return std::make_unique<Client>(PrivateTag{}, fd);
}

bool Client::sendMessage(const PlistValue& body, uint16_t flags, uint64_t id, std::string* why) {
    thread_local std::vector<uint8_t> encoded;
    if (!EncodeMessage(body, &encoded, why)) return false;
    RecordHeader h;
    h.flags = flags;
    h.messageId = id;
    return sock::SendEncodedMessage(fd_, h, &encoded, kClientSendTimeout, why);
}

std::optional<uint64_t> Client::sendRequest(const PlistValue& request, std::string* why) {
    const uint64_t id = nextId_++;
    if (!sendMessage(request, kFlagRequest, id, why)) return std::nullopt;
    return id;
}

bool Client::sendOneWay(const PlistValue& message, std::string* why) {
    return sendMessage(message, 0, nextId_++, why);
}

bool Client::sendRaw(const void* bytes, size_t n) {
    return ::send(fd_, bytes, n, MSG_NOSIGNAL) == static_cast<ssize_t>(n);
}

std::optional<Client::Received> Client::receive(std::chrono::milliseconds timeout,
                                                std::string* why) {
    return receiveUntil(std::chrono::steady_clock::now() + timeout, why);
}

std::optional<Client::Received> Client::receiveUntil(std::chrono::steady_clock::time_point deadline,
                                                     std::string* why) {
    for (bool first = true;; first = false) {
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
            deadline - std::chrono::steady_clock::now());
        // With no time left, the first try still takes what has arrived.
        const bool wait = left > std::chrono::milliseconds(0);
        if (!wait && !first) {
            if (why) *why = "timed out";
            return std::nullopt;
        }
        // A wait may overrun by up to kTimeoutSlack rather than pay a
        // setsockopt on every reply.
        if (wait && (receiveTimeout_ < left || receiveTimeout_ > left + kTimeoutSlack)) {
            if (!sock::SetReceiveTimeout(fd_, left)) {
                if (why) *why = Format("setsockopt SO_RCVTIMEO: %s", std::strerror(errno));
                return std::nullopt;
            }
            receiveTimeout_ = left;
        }
        switch (sock::ReceiveRecord(fd_, kMaxRecordBytes, &assembly_->record, why, wait)) {
            case sock::RecvResult::WouldBlock:
                continue;  // the time passed; the check above says so
            case sock::RecvResult::Closed:
                if (why) *why = "connection closed by the peer";
                return std::nullopt;
            case sock::RecvResult::Error:
                return std::nullopt;
            case sock::RecvResult::Record:
                break;
        }
        const auto r =
            assembly_->assembler.add(assembly_->record.data(), assembly_->record.size(), why);
        if (r == RecordAssembler::Result::Malformed) {
            // The stream cannot be resynchronised; start over on the next record.
            assembly_->assembler = RecordAssembler();
            return std::nullopt;
        }
        if (r == RecordAssembler::Result::NeedMore) continue;
        const RecordHeader h = assembly_->assembler.header();
        assembly_->assembler.takeInto(&assembly_->body);
        const std::vector<uint8_t>& body = assembly_->body;
        // Built in place: GCC's -O2 flow analysis misreads a moved-in temporary
        // as uninitialised.
        std::optional<Received> out(std::in_place);
        auto value = DecodeBody(body.data(), body.size(), why);
        if (!value) return std::nullopt;
        out->messageId = h.messageId;
        out->replyTo = h.replyTo;
        out->flags = h.flags;
        out->body = std::move(*value);
        return out;
    }
}

std::optional<PlistValue> Client::waitForReply(uint64_t id, std::chrono::milliseconds timeout,
                                               std::string* why) {
    auto stashed = std::find_if(stash_.begin(), stash_.end(),
                                [id](const Received& r) { return r.replyTo == id; });
    if (stashed != stash_.end()) {
        PlistValue body = std::move(stashed->body);
        stash_.erase(stashed);
        return body;
    }
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    for (;;) {
        auto m = receiveUntil(deadline, why);
        if (!m) return std::nullopt;
        if (!(m->flags & kFlagReply)) continue;  // nobody asked for it
        if (m->replyTo == id) return std::move(m->body);
        if (stash_.size() < kMaxStashedReplies) stash_.push_back(std::move(*m));
    }
}

std::optional<PlistValue> Client::sendSync(const PlistValue& request,
                                           std::chrono::milliseconds timeout, std::string* why) {
    auto id = sendRequest(request, why);
    if (!id) return std::nullopt;
    return waitForReply(*id, timeout, why);
}

}  // namespace tarn::conduit
