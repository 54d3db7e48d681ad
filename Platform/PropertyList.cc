#include "Platform/PropertyList.h"

#include <plist/plist.h>
#include <sys/random.h>
#include <uuid/uuid.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cmath>
#include <cstring>

namespace tarn {

// ---- Uuid ----

Uuid Uuid::generate() {
    // A version 4 UUID straight from the kernel's generator: one system call,
    // where the library makes six (it mixes in process ids for a fallback
    // generator we never need). Nothing is buffered, so a forked child never
    // repeats its parent's UUIDs.
    Uuid u;
    size_t got = 0;
    while (got < u.bytes.size()) {
        const ssize_t n = ::getrandom(u.bytes.data() + got, u.bytes.size() - got, 0);
        if (n > 0) {
            got += static_cast<size_t>(n);
        } else if (n < 0 && errno != EINTR) {
            uuid_generate_random(u.bytes.data());
            return u;
        }
    }
    u.bytes[6] = static_cast<uint8_t>((u.bytes[6] & 0x0F) | 0x40);  // version 4
    u.bytes[8] = static_cast<uint8_t>((u.bytes[8] & 0x3F) | 0x80);  // RFC 4122 variant
    return u;
}

namespace {

// A table, not comparisons: the digits of a random UUID mix letters and
// numbers at random, which mispredicts a branch on about every other one.
constexpr std::array<int8_t, 256> kHexDigits = [] {
    std::array<int8_t, 256> t{};
    for (auto& v : t) v = -1;
    for (int c = '0'; c <= '9'; ++c) t[c] = static_cast<int8_t>(c - '0');
    for (int c = 'a'; c <= 'f'; ++c) t[c] = static_cast<int8_t>(c - 'a' + 10);
    for (int c = 'A'; c <= 'F'; ++c) t[c] = static_cast<int8_t>(c - 'A' + 10);
    return t;
}();

int hexDigit(char c) { return kHexDigits[static_cast<unsigned char>(c)]; }

}  // namespace

// The 8-4-4-4-12 form in either case, nothing else: what uuid_parse accepts,
// without its per-byte strtoul (a class rebuild parses two per container).
std::optional<Uuid> Uuid::parse(std::string_view text) {
    if (text.size() != 36) return std::nullopt;
    Uuid u;
    size_t out = 0;
    for (size_t i = 0; i < 36;) {
        if (i == 8 || i == 13 || i == 18 || i == 23) {
            if (text[i] != '-') return std::nullopt;
            ++i;
            continue;
        }
        int high = hexDigit(text[i]), low = hexDigit(text[i + 1]);
        if (high < 0 || low < 0) return std::nullopt;
        u.bytes[out++] = static_cast<uint8_t>(high << 4 | low);
        i += 2;
    }
    return u;
}

std::string Uuid::string() const {
    char buf[37];
    uuid_unparse_upper(bytes.data(), buf);
    return buf;
}

bool Uuid::isNull() const {
    for (auto b : bytes)
        if (b) return false;
    return true;
}

// ---- accessors ----

bool PlistValue::isNumber() const {
    auto t = type();
    return t == Type::UInt || t == Type::Int || t == Type::Real;
}

std::optional<bool> PlistValue::asBool() const {
    if (auto* b = std::get_if<bool>(&v_)) return *b;
    return std::nullopt;
}

std::optional<uint64_t> PlistValue::asUInt64() const {
    if (auto* u = std::get_if<uint64_t>(&v_)) return *u;
    if (auto* i = std::get_if<int64_t>(&v_)) return static_cast<uint64_t>(*i);
    if (auto* d = std::get_if<double>(&v_)) {
        if (*d >= 0 && *d < 18446744073709551616.0) return static_cast<uint64_t>(*d);
        return std::nullopt;
    }
    if (auto* b = std::get_if<bool>(&v_)) return *b ? 1 : 0;
    return std::nullopt;
}

std::optional<int64_t> PlistValue::asInt64() const {
    if (auto* i = std::get_if<int64_t>(&v_)) return *i;
    if (auto* u = std::get_if<uint64_t>(&v_)) return static_cast<int64_t>(*u);
    if (auto* d = std::get_if<double>(&v_)) {
        if (*d >= -9223372036854775808.0 && *d < 9223372036854775808.0)
            return static_cast<int64_t>(*d);
        return std::nullopt;
    }
    if (auto* b = std::get_if<bool>(&v_)) return *b ? 1 : 0;
    return std::nullopt;
}

std::optional<double> PlistValue::asReal() const {
    if (auto* d = std::get_if<double>(&v_)) return *d;
    if (auto* u = std::get_if<uint64_t>(&v_)) return static_cast<double>(*u);
    if (auto* i = std::get_if<int64_t>(&v_)) return static_cast<double>(*i);
    return std::nullopt;
}

const std::string* PlistValue::asString() const { return std::get_if<std::string>(&v_); }
const PlistData* PlistValue::asData() const { return std::get_if<PlistData>(&v_); }
const PlistArray* PlistValue::asArray() const { return std::get_if<PlistArray>(&v_); }
const PlistDict* PlistValue::asDict() const { return std::get_if<PlistDict>(&v_); }
PlistArray* PlistValue::asArray() { return std::get_if<PlistArray>(&v_); }
PlistDict* PlistValue::asDict() { return std::get_if<PlistDict>(&v_); }

std::optional<Uuid> PlistValue::asUuid() const {
    if (auto* u = std::get_if<Uuid>(&v_)) return *u;
    if (auto* s = std::get_if<std::string>(&v_)) return Uuid::parse(*s);
    return std::nullopt;
}

std::optional<PlistDate> PlistValue::asDate() const {
    if (auto* d = std::get_if<PlistDate>(&v_)) return *d;
    return std::nullopt;
}

const PlistValue* PlistValue::find(std::string_view key) const {
    auto* d = asDict();
    if (!d) return nullptr;
    auto it = d->find(key);
    return it == d->end() ? nullptr : &it->second;
}

void PlistValue::set(std::string key, PlistValue value) {
    if (isNull()) v_ = PlistDict{};
    if (auto* d = asDict()) d->insert_or_assign(std::move(key), std::move(value));
}

void PlistValue::erase(std::string_view key) {
    if (auto* d = asDict()) {
        auto it = d->find(key);
        if (it != d->end()) d->erase(it);
    }
}

bool PlistValue::truthy() const {
    if (auto b = asBool()) return *b;
    if (auto* d = std::get_if<double>(&v_)) return *d != 0;
    if (isInteger()) return *asUInt64() != 0;
    return false;
}

bool PlistValue::operator==(const PlistValue& other) const {
    // Integers compare by their 64 bits across signedness: a property-list file
    // cannot tell 2^64-1 from -1, so a round trip must not make them unequal.
    if (isInteger() && other.isInteger()) return *asUInt64() == *other.asUInt64();
    return v_ == other.v_;
}

// ---- description ----

namespace {

bool needsQuotes(const std::string& s) {
    if (s.empty()) return true;
    for (unsigned char c : s)
        if (!(std::isalnum(c) || c == '.' || c == '_' || c == '-' || c == '/' || c == ':' ||
              c == '$'))
            return true;
    return false;
}

std::string quoted(const std::string& s) {
    if (!needsQuotes(s)) return s;
    std::string out = "\"";
    for (char c : s) {
        if (c == '"' || c == '\\') out += '\\';
        if (c == '\n') {
            out += "\\n";
            continue;
        }
        out += c;
    }
    return out + "\"";
}

void describe(const PlistValue& v, std::string& out, int indent, bool top) {
    std::string pad(static_cast<size_t>(indent) * 4, ' ');
    switch (v.type()) {
        case PlistValue::Type::Null: out += "(null)"; break;
        case PlistValue::Type::Bool: out += *v.asBool() ? "1" : "0"; break;
        case PlistValue::Type::UInt: out += std::to_string(*v.asUInt64()); break;
        case PlistValue::Type::Int: out += std::to_string(*v.asInt64()); break;
        case PlistValue::Type::Real: {
            char buf[64];
            std::snprintf(buf, sizeof buf, "%g", *v.asReal());
            out += buf;
            break;
        }
        case PlistValue::Type::String: out += top ? *v.asString() : quoted(*v.asString()); break;
        case PlistValue::Type::Uuid: out += v.asUuid()->string(); break;
        case PlistValue::Type::Date: {
            char buf[64];
            std::snprintf(buf, sizeof buf, "%.3f", v.asDate()->seconds);
            out += buf;
            break;
        }
        case PlistValue::Type::Data: {
            static const char* hex = "0123456789abcdef";
            out += '{';
            out += "length = " + std::to_string(v.asData()->size()) + ", bytes = 0x";
            size_t n = 0;
            for (uint8_t b : *v.asData()) {
                if (++n > 32) {
                    out += "...";
                    break;
                }
                out += hex[b >> 4];
                out += hex[b & 15];
            }
            out += '}';
            break;
        }
        case PlistValue::Type::Array: {
            out += "(\n";
            const auto& a = *v.asArray();
            for (size_t i = 0; i < a.size(); ++i) {
                out += pad + "    ";
                describe(a[i], out, indent + 1, false);
                out += i + 1 < a.size() ? ",\n" : "\n";
            }
            out += pad + ")";
            break;
        }
        case PlistValue::Type::Dict: {
            out += "{\n";
            for (const auto& [k, val] : *v.asDict()) {
                out += pad + "    " + quoted(k) + " = ";
                describe(val, out, indent + 1, false);
                out += ";\n";
            }
            out += pad + "}";
            break;
        }
    }
}

// ---- libplist conversion ----

constexpr int kMaxDepth = 256;

// Strings the daemon keeps must be valid UTF-8: they are written back to files
// and sent over IPC, and neither can carry broken text.
bool validUtf8(const std::string& s) { return PlistIsValidUtf8(s); }

plist_t toNode(const PlistValue& v, int depth) {
    if (depth > kMaxDepth) return nullptr;
    switch (v.type()) {
        case PlistValue::Type::Null: return nullptr;
        case PlistValue::Type::Bool: return plist_new_bool(*v.asBool());
        case PlistValue::Type::UInt: return plist_new_uint(*v.asUInt64());
        // Binary plists store negative integers as 8-byte two's complement.
        case PlistValue::Type::Int: return plist_new_uint(static_cast<uint64_t>(*v.asInt64()));
        case PlistValue::Type::Real: return plist_new_real(*v.asReal());
        // The file format's library cuts strings at a NUL: refuse rather than lose text.
        case PlistValue::Type::String:
            if (v.asString()->find('\0') != std::string::npos) return nullptr;
            return plist_new_string(v.asString()->c_str());
        case PlistValue::Type::Uuid: return plist_new_string(v.asUuid()->string().c_str());
        case PlistValue::Type::Data: {
            const auto& d = *v.asData();
            return plist_new_data(reinterpret_cast<const char*>(d.data()), d.size());
        }
        case PlistValue::Type::Date: {
            // The file format holds 32-bit seconds; clamp rather than overflow.
            double s = v.asDate()->seconds;
            if (!std::isfinite(s)) s = 0;
            s = std::clamp(s, static_cast<double>(INT32_MIN), static_cast<double>(INT32_MAX));
            double whole = std::floor(s);
            return plist_new_date(static_cast<int32_t>(whole),
                                  static_cast<int32_t>((s - whole) * 1e6));
        }
        case PlistValue::Type::Array: {
            plist_t a = plist_new_array();
            for (const auto& item : *v.asArray()) {
                plist_t n = toNode(item, depth + 1);
                if (!n) {
                    plist_free(a);
                    return nullptr;
                }
                plist_array_append_item(a, n);
            }
            return a;
        }
        case PlistValue::Type::Dict: {
            plist_t d = plist_new_dict();
            for (const auto& [k, item] : *v.asDict()) {
                plist_t n = k.find('\0') == std::string::npos ? toNode(item, depth + 1) : nullptr;
                if (!n) {
                    plist_free(d);
                    return nullptr;
                }
                plist_dict_set_item(d, k.c_str(), n);
            }
            return d;
        }
    }
    return nullptr;
}

std::optional<PlistValue> fromNode(plist_t node, int depth) {
    if (!node || depth > kMaxDepth) return std::nullopt;
    switch (plist_get_node_type(node)) {
        case PLIST_BOOLEAN: {
            uint8_t b = 0;
            plist_get_bool_val(node, &b);
            return PlistValue(b != 0);
        }
        case PLIST_UINT: {
            uint64_t u = 0;
            plist_get_uint_val(node, &u);
            // Values above INT64_MAX come from 8-byte negative integers in the file.
            if (u > static_cast<uint64_t>(INT64_MAX)) return PlistValue(static_cast<int64_t>(u));
            return PlistValue(u);
        }
        case PLIST_UID: {
            uint64_t u = 0;
            plist_get_uid_val(node, &u);
            return PlistValue(u);
        }
        case PLIST_REAL: {
            double d = 0;
            plist_get_real_val(node, &d);
            return PlistValue(d);
        }
        case PLIST_STRING:
        case PLIST_KEY: {
            char* s = nullptr;
            plist_get_string_val(node, &s);
            std::string out = s ? s : "";
            free(s);
            if (!validUtf8(out)) return std::nullopt;
            return PlistValue(std::move(out));
        }
        case PLIST_DATA: {
            char* d = nullptr;
            uint64_t len = 0;
            plist_get_data_val(node, &d, &len);
            PlistData out(reinterpret_cast<uint8_t*>(d), reinterpret_cast<uint8_t*>(d) + len);
            free(d);
            return PlistValue(std::move(out));
        }
        case PLIST_DATE: {
            int32_t sec = 0, usec = 0;
            plist_get_date_val(node, &sec, &usec);
            return PlistValue(PlistDate{sec + usec / 1e6});
        }
        case PLIST_ARRAY: {
            PlistArray out;
            uint32_t n = plist_array_get_size(node);
            out.reserve(n);
            for (uint32_t i = 0; i < n; ++i) {
                auto item = fromNode(plist_array_get_item(node, i), depth + 1);
                if (!item) return std::nullopt;
                out.push_back(std::move(*item));
            }
            return PlistValue(std::move(out));
        }
        case PLIST_DICT: {
            PlistDict out;
            plist_dict_iter it = nullptr;
            plist_dict_new_iter(node, &it);
            for (;;) {
                char* key = nullptr;
                plist_t val = nullptr;
                plist_dict_next_item(node, it, &key, &val);
                if (!val) {
                    free(key);
                    break;
                }
                auto item = fromNode(val, depth + 1);
                std::string k = key ? key : "";
                free(key);
                if (!item || !validUtf8(k)) {
                    free(it);
                    return std::nullopt;
                }
                out.insert_or_assign(std::move(k), std::move(*item));
            }
            free(it);
            return PlistValue(std::move(out));
        }
        default: return std::nullopt;
    }
}

// The property-list library asserts (and so aborts the process) when a string
// holds a NUL character. Such input is refused before it reaches the library.
bool binaryHasNulInStrings(const uint8_t* p, size_t n) {
    if (n < 8 + 32) return false;  // the library refuses it on its own
    const uint8_t* trailer = p + n - 32;
    auto be = [](const uint8_t* q, size_t width) {
        uint64_t v = 0;
        for (size_t i = 0; i < width; ++i) v = (v << 8) | q[i];
        return v;
    };
    size_t offsetSize = trailer[6];
    uint64_t count = be(trailer + 8, 8);
    uint64_t tableAt = be(trailer + 24, 8);
    if (offsetSize == 0 || offsetSize > 8 || tableAt >= n || count > (n - tableAt) / offsetSize)
        return false;  // malformed: the library refuses it
    for (uint64_t i = 0; i < count; ++i) {
        uint64_t at = be(p + tableAt + i * offsetSize, offsetSize);
        if (at >= n) continue;
        uint8_t marker = p[at];
        uint8_t kind = marker >> 4;
        if (kind != 0x5 && kind != 0x6 && kind != 0x7) continue;
        uint64_t length = marker & 0xF;
        uint64_t start = at + 1;
        if (length == 0xF) {
            if (start >= n || (p[start] >> 4) != 0x1) continue;
            size_t width = size_t{1} << (p[start] & 0xF);
            if (width > 8 || start + 1 + width > n) continue;
            length = be(p + start + 1, width);
            start += 1 + width;
        }
        size_t unit = kind == 0x6 ? 2 : 1;
        if (start > n || length > (n - start) / unit) continue;
        for (uint64_t k = 0; k < length; ++k) {
            const uint8_t* c = p + start + k * unit;
            if (unit == 1 ? c[0] == 0 : (c[0] == 0 && c[1] == 0)) return true;
        }
    }
    return false;
}

// XML can spell a NUL as a character reference.
bool xmlHasNulReference(const char* p, size_t n) {
    for (size_t i = 0; i + 2 < n; ++i) {
        if (p[i] == '\0') return true;
        if (p[i] != '&' || p[i + 1] != '#') continue;
        size_t j = i + 2;
        bool hex = j < n && (p[j] == 'x' || p[j] == 'X');
        if (hex) ++j;
        size_t digits = 0;
        bool nonZero = false;
        for (; j < n && std::isxdigit(static_cast<unsigned char>(p[j])); ++j, ++digits)
            if (p[j] != '0') nonZero = true;
        if (digits > 0 && !nonZero && j < n && p[j] == ';') return true;
    }
    return false;
}

}  // namespace

// ---- binary reader ----

namespace {

constexpr size_t kHeaderBytes = 8;   // "bplist00"
constexpr size_t kTrailerBytes = 32;
// Values a file may expand into through shared references beyond one per byte
// of the file: enough for any honest writer, too few to exhaust memory.
constexpr uint64_t kExtraValueBudget = uint64_t{1} << 16;

uint64_t bigEndian(const uint8_t* p, size_t width) {
    uint64_t v = 0;
    for (size_t i = 0; i < width; ++i) v = (v << 8) | p[i];
    return v;
}

class Reader {
  public:
    Reader(const uint8_t* bytes, size_t length) : p_(bytes), n_(length) {}

