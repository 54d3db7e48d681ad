// The root-entries reader answers as fromBytes would, or declines so that the
// caller asks fromBytes; it never accepts what fromBytes refuses.
#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <vector>

#include "Platform/PropertyList.h"

namespace tarn {
namespace {

// A binary property list built object by object: one-byte references and
// offsets, so hand-made files can hold what no writer emits.
struct HandMadePlist {
    std::vector<std::vector<uint8_t>> objects;

    uint8_t string(const std::string& s) {
        std::vector<uint8_t> o{static_cast<uint8_t>(0x50 | s.size())};
        o.insert(o.end(), s.begin(), s.end());
        return add(o);
    }
    uint8_t integer(uint8_t v) { return add({0x10, v}); }
    uint8_t dict(const std::vector<std::pair<uint8_t, uint8_t>>& entries) {
        std::vector<uint8_t> o{static_cast<uint8_t>(0xD0 | entries.size())};
        for (auto& e : entries) o.push_back(e.first);
        for (auto& e : entries) o.push_back(e.second);
        return add(o);
    }
    uint8_t add(std::vector<uint8_t> o) {
        objects.push_back(std::move(o));
        return static_cast<uint8_t>(objects.size() - 1);
    }
    // An object filled in later (to refer to one made after it).
    void replace(uint8_t index, std::vector<uint8_t> o) { objects[index] = std::move(o); }

