#include "Daemon/TarnWhitelist.h"

#include <gtest/gtest.h>

#include <fstream>
#include <sstream>

#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

class TarnWhitelistTest : public test::ScratchRootTest {
protected:
    std::unique_ptr<TarnWhitelist> builtIn(bool internal = false) {
        return TarnWhitelist::whitelistWithTable(TarnWhitelist::builtInTable(), internal, nullptr);
    }
};

TEST_F(TarnWhitelistTest, LookupGrants) {
    auto w = builtIn();
    ASSERT_TRUE(w);
    // Any-container caller.
    EXPECT_TRUE(w->isLookupWhitelistedFromCodeSignIdentifier("com.ostrea.installd", 2, "com.any"));
    EXPECT_TRUE(w->isLookupWhitelistedFromCodeSignIdentifier("com.ostrea.installd", 13, "x"));
    EXPECT_FALSE(w->isLookupWhitelistedFromCodeSignIdentifier("com.ostrea.installd", 14, "x"));
    // One group of class 7 only.
    EXPECT_TRUE(w->isLookupWhitelistedFromCodeSignIdentifier("com.ostrea.mail", 7,
                                                             "group.com.ostrea.mail.shared"));
    EXPECT_FALSE(w->isLookupWhitelistedFromCodeSignIdentifier("com.ostrea.mail", 7, "group.other"));
    EXPECT_FALSE(w->isLookupWhitelistedFromCodeSignIdentifier("com.ostrea.mail", 2,
                                                              "group.com.ostrea.mail.shared"));
    // Open to every caller by class.
    EXPECT_TRUE(w->isLookupWhitelistedFromCodeSignIdentifier("", 10, "com.ostrea.logd"));
    EXPECT_FALSE(w->isLookupWhitelistedFromCodeSignIdentifier("", 2, "com.ostrea.logd"));
    EXPECT_FALSE(w->isLookupWhitelistedFromCodeSignIdentifier("com.unknown", 2, "com.ostrea.notes"));

    // Class-level "any" marker.
    PlistValue grants(PlistDict{{"c", PlistValue(PlistDict{{"2", PlistValue()}})}});
    TarnWhitelist custom({}, {}, {}, grants);
    EXPECT_TRUE(custom.isLookupWhitelistedFromCodeSignIdentifier("c", 2, "whatever"));
    EXPECT_FALSE(custom.isLookupWhitelistedFromCodeSignIdentifier("c", 4, "whatever"));
}

TEST_F(TarnWhitelistTest, WellKnownTablesByClassAndBuild) {
    auto w = builtIn();
    EXPECT_EQ(w->wellknownSystemContainers().size(), 2u);
    EXPECT_EQ(w->wellknownSystemGroupContainers().size(), 8u);
    const std::string group = "systemgroup.com.ostrea.profiles";
    EXPECT_TRUE(w->containerIdIsWellknown(group, 13));
    EXPECT_FALSE(w->containerIdIsWellknown(group, 12));
    EXPECT_EQ(w->wellknownContainerForId(group, 13), group);
    EXPECT_FALSE(w->wellknownContainerForId(group, 2));
    EXPECT_TRUE(w->containerIdIsWellknown("com.ostrea.locationd", 12));
    EXPECT_FALSE(w->systemGroupContainerIdIsWellknown("systemgroup.com.ostrea.internal.testing"));
    EXPECT_TRUE(builtIn(true)->systemGroupContainerIdIsWellknown(
        "systemgroup.com.ostrea.internal.testing"));
    EXPECT_EQ(builtIn(true)->wellknownSystemGroupContainers().size(), 9u);
}

TEST_F(TarnWhitelistTest, ShippedFileMatchesTheBuiltInTable) {
    std::ifstream in(std::string(TARN_SOURCE_DIR) + "/dist/wellknown.plist", std::ios::binary);
    ASSERT_TRUE(in) << "dist/wellknown.plist is missing";
    std::stringstream bytes;
    bytes << in.rdbuf();
    std::string text = bytes.str();
    auto table = PlistValue::fromBytes(text.data(), text.size());
    ASSERT_TRUE(table);
    EXPECT_EQ(*table, TarnWhitelist::builtInTable());
}

TEST_F(TarnWhitelistTest, ConfigurationFileOverridesAndBadFilesFallBack) {
    PlistValue table = TarnWhitelist::builtInTable();
    table.set("SystemContainers", PlistValue(PlistDict{{"com.ostrea.only", PlistValue("only")}}));
    auto bytes = table.toBinary();
    root_.writeFile("/etc/tarnkeeper/wellknown.plist", std::string(bytes.begin(), bytes.end()));
    auto& fromFile = TarnWhitelist::sharedWhitelist();
    EXPECT_EQ(fromFile.wellknownSystemContainers(), std::vector<std::string>{"com.ostrea.only"});
    // The container lives under the table's directory name, which the cache
    // must take for a container directory; the identifier is not a name.
    EXPECT_TRUE(TarnContainerCache::containerName("only", TarnContainerClassSystemData));
    EXPECT_FALSE(TarnContainerCache::containerName("com.ostrea.only", TarnContainerClassSystemData));
    EXPECT_FALSE(TarnContainerCache::containerName("only", TarnContainerClassSystemGroup));

    // A directory name that would leave the class directory is refused.
    table.set("SystemContainers", PlistValue(PlistDict{{"x", PlistValue("../../etc")}}));
    std::string why;
    EXPECT_FALSE(TarnWhitelist::whitelistWithTable(table, false, &why));
    EXPECT_FALSE(why.empty());
    table.set("LookupByClass", PlistValue(PlistDict{{"99", PlistValue(PlistArray{})}}));
    EXPECT_FALSE(TarnWhitelist::whitelistWithTable(table, false, &why));
    table.set("SystemContainers", PlistValue(PlistDict{{"com.ostrea.only", PlistValue("only")}}));
    table.set("LookupByClass", PlistValue(PlistDict{{"7", PlistValue(PlistArray{})}}));
    EXPECT_TRUE(TarnWhitelist::whitelistWithTable(table, false, &why)) << why;
    table.set("LookupByClass", PlistValue(PlistDict{{"07", PlistValue(PlistArray{})}}));
    EXPECT_FALSE(TarnWhitelist::whitelistWithTable(table, false, &why)) << "only the plain form matches";

    test::ScratchRoot other;
    other.writeFile("/etc/tarnkeeper/wellknown.plist", "<plist>broken");
    auto& fallback = TarnWhitelist::sharedWhitelist();
    EXPECT_EQ(fallback.wellknownSystemContainers().size(), 2u);
}

TEST_F(TarnWhitelistTest, NestedConversionHandlesDeepTables) {
    PlistValue deep(PlistArray{PlistValue("a"), PlistValue("b"), PlistValue("a")});
    for (int i = 0; i < 1000; ++i) {
        PlistDict d;
        d.emplace("k", std::move(deep));
        deep = PlistValue(std::move(d));
    }
    auto converted = TarnWhitelist::_convertArraysToSetsInNestedDictionary(deep);
    const TarnNestedSetValue* node = &converted;
    int depth = 0;
    while (node->kind == TarnNestedSetValue::Kind::Dict) {
        node = &node->dict.at("k");
        ++depth;
    }
    EXPECT_EQ(depth, 1000);
    EXPECT_EQ(node->set, (std::set<std::string>{"a", "b"}));
}

}  // namespace
}  // namespace tarn