    std::optional<PlistValue> run() {
        uint64_t root;
        if (!readTrailer(&root)) return std::nullopt;
        PlistValue out;
        if (!parse(root, 0, out)) return std::nullopt;
        return out;
    }

    const char* why() const { return why_; }

    // The root dictionary's entries (see PlistBinaryRootEntries): the root
    // half of parse() for a dictionary, keys kept as views. Every value goes
    // through parse() with the root open at depth 0, so nesting, cycles and
    // the expansion budget are checked as for the whole tree.
    bool runRootEntries(PlistEntries* entries, std::string_view inlineKey,
                        PlistEntries* inlined) {
        uint64_t root;
        if (!readTrailer(&root)) return false;
        --budget_;  // the root itself, as parse() counts it
        path_[0] = root;
        uint64_t at;
        if (!objectAt(root, &at)) return false;
        if ((p_[at] >> 4) != 0xD) return false;
        return dictEntries(at, entries, [&](std::string_view key, uint64_t ref, PlistValue& value) {
            if (inlined && key == inlineKey) return inlineEntries(ref, &value, inlined);
            return parse(ref, 1, value);
        });
    }

    // A root value that, when it is a dictionary, is decoded like the root:
    // its entries go to `inlined` and `value` is left an empty dictionary.
    // The depth, budget and cycle checks are parse()'s for a value at depth 1.
    bool inlineEntries(uint64_t index, PlistValue* value, PlistEntries* inlined) {
        uint64_t at;
        if (!objectAt(index, &at)) return false;
        const uint8_t marker = p_[at];
        if ((marker >> 4) != 0xD) return parse(index, 1, *value);
        if (budget_ == 0) return fail("property list expands into too many values");
        --budget_;
        if (path_[0] == index) return fail("object reference cycle");
        path_[1] = index;
        if (!dictEntries(at, inlined, [&](std::string_view, uint64_t ref, PlistValue& nested) {
                return parse(ref, 2, nested);
            }))
            return false;
        *value = PlistValue(PlistDict());
        return true;
    }

