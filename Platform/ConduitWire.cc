#include "Platform/ConduitWire.h"

#include <cstring>

#include "Platform/Format.h"

namespace tarn::conduit {

namespace {

enum Tag : uint8_t {
    kTagString = 0x01,
    kTagUInt = 0x02,
    kTagInt = 0x03,
    kTagFalse = 0x04,
    kTagTrue = 0x05,
    kTagUuid = 0x06,
    kTagData = 0x07,
    kTagArray = 0x08,
    kTagDict = 0x09,
};

void putVarint(std::vector<uint8_t>* out, uint64_t v) {
    while (v >= 0x80) {
        out->push_back(static_cast<uint8_t>(v) | 0x80);
        v >>= 7;
    }
    out->push_back(static_cast<uint8_t>(v));
}

void putBytes(std::vector<uint8_t>* out, const void* p, size_t n) {
    const auto* b = static_cast<const uint8_t*>(p);
    out->insert(out->end(), b, b + n);
}

class Encoder {
public:
    // Appends to `out`, whose first `base` bytes are not part of the value.
    explicit Encoder(std::vector<uint8_t>* out, size_t base = 0) : out_(out), base_(base) {}

    bool value(const PlistValue& v, size_t depth, std::string* why) {
        if (depth > kMaxNestingDepth) return fail(why, "nesting deeper than the limit");
        // Checked as we go so that a huge value stops early instead of growing the buffer.
        if (out_->size() - base_ > kMaxBodyBytes) return fail(why, "message larger than 1 MiB");
        switch (v.type()) {
            case PlistValue::Type::String: {
                const std::string& s = *v.asString();
                out_->push_back(kTagString);
                putVarint(out_, s.size());
                putBytes(out_, s.data(), s.size());
                return true;
            }
            case PlistValue::Type::UInt:
                out_->push_back(kTagUInt);
                putVarint(out_, *v.asUInt64());
                return true;
            case PlistValue::Type::Int: {
                // asInt64 converts only when it fits; an Int always does.
                const int64_t i = *v.asInt64();
                out_->push_back(kTagInt);
                putVarint(out_, (static_cast<uint64_t>(i) << 1) ^ static_cast<uint64_t>(i >> 63));
                return true;
            }
            case PlistValue::Type::Bool:
                out_->push_back(*v.asBool() ? kTagTrue : kTagFalse);
                return true;
            case PlistValue::Type::Uuid:
                out_->push_back(kTagUuid);
                putBytes(out_, v.asUuid()->bytes.data(), 16);
                return true;
            case PlistValue::Type::Data: {
                const PlistData& d = *v.asData();
                out_->push_back(kTagData);
                putVarint(out_, d.size());
                putBytes(out_, d.data(), d.size());
                return true;
            }
            case PlistValue::Type::Array: {
                const PlistArray& a = *v.asArray();
                out_->push_back(kTagArray);
                putVarint(out_, a.size());
                for (const PlistValue& e : a)
                    if (!value(e, depth + 1, why)) return false;
                return true;
            }
            case PlistValue::Type::Dict: {
                const PlistDict& d = *v.asDict();
                out_->push_back(kTagDict);
                putVarint(out_, d.size());
                for (const auto& [k, e] : d) {
                    putVarint(out_, k.size());
                    putBytes(out_, k.data(), k.size());
                    if (!value(e, depth + 1, why)) return false;
                }
                return true;
            }
            case PlistValue::Type::Null:
                return fail(why, "null values cannot be sent");
            case PlistValue::Type::Real:
                return fail(why, "real numbers cannot be sent");
            case PlistValue::Type::Date:
                return fail(why, "dates cannot be sent");
        }
        return fail(why, "unknown value type");
    }

private:
    static bool fail(std::string* why, const char* reason) {
        if (why) *why = reason;
        return false;
    }
    std::vector<uint8_t>* out_;
    const size_t base_;
};

bool validUtf8(const uint8_t* s, size_t n) {
    size_t i = 0;
    while (i < n) {
        // Keys, identifiers and paths are nearly always ASCII: eight bytes at a time.
        if (n - i >= 8) {
            uint64_t word;
            std::memcpy(&word, s + i, 8);
            if ((word & 0x8080808080808080ull) == 0) {
                i += 8;
                continue;
            }
        }
        const uint8_t c = s[i];
        if (c < 0x80) {
            ++i;
            continue;
        }
        size_t len;
        uint32_t cp;
        if ((c & 0xE0) == 0xC0) {
            len = 2;
            cp = c & 0x1F;
        } else if ((c & 0xF0) == 0xE0) {
            len = 3;
            cp = c & 0x0F;
        } else if ((c & 0xF8) == 0xF0) {
            len = 4;
            cp = c & 0x07;
        } else {
            return false;
        }
        if (n - i < len) return false;
        for (size_t k = 1; k < len; ++k) {
            if ((s[i + k] & 0xC0) != 0x80) return false;
            cp = (cp << 6) | (s[i + k] & 0x3F);
        }
        // Overlong forms, surrogates and values past U+10FFFF are not text.
        static constexpr uint32_t kMinForLen[5] = {0, 0, 0x80, 0x800, 0x10000};
        if (cp < kMinForLen[len] || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF)) return false;
        i += len;
    }
    return true;
}

class Decoder {
public:
    Decoder(const uint8_t* p, size_t n) : p_(p), end_(p + n) {}

