// The kernel upcall channel (Linux): the kernel-initiated message service
// through which the kernel sandbox asks the daemon about a process's
// containers, carried over a second SOCK_SEQPACKET socket,
// RootPath("/run/com.ostrea.tarnkeeperd.upcall.socket") (mode 0666, or the one
// systemd hands over). Anyone may send: the daemon decides who is the kernel
// from the sender token it is given here, never from the datagram.
//
// Framing. A client connects and sends requests, one per record, each
// answered by one record, in order. All integers are little-endian.
//
//   Request datagram: the 56-byte request message, then the request pack
//   buffer (src/packbuff). The out-of-line descriptor's address field holds
//   the offset of the pack-buffer bytes within the datagram (56 when they
//   follow the header), its size their length.
//
//      0  4  header bits (0x80000000: complex; low 5 bits: reply disposition)
//      4  4  message size (56)        8  4  reply port     12  4  local port
//     16  4  voucher port            20  4  message id (322514900)
//     24  4  descriptor count (1)
//     28  8  descriptor address      36  1  deallocate     37  1  copy option
//     38  1  padding                 39  1  descriptor type (1: out-of-line)
//     40  4  descriptor size
//     44  8  data-representation record
//     52  4  data count (bytes of the request buffer)
//
//   What the service receives (ReceivedMessage): those 56 bytes followed by a
//   52-byte trailer the transport writes itself: type 0 at 56, size 52 at 60,
//   sequence number 0 at 64, sender security token (uid, gid) at 68 and the
//   sender's 32-byte audit token (Conduit.h's AuditToken layout) at 76. The
//   audit token carries pid 0 when the peer's uid is 0 (the trusted launcher
//   acting for the kernel) and the peer's real pid otherwise.
//
//   Success reply datagram: the 56-byte reply message (complex, id + 100,
//   descriptor count 1, descriptor type 1, size = data count = answer size)
//   with the address field holding 56, then the answer pack buffer.
//   Error reply datagram: 36 bytes: the 24-byte header (id + 100), the
//   data-representation record at 24, the signed return code at 32.
//
// A datagram whose out-of-line region lies outside it, or that is shorter
// than 56 bytes, never reaches the service: the transport answers it with
// the error reply and kUpcallBadArguments.
//
// Thread-safe. The receive handler runs as an item of the queue given to it,
// one message at a time.
#pragma once

#include <sys/types.h>

#include <array>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "Platform/Dispatch.h"

namespace tarn::upcall {

inline constexpr const char* kUpcallServiceName = "com.ostrea.tarnkeeperd.upcall";

inline constexpr int32_t kProcessContainersRequestID = 322514900;
inline constexpr int32_t kReplyIDOffset = 100;

inline constexpr size_t kRequestMessageSize = 56;
inline constexpr size_t kTrailerSize = 52;
inline constexpr size_t kSuccessReplySize = 56;
inline constexpr size_t kErrorReplySize = 36;
// The largest request datagram taken in (header and pack buffer).
inline constexpr size_t kMaxRequestDatagram = 256 * 1024;

inline constexpr uint32_t kComplexBit = 0x80000000u;
inline constexpr uint32_t kRemoteDispositionMask = 0x1fu;
inline constexpr uint8_t kOutOfLineDescriptor = 1;
inline constexpr uint8_t kVirtualCopy = 1;

// Return codes of the message layer (the service's own are 0, 4, 5, 9).
inline constexpr int32_t kUpcallTypeError = -300;
inline constexpr int32_t kUpcallBadID = -303;
inline constexpr int32_t kUpcallBadArguments = -304;
inline constexpr int32_t kUpcallTrailerError = -309;

// Byte offsets of the message fields.
enum Offset : size_t {
    kOffsetBits = 0,
    kOffsetSize = 4,
    kOffsetRemotePort = 8,
    kOffsetLocalPort = 12,
    kOffsetVoucherPort = 16,
    kOffsetID = 20,
    kOffsetDescriptorCount = 24,
    kOffsetDescriptorAddress = 28,
    kOffsetDescriptorDeallocate = 36,
    kOffsetDescriptorCopy = 37,
    kOffsetDescriptorType = 39,
    kOffsetDescriptorSize = 40,
    kOffsetDataRepresentation = 44,
    kOffsetDataCount = 52,
    kOffsetTrailerType = 56,
    kOffsetTrailerSize = 60,
    kOffsetTrailerSequence = 64,
    kOffsetTrailerSecurityToken = 68,
    kOffsetTrailerAuditToken = 76,
    kOffsetErrorDataRepresentation = 24,
    kOffsetErrorReturnCode = 32,
};

uint32_t LoadU32(const uint8_t* at);
uint64_t LoadU64(const uint8_t* at);
void StoreU32(uint8_t* at, uint32_t value);
void StoreU64(uint8_t* at, uint64_t value);

// A request as the service sees it: header and trailer, and the out-of-line
// region its descriptor names (inside the transport's datagram, valid for the
// handler call only; writable because the pack-buffer wrapper wants it so).
struct ReceivedMessage {
    std::array<uint8_t, kRequestMessageSize + kTrailerSize> bytes{};
    uint8_t* outOfLine = nullptr;
    size_t outOfLineSize = 0;
};

// A reply: the message bytes (56 or 36) and, for a success reply, the bytes
// its descriptor hands over (moved into the datagram after the header).
struct ReplyMessage {
    std::vector<uint8_t> header;
    std::vector<uint8_t> outOfLine;