    // The entries of the dictionary object at `at`, appended to `out` with
    // keys as views; a repeated key declines. `decode(key, ref, value)`
    // decodes each value into its entry.
    template <class Decode>
    bool dictEntries(uint64_t at, PlistEntries* out, Decode&& decode) {
        const uint8_t marker = p_[at];
        uint64_t cursor = at + 1;
        uint64_t n;
        if (!count(marker, &cursor, &n)) return false;
        if (n > (tableAt_ - cursor) / refSize_ / 2) return fail("dictionary out of bounds");
        const uint8_t* keys = p_ + cursor;
        const uint8_t* values = keys + n * refSize_;
        for (uint64_t i = 0; i < n; ++i) {
            std::string_view key;
            if (!dictKeyView(bigEndian(keys + i * refSize_, refSize_), &key)) return false;
            for (const auto& entry : *out)
                if (entry.first == key) return false;
            PlistValue& value = out->emplace_back(key, PlistValue()).second;
            if (!decode(key, bigEndian(values + i * refSize_, refSize_), value)) return false;
        }
        return true;
    }

  private:
    // The header and trailer: sizes, counts and the offset table's place,
    // checked; the root object's index in `root`. Sets the value budget.
    bool readTrailer(uint64_t* root) {
        if (n_ < kHeaderBytes + kTrailerBytes || std::memcmp(p_, "bplist00", 8) != 0)
            return fail("not a binary property list");
        const uint8_t* trailer = p_ + n_ - kTrailerBytes;
        offsetSize_ = trailer[6];
        refSize_ = trailer[7];
        count_ = bigEndian(trailer + 8, 8);
        *root = bigEndian(trailer + 16, 8);
        tableAt_ = bigEndian(trailer + 24, 8);
        const uint64_t trailerAt = n_ - kTrailerBytes;
        if (offsetSize_ == 0 || offsetSize_ > 8 || refSize_ == 0 || refSize_ > 8)
            return fail("bad offset or reference size");
        if (count_ == 0 || *root >= count_) return fail("bad object count or root");
        if (tableAt_ < kHeaderBytes || tableAt_ >= trailerAt ||
            count_ > (trailerAt - tableAt_) / offsetSize_)
            return fail("offset table out of bounds");
        budget_ = n_ + kExtraValueBudget;
        return true;
    }