    // Decodes one value into *out, which is built in place (a dictionary
    // entry decodes straight into its node): no temporary value to move.
    bool value(PlistValue* out, size_t depth) {
        if (depth > kMaxNestingDepth) return fail("nesting deeper than the limit");
        if (++values_ > kMaxValueCount) return fail("too many values");
        if (p_ == end_) return fail("truncated value");
        const uint8_t tag = *p_++;
        switch (tag) {
            case kTagString: {
                std::string_view s;
                if (!text(&s, "string")) return false;
                *out = PlistValue(s);
                return true;
            }
            case kTagUInt: {
                uint64_t u;
                if (!varint(&u)) return false;
                *out = PlistValue(u);
                return true;
            }
            case kTagInt: {
                uint64_t z;
                if (!varint(&z)) return false;
                *out = PlistValue(static_cast<int64_t>(z >> 1) ^ -static_cast<int64_t>(z & 1));
                return true;
            }
            case kTagFalse:
                *out = PlistValue(false);
                return true;
            case kTagTrue:
                *out = PlistValue(true);
                return true;
            case kTagUuid: {
                if (remaining() < 16) return fail("truncated uuid");
                Uuid u;
                std::memcpy(u.bytes.data(), p_, 16);
                p_ += 16;
                *out = PlistValue(u);
                return true;
            }
            case kTagData: {
                uint64_t n;
                if (!varint(&n)) return false;
                if (n > remaining()) return fail("data longer than the message");
                *out = PlistValue(PlistData(p_, p_ + n));
                p_ += n;
                return true;
            }
            case kTagArray: {
                uint64_t count;
                if (!varint(&count)) return false;
                // Every element takes at least one byte.
                if (count > remaining()) return fail("array count larger than the message");
                *out = PlistValue(PlistArray());
                PlistArray& a = *out->asArray();
                a.reserve(count);
                for (uint64_t k = 0; k < count; ++k)
                    if (!value(&a.emplace_back(), depth + 1)) return false;
                return true;
            }
            case kTagDict: {
                uint64_t count;
                if (!varint(&count)) return false;
                // Every entry takes at least two bytes (key length, tag).
                if (count > remaining() / 2) return fail("dictionary count larger than the message");
                *out = PlistValue(PlistDict());
                PlistDict& d = *out->asDict();
                for (uint64_t k = 0; k < count; ++k) {
                    std::string_view key;
                    if (!text(&key, "key")) return false;
                    // Encoders write keys in order, so the end is nearly always
                    // the right place: one comparison instead of a descent.
                    const size_t before = d.size();
                    auto at = d.emplace_hint(d.end(), key, PlistValue());
                    if (d.size() == before) return fail("duplicate dictionary key");
                    if (!value(&at->second, depth + 1)) return false;
                }
                return true;
            }
            default:
                reason_ = Format("unknown value tag 0x%02x", static_cast<unsigned>(tag));
                return false;
        }
    }

    size_t remaining() const { return static_cast<size_t>(end_ - p_); }
    const std::string& reason() const { return reason_; }

private:
    bool fail(const char* r) {
        reason_ = r;
        return false;
    }

    bool varint(uint64_t* out) {
        uint64_t v = 0;
        for (int shift = 0; shift < 70; shift += 7) {
            if (p_ == end_) {
                reason_ = "truncated integer";
                return false;
            }
            const uint8_t b = *p_++;
            // The tenth byte may only carry the top bit of a 64-bit number.
            if (shift == 63 && (b & 0xFE) != 0) {
                reason_ = "integer overflows 64 bits";
                return false;
            }
            v |= static_cast<uint64_t>(b & 0x7F) << shift;
            if (!(b & 0x80)) {
                *out = v;
                return true;
            }
        }
        reason_ = "integer overflows 64 bits";
        return false;
    }