    bool empty() const { return header.empty(); }
};

// The 36-byte error reply to `request` (its first 56 bytes) with `returnCode`.
ReplyMessage MakeErrorReply(const uint8_t* request, int32_t returnCode);
// The data-representation record every message carries.
void StoreDataRepresentation(uint8_t* at);

// Who sent a datagram, as the kernel recorded it at connect time.
struct SenderCredentials {
    uid_t uid = 0;
    gid_t gid = 0;
    pid_t pid = 0;
    uint64_t startTime = 0;
};

// Turns a request datagram into the message the service receives (trailer
// included). nullopt when the transport itself cannot deliver it; answer that
// with MakeErrorReply(..., kUpcallBadArguments).
std::optional<ReceivedMessage> DecodeRequestDatagram(std::span<uint8_t> datagram,
                                                     const SenderCredentials& sender);
// The datagram of a reply.
std::vector<uint8_t> EncodeReplyDatagram(const ReplyMessage& reply);

// ---- Client side (tarnctl, tests, benchmarks) ----

// A request datagram of message id `id` carrying `packBuffer`.
std::vector<uint8_t> EncodeRequestDatagram(std::span<const uint8_t> packBuffer,
                                           int32_t id = kProcessContainersRequestID);

struct DecodedReply {
    int32_t id = 0;
    int32_t returnCode = 0;       // 0 for a success reply
    std::vector<uint8_t> answer;  // the answer pack buffer of a success reply
};
// nullopt (reason in *why) when the bytes are not a reply of either layout.
std::optional<DecodedReply> DecodeReplyDatagram(std::span<const uint8_t> datagram,
                                                std::string* why);

class UpcallClient {
  public:
    static std::unique_ptr<UpcallClient> connect(const std::string& socketPath, std::string* why);
    ~UpcallClient();
    UpcallClient(const UpcallClient&) = delete;
    UpcallClient& operator=(const UpcallClient&) = delete;

    // Sends one datagram and waits for the next record; nullopt on failure.
    std::optional<std::vector<uint8_t>> call(std::span<const uint8_t> datagram,
                                             std::chrono::milliseconds timeout, std::string* why);

  private:
    explicit UpcallClient(int fd) : fd_(fd) {}
    int fd_;
};

// ---- Service side ----

// The socket of the upcall service: RootPath("/run/" + name + ".socket").
std::string UpcallSocketPath(const std::string& serviceName = kUpcallServiceName);

class UpcallPort {
  public:
    using Handler = std::function<ReplyMessage(const ReceivedMessage&)>;

    // Checks the service in: takes the socket systemd handed over for its
    // path, else binds it (replacing a stale socket, never a live one).
    static std::shared_ptr<UpcallPort> checkIn(const std::string& serviceName, std::string* why);
    ~UpcallPort();
    UpcallPort(const UpcallPort&) = delete;
    UpcallPort& operator=(const UpcallPort&) = delete;

    // The receive source: `handler` runs for each delivered message as an
    // item of `queue`; its reply goes back to the sender. Call once, before
    // resume(); false (with a reason) when the source cannot be made.
    bool setReceiveHandler(DispatchQueueRef queue, Handler handler, std::string* why);
    void resume();
    // Stops receiving and closes every peer; the handler is not called again
    // once this returns (except by an item already running it).
    void cancel();

    const std::string& socketPath() const;

  private:
    struct Loop;
    explicit UpcallPort(std::shared_ptr<Loop> loop);
    std::shared_ptr<Loop> loop_;
};

}  // namespace tarn::upcall
