// Property lists, the message formatter, error values and host configuration.
#include <gtest/gtest.h>

#include "Daemon/TarnError.h"
#include "Platform/Format.h"
#include "Platform/HostConfiguration.h"
#include "Platform/PlatformLog.h"
#include "Platform/PropertyList.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

PlistValue sampleTree() {
    PlistValue d{PlistDict{}};
    d.set("s", "text with \"quotes\"");
    d.set("u", uint64_t{18446744073709551615ull});
    d.set("neg", int64_t{-42});
    d.set("b", true);
    d.set("data", PlistData{0, 1, 2, 255});
    d.set("arr", PlistArray{PlistValue("a"), PlistValue(uint64_t{1}), PlistValue(PlistDict{})});
    PlistValue inner{PlistDict{}};
    inner.set("k", "v");
    d.set("dict", inner);
    return d;
}

TEST(PropertyList, BinaryAndXmlRoundTripsKeepEveryType) {
    PlistValue tree = sampleTree();
    auto bin = tree.toBinary();
    auto back = PlistValue::fromBytes(bin.data(), bin.size());
    ASSERT_TRUE(back);
    EXPECT_EQ(*back, tree);
    std::string xml = tree.toXml();
    auto fromXml = PlistValue::fromBytes(xml.data(), xml.size());
    ASSERT_TRUE(fromXml);
    EXPECT_EQ(*fromXml, tree);
    EXPECT_EQ(fromXml->find("neg")->asInt64(), -42);
}

TEST(PropertyList, UuidIsWrittenAsItsCanonicalString) {
    Uuid u = Uuid::generate();
    PlistValue d{PlistDict{}};
    d.set("id", u);
    auto bin = d.toBinary();
    auto back = PlistValue::fromBytes(bin.data(), bin.size());
    ASSERT_TRUE(back);
    EXPECT_EQ(*back->find("id")->asString(), u.string());
    EXPECT_EQ(back->find("id")->asUuid(), u);
    EXPECT_FALSE(Uuid::parse("not-a-uuid"));
}

TEST(PropertyList, MalformedInputIsRefusedWithAReason) {
    std::string why;
    const std::string cases[] = {"", "bplist00", "<plist><dict><key>a</key></plist>",
                                 std::string("bplist00\xff\xff\xff\xff", 12), "garbage"};
    for (const auto& c : cases) {
        why.clear();
        EXPECT_FALSE(PlistValue::fromBytes(c.data(), c.size(), &why)) << c;
        EXPECT_FALSE(why.empty());
    }
    // Nesting deeper than we accept is refused rather than recursed into.
    std::string deep = "<plist>";
    for (int i = 0; i < 2000; ++i) deep += "<array>";
    for (int i = 0; i < 2000; ++i) deep += "</array>";
    deep += "</plist>";
    EXPECT_FALSE(PlistValue::fromBytes(deep.data(), deep.size()));
}

TEST(PropertyList, TextTheDaemonCouldNotWriteBackIsRefused) {
    // A NUL inside a string would abort the file library; broken UTF-8 could
    // not be written back. Both are refused as malformed input.
    const std::string withNul = "<plist><string>a&#0;b</string></plist>";
    const std::string withHexNul = "<plist><dict><key>k&#x00;</key><true/></dict></plist>";
    const std::string badUtf8 = "<plist><string>\xC3\x28</string></plist>";
    for (const auto& c : {withNul, withHexNul, badUtf8}) {
        std::string why;
        EXPECT_FALSE(PlistValue::fromBytes(c.data(), c.size(), &why)) << c;
    }
    PlistValue d{PlistDict{}};
    d.set("s", std::string("a\0b", 3));
    EXPECT_TRUE(d.toBinary().empty());  // not silently cut at the NUL
    const std::string fine = "<plist><string>caf\xC3\xA9 &#233;</string></plist>";
    EXPECT_TRUE(PlistValue::fromBytes(fine.data(), fine.size()));
}