    // A view into the message: the caller copies it where it belongs.
    bool text(std::string_view* out, const char* what) {
        uint64_t n;
        if (!varint(&n)) return false;
        if (n > remaining()) {
            reason_ = Format("%s longer than the message", what);
            return false;
        }
        if (!validUtf8(p_, n)) {
            reason_ = Format("%s is not UTF-8", what);
            return false;
        }
        *out = std::string_view(reinterpret_cast<const char*>(p_), n);
        p_ += n;
        return true;
    }

    const uint8_t* p_;
    const uint8_t* end_;
    size_t values_ = 0;
    std::string reason_;
};

uint16_t get16(const uint8_t* p) { return static_cast<uint16_t>(p[0] | (p[1] << 8)); }
uint32_t get32(const uint8_t* p) {
    return uint32_t{p[0]} | (uint32_t{p[1]} << 8) | (uint32_t{p[2]} << 16) | (uint32_t{p[3]} << 24);
}
uint64_t get64(const uint8_t* p) { return uint64_t{get32(p)} | (uint64_t{get32(p + 4)} << 32); }
void put16(uint8_t* p, uint16_t v) {
    p[0] = static_cast<uint8_t>(v);
    p[1] = static_cast<uint8_t>(v >> 8);
}
void put32(uint8_t* p, uint32_t v) {
    for (int i = 0; i < 4; ++i) p[i] = static_cast<uint8_t>(v >> (8 * i));
}
void put64(uint8_t* p, uint64_t v) {
    put32(p, static_cast<uint32_t>(v));
    put32(p + 4, static_cast<uint32_t>(v >> 32));
}

}  // namespace

bool EncodeValue(const PlistValue& value, std::vector<uint8_t>* out, std::string* why) {
    out->clear();
    if (!Encoder(out).value(value, 1, why)) return false;
    if (out->size() > kMaxBodyBytes) {
        if (why) *why = "message larger than 1 MiB";
        return false;
    }
    return true;
}

bool EncodeBody(const PlistValue& value, std::vector<uint8_t>* out, std::string* why) {
    if (!value.isDict()) {
        if (why) *why = "message body is not a dictionary";
        return false;
    }
    return EncodeValue(value, out, why);
}

bool EncodeMessage(const PlistValue& body, std::vector<uint8_t>* out, std::string* why) {
    if (!body.isDict()) {
        if (why) *why = "message body is not a dictionary";
        return false;
    }
    out->resize(kHeaderBytes);
    if (!Encoder(out, kHeaderBytes).value(body, 1, why)) return false;
    if (out->size() - kHeaderBytes > kMaxBodyBytes) {
        if (why) *why = "message larger than 1 MiB";
        return false;
    }
    return true;
}

std::vector<std::vector<uint8_t>> FrameMessage(RecordHeader header, std::vector<uint8_t>* encoded) {
    const size_t length = encoded->size() - kHeaderBytes;
    if (length > kMaxRecordPayload)
        return BuildRecords(header, std::vector<uint8_t>(encoded->begin() + kHeaderBytes, encoded->end()));
    header.bodyLength = static_cast<uint32_t>(length);
    header.bodyOffset = 0;
    header.flags = static_cast<uint16_t>(header.flags & ~kFlagMore);
    EncodeHeader(header, encoded->data());
    return {};
}

std::optional<PlistValue> DecodeValue(const uint8_t* bytes, size_t length, std::string* why) {
    if (length > kMaxBodyBytes) {
        if (why) *why = "message larger than 1 MiB";
        return std::nullopt;
    }
    Decoder d(bytes, length);
    std::optional<PlistValue> v(std::in_place);
    if (!d.value(&*v, 1)) {
        if (why) *why = d.reason();
        return std::nullopt;
    }
    if (d.remaining() != 0) {
        if (why) *why = "trailing bytes after the value";
        return std::nullopt;
    }
    return v;
}

std::optional<PlistValue> DecodeBody(const uint8_t* bytes, size_t length, std::string* why) {
    // Refuse a non-dictionary before decoding any of it.
    if (length == 0 || bytes[0] != kTagDict) {
        if (why) *why = "message body is not a dictionary";
        return std::nullopt;
    }
    return DecodeValue(bytes, length, why);
}

void EncodeHeader(const RecordHeader& h, uint8_t out[kHeaderBytes]) {
    put32(out, kWireMagic);
    put16(out + 4, kWireVersion);
    put16(out + 6, h.flags);
    put64(out + 8, h.messageId);
    put64(out + 16, h.replyTo);
    put32(out + 24, h.bodyLength);
    put32(out + 28, h.bodyOffset);
}