    bool fail(const char* why) {
        if (!why_) why_ = why;
        return false;
    }

    // Start of object `index`; objects live between the header and the table.
    bool objectAt(uint64_t index, uint64_t* at) {
        if (index >= count_) return fail("object reference out of range");
        *at = bigEndian(p_ + tableAt_ + index * offsetSize_, offsetSize_);
        if (*at < kHeaderBytes || *at >= tableAt_) return fail("object offset out of bounds");
        return true;
    }

    // The count that follows a marker: in its low nibble, or in an integer
    // object after it when the nibble is 0xF.
    bool count(uint8_t marker, uint64_t* cursor, uint64_t* out) {
        *out = marker & 0xF;
        if (*out != 0xF) return true;
        if (*cursor >= tableAt_ || (p_[*cursor] >> 4) != 0x1) return fail("bad length marker");
        const size_t width = size_t{1} << (p_[*cursor] & 0xF);
        if (width > 8 || width > tableAt_ - *cursor - 1) return fail("bad length marker");
        *out = bigEndian(p_ + *cursor + 1, width);
        *cursor += 1 + width;
        return true;
    }

    bool fits(uint64_t cursor, uint64_t bytes) const { return bytes <= tableAt_ - cursor; }

    bool parse(uint64_t index, int depth, PlistValue& out) {
        if (depth > kMaxDepth) return fail("property list nested too deeply");
        if (budget_ == 0) return fail("property list expands into too many values");
        --budget_;
        // A reference back to an object still open above is a cycle.
        for (int i = 0; i < depth; ++i)
            if (path_[i] == index) return fail("object reference cycle");
        path_[depth] = index;

        uint64_t at;
        if (!objectAt(index, &at)) return false;
        const uint8_t marker = p_[at];
        const uint8_t info = marker & 0xF;
        uint64_t cursor = at + 1;
        switch (marker >> 4) {
            case 0x0:
                if (info == 0x8 || info == 0x9) {
                    out = PlistValue(info == 0x9);
                    return true;
                }
                return fail("unsupported null or fill object");
            case 0x1: {
                const size_t width = size_t{1} << info;
                if (width != 1 && width != 2 && width != 4 && width != 8 && width != 16)
                    return fail("bad integer size");
                if (!fits(cursor, width)) return fail("integer out of bounds");
                // 16-byte integers carry their value in the low 8 bytes.
                const uint64_t u = width == 16 ? bigEndian(p_ + cursor + 8, 8)
                                               : bigEndian(p_ + cursor, width);
                // Above INT64_MAX only from 8-byte negative integers.
                if (u > static_cast<uint64_t>(INT64_MAX))
                    out = PlistValue(static_cast<int64_t>(u));
                else
                    out = PlistValue(u);
                return true;
            }
            case 0x2: {
                double d;
                if (!real(info, cursor, &d)) return false;
                out = PlistValue(d);
                return true;
            }
            case 0x3: {
                double d;
                if (info != 0x3 || !real(info, cursor, &d)) return fail("bad date");
                out = PlistValue(PlistDate{clampedDate(d)});
                return true;
            }
            case 0x4: {
                uint64_t length;
                if (!count(marker, &cursor, &length)) return false;
                if (!fits(cursor, length)) return fail("data out of bounds");
                out = PlistValue(PlistData(p_ + cursor, p_ + cursor + length));
                return true;
            }
            case 0x5:
            case 0x6: {
                std::string s;
                if (!string(marker, cursor, &s)) return false;
                out = PlistValue(std::move(s));
                return true;
            }
            case 0x8: {
                const size_t width = size_t{info} + 1;
                if (!fits(cursor, width)) return fail("uid out of bounds");
                const uint64_t u = width > 8 ? bigEndian(p_ + cursor + width - 8, 8)
                                             : bigEndian(p_ + cursor, width);
                if (u > UINT32_MAX) return fail("uid too large");
                out = PlistValue(u);
                return true;
            }
            case 0xA:
            case 0xC: {
                uint64_t n;
                if (!count(marker, &cursor, &n)) return false;
                if (n > (tableAt_ - cursor) / refSize_) return fail("array out of bounds");
                PlistArray items(n);
                for (uint64_t i = 0; i < n; ++i) {
                    const uint64_t ref = bigEndian(p_ + cursor + i * refSize_, refSize_);
                    if (!parse(ref, depth + 1, items[i])) return false;
                }
                out = PlistValue(std::move(items));
                return true;
            }
            case 0xD: {
                uint64_t n;
                if (!count(marker, &cursor, &n)) return false;
                if (n > (tableAt_ - cursor) / refSize_ / 2) return fail("dictionary out of bounds");
                PlistDict items;
                const uint8_t* keys = p_ + cursor;
                const uint8_t* values = keys + n * refSize_;
                for (uint64_t i = 0; i < n; ++i) {
                    std::string key;
                    if (!dictKey(bigEndian(keys + i * refSize_, refSize_), &key)) return false;
                    PlistValue value;
                    if (!parse(bigEndian(values + i * refSize_, refSize_), depth + 1, value))
                        return false;
                    // Writers emit keys sorted, so the hint is nearly always right;
                    // a repeated key keeps its last value.
                    items.insert_or_assign(items.end(), std::move(key), std::move(value));
                }
                out = PlistValue(std::move(items));
                return true;
            }
            default: return fail("unknown object type");
        }
    }

