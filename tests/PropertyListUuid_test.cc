// Uuid::parse takes the text form exactly as uuid_parse does; the library is
// the reference. Uuid::generate makes random version 4 UUIDs.
#include <gtest/gtest.h>
#include <uuid/uuid.h>

#include <cstring>
#include <random>
#include <set>
#include <string>

#include "Platform/PropertyList.h"

namespace tarn {
namespace {

void expectAsLibrary(const std::string& text) {
    uuid_t reference;
    const bool accepted = uuid_parse(text.c_str(), reference) == 0;
    auto parsed = Uuid::parse(text);
    ASSERT_EQ(parsed.has_value(), accepted) << "'" << text << "'";
    if (accepted) {
        EXPECT_EQ(0, std::memcmp(parsed->bytes.data(), reference, 16)) << "'" << text << "'";
    }
}

TEST(UuidParseTest, AcceptsAndRefusesWhatTheLibraryDoes) {
    for (const char* text :
         {"00000000-0000-0000-0000-000000000000", "E621E1F8-C36C-495A-93FC-0C247A3E6E5F",
          "e621e1f8-c36c-495a-93fc-0c247a3e6e5f", "E621e1f8-C36c-495A-93fC-0c247A3E6e5F",
          "E621E1F8C36C495A93FC0C247A3E6E5F", "E621E1F8-C36C-495A-93FC-0C247A3E6E5",
          "E621E1F8-C36C-495A-93FC-0C247A3E6E5F0", "E621E1F8+C36C-495A-93FC-0C247A3E6E5F",
          "E621E1F-8C36C-495A-93FC-0C247A3E6E5F", "G621E1F8-C36C-495A-93FC-0C247A3E6E5F",
          " 621E1F8-C36C-495A-93FC-0C247A3E6E5F", "E621E1F8-C36C-495A-93FC-0C247A3E6E5 ", "", "-"})
        expectAsLibrary(text);

    // Single-character changes of a valid form, at every position.
    std::mt19937 random(8);
    const std::string valid = Uuid::generate().string();
    const std::string alphabet = "0123456789abcdefABCDEFgG-+ xX:/{}";
    for (size_t i = 0; i < valid.size(); ++i) {
        for (char c : alphabet) {
            std::string changed = valid;
            changed[i] = c;
            expectAsLibrary(changed);
        }
    }
    for (int round = 0; round < 2000; ++round) {
        std::string text = valid;
        for (int k = 0; k < 3; ++k)
            text[random() % text.size()] = alphabet[random() % alphabet.size()];
        expectAsLibrary(text);
    }
    // Text that holds a NUL is refused, not cut short.
    std::string withNul = valid;
    withNul[5] = '\0';
    EXPECT_FALSE(Uuid::parse(withNul));
}

TEST(UuidGenerateTest, RandomVersionFourWithTheStandardVariantAndNoRepeats) {
    std::set<std::string> seen;
    int highBitsSet = 0;
    for (int i = 0; i < 2000; ++i) {
        const Uuid u = Uuid::generate();
        ASSERT_EQ(u.bytes[6] >> 4, 4);
        ASSERT_EQ(u.bytes[8] >> 6, 2);
        // The library agrees on what it is.
        EXPECT_EQ(uuid_type(u.bytes.data()), UUID_TYPE_DCE_RANDOM);
        EXPECT_EQ(uuid_variant(u.bytes.data()), UUID_VARIANT_DCE);
        ASSERT_TRUE(seen.insert(u.string()).second) << u.string();
        highBitsSet += u.bytes[0] >> 7;
    }
    // The random bits are random: the top bit of the first byte is set about
    // half the time (far outside this band means a constant or a stuck source).
    EXPECT_GT(highBitsSet, 800);
    EXPECT_LT(highBitsSet, 1200);
}

}  // namespace
}  // namespace tarn
