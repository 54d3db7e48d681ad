// The direct binary property-list reader against the property-list library's
// parser: the same values on every well-formed file, and a refusal for every
// kind of damage either of them can see.
#include <gtest/gtest.h>

#include <cmath>
#include <cstring>
#include <random>

#include "Platform/PropertyList.h"

namespace tarn {
namespace {

// Same type and same bits (NaN included), recursively. With `anyDate`, dates
// the two readers read differently on purpose (negative, clamped, not finite)
// pass.
::testing::AssertionResult identical(const PlistValue& a, const PlistValue& b, bool anyDate = false,
                                     const std::string& at = "root") {
    if (a.type() != b.type())
        return ::testing::AssertionFailure()
               << at << ": types differ: " << a.description() << " vs " << b.description();
    bool same = true;
    switch (a.type()) {
        case PlistValue::Type::Real: {
            double x = *a.asReal(), y = *b.asReal();
            same = std::memcmp(&x, &y, sizeof x) == 0;
            break;
        }
        case PlistValue::Type::Array: {
            const auto &x = *a.asArray(), &y = *b.asArray();
            if (x.size() != y.size())
                return ::testing::AssertionFailure() << at << ": sizes differ";
            for (size_t i = 0; i < x.size(); ++i) {
                auto r = identical(x[i], y[i], anyDate, at + "[" + std::to_string(i) + "]");
                if (!r) return r;
            }
            return ::testing::AssertionSuccess();
        }
        case PlistValue::Type::Dict: {
            const auto &x = *a.asDict(), &y = *b.asDict();
            if (x.size() != y.size())
                return ::testing::AssertionFailure() << at << ": sizes differ";
            for (auto i = x.begin(), j = y.begin(); i != x.end(); ++i, ++j) {
                if (i->first != j->first)
                    return ::testing::AssertionFailure()
                           << at << ": keys differ: " << i->first << " vs " << j->first;
                auto r = identical(i->second, j->second, anyDate, at + "." + i->first);
                if (!r) return r;
            }
            return ::testing::AssertionSuccess();
        }
        case PlistValue::Type::Date: {
            const double x = a.asDate()->seconds, y = b.asDate()->seconds;
            same = x == y || (anyDate && (x < 0 || x >= INT32_MAX || y < 0 || y >= INT32_MAX));
            break;
        }
        default:
            same = a == b;
    }
    if (same) return ::testing::AssertionSuccess();
    return ::testing::AssertionFailure()
           << at << ": " << a.description() << " vs " << b.description();
}

// Both readers on the same bytes.
struct Both {
    std::optional<PlistValue> direct, library;
    std::string why, libraryWhy;
};
Both readBoth(const std::vector<uint8_t>& bytes) {
    Both r;
    r.direct = PlistValue::fromBytes(bytes.data(), bytes.size(), &r.why);
    r.library = PlistValue::TEST_fromBytesViaLibrary(bytes.data(), bytes.size(), &r.libraryWhy);
    return r;
}

// Hand-made binary lists, for what the library's writer never produces.
struct Bplist {
    std::vector<std::vector<uint8_t>> objects;
    uint8_t offsetSize = 1, refSize = 1;
    uint64_t root = 0;
    // Overrides for damaged trailers.
    std::optional<uint64_t> count, tableAt;