    bool real(uint8_t info, uint64_t cursor, double* out) {
        if (info == 0x2) {
            if (!fits(cursor, 4)) return fail("real out of bounds");
            const uint32_t bits = static_cast<uint32_t>(bigEndian(p_ + cursor, 4));
            float f;
            std::memcpy(&f, &bits, 4);
            *out = f;
            return true;
        }
        if (info == 0x3) {
            if (!fits(cursor, 8)) return fail("real out of bounds");
            const uint64_t bits = bigEndian(p_ + cursor, 8);
            std::memcpy(out, &bits, 8);
            return true;
        }
        return fail("bad real size");
    }

    // Whole seconds within 32 bits plus whole microseconds, as dates have
    // always been kept here; out-of-range seconds are clamped, non-finite
    // values read as the epoch.
    static double clampedDate(double d) {
        if (!std::isfinite(d)) return 0;
        if (d >= 2147483648.0) return INT32_MAX;
        if (d <= -2147483649.0) return INT32_MIN;
        const int32_t seconds = static_cast<int32_t>(d);
        const int32_t micros = static_cast<int32_t>(std::fabs((d - seconds) * 1000000));
        return d < 0 ? seconds - micros / 1e6 : seconds + micros / 1e6;
    }

    // A dictionary key: a string object, referenced from the dictionary. Keys
    // are leaves, so they need neither the depth nor the cycle check.
    bool dictKey(uint64_t index, std::string* out) {
        uint64_t at;
        if (!objectAt(index, &at)) return false;
        const uint8_t kind = p_[at] >> 4;
        if (kind != 0x5 && kind != 0x6) return fail("dictionary key is not a string");
        if (budget_ == 0) return fail("property list expands into too many values");
        --budget_;
        return string(p_[at], at + 1, out);
    }