std::optional<RecordHeader> DecodeHeader(const uint8_t* record, size_t recordLength,
                                         std::string* why) {
    auto fail = [&](std::string r) -> std::optional<RecordHeader> {
        if (why) *why = std::move(r);
        return std::nullopt;
    };
    if (recordLength < kHeaderBytes) return fail("record shorter than its header");
    if (recordLength > kMaxRecordBytes) return fail("record larger than the limit");
    if (get32(record) != kWireMagic) return fail("bad magic");
    const uint16_t version = get16(record + 4);
    if (version != kWireVersion) return fail(Format("unsupported version %u", unsigned{version}));
    RecordHeader h;
    h.flags = get16(record + 6);
    h.messageId = get64(record + 8);
    h.replyTo = get64(record + 16);
    h.bodyLength = get32(record + 24);
    h.bodyOffset = get32(record + 28);
    if (h.flags & ~(kFlagRequest | kFlagReply | kFlagMore)) return fail("unknown flags");
    if ((h.flags & kFlagRequest) && (h.flags & kFlagReply))
        return fail("message is both request and reply");
    if (h.messageId == 0) return fail("message id 0");
    if (!(h.flags & kFlagReply) && h.replyTo != 0) return fail("reply-to id on a non-reply");
    if ((h.flags & kFlagReply) && h.replyTo == 0) return fail("reply without reply-to id");
    if (h.bodyLength > kMaxBodyBytes) return fail("message larger than 1 MiB");
    const size_t payload = recordLength - kHeaderBytes;
    if (uint64_t{h.bodyOffset} + payload > h.bodyLength)
        return fail("record runs past the body length");
    return h;
}

std::vector<std::vector<uint8_t>> BuildRecords(RecordHeader header,
                                               const std::vector<uint8_t>& body) {
    std::vector<std::vector<uint8_t>> records;
    header.bodyLength = static_cast<uint32_t>(body.size());
    size_t offset = 0;
    do {
        const size_t n = std::min(kMaxRecordPayload, body.size() - offset);
        RecordHeader h = header;
        h.bodyOffset = static_cast<uint32_t>(offset);
        h.flags = static_cast<uint16_t>(header.flags & ~kFlagMore);
        if (offset + n < body.size()) h.flags |= kFlagMore;
        std::vector<uint8_t> r(kHeaderBytes + n);
        EncodeHeader(h, r.data());
        if (n) std::memcpy(r.data() + kHeaderBytes, body.data() + offset, n);
        records.push_back(std::move(r));
        offset += n;
    } while (offset < body.size());
    return records;
}

RecordAssembler::Result RecordAssembler::add(const uint8_t* record, size_t length,
                                             std::string* why) {
    auto h = DecodeHeader(record, length, why);
    if (!h) return Result::Malformed;
    const size_t payload = length - kHeaderBytes;
    const bool more = h->flags & kFlagMore;
    if (!inProgress_) {
        if (h->bodyOffset != 0) {
            if (why) *why = "first record does not start the body";
            return Result::Malformed;
        }
        header_ = *h;
        header_.flags = static_cast<uint16_t>(h->flags & ~kFlagMore);
        body_.clear();
        // Cap already checked in DecodeHeader.
        body_.reserve(h->bodyLength);
        inProgress_ = true;
    } else if (h->messageId != header_.messageId || h->replyTo != header_.replyTo ||
               h->bodyLength != header_.bodyLength ||
               (h->flags & ~kFlagMore) != header_.flags || h->bodyOffset != body_.size()) {
        if (why) *why = "record does not continue the message in progress";
        return Result::Malformed;
    }
    if (more && payload == 0) {
        if (why) *why = "empty continuation record";
        return Result::Malformed;
    }
    body_.insert(body_.end(), record + kHeaderBytes, record + length);
    if (more) {
        if (body_.size() >= header_.bodyLength) {
            if (why) *why = "more records announced after the body is complete";
            return Result::Malformed;
        }
        return Result::NeedMore;
    }
    if (body_.size() != header_.bodyLength) {
        if (why) *why = "message ended before its body length";
        return Result::Malformed;
    }
    return Result::Complete;
}

std::vector<uint8_t> RecordAssembler::take() {
    inProgress_ = false;
    return std::move(body_);
}

void RecordAssembler::takeInto(std::vector<uint8_t>* out) {
    inProgress_ = false;
    body_.swap(*out);
}

}  // namespace tarn::conduit