    uint8_t add(std::vector<uint8_t> object) {
        objects.push_back(std::move(object));
        return static_cast<uint8_t>(objects.size() - 1);
    }
    std::vector<uint8_t> bytes() const {
        std::vector<uint8_t> out = {'b', 'p', 'l', 'i', 's', 't', '0', '0'};
        std::vector<uint64_t> offsets;
        for (const auto& o : objects) {
            offsets.push_back(out.size());
            out.insert(out.end(), o.begin(), o.end());
        }
        const uint64_t table = out.size();
        for (uint64_t off : offsets)
            for (int i = offsetSize - 1; i >= 0; --i)
                out.push_back(static_cast<uint8_t>(off >> (8 * i)));
        std::vector<uint8_t> trailer(32, 0);
        trailer[6] = offsetSize;
        trailer[7] = refSize;
        auto put = [&](size_t at, uint64_t v) {
            for (int i = 0; i < 8; ++i) trailer[at + i] = static_cast<uint8_t>(v >> (8 * (7 - i)));
        };
        put(8, count.value_or(objects.size()));
        put(16, root);
        put(24, tableAt.value_or(table));
        out.insert(out.end(), trailer.begin(), trailer.end());
        return out;
    }
};

std::vector<uint8_t> ascii(const std::string& s) {
    std::vector<uint8_t> o = {static_cast<uint8_t>(0x50 | std::min<size_t>(s.size(), 0xF))};
    if (s.size() >= 0xF) o.insert(o.end(), {0x10, static_cast<uint8_t>(s.size())});
    o.insert(o.end(), s.begin(), s.end());
    return o;
}
std::vector<uint8_t> utf16(const std::u16string& s) {
    std::vector<uint8_t> o = {static_cast<uint8_t>(0x60 | s.size())};
    for (char16_t c : s) o.insert(o.end(), {static_cast<uint8_t>(c >> 8), static_cast<uint8_t>(c)});
    return o;
}
std::vector<uint8_t> container(uint8_t kind, std::vector<uint8_t> refs, size_t n) {
    std::vector<uint8_t> o = {static_cast<uint8_t>(kind | n)};
    o.insert(o.end(), refs.begin(), refs.end());
    return o;
}
std::vector<uint8_t> real8(uint8_t marker, double d) {
    uint64_t bits;
    std::memcpy(&bits, &d, 8);
    std::vector<uint8_t> o = {marker};
    for (int i = 7; i >= 0; --i) o.push_back(static_cast<uint8_t>(bits >> (8 * i)));
    return o;
}

// `n` arrays, each holding the next; the last is empty.
Bplist nestedArrays(int n) {
    Bplist b;
    b.offsetSize = b.refSize = 2;
    for (int i = 1; i < n; ++i)
        b.add({0xA1, static_cast<uint8_t>(i >> 8), static_cast<uint8_t>(i)});
    b.add({0xA0});
    return b;
}

// Values of every type the daemon keeps, nested, with the awkward corners.
std::vector<PlistValue> corpus() {
    std::vector<PlistValue> out;
    const std::vector<PlistValue> leaves = {
        PlistValue(true),
        PlistValue(false),
        PlistValue(uint64_t{0}),
        PlistValue(uint64_t{255}),
        PlistValue(uint64_t{256}),
        PlistValue(uint64_t{65536}),
        PlistValue(uint64_t{1} << 32),
        PlistValue(uint64_t{INT64_MAX}),
        PlistValue(UINT64_MAX),
        PlistValue(int64_t{-1}),
        PlistValue(INT64_MIN),
        PlistValue(0.0),
        PlistValue(-0.0),
        PlistValue(1.5e300),
        PlistValue(-3.25),
        PlistValue(std::nan("")),
        PlistValue(PlistDate{0}),
        PlistValue(PlistDate{694224000.123456}),
        PlistValue(PlistDate{2147483647}),
        PlistValue(""),
        PlistValue("ascii"),
        PlistValue(std::string(300, 'x')),
        PlistValue("caf\xc3\xa9 \xe6\x97\xa5\xe6\x9c\xac"),
        PlistValue("\xf0\x9f\x93\xa6 box"),
        PlistValue("\xef\xbf\xbd\xef\xbf\xbf"),
        PlistValue(PlistData{}),
        PlistValue(PlistData{0, 1, 2, 255}),
        PlistValue(PlistData(5000, 0xAB)),
        PlistValue(*Uuid::parse("12345678-9ABC-DEF0-1234-56789ABCDEF0"))};
    for (const auto& v : leaves) out.push_back(v);
    out.emplace_back(PlistArray(leaves));
    PlistDict wide;
    for (size_t i = 0; i < leaves.size(); ++i) wide["key" + std::to_string(i)] = leaves[i];
    wide["\xc3\xa9t\xc3\xa9"] = PlistValue(PlistArray{});
    wide["nested"] = PlistValue(PlistDict{{"a", PlistValue(PlistArray{PlistValue(PlistDict{})})}});
    out.emplace_back(wide);
    PlistDict big;  // more than 15 entries and refs wider than a byte
    for (int i = 0; i < 600; ++i) big[std::to_string(i)] = PlistValue(uint64_t(i) * 7919);
    out.emplace_back(big);
    PlistValue deep = PlistValue(uint64_t{7});
    for (int i = 0; i < 256; ++i) deep = PlistValue(PlistArray{deep});
    out.push_back(deep);  // the deepest the writer allows
    // Shaped like the daemon's metadata files.
    PlistDict metadata{{"MCMMetadataIdentifier", PlistValue("com.example.app")},
                       {"MCMMetadataUUID", PlistValue("6F1C7A7E-0D52-4C1B-9A3E-2B2A53C1F0D4")},
                       {"MCMMetadataContentClass", PlistValue(uint64_t{2})},
                       {"MCMMetadataSchemaVersion", PlistValue(uint64_t{1})},
                       {"MCMMetadataInfo", PlistValue(PlistDict{{"x", PlistValue(true)}})}};
    out.emplace_back(metadata);
    return out;
}

TEST(BinaryPlist, GivesTheLibrarysValuesOnWrittenFiles) {
    for (const PlistValue& v : corpus()) {
        std::vector<uint8_t> bytes = v.toBinary();
        ASSERT_FALSE(bytes.empty()) << v.description();
        Both r = readBoth(bytes);
        ASSERT_TRUE(r.direct) << r.why << " for " << v.description();
        ASSERT_TRUE(r.library) << v.description();
        EXPECT_TRUE(identical(*r.direct, *r.library));
    }
}

TEST(BinaryPlist, ReadsFormsTheWriterNeverUses) {
    // UTF-16 with a surrogate pair, one-byte UTF-8, a set, a UID, a 4-byte
    // real, a 16-byte integer, a repeated key, a shared leaf.
    Bplist b;
    b.root = b.add(container(0xD0, {1, 2, 3, 4, 5, 1, 6, 7, 8, 9, 10, 11}, 6));
    b.add(ascii("k"));                                                     // 1
    b.add(ascii("s"));                                                     // 2
    b.add(ascii("u"));                                                     // 3
    b.add(ascii("f"));                                                     // 4
    b.add(ascii("i"));                                                     // 5
    b.add(utf16({u'h', 0xE9, 0xD83D, 0xDCE6}));                            // 6
    b.add(container(0xC0, {9, 9}, 2));                                     // 7
    b.add({0x81, 0x01, 0x00});                                             // 8: uid 256
    b.add({0x22, 0x3F, 0xC0, 0x00, 0x00});                                 // 9: 1.5f
    b.add({0x14, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0, 42});        // 10
    b.add({0x5A, 'c', 'a', 'f', 0xC3, 0xA9, ' ', 0xE2, 0x82, 0xAC, '!'});  // 11
    Both r = readBoth(b.bytes());
    ASSERT_TRUE(r.direct) << r.why;
    ASSERT_TRUE(r.library);
    EXPECT_TRUE(identical(*r.direct, *r.library));
    EXPECT_EQ(*r.direct->find("k")->asString(), "caf\xc3\xa9 \xe2\x82\xac!");  // last one wins
    EXPECT_EQ(*r.direct->find("s")->asArray(), (PlistArray{PlistValue(1.5), PlistValue(1.5)}));
    EXPECT_EQ(r.direct->find("u")->asUInt64(), uint64_t{256});
    EXPECT_EQ(r.direct->find("i")->asUInt64(), uint64_t{42});
}

TEST(BinaryPlist, ReadsDatesWithTheirSignAndClampsThem) {
    // The library loses the sign of the fraction of a negative date; the
    // direct reader keeps it. Out-of-range seconds clamp, non-finite is 0.
    const std::vector<std::pair<double, double>> cases = {{-1.5, -1.5},
                                                          {-0.25, -0.25},
                                                          {12.25, 12.25},
                                                          {12.0000004, 12},
                                                          {1e12, INT32_MAX},
                                                          {-1e12, INT32_MIN},
                                                          {2147483647.5, 2147483647.5},
                                                          {INFINITY, 0},
                                                          {NAN, 0}};
    for (auto [stored, expected] : cases) {
        Bplist b;
        b.add(real8(0x33, stored));
        auto v = PlistValue::fromBytes(b.bytes().data(), b.bytes().size());
        ASSERT_TRUE(v && v->asDate()) << stored;
        EXPECT_DOUBLE_EQ(v->asDate()->seconds, expected) << stored;
    }
}

// Damage each reader must refuse. The library refuses all of them too, except
// where noted: there the direct reader is the stricter one.
TEST(BinaryPlist, RefusesDamagedFiles) {
    struct Case {
        const char* name;
        Bplist b;
        bool libraryAccepts = false;
    };
    std::vector<Case> cases;
    auto simple = [] {
        Bplist b;
        b.add(container(0xA0, {1}, 1));
        b.add(ascii("x"));
        return b;
    };
    // Damage to the trailer of an otherwise good file.
    const std::pair<const char*, void (*)(Bplist&)> trailerDamage[] = {
        {"zero offset size", [](Bplist& b) { b.offsetSize = 0; }},
        {"zero reference size", [](Bplist& b) { b.refSize = 0; }},
        {"no objects", [](Bplist& b) { b.count = 0; }},
        {"root past the objects", [](Bplist& b) { b.root = 2; }},
        {"offset table longer than the file", [](Bplist& b) { b.count = 1000; }},
        {"offset table inside the header", [](Bplist& b) { b.tableAt = 4; }},
        {"offset table far past the end", [](Bplist& b) { b.tableAt = uint64_t{1} << 60; }},
    };
    for (const auto& [name, damage] : trailerDamage) {
        Bplist b = simple();
        damage(b);
        cases.push_back({name, b});
    }
    {
        Bplist b;
        b.add(container(0xA0, {5}, 1));
        cases.push_back({"reference past the objects", b});
    }
    {
        Bplist b;
        b.add(container(0xA0, {0}, 1));
        cases.push_back({"array that holds itself", b});
    }
    {
        Bplist b;
        b.add(container(0xD0, {1, 2}, 1));
        b.add(ascii("k"));
        b.add(container(0xA0, {0}, 1));
        cases.push_back({"cycle through a dictionary", b});
    }
    {
        Bplist b;
        b.add(container(0xD0, {1, 1}, 1));
        b.add({0x10, 0x01});
        cases.push_back({"integer key", b});
    }
    {
        Bplist b;
        b.add(container(0xA0, {1, 2, 3, 4}, 9));  // nine refs claimed, four there
        cases.push_back({"array longer than its object", b, true});
    }
    {
        Bplist b;
        b.add({0x13, 0, 0, 0});
        cases.push_back({"truncated integer", b});
    }
    {
        Bplist b;
        b.add({0x15, 0, 0, 0, 0});
        cases.push_back({"32-byte integer", b});
    }
    {
        Bplist b;
        b.add({0x21, 0, 0});
        cases.push_back({"2-byte real", b});
    }
    {
        Bplist b;
        b.add({0x32, 0, 0, 0, 0});
        cases.push_back({"4-byte date", b});
    }
    {
        Bplist b;
        b.add({0x5F, 0x10, 0x40, 'a'});
        cases.push_back({"string longer than the file", b});
    }
    {
        Bplist b;
        b.add({0x5F, 0x20, 'a'});
        cases.push_back({"length that is not an integer", b});
    }
    {
        Bplist b;
        b.add({0x53, 'a', 0, 'b'});
        cases.push_back({"NUL in a string", b});
    }
    {
        Bplist b;
        b.add(utf16({u'a', 0}));
        cases.push_back({"NUL in a UTF-16 string", b});
    }
    {
        Bplist b;
        b.add({0x52, 0xC0, 0x80});
        cases.push_back({"overlong UTF-8", b});
    }
    {
        Bplist b;
        b.add(utf16({u'a', 0xD800, u'b'}));
        cases.push_back({"lone surrogate", b, true});
    }
    {
        Bplist b;
        b.add({0x60});
        cases.push_back({"empty UTF-16 string", b});
    }
    {
        Bplist b;
        b.add({0x00});
        cases.push_back({"null object", b});
    }
    {
        Bplist b;
        b.add({0x70});
        cases.push_back({"unknown type", b});
    }
    {
        Bplist b;
        b.add({0x84, 0x01, 0, 0, 0, 0});
        cases.push_back({"UID past 32 bits", b});
    }
    cases.push_back({"too deep", nestedArrays(258), true});
    {
        Bplist b;  // 60 levels of [x, x]: 2^60 values from a few hundred bytes
        for (int i = 0; i < 60; ++i)
            b.add(container(0xA0, {static_cast<uint8_t>(i + 1), static_cast<uint8_t>(i + 1)}, 2));
        b.add({0x09});
        cases.push_back({"exponential sharing", b, true});
    }
    for (const Case& c : cases) {
        if (std::string(c.name) == "exponential sharing") {
            // The library would try to build all of it.
            auto bytes = c.b.bytes();
            EXPECT_FALSE(PlistValue::fromBytes(bytes.data(), bytes.size())) << c.name;
            continue;
        }
        Both r = readBoth(c.b.bytes());
        EXPECT_FALSE(r.direct) << c.name;
        if (!c.libraryAccepts) {
            EXPECT_FALSE(r.library) << c.name;
        }
    }
    // One level fewer is fine.
    auto bytes = nestedArrays(257).bytes();
    EXPECT_TRUE(PlistValue::fromBytes(bytes.data(), bytes.size()));
}

// Every truncation and a sweep of byte flips over written files: the direct
// reader never accepts what the library refuses, and agrees where both accept.
TEST(BinaryPlist, AgreesWithTheLibraryOnMutatedFiles) {
    std::mt19937 rng(20261122);
    size_t accepted = 0;
    for (const PlistValue& v : corpus()) {
        const std::vector<uint8_t> good = v.toBinary();
        if (good.size() > 4096) continue;
        for (size_t n = 0; n < good.size(); ++n) {
            std::vector<uint8_t> cut(good.begin(), good.begin() + static_cast<ptrdiff_t>(n));
            EXPECT_FALSE(PlistValue::fromBytes(cut.data(), cut.size())) << n;
        }
        for (int round = 0; round < 300; ++round) {
            std::vector<uint8_t> bad = good;
            for (int flips = 1 + static_cast<int>(rng() % 3); flips > 0; --flips)
                bad[8 + rng() % (bad.size() - 8)] = static_cast<uint8_t>(rng());
            Both r = readBoth(bad);
            if (!r.direct) continue;
            ++accepted;
            // The library also looks at objects nothing refers to, for NUL only.
            if (!r.library) {
                EXPECT_EQ(r.libraryWhy, "property list holds a string with a NUL character");
                continue;
            }
            EXPECT_TRUE(identical(*r.direct, *r.library, true));
        }
    }
    EXPECT_GT(accepted, 0u);
}

}  // namespace
}  // namespace tarn