    // dictKey() for a one-byte text key, as a view; false for anything else.
    bool dictKeyView(uint64_t index, std::string_view* out) {
        uint64_t at;
        if (!objectAt(index, &at)) return false;
        if ((p_[at] >> 4) != 0x5) return false;
        if (budget_ == 0) return fail("property list expands into too many values");
        --budget_;
        uint64_t cursor = at + 1;
        uint64_t length;
        if (!count(p_[at], &cursor, &length)) return false;
        if (!fits(cursor, length)) return fail("string out of bounds");
        const uint8_t* s = p_ + cursor;
        for (uint64_t i = 0; i < length; ++i)
            if (s[i] == 0 || s[i] >= 0x80) return false;
        *out = std::string_view(reinterpret_cast<const char*>(s), length);
        return true;
    }

    bool string(uint8_t marker, uint64_t cursor, std::string* out) {
        uint64_t length;
        if (!count(marker, &cursor, &length)) return false;
        const uint8_t* s = p_ + cursor;
        if ((marker >> 4) == 0x5) {
            if (!fits(cursor, length)) return fail("string out of bounds");
            bool ascii = true;
            for (uint64_t i = 0; i < length; ++i) {
                if (s[i] == 0) return fail("property list holds a string with a NUL character");
                ascii &= s[i] < 0x80;
            }
            out->assign(reinterpret_cast<const char*>(s), length);
            if (!ascii && !PlistIsValidUtf8(*out)) return fail("string is not valid UTF-8");
            return true;
        }
        if (length > (tableAt_ - cursor) / 2) return fail("string out of bounds");
        // Writers put an empty string in the one-byte form; the UTF-16 form
        // with no units has always been refused here.
        if (length == 0) return fail("empty UTF-16 string");
        out->clear();
        out->reserve(length);
        for (uint64_t i = 0; i < length; ++i) {
            uint32_t c = (uint32_t{s[2 * i]} << 8) | s[2 * i + 1];
            if (c == 0) return fail("property list holds a string with a NUL character");
            if (c >= 0xDC00 && c <= 0xDFFF) return fail("string is not valid UTF-16");
            if (c >= 0xD800 && c <= 0xDBFF) {
                if (i + 1 == length) return fail("string is not valid UTF-16");
                const uint32_t low = (uint32_t{s[2 * i + 2]} << 8) | s[2 * i + 3];
                if (low < 0xDC00 || low > 0xDFFF) return fail("string is not valid UTF-16");
                c = 0x10000 + ((c - 0xD800) << 10) + (low - 0xDC00);
                ++i;
            }
            if (c < 0x80) {
                out->push_back(static_cast<char>(c));
            } else if (c < 0x800) {
                out->push_back(static_cast<char>(0xC0 | (c >> 6)));
                out->push_back(static_cast<char>(0x80 | (c & 0x3F)));
            } else if (c < 0x10000) {
                out->push_back(static_cast<char>(0xE0 | (c >> 12)));
                out->push_back(static_cast<char>(0x80 | ((c >> 6) & 0x3F)));
                out->push_back(static_cast<char>(0x80 | (c & 0x3F)));
            } else {
                out->push_back(static_cast<char>(0xF0 | (c >> 18)));
                out->push_back(static_cast<char>(0x80 | ((c >> 12) & 0x3F)));
                out->push_back(static_cast<char>(0x80 | ((c >> 6) & 0x3F)));
                out->push_back(static_cast<char>(0x80 | (c & 0x3F)));
            }
        }
        return true;
    }

