#include "Platform/PropertyList.h"

#include <plist/plist.h>
#include <uuid/uuid.h>

#include <cmath>
#include <cstring>

namespace tarn {

// ---- Uuid ----

Uuid Uuid::generate() {
    Uuid u;
    uuid_generate_random(u.bytes.data());
    return u;
}

std::optional<Uuid> Uuid::parse(std::string_view text) {
    if (text.size() != 36) return std::nullopt;
    char buf[37];
    std::memcpy(buf, text.data(), 36);
    buf[36] = '\0';
    Uuid u;
    if (uuid_parse(buf, u.bytes.data()) != 0) return std::nullopt;
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

plist_t toNode(const PlistValue& v, int depth) {
    if (depth > kMaxDepth) return nullptr;
    switch (v.type()) {
        case PlistValue::Type::Null: return nullptr;
        case PlistValue::Type::Bool: return plist_new_bool(*v.asBool());
        case PlistValue::Type::UInt: return plist_new_uint(*v.asUInt64());
        // Binary plists store negative integers as 8-byte two's complement.
        case PlistValue::Type::Int: return plist_new_uint(static_cast<uint64_t>(*v.asInt64()));
        case PlistValue::Type::Real: return plist_new_real(*v.asReal());
        case PlistValue::Type::String: return plist_new_string(v.asString()->c_str());
        case PlistValue::Type::Uuid: return plist_new_string(v.asUuid()->string().c_str());
        case PlistValue::Type::Data: {
            const auto& d = *v.asData();
            return plist_new_data(reinterpret_cast<const char*>(d.data()), d.size());
        }
        case PlistValue::Type::Date: {
            double s = v.asDate()->seconds;
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
                plist_t n = toNode(item, depth + 1);
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
                if (!item) {
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

}  // namespace

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
    plist_t node = nullptr;
    plist_from_memory(static_cast<const char*>(bytes), static_cast<uint32_t>(length), &node);
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
