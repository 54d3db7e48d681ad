// The one property-list value type of the daemon: metadata files, IPC message
// values and entitlements are all PlistValue trees.
//
// A PlistValue is a plain value (copyable, immutable by convention once shared).
// Integers keep their signedness because IPC distinguishes uint64 from int64;
// a property-list file only knows "integer", so reading a file yields UInt for
// values that fit and Int for negative ones.
//
// Reading accepts any property-list format (binary, XML); writing produces a
// binary property list. Parsing never throws and never aborts on bad input.
#pragma once

#include <array>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

namespace tarn {

// 16 raw bytes; canonical text form is upper-case 8-4-4-4-12.
struct Uuid {
    std::array<uint8_t, 16> bytes{};

    static Uuid generate();
    static std::optional<Uuid> parse(std::string_view text);
    std::string string() const;  // upper case, canonical
    bool isNull() const;
    auto operator<=>(const Uuid&) const = default;
};

// Seconds since 2001-01-01T00:00:00Z, the epoch of property-list dates.
struct PlistDate {
    double seconds = 0;
    auto operator<=>(const PlistDate&) const = default;
};

class PlistValue;
using PlistArray = std::vector<PlistValue>;
using PlistDict = std::map<std::string, PlistValue, std::less<>>;
using PlistData = std::vector<uint8_t>;

class PlistValue {
public:
    enum class Type { Null, Bool, UInt, Int, Real, String, Data, Date, Uuid, Array, Dict };

    PlistValue() = default;
    PlistValue(std::nullptr_t) {}
    PlistValue(bool b) : v_(b) {}
    PlistValue(uint64_t u) : v_(u) {}
    PlistValue(uint32_t u) : v_(uint64_t{u}) {}
    PlistValue(int64_t i) : v_(i) {}
    PlistValue(int32_t i) : v_(int64_t{i}) {}
    PlistValue(double d) : v_(d) {}
    PlistValue(std::string s) : v_(std::move(s)) {}
    PlistValue(std::string_view s) : v_(std::string(s)) {}
    PlistValue(const char* s) : v_(std::string(s)) {}
    PlistValue(PlistData d) : v_(std::move(d)) {}
    PlistValue(PlistDate d) : v_(d) {}
    PlistValue(Uuid u) : v_(u) {}
    PlistValue(PlistArray a) : v_(std::move(a)) {}
    PlistValue(PlistDict d) : v_(std::move(d)) {}

    Type type() const { return static_cast<Type>(v_.index()); }
    bool isNull() const { return type() == Type::Null; }
    bool isBool() const { return type() == Type::Bool; }
    bool isString() const { return type() == Type::String; }
    bool isArray() const { return type() == Type::Array; }
    bool isDict() const { return type() == Type::Dict; }
    bool isData() const { return type() == Type::Data; }
    bool isUuid() const { return type() == Type::Uuid; }
    // UInt, Int or Real: what a property list calls a number.
    bool isNumber() const;
    bool isInteger() const { return type() == Type::UInt || type() == Type::Int; }

    // Typed accessors: empty when the value has another type. Integers convert
    // between signed and unsigned when the value fits.
    std::optional<bool> asBool() const;
    std::optional<uint64_t> asUInt64() const;
    std::optional<int64_t> asInt64() const;
    std::optional<double> asReal() const;
    const std::string* asString() const;
    const PlistData* asData() const;
    std::optional<Uuid> asUuid() const;  // a Uuid value, or a string in UUID form
    std::optional<PlistDate> asDate() const;
    const PlistArray* asArray() const;
    const PlistDict* asDict() const;
    PlistArray* asArray();
    PlistDict* asDict();

    // Dictionary access; nullptr when this is not a dictionary or the key is absent.
    const PlistValue* find(std::string_view key) const;
    // Sets a key, turning a Null value into an empty dictionary first.
    void set(std::string key, PlistValue value);
    void erase(std::string_view key);

    // Number semantics of a property list's boolean test: a bool, or a non-zero
    // number. Used where the platform reads a flag with a "bool value".
    bool truthy() const;

    bool operator==(const PlistValue& other) const;

    // Human-readable text in the style of the platform's object descriptions:
    // strings bare at the top level, dictionaries as { key = value; }.
    std::string description() const;

    // Binary property list. Returns empty when the tree cannot be written: a
    // Null anywhere, a string or key holding a NUL, nesting deeper than 256.
    // Uuid values are written as their canonical string.
    std::vector<uint8_t> toBinary() const;
    std::string toXml() const;
    // Any property-list format. Returns empty on malformed input, with a short
    // reason in *why when given.
    static std::optional<PlistValue> fromBytes(const void* bytes, size_t length,
                                               std::string* why = nullptr);
    // Any format through the property-list library's own parser, which
    // fromBytes uses for XML only: the reference the binary reader is checked
    // against.
    static std::optional<PlistValue> TEST_fromBytesViaLibrary(const void* bytes, size_t length,
                                                              std::string* why = nullptr);

private:
    std::variant<std::monostate, bool, uint64_t, int64_t, double, std::string, PlistData,
                 PlistDate, Uuid, PlistArray, PlistDict>
        v_;
};

// The entries of a binary property list's root dictionary, decoded without
// the dictionary itself: for readers of many small files who look at a few
// keys each. Keys are views into the bytes, which must outlive them; values
// are parsed exactly as fromBytes parses them, with the same checks, so an
// answer here is the dictionary fromBytes would give, in file order. False
// whenever fromBytes would refuse the bytes, and also for what only it
// handles: another format, a root that is not a dictionary, a key that is not
// one-byte text, a key given twice. The caller then asks fromBytes.
// `entries` is cleared first; its capacity is kept, so that it can be reused.
using PlistEntries = std::vector<std::pair<std::string_view, PlistValue>>;
bool PlistBinaryRootEntries(const void* bytes, size_t length, PlistEntries* entries);
// The same, and should the root map `inlineKey` to a dictionary, that
// dictionary's entries are decoded into `inlined` the same way (views, file
// order, false for a repeated key) and its root entry is an empty dictionary.
// `inlined` is cleared first too.
bool PlistBinaryRootEntries(const void* bytes, size_t length, PlistEntries* entries,
                            std::string_view inlineKey, PlistEntries* inlined);

// True when `s` is well-formed UTF-8: no overlong forms, no surrogates, nothing
// past U+10FFFF.
bool PlistIsValidUtf8(std::string_view s);

// Largest property-list file the daemon will parse; anything bigger is refused
// before allocation.
inline constexpr size_t kMaxPlistBytes = 16 * 1024 * 1024;

}  // namespace tarn
