// The Conduit wire format: how one message travels over a SOCK_SEQPACKET
// socket. Pure functions, no I/O; both the daemon and its clients use them.
//
// A message is a header plus a body. The body is one encoded value, always a
// dictionary. A message bigger than one socket record is split into several
// records that each repeat the header; records of one message follow each
// other on the socket without anything in between (senders hold a per-socket
// lock while they send one message).
//
// Record header, 32 bytes, all integers little-endian:
//
//   offset size field
//        0    4 magic         "TNKC" (0x54 0x4E 0x4B 0x43)
//        4    2 version       1
//        6    2 flags         bit 0 request: carries a reply context
//                             bit 1 reply: answers the message named by reply-to
//                             bit 2 more: further records of this message follow
//                             other bits must be zero
//        8    8 message id    non-zero, chosen by the sender, unique per socket
//       16    8 reply-to id   the id of the request answered; 0 unless a reply
//       24    4 body length   of the whole message body (all records together)
//       28    4 body offset   where this record's payload sits in the body
//   32..      payload         bytes [offset, offset + payload length) of the body
//
// The first record has offset 0; each next record continues exactly where the
// previous one ended and repeats id, reply-to, body length and the flags other
// than "more"; the last record (no "more") ends at the body length. A message
// may not be both request and reply. The body length is at most
// kMaxBodyBytes, so a whole message stays within 1 MiB.
//
// Values: one tag byte, then the tag's content. Lengths and counts are
// unsigned LEB128 varints (at most 10 bytes); signed integers are zigzag
// encoded varints.
//
//   0x01 string      varint byte length, UTF-8 bytes
//   0x02 uint64      varint
//   0x03 int64       zigzag varint
//   0x04 false
//   0x05 true
//   0x06 uuid        16 raw bytes
//   0x07 data        varint byte length, bytes
//   0x08 array       varint count, that many values
//   0x09 dictionary  varint count, that many (varint key length, UTF-8 key, value);
//                    keys are unique
//
// Decoding refuses, with a reason: unknown tags, truncation, trailing bytes,
// invalid UTF-8, duplicate keys, nesting deeper than kMaxNestingDepth, more
// than kMaxValueCount values, and any length or count that cannot fit in the
// bytes that remain (checked before anything is allocated). Property-list
// values that IPC does not carry (null, real, date) cannot be encoded.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "Platform/PropertyList.h"

namespace tarn::conduit {

inline constexpr uint32_t kWireMagic = 0x434B4E54;  // "TNKC" in memory order
inline constexpr uint16_t kWireVersion = 1;
inline constexpr size_t kHeaderBytes = 32;
inline constexpr size_t kMaxMessageBytes = 1024 * 1024;
inline constexpr size_t kMaxBodyBytes = kMaxMessageBytes - kHeaderBytes;
// Payload per record: small enough for any default socket send buffer.
inline constexpr size_t kMaxRecordPayload = 64 * 1024;
inline constexpr size_t kMaxRecordBytes = kHeaderBytes + kMaxRecordPayload;
inline constexpr size_t kMaxNestingDepth = 32;
inline constexpr size_t kMaxValueCount = 65536;

enum WireFlags : uint16_t {
    kFlagRequest = 1u << 0,
    kFlagReply = 1u << 1,
    kFlagMore = 1u << 2,
};

struct RecordHeader {
    uint16_t flags = 0;
    uint64_t messageId = 0;
    uint64_t replyTo = 0;
    uint32_t bodyLength = 0;
    uint32_t bodyOffset = 0;
};

// Body encoding. `value` must be a dictionary (the body of a message); fails
// for null/real/date values, too deep nesting, and bodies over kMaxBodyBytes.
bool EncodeBody(const PlistValue& value, std::vector<uint8_t>* out, std::string* why);
// Encodes any single value (also non-dictionaries); same limits.
bool EncodeValue(const PlistValue& value, std::vector<uint8_t>* out, std::string* why);
// Decodes a body; the result is always a dictionary.
std::optional<PlistValue> DecodeBody(const uint8_t* bytes, size_t length, std::string* why);
// Decodes any single value filling exactly `length` bytes.
std::optional<PlistValue> DecodeValue(const uint8_t* bytes, size_t length, std::string* why);

void EncodeHeader(const RecordHeader& header, uint8_t out[kHeaderBytes]);
// Checks magic, version, flags and the body length cap; `recordLength` is the
// whole record size including the header.
std::optional<RecordHeader> DecodeHeader(const uint8_t* record, size_t recordLength,
                                         std::string* why);

// Splits one message into records ready to send, each at most kMaxRecordBytes.
// `header.bodyLength`/`bodyOffset` and the "more" flag are filled in here.
std::vector<std::vector<uint8_t>> BuildRecords(RecordHeader header,
                                               const std::vector<uint8_t>& body);

// Encodes a message body straight after kHeaderBytes of room in `*out`
// (reusing its capacity); same checks as EncodeBody. FrameMessage() then
// writes the header: a message that fits one record (nearly all) becomes that
// record in place, without a copy, and nothing is returned; a larger one is
// returned split as BuildRecords() would.
bool EncodeMessage(const PlistValue& body, std::vector<uint8_t>* out, std::string* why);
std::vector<std::vector<uint8_t>> FrameMessage(RecordHeader header, std::vector<uint8_t>* encoded);

// Joins records back into one message. Feed records in arrival order; a
// message is ready when add() returns Complete. Any record that breaks the
// rules above makes add() return Malformed with a reason; the assembler must
// then be discarded along with the connection.
class RecordAssembler {
public:
    enum class Result { NeedMore, Complete, Malformed };
    Result add(const uint8_t* record, size_t length, std::string* why);
    // Valid after Complete; take() moves the body out and resets for the next message.
    const RecordHeader& header() const { return header_; }
    std::vector<uint8_t> take();
    // The same into *out, whose old storage the assembler keeps for the next
    // message: a reader that reuses `out` allocates nothing per message.
    void takeInto(std::vector<uint8_t>* out);

private:
    bool inProgress_ = false;
    RecordHeader header_;
    std::vector<uint8_t> body_;
};

}  // namespace tarn::conduit