    std::vector<uint8_t> bytes(uint8_t root) const {
        std::vector<uint8_t> out{'b', 'p', 'l', 'i', 's', 't', '0', '0'};
        std::vector<uint8_t> offsets;
        for (auto& o : objects) {
            offsets.push_back(static_cast<uint8_t>(out.size()));
            out.insert(out.end(), o.begin(), o.end());
        }
        const uint8_t tableAt = static_cast<uint8_t>(out.size());
        out.insert(out.end(), offsets.begin(), offsets.end());
        std::vector<uint8_t> trailer(32, 0);
        trailer[6] = 1;
        trailer[7] = 1;
        trailer[15] = static_cast<uint8_t>(objects.size());
        trailer[23] = root;
        trailer[31] = tableAt;
        out.insert(out.end(), trailer.begin(), trailer.end());
        return out;
    }
};

TEST(PlistRootEntriesTest, AnswersTheDictionaryFromBytesBuildsInFileOrder) {
    PlistDict identity{{"posixUID", PlistValue(uint32_t{501})}, {"version", PlistValue("2")}};
    PlistDict d{{"TarnMetadataIdentifier", PlistValue("com.ostrea.some.long.identifier")},
                {"TarnMetadataContentClass", PlistValue(uint64_t{2})},
                {"TarnMetadataUserIdentity", PlistValue(identity)},
                {"TarnMetadataInfo", PlistValue(PlistDict{{"x", PlistValue(PlistArray{1.5, -3})}})},
                {"Unicode", PlistValue("h\xC3\xA9llo")}};
    const std::vector<uint8_t> bytes = PlistValue(d).toBinary();
    ASSERT_FALSE(bytes.empty());

    PlistEntries entries;
    entries.emplace_back("left over", PlistValue(true));  // a reused list is cleared first
    ASSERT_TRUE(PlistBinaryRootEntries(bytes.data(), bytes.size(), &entries));
    ASSERT_EQ(entries.size(), d.size());
    auto expected = d.begin();
    for (const auto& [key, value] : entries) {
        EXPECT_EQ(key, expected->first);
        EXPECT_EQ(value, expected->second) << key;
        ++expected;
    }
    auto whole = PlistValue::fromBytes(bytes.data(), bytes.size());
    ASSERT_TRUE(whole);
    EXPECT_EQ(*whole, PlistValue(d));
}

TEST(PlistRootEntriesTest, DeclinesWhatOnlyTheWholeTreeReaderHandles) {
    PlistEntries entries;
    const std::string xml = PlistValue(PlistDict{{"a", PlistValue("b")}}).toXml();
    EXPECT_FALSE(PlistBinaryRootEntries(xml.data(), xml.size(), &entries)) << "not binary";

    const std::vector<uint8_t> array = PlistValue(PlistArray{PlistValue("a")}).toBinary();
    EXPECT_FALSE(PlistBinaryRootEntries(array.data(), array.size(), &entries)) << "root array";

    const std::vector<uint8_t> wide = PlistValue(PlistDict{{"\xC3\xA9", PlistValue("b")}}).toBinary();
    EXPECT_FALSE(PlistBinaryRootEntries(wide.data(), wide.size(), &entries)) << "non-ASCII key";
    EXPECT_TRUE(PlistValue::fromBytes(wide.data(), wide.size()));

    // A key given twice: the whole-tree reader keeps the last value.
    HandMadePlist twice;
    const uint8_t key = twice.string("Key");
    const uint8_t first = twice.integer(1), second = twice.integer(2);
    const uint8_t root = twice.dict({{key, first}, {key, second}});
    const auto bytes = twice.bytes(root);
    EXPECT_FALSE(PlistBinaryRootEntries(bytes.data(), bytes.size(), &entries));
    EXPECT_TRUE(entries.empty());
    auto whole = PlistValue::fromBytes(bytes.data(), bytes.size());
    ASSERT_TRUE(whole);
    EXPECT_EQ(*whole->find("Key"), PlistValue(uint64_t{2}));
}

TEST(PlistRootEntriesTest, RefusesWhatFromBytesRefuses) {
    std::vector<std::vector<uint8_t>> refused;

    // A value that refers back to the root dictionary.
    HandMadePlist cycle;
    const uint8_t key = cycle.string("Self");
    const uint8_t inner = cycle.add({});
    const uint8_t root = cycle.dict({{key, inner}});
    cycle.replace(inner, {0xA1, root});  // an array holding the root
    refused.push_back(cycle.bytes(root));

    // A key holding a NUL; a key that is a number; a value out of range.
    HandMadePlist nul;
    const uint8_t nulKey = nul.add({0x52, 'a', 0});
    refused.push_back(nul.bytes(nul.dict({{nulKey, nul.integer(1)}})));
    HandMadePlist numberKey;
    const uint8_t k = numberKey.integer(7);
    refused.push_back(numberKey.bytes(numberKey.dict({{k, k}})));
    HandMadePlist dangling;
    const uint8_t dk = dangling.string("k");
    refused.push_back(dangling.bytes(dangling.dict({{dk, 40}})));

    // A good file cut short.
    auto good = PlistValue(PlistDict{{"a", PlistValue("b")}}).toBinary();
    good.resize(good.size() - 1);
    refused.push_back(good);

    for (size_t i = 0; i < refused.size(); ++i) {
        const auto& bytes = refused[i];
        EXPECT_FALSE(PlistValue::fromBytes(bytes.data(), bytes.size())) << i;
        PlistEntries entries;
        EXPECT_FALSE(PlistBinaryRootEntries(bytes.data(), bytes.size(), &entries)) << i;
        EXPECT_TRUE(entries.empty()) << i;
    }
}

// One key's dictionary decoded into a list of its own: the same values, the
// root entry left an empty dictionary; the same refusals one level down.
TEST(PlistRootEntriesTest, DecodesOneKeysDictionaryIntoASecondList) {
    PlistDict identity{{"posixUID", PlistValue(uint32_t{501})}, {"version", PlistValue("2")}};
    PlistDict d{{"Id", PlistValue(identity)},
                {"Info", PlistValue(identity)},
                {"Name", PlistValue("com.ostrea.some.long.identifier")}};
    const std::vector<uint8_t> bytes = PlistValue(d).toBinary();
    PlistEntries entries, inlined{{"left over", PlistValue(true)}};
    ASSERT_TRUE(PlistBinaryRootEntries(bytes.data(), bytes.size(), &entries, "Id", &inlined));
    ASSERT_EQ(entries.size(), 3u);
    EXPECT_EQ(entries[0].second, PlistValue(PlistDict{}));
    EXPECT_EQ(entries[1].second, PlistValue(identity)) << "only the named key";
    ASSERT_EQ(inlined.size(), 2u);
    EXPECT_EQ(inlined[0].first, "posixUID");
    EXPECT_EQ(inlined[0].second, PlistValue(uint32_t{501}));
    EXPECT_EQ(inlined[1].first, "version");
    EXPECT_EQ(inlined[1].second, PlistValue("2"));

    // Not a dictionary under that key: an ordinary entry, nothing inlined.
    ASSERT_TRUE(PlistBinaryRootEntries(bytes.data(), bytes.size(), &entries, "Name", &inlined));
    EXPECT_EQ(entries[2].second, PlistValue("com.ostrea.some.long.identifier"));
    EXPECT_TRUE(inlined.empty());

    // A nested key given twice declines; a nested reference back to the root
    // is refused as fromBytes refuses it.
    HandMadePlist twice;
    const uint8_t id = twice.string("Id"), key = twice.string("k");
    const uint8_t nested = twice.dict({{key, twice.integer(1)}, {key, twice.integer(2)}});
    const auto twiceBytes = twice.bytes(twice.dict({{id, nested}}));
    ASSERT_TRUE(PlistValue::fromBytes(twiceBytes.data(), twiceBytes.size()));
    EXPECT_FALSE(PlistBinaryRootEntries(twiceBytes.data(), twiceBytes.size(), &entries, "Id",
                                        &inlined));
    EXPECT_TRUE(entries.empty() && inlined.empty());

    HandMadePlist cycle;
    const uint8_t cid = cycle.string("Id"), self = cycle.string("Self");
    const uint8_t inner = cycle.add({});
    const uint8_t root = cycle.dict({{cid, inner}});
    cycle.replace(inner, {0xD1, self, root});
    const auto cycleBytes = cycle.bytes(root);
    EXPECT_FALSE(PlistValue::fromBytes(cycleBytes.data(), cycleBytes.size()));
    EXPECT_FALSE(PlistBinaryRootEntries(cycleBytes.data(), cycleBytes.size(), &entries, "Id",
                                        &inlined));
}

}  // namespace
}  // namespace tarn