TEST(Format, PrintfConversionsAndDescriptions) {
    EXPECT_EQ(Format("command=%llu, client=%@, error=%llu", uint64_t{3}, std::string("x"),
                     uint64_t{49}),
              "command=3, client=x, error=49");
    // The argument's own type wins over the length modifier; C's truncation stays.
    EXPECT_EQ(Format("%d", uint64_t{4294967295u}), "-1");
    EXPECT_EQ(Format("%lld", int64_t{-5}), "-5");
    EXPECT_EQ(Format("%5s|%-3d|%x|%%", "ab", 7, 255), "   ab|7  |ff|%");
    std::shared_ptr<const TarnError> none;
    EXPECT_EQ(Format("%@", none), "(null)");
    EXPECT_EQ(Format("%@ and %@", "one"), "one and (missing)");
    // Literal runs around directives, a cut-off directive, an unknown one.
    EXPECT_EQ(Format("no directives at all"), "no directives at all");
    EXPECT_EQ(Format("100%"), "100%");
    EXPECT_EQ(Format("a %y b %d", 4), "a %y b 4");
    EXPECT_EQ(Format("[%08.3f][%-4s][%lX]", 3.14159, "ab", uint64_t{0xbeef}), "[0003.142][ab  ][BEEF]");
    PlistValue d{PlistDict{}};
    d.set("k", "v");
    EXPECT_NE(Format("%@", d).find("k = v;"), std::string::npos);
}

TEST(TarnErrorValues, CarryCodePlaceAndOptionalDescription) {
    PlatformLogSetQuiet(true);
    auto plain = TARN_ERROR_CODE(TarnErrorNotFound, nullptr);
    EXPECT_EQ(plain->code(), TarnErrorNotFound);
    EXPECT_FALSE(plain->localizedDescription());
    EXPECT_EQ(plain->functionName(), "TestBody");
    EXPECT_GT(plain->sourceFileLine(), 0);

    auto posix = TARN_POSIX_ERROR(ENOENT, "open %s", "/x");
    auto wrapped = TARN_ERROR(TarnErrorReadFailed, posix, "Failed to read %@", "/x");
    EXPECT_EQ(wrapped->underlyingError(), posix);
    EXPECT_EQ(*wrapped->localizedDescription(), "Failed to read /x");
    EXPECT_EQ(TarnErrorCodeOf(wrapped, 99), TarnErrorReadFailed);
    EXPECT_EQ(TarnErrorCodeOf(posix, 99), 99u);
    EXPECT_EQ(TarnErrorCodeOf(nullptr, 99), 99u) << "a failure without a value is no success";
    EXPECT_NE(wrapped->description().find("UnderlyingError=Error Domain=PosixErrorDomain Code=2"),
              std::string::npos)
        << wrapped->description();
    EXPECT_EQ(posix->posixCode(), ENOENT);
    PlatformLogSetQuiet(false);
}

class HostConfigurationTest : public test::ScratchRootTest {};

TEST_F(HostConfigurationTest, MissingFilesGiveDefaults) {
    auto c = HostConfiguration::load();
    EXPECT_FALSE(c.multiUserFlags);
    EXPECT_FALSE(c.internalBuild);
    EXPECT_EQ(c.releaseType, "Release");
    EXPECT_TRUE(c.problems.empty());
}

TEST_F(HostConfigurationTest, ReadsKeysAndReportsWrongTypes) {
    PlistValue host{PlistDict{}};
    host.set("MultiUserFlags", uint64_t{6});
    host.set("InternalBuild", true);
    host.set("DeviceSupportsPersonas", "yes");  // wrong type: reported, default kept
    PlistValue flags{PlistDict{}};
    flags.set("fast_container_sizing", true);
    host.set("FeatureFlags", flags);
    auto bin = host.toBinary();
    root_.writeFile("/etc/tarnkeeper/host.plist", std::string(bin.begin(), bin.end()));
    root_.writeFile("/etc/os-release", "NAME=x\nBUILD_ID=\"21A5\"\n");
    auto c = HostConfiguration::load();
    EXPECT_EQ(c.multiUserFlags, 6u);
    EXPECT_TRUE(c.internalBuild);
    EXPECT_FALSE(c.deviceSupportsPersonas);
    EXPECT_EQ(c.problems.size(), 1u);
    EXPECT_TRUE(c.featureEnabled("fast_container_sizing"));
    EXPECT_EQ(c.buildVersion, "21A5");
}

TEST_F(HostConfigurationTest, MalformedFileIsAProblemNotACrash) {
    root_.writeFile("/etc/tarnkeeper/host.plist", "<plist><dict><key>");
    auto c = HostConfiguration::load();
    EXPECT_EQ(c.problems.size(), 1u);
    EXPECT_FALSE(c.internalBuild);
}

}  // namespace
}  // namespace tarn
