#include "Tools/tarnctl/Json.h"

#include <cstdio>
#include <limits>

#include "Platform/Format.h"

namespace tarnctl {

using tarn::Format;
using tarn::PlistArray;
using tarn::PlistData;
using tarn::PlistDict;
using tarn::PlistValue;

namespace {

constexpr size_t kMaxDepth = 64;
constexpr char kBase64[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

std::string base64Encode(const PlistData& d) {
    std::string out;
    out.reserve((d.size() + 2) / 3 * 4);
    size_t i = 0;
    for (; i + 2 < d.size(); i += 3) {
        const uint32_t v = (uint32_t{d[i]} << 16) | (uint32_t{d[i + 1]} << 8) | d[i + 2];
        for (int s = 18; s >= 0; s -= 6) out += kBase64[(v >> s) & 63];
    }
    if (i + 1 == d.size()) {
        const uint32_t v = uint32_t{d[i]} << 16;
        out += kBase64[(v >> 18) & 63];
        out += kBase64[(v >> 12) & 63];
        out += "==";
    } else if (i + 2 == d.size()) {
        const uint32_t v = (uint32_t{d[i]} << 16) | (uint32_t{d[i + 1]} << 8);
        out += kBase64[(v >> 18) & 63];
        out += kBase64[(v >> 12) & 63];
        out += kBase64[(v >> 6) & 63];
        out += '=';
    }
    return out;
}

std::optional<PlistData> base64Decode(std::string_view s) {
    PlistData out;
    uint32_t acc = 0;
    int bits = 0;
    size_t padding = 0;
    for (char c : s) {
        if (c == '=') {
            ++padding;
            continue;
        }
        if (padding) return std::nullopt;  // data after padding
        int v;
        if (c >= 'A' && c <= 'Z') v = c - 'A';
        else if (c >= 'a' && c <= 'z') v = c - 'a' + 26;
        else if (c >= '0' && c <= '9') v = c - '0' + 52;
        else if (c == '+') v = 62;
        else if (c == '/') v = 63;
        else return std::nullopt;
        acc = (acc << 6) | static_cast<uint32_t>(v);
        bits += 6;
        if (bits >= 8) {
            bits -= 8;
            out.push_back(static_cast<uint8_t>(acc >> bits));
        }
    }
    // Six leftover bits cannot come from whole bytes.
    if (bits >= 6 || padding > 2) return std::nullopt;
    return out;
}

void appendUtf8(std::string* out, uint32_t cp) {
    if (cp < 0x80) {
        *out += static_cast<char>(cp);
    } else if (cp < 0x800) {
        *out += static_cast<char>(0xC0 | (cp >> 6));
        *out += static_cast<char>(0x80 | (cp & 0x3F));
    } else if (cp < 0x10000) {
        *out += static_cast<char>(0xE0 | (cp >> 12));
        *out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
        *out += static_cast<char>(0x80 | (cp & 0x3F));
    } else {
        *out += static_cast<char>(0xF0 | (cp >> 18));
        *out += static_cast<char>(0x80 | ((cp >> 12) & 0x3F));
        *out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
        *out += static_cast<char>(0x80 | (cp & 0x3F));
    }
}

class Parser {
public:
    explicit Parser(std::string_view text) : s_(text) {}

    std::optional<PlistValue> document(std::string* why) {
        auto v = value(0);
        if (v) {
            skipSpace();
            if (pos_ != s_.size()) {
                v.reset();
                error("unexpected text after the value");
            }
        }
        if (!v && why) *why = Format("%s at offset %zu", error_, pos_);
        return v;
    }

private:
    std::nullopt_t error(std::string message) {
        if (error_.empty()) error_ = std::move(message);
        return std::nullopt;
    }

    void skipSpace() {
        while (pos_ < s_.size() &&
               (s_[pos_] == ' ' || s_[pos_] == '\t' || s_[pos_] == '\n' || s_[pos_] == '\r'))
            ++pos_;
    }

    bool consume(std::string_view word) {
        if (s_.substr(pos_, word.size()) != word) return false;
        pos_ += word.size();
        return true;
    }

    std::optional<PlistValue> value(size_t depth) {
        if (depth > kMaxDepth) return error("nesting too deep");
        skipSpace();
        if (pos_ >= s_.size()) return error("unexpected end of input");
        const char c = s_[pos_];
        if (c == '{') return object(depth);
        if (c == '[') return array(depth);
        if (c == '"') {
            auto str = string();
            if (!str) return std::nullopt;
            return PlistValue(std::move(*str));
        }
        if (c == '-' || (c >= '0' && c <= '9')) return number();
        if (consume("true")) return PlistValue(true);
        if (consume("false")) return PlistValue(false);
        if (consume("null")) return error("null has no message value");
        return error(Format("unexpected character '%c'", c));
    }

    std::optional<PlistValue> number() {
        const size_t start = pos_;
        const bool negative = s_[pos_] == '-';
        if (negative) ++pos_;
        if (pos_ >= s_.size() || s_[pos_] < '0' || s_[pos_] > '9') return error("bad number");
        if (s_[pos_] == '0' && pos_ + 1 < s_.size() && s_[pos_ + 1] >= '0' && s_[pos_ + 1] <= '9')
            return error("leading zero in number");
        uint64_t magnitude = 0;
        while (pos_ < s_.size() && s_[pos_] >= '0' && s_[pos_] <= '9') {
            const uint64_t digit = static_cast<uint64_t>(s_[pos_] - '0');
            if (magnitude > (std::numeric_limits<uint64_t>::max() - digit) / 10) {
                pos_ = start;
                return error("integer out of range");
            }
            magnitude = magnitude * 10 + digit;
            ++pos_;
        }
        if (pos_ < s_.size() && (s_[pos_] == '.' || s_[pos_] == 'e' || s_[pos_] == 'E'))
            return error("only integers are supported");
        if (!negative) return PlistValue(magnitude);
        if (magnitude == 0) return PlistValue(uint64_t{0});  // -0 is zero
        if (magnitude > uint64_t{1} << 63) {
            pos_ = start;
            return error("integer out of range");
        }
        return PlistValue(static_cast<int64_t>(0 - magnitude));
    }

    std::optional<std::string> string() {
        ++pos_;  // opening quote
        std::string out;
        while (pos_ < s_.size()) {
            const unsigned char c = static_cast<unsigned char>(s_[pos_++]);
            if (c == '"') return out;
            if (c < 0x20) return error("control character in string");
            if (c != '\\') {
                out += static_cast<char>(c);
                continue;
            }
            if (pos_ >= s_.size()) break;
            const char e = s_[pos_++];
            switch (e) {
                case '"': out += '"'; break;
                case '\\': out += '\\'; break;
                case '/': out += '/'; break;
                case 'b': out += '\b'; break;
                case 'f': out += '\f'; break;
                case 'n': out += '\n'; break;
                case 'r': out += '\r'; break;
                case 't': out += '\t'; break;
                case 'u': {
                    auto cp = hex4();
                    if (!cp) return std::nullopt;
                    uint32_t code = *cp;
                    if (code >= 0xD800 && code <= 0xDBFF) {
                        if (!consume("\\u")) return error("unpaired surrogate");
                        auto low = hex4();
                        if (!low) return std::nullopt;
                        if (*low < 0xDC00 || *low > 0xDFFF) return error("unpaired surrogate");
                        code = 0x10000 + ((code - 0xD800) << 10) + (*low - 0xDC00);
                    } else if (code >= 0xDC00 && code <= 0xDFFF) {
                        return error("unpaired surrogate");
                    }
                    appendUtf8(&out, code);
                    break;
                }
                default:
                    return error("bad escape in string");
            }
        }
        return error("unterminated string");
    }

    std::optional<uint32_t> hex4() {
        if (s_.size() - pos_ < 4) return error("short \\u escape");
        uint32_t v = 0;
        for (int i = 0; i < 4; ++i) {
            const char h = s_[pos_++];
            v <<= 4;
            if (h >= '0' && h <= '9') v |= static_cast<uint32_t>(h - '0');
            else if (h >= 'a' && h <= 'f') v |= static_cast<uint32_t>(h - 'a' + 10);
            else if (h >= 'A' && h <= 'F') v |= static_cast<uint32_t>(h - 'A' + 10);
            else return error("bad \\u escape");
        }
        return v;
    }

    std::optional<PlistValue> array(size_t depth) {
        ++pos_;
        PlistArray a;
        skipSpace();
        if (pos_ < s_.size() && s_[pos_] == ']') {
            ++pos_;
            return PlistValue(std::move(a));
        }
        for (;;) {
            auto v = value(depth + 1);
            if (!v) return std::nullopt;
            a.push_back(std::move(*v));
            skipSpace();
            if (pos_ < s_.size() && s_[pos_] == ',') {
                ++pos_;
                continue;
            }
            if (pos_ < s_.size() && s_[pos_] == ']') {
                ++pos_;
                return PlistValue(std::move(a));
            }
            return error("expected ',' or ']'");
        }
    }

    std::optional<PlistValue> object(size_t depth) {
        ++pos_;
        PlistDict d;
        skipSpace();
        if (pos_ < s_.size() && s_[pos_] == '}') {
            ++pos_;
            return PlistValue(std::move(d));
        }
        for (;;) {
            skipSpace();
            if (pos_ >= s_.size() || s_[pos_] != '"') return error("expected a key string");
            auto key = string();
            if (!key) return std::nullopt;
            skipSpace();
            if (pos_ >= s_.size() || s_[pos_] != ':') return error("expected ':'");
            ++pos_;
            auto v = value(depth + 1);
            if (!v) return std::nullopt;
            if (!d.emplace(std::move(*key), std::move(*v)).second)
                return error("duplicate key in object");
            skipSpace();
            if (pos_ < s_.size() && s_[pos_] == ',') {
                ++pos_;
                continue;
            }
            if (pos_ < s_.size() && s_[pos_] == '}') {
                ++pos_;
                break;
            }
            return error("expected ',' or '}'");
        }
        if (d.size() == 1) return special(std::move(d));
        return PlistValue(std::move(d));
    }

    // The typed forms {"$uuid": ...}, {"$int64": ...}, {"$data": ...}.
    std::optional<PlistValue> special(PlistDict d) {
        const auto& [key, v] = *d.begin();
        if (key == "$uuid") {
            auto u = v.isString() ? tarn::Uuid::parse(*v.asString()) : std::nullopt;
            if (!u) return error("\"$uuid\" needs a UUID string");
            return PlistValue(*u);
        }
        if (key == "$int64") {
            // A UInt past INT64_MAX has no int64 form.
            auto i = v.type() == PlistValue::Type::Int ||
                             (v.type() == PlistValue::Type::UInt &&
                              *v.asUInt64() <= uint64_t{std::numeric_limits<int64_t>::max()})
                         ? v.asInt64()
                         : std::nullopt;
            if (!i) return error("\"$int64\" needs an integer within the signed 64-bit range");
            return PlistValue(*i);
        }
        if (key == "$data") {
            auto bytes = v.isString() ? base64Decode(*v.asString()) : std::nullopt;
            if (!bytes) return error("\"$data\" needs a base64 string");
            return PlistValue(std::move(*bytes));
        }
        return PlistValue(std::move(d));
    }

    std::string_view s_;
    size_t pos_ = 0;
    std::string error_;
};

void appendString(std::string* out, const std::string& s) {
    *out += '"';
    for (unsigned char c : s) {
        switch (c) {
            case '"': *out += "\\\""; break;
            case '\\': *out += "\\\\"; break;
            case '\n': *out += "\\n"; break;
            case '\r': *out += "\\r"; break;
            case '\t': *out += "\\t"; break;
            default:
                if (c < 0x20) {
                    char buf[8];
                    std::snprintf(buf, sizeof buf, "\\u%04x", c);
                    *out += buf;
                } else {
                    *out += static_cast<char>(c);
                }
        }
    }
    *out += '"';
}

void append(std::string* out, const PlistValue& v) {
    switch (v.type()) {
        case PlistValue::Type::Null: *out += "null"; return;
        case PlistValue::Type::Bool: *out += *v.asBool() ? "true" : "false"; return;
        case PlistValue::Type::UInt: *out += std::to_string(*v.asUInt64()); return;
        case PlistValue::Type::Int: {
            const int64_t i = *v.asInt64();
            if (i < 0)
                *out += std::to_string(i);
            else
                *out += "{\"$int64\": " + std::to_string(i) + "}";
            return;
        }
        case PlistValue::Type::Real: {
            char buf[40];
            std::snprintf(buf, sizeof buf, "%.17g", *v.asReal());
            *out += buf;
            return;
        }
        case PlistValue::Type::String: appendString(out, *v.asString()); return;
        case PlistValue::Type::Data:
            *out += "{\"$data\": \"" + base64Encode(*v.asData()) + "\"}";
            return;
        case PlistValue::Type::Date: {
            char buf[64];
            std::snprintf(buf, sizeof buf, "{\"$date\": %.17g}", v.asDate()->seconds);
            *out += buf;
            return;
        }
        case PlistValue::Type::Uuid:
            *out += "{\"$uuid\": \"" + v.asUuid()->string() + "\"}";
            return;
        case PlistValue::Type::Array: {
            *out += '[';
            bool first = true;
            for (const auto& e : *v.asArray()) {
                if (!first) *out += ", ";
                first = false;
                append(out, e);
            }
            *out += ']';
            return;
        }
        case PlistValue::Type::Dict: {
            *out += '{';
            bool first = true;
            for (const auto& [k, e] : *v.asDict()) {
                if (!first) *out += ", ";
                first = false;
                appendString(out, k);
                *out += ": ";
                append(out, e);
            }
            *out += '}';
            return;
        }
    }
}

}  // namespace

std::optional<PlistValue> JsonToPlist(std::string_view text, std::string* why) {
    return Parser(text).document(why);
}

std::string PlistToJson(const PlistValue& value) {
    std::string out;
    append(&out, value);
    return out;
}

}  // namespace tarnctl