    const uint8_t* const p_;
    const size_t n_;
    uint64_t tableAt_ = 0;
    uint64_t count_ = 0;
    size_t offsetSize_ = 0;
    size_t refSize_ = 0;
    uint64_t budget_ = 0;
    // Object index open at each depth; entries up to the current depth are
    // written before they are read, so the array is left uninitialised (a
    // small file would otherwise pay for zeroing all of it).
    uint64_t path_[kMaxDepth + 1];
    const char* why_ = nullptr;
};

}  // namespace

namespace {

// Parses a whole binary property list straight into PlistValue, without the
// library's node tree. Every offset, length and reference is checked before
// use; a reference to an object still open on the current path (a cycle) is
// refused, and so is a file whose shared references would expand into far
// more values than it has bytes.
std::optional<PlistValue> parseBinary(const uint8_t* bytes, size_t length, std::string* why) {
    Reader reader(bytes, length);
    auto out = reader.run();
    if (!out && why) *why = reader.why() ? reader.why() : "malformed property list";
    return out;
}

}  // namespace

bool PlistBinaryRootEntries(const void* bytes, size_t length, PlistEntries* entries) {
    return PlistBinaryRootEntries(bytes, length, entries, {}, nullptr);
}

bool PlistBinaryRootEntries(const void* bytes, size_t length, PlistEntries* entries,
                            std::string_view inlineKey, PlistEntries* inlined) {
    entries->clear();
    if (inlined) inlined->clear();
    if (length == 0 || length > kMaxPlistBytes) return false;
    Reader reader(static_cast<const uint8_t*>(bytes), length);
    if (reader.runRootEntries(entries, inlineKey, inlined)) return true;
    entries->clear();
    if (inlined) inlined->clear();
    return false;
}

bool PlistIsValidUtf8(std::string_view s) {
    size_t i = 0, n = s.size();
    while (i < n) {
        unsigned char c = static_cast<unsigned char>(s[i]);
        size_t extra;
        if (c < 0x80) extra = 0;
        else if ((c >> 5) == 0x6) extra = 1;
        else if ((c >> 4) == 0xE) extra = 2;
        else if ((c >> 3) == 0x1E) extra = 3;
        else return false;
        if (extra > n - i - 1) return false;
        uint32_t cp = extra == 0 ? c : c & (0x3F >> extra);
        for (size_t k = 1; k <= extra; ++k) {
            unsigned char d = static_cast<unsigned char>(s[i + k]);
            if ((d >> 6) != 0x2) return false;
            cp = (cp << 6) | (d & 0x3F);
        }
        // Overlong forms, surrogates and values past the last code point.
        if ((extra == 1 && cp < 0x80) || (extra == 2 && cp < 0x800) ||
            (extra == 3 && cp < 0x10000) || (cp >= 0xD800 && cp <= 0xDFFF) || cp > 0x10FFFF)
            return false;
        i += extra + 1;
    }
    return true;
}


std::string PlistValue::description() const {
    std::string out;
    describe(*this, out, 0, true);
    return out;
}

std::vector<uint8_t> PlistValue::toBinary() const {
    plist_t node = toNode(*this, 0);
    if (!node) return {};
    char* buf = nullptr;
    uint32_t len = 0;
    plist_to_bin(node, &buf, &len);
    plist_free(node);
    std::vector<uint8_t> out(reinterpret_cast<uint8_t*>(buf), reinterpret_cast<uint8_t*>(buf) + len);
    plist_to_bin_free(buf);
    return out;
}

std::string PlistValue::toXml() const {
    plist_t node = toNode(*this, 0);
    if (!node) return {};
    char* buf = nullptr;
    uint32_t len = 0;
    plist_to_xml(node, &buf, &len);
    plist_free(node);
    std::string out(buf ? buf : "", len);
    plist_to_xml_free(buf);
    return out;
}

std::optional<PlistValue> PlistValue::fromBytes(const void* bytes, size_t length,
                                                std::string* why) {
    if (length == 0 || length > kMaxPlistBytes) {
        if (why) *why = length == 0 ? "empty property list" : "property list too large";
        return std::nullopt;
    }
    // Binary lists, the daemon's own format, skip the library's node tree.
    if (length >= 8 && std::memcmp(bytes, "bplist00", 8) == 0)
        return parseBinary(static_cast<const uint8_t*>(bytes), length, why);
    return TEST_fromBytesViaLibrary(bytes, length, why);
}

std::optional<PlistValue> PlistValue::TEST_fromBytesViaLibrary(const void* bytes, size_t length,
                                                               std::string* why) {
    if (length == 0 || length > kMaxPlistBytes) {
        if (why) *why = length == 0 ? "empty property list" : "property list too large";
        return std::nullopt;
    }
    const char* text = static_cast<const char*>(bytes);
    bool binary = length >= 8 && std::memcmp(text, "bplist00", 8) == 0;
    if (binary ? binaryHasNulInStrings(static_cast<const uint8_t*>(bytes), length)
               : xmlHasNulReference(text, length)) {
        if (why) *why = "property list holds a string with a NUL character";
        return std::nullopt;
    }
    plist_t node = nullptr;
    plist_from_memory(text, static_cast<uint32_t>(length), &node);
    if (!node) {
        if (why) *why = "malformed property list";
        return std::nullopt;
    }
    auto out = fromNode(node, 0);
    plist_free(node);
    if (!out && why) *why = "unsupported or too deeply nested property list";
    return out;
}

}  // namespace tarn
