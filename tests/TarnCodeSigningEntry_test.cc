// The code-signing entry's value semantics: equality, hash, serialised form.
#include "Daemon/TarnCodeSigningEntry.h"

#include <gtest/gtest.h>

#include <functional>

namespace tarn {
namespace {

TarnCodeSigningEntry sample() {
    TarnCodeSigningEntry e(PlistDict{{kTarnEntitlementsKey, PlistDict{{"k", uint64_t{5}}}}}, 2);
    e.setChildBundleIdentifiers({"com.a.one", "com.a.two"});
    return e;
}

TEST(TarnCodeSigningEntry, EqualityCoversEveryFieldAndHashFollowsIt) {
    const TarnCodeSigningEntry base = sample();
    // Integers compare across signedness, as after a file round trip; the hash must agree.
    TarnCodeSigningEntry signedCopy(PlistDict{{kTarnEntitlementsKey, PlistDict{{"k", int64_t{5}}}}}, 2);
    signedCopy.setChildBundleIdentifiers({"com.a.one", "com.a.two"});
    EXPECT_EQ(base, signedCopy);
    EXPECT_EQ(base.hash(), signedCopy.hash());

    std::vector<std::function<void(TarnCodeSigningEntry&)>> changes = {
        [](auto& e) { e.setInvalid(true); },
        [](auto& e) { e.setPlaceholder(true); },
        [](auto& e) { e.setAdvanceCopy(true); },
        [](auto& e) { e.setRegisteredByCaller(true); },
        [](auto& e) { e.setDataContainerClass(4); },
        [](auto& e) { e.setChildBundleIdentifiers({"com.a.two", "com.a.one"}); },  // order matters
        [](auto& e) { e.setChildBundleIdentifiers({}); },
        [](auto& e) { e.setCodeSigningInfo(std::nullopt); },
        [](auto& e) { e.setCodeSigningInfo(PlistDict{}); },
    };
    for (size_t i = 0; i < changes.size(); ++i) {
        TarnCodeSigningEntry changed = base;
        changes[i](changed);
        EXPECT_FALSE(changed == base) << "change " << i;
    }
    // Each flag moves the hash by its own amount.
    TarnCodeSigningEntry flagged = base;
    flagged.setInvalid(true);
    flagged.setPlaceholder(true);
    flagged.setRegisteredByCaller(true);
    flagged.setAdvanceCopy(true);
    EXPECT_EQ(flagged.hash(), base.hash() + 2 + 4 + 8 + 32);

    EXPECT_TRUE(TarnCodeSigningEntriesEqual(nullptr, nullptr));
    EXPECT_FALSE(TarnCodeSigningEntriesEqual(std::make_shared<TarnCodeSigningEntry>(), nullptr));
    EXPECT_TRUE(TarnCodeSigningEntry() == TarnCodeSigningEntry());
}

TEST(TarnCodeSigningEntry, SerialisedFormRoundTripsThroughBinaryPlist) {
    TarnCodeSigningEntry e = sample();
    e.setPlaceholder(true);
    e.setAdvanceCopy(true);
    PlistValue s = e.serialize();
    EXPECT_EQ(*s.find("DataContainerClass"), PlistValue(uint64_t{2}));
    EXPECT_EQ(*s.find("AdvanceCopy"), PlistValue(true));
    EXPECT_EQ(*s.find("ChildBundleIds"), PlistValue(PlistArray{"com.a.one", "com.a.two"}));
    std::vector<uint8_t> bytes = s.toBinary();
    auto parsed = PlistValue::fromBytes(bytes.data(), bytes.size());
    ASSERT_TRUE(parsed);
    auto back = TarnCodeSigningEntry::initWithSerializedDictionary(*parsed);
    ASSERT_TRUE(back);
    EXPECT_EQ(*back, e);

    // No children: the key is left out.
    EXPECT_EQ(TarnCodeSigningEntry(PlistDict{}).serialize().find("ChildBundleIds"), nullptr);
}

TEST(TarnCodeSigningEntry, SerialisedFormToleratesMissingAndWrongKeys) {
    auto e = TarnCodeSigningEntry::initWithSerializedDictionary(PlistValue(PlistDict{
        {"CodeSigningInfo", PlistDict{{"a", "b"}}},
        {"ChildBundleIds", PlistArray{"com.kid", uint64_t{3}}},
        {"Invalid", "yes"},
        {"DataContainerClass", "two"},
    }));
    ASSERT_TRUE(e);
    EXPECT_EQ(e->codeSigningInfo(), (PlistDict{{"a", "b"}}));
    EXPECT_EQ(e->childBundleIdentifiers(), std::vector<std::string>{"com.kid"});
    EXPECT_FALSE(e->invalid());
    EXPECT_FALSE(e->placeholder());
    EXPECT_EQ(e->dataContainerClass(), 0u);
    EXPECT_FALSE(TarnCodeSigningEntry::initWithSerializedDictionary(PlistValue("not a dictionary")));
    auto noInfo = TarnCodeSigningEntry::initWithSerializedDictionary(PlistValue(PlistDict{{"CodeSigningInfo", "x"}}));
    ASSERT_TRUE(noInfo);
    EXPECT_FALSE(noInfo->codeSigningInfo());
}

TEST(TarnCodeSigningEntry, Description) {
    TarnCodeSigningEntry e(PlistDict{{"a", "b"}}, 7);
    e.setInvalid(true);
    EXPECT_EQ(e.description(),
              "<TarnCodeSigningEntry invalid: Y, placeholder: N, advanceCopy: N, regByCaller: N, dataClass: 7, "
              "childBundles: (null), CSinfo: " +
                  PlistValue(PlistDict{{"a", "b"}}).description() + ">");
}

}  // namespace
}  // namespace tarn
