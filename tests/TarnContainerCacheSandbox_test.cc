// The sandbox layers under the container cache: the durable per-user item
// tables and the extension tokens.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>

#include "Platform/Failpoints.h"
#include "Platform/PlatformLog.h"
#include "Platform/Sandbox.h"
#include "Platform/SandboxUserState.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;

std::vector<std::string> items(SandboxUserState& state, uint32_t uid) {
    std::vector<std::string> out;
    EXPECT_EQ(state.iterateUserStateItems(uid,
                                          [&](uint64_t type, const SandboxUserStateItem* item) {
                                              out.push_back(std::to_string(type) + ":" +
                                                            item->identifier + ":" +
                                                            std::to_string(item->personaID) + "=" +
                                                            item->path.value_or("-"));
                                          }),
              0);
    return out;
}

class SandboxUserStateTest : public test::ScratchRootTest {
  protected:
    void SetUp() override { PlatformLogSetQuiet(true); }
    void TearDown() override { PlatformLogSetQuiet(false); }
    FileURL dir() const { return FileSandboxUserState::defaultDirectory(); }
};

TEST_F(SandboxUserStateTest, ItemsSurviveANewInstanceAndClearsAreDurable) {
    {
        FileSandboxUserState state(dir());
        EXPECT_EQ(state.setUserStateItemWithPersona(501, 501, 1, "com.a", "/c/A"), 0);
        EXPECT_EQ(state.setUserStateItemWithPersona(501, 900, 1, "com.a", "/e/A"), 0)
            << "another persona has its own item";
        EXPECT_EQ(state.setUserStateItemWithPersona(501, 501, 2, "group.g", "/c/G"), 0);
        EXPECT_EQ(state.setUserStateItemWithPersona(501, 501, 1, "com.a", nullptr), 0);
        EXPECT_EQ(state.setUserStateItemWithPersona(0, 501, 4, "com.sys", "/s"), 0);
        EXPECT_EQ(state.setUserStateItemWithPersona(501, 501, 1, nullptr, "/x"), EINVAL);
        // A container may be named "": its item is kept like any other.
        EXPECT_EQ(state.setUserStateItemWithPersona(501, 501, 1, "", "/x"), 0);
        EXPECT_TRUE(state.userStateItemIsRecordedWithPersona(501, 501, 1, "", "/x"));
    }
    FileSandboxUserState restarted(dir());
    EXPECT_EQ(items(restarted, 501),
              (std::vector<std::string>{"1::501=/x", "1:com.a:900=/e/A", "2:group.g:501=/c/G"}));
    EXPECT_EQ(items(restarted, 0), (std::vector<std::string>{"4:com.sys:501=/s"}));
    EXPECT_TRUE(items(restarted, 777).empty());
    EXPECT_TRUE(fs::exists(dir())) << "state lives below the root's run directory";
}

TEST_F(SandboxUserStateTest, RecordedItemsAreRecognisedAndIterationStaysOrdered) {
    FileSandboxUserState state(dir());
    // Set out of order: the table is hashed, iteration must still be ordered.
    for (const char* id : {"com.z", "com.a", "com.m"})
        ASSERT_EQ(state.setUserStateItemWithPersona(501, 501, 1, id, "/c/x"), 0);
    ASSERT_EQ(state.setUserStateItemWithPersona(501, 7, 1, "com.a", "/e/a"), 0);
    ASSERT_EQ(state.setUserStateItemWithPersona(501, 501, 2, "com.a", "/g/a"), 0);
    EXPECT_EQ(items(state, 501),
              (std::vector<std::string>{"1:com.a:7=/e/a", "1:com.a:501=/c/x", "1:com.m:501=/c/x",
                                        "1:com.z:501=/c/x", "2:com.a:501=/g/a"}));

    EXPECT_TRUE(state.userStateItemIsRecordedWithPersona(501, 501, 1, "com.a", "/c/x"));
    EXPECT_FALSE(state.userStateItemIsRecordedWithPersona(501, 501, 1, "com.a", "/c/y"))
        << "another path";
    EXPECT_FALSE(state.userStateItemIsRecordedWithPersona(501, 501, 1, "com.a", nullptr))
        << "present, so not recorded as absent";
    EXPECT_FALSE(state.userStateItemIsRecordedWithPersona(501, 8, 1, "com.a", "/c/x"))
        << "another persona";
    EXPECT_FALSE(state.userStateItemIsRecordedWithPersona(501, 501, 4, "com.a", "/c/x"))
        << "another type";
    EXPECT_TRUE(state.userStateItemIsRecordedWithPersona(501, 501, 1, "com.none", nullptr));
    EXPECT_FALSE(state.userStateItemIsRecordedWithPersona(502, 501, 1, "com.a", "/c/x"))
        << "another user";
    EXPECT_FALSE(state.userStateItemIsRecordedWithPersona(501, 501, 1, nullptr, nullptr));

    // The snapshot a big batch writes comes back the same, in order.
    {
        SandboxUserState::Batch batch(state);
        for (int i = 300; i > 0; --i)
            ASSERT_EQ(state.setUserStateItemWithPersona(
                          501, 501, 1, ("com.n" + std::to_string(i)).c_str(), "/n"),
                      0);
    }
    FileSandboxUserState restarted(dir());
    EXPECT_EQ(items(restarted, 501), items(state, 501));
    EXPECT_TRUE(restarted.userStateItemIsRecordedWithPersona(501, 501, 1, "com.n17", "/n"));
}

TEST_F(SandboxUserStateTest, ABatchWritesOnceAtItsEnd) {
    FileSandboxUserState state(dir());
    {
        SandboxUserState::Batch batch(state);
        for (int i = 0; i < 100; ++i)
            ASSERT_EQ(state.setUserStateItemWithPersona(
                          501, 501, 1, ("com.b" + std::to_string(i)).c_str(), "/p"),
                      0);
        EXPECT_FALSE(fs::exists(state.journalForUID(501))) << "nothing written inside the batch";
        EXPECT_EQ(items(state, 501).size(), 100u) << "but visible at once";
    }
    FileSandboxUserState restarted(dir());
    EXPECT_EQ(items(restarted, 501).size(), 100u);

    // Re-pushing what is recorded (clear, then set the same path) writes nothing.
    const auto sizeBefore = fs::file_size(state.journalForUID(501));
    {
        SandboxUserState::Batch batch(restarted);
        ASSERT_EQ(restarted.setUserStateItemWithPersona(501, 501, 1, "com.b7", nullptr), 0);
        ASSERT_EQ(restarted.setUserStateItemWithPersona(501, 501, 1, "com.b7", "/p"), 0);
    }
    EXPECT_EQ(fs::file_size(state.journalForUID(501)), sizeBefore);
}

TEST_F(SandboxUserStateTest, TheJournalIsFoldedIntoTheSnapshotAndATornTailIsIgnored) {
    {
        FileSandboxUserState state(dir());
        // Many more single changes than the table holds: the journal is folded
        // into a snapshot now and then instead of growing without bound.
        for (int i = 0; i < 2000; ++i) {
            const std::string id = "com.j" + std::to_string(i % 10);
            ASSERT_EQ(state.setUserStateItemWithPersona(501, 501, 1, id.c_str(),
                                                        ("/p" + std::to_string(i)).c_str()),
                      0);
        }
        EXPECT_TRUE(fs::exists(state.fileForUID(501)));
        EXPECT_LT(fs::file_size(state.journalForUID(501)), 300u * 100u);
        ASSERT_EQ(state.setUserStateItemWithPersona(501, 501, 1, "com.j0", nullptr), 0);
    }
    // The daemon died in the middle of an append.
    {
        std::ofstream journal(FileSandboxUserState(dir()).journalForUID(501),
                              std::ios::binary | std::ios::app);
        journal.write("\x40\x00\x00\x00bplist", 10);
    }
    FileSandboxUserState restarted(dir());
    const auto all = items(restarted, 501);
    ASSERT_EQ(all.size(), 9u);
    EXPECT_EQ(all.front(), "1:com.j1:501=/p1991");
    EXPECT_EQ(all.back(), "1:com.j9:501=/p1999");
    // Later changes still count: the next load sees them past the torn record.
    ASSERT_EQ(restarted.setUserStateItemWithPersona(501, 501, 1, "com.j1", "/new"), 0);
    FileSandboxUserState again(dir());
    EXPECT_EQ(items(again, 501).front(), "1:com.j1:501=/new");
}

TEST_F(SandboxUserStateTest, AnAppendRemakesADirectoryThatWentAway) {
    FileSandboxUserState state(dir());
    ASSERT_EQ(state.setUserStateItemWithPersona(501, 501, 1, "com.a", "/a"), 0);
    fs::remove_all(dir());  // the run directory was cleared under the daemon
    ASSERT_EQ(state.setUserStateItemWithPersona(501, 501, 1, "com.b", "/b"), 0);
    FileSandboxUserState restarted(dir());
    EXPECT_EQ(items(restarted, 501), std::vector<std::string>{"1:com.b:501=/b"});
}

TEST_F(SandboxUserStateTest, AFailedWriteLeavesTheTableAsTheDiskHasIt) {
    FailpointClearAll();
    FileSandboxUserState state(dir());
    ASSERT_EQ(state.setUserStateItemWithPersona(501, 501, 1, "com.a", "/old"), 0);

    ASSERT_TRUE(FailpointSet("sandbox.recordChanges", "errno:28"));
    EXPECT_EQ(state.setUserStateItemWithPersona(501, 501, 1, "com.a", "/new"), ENOSPC);
    EXPECT_EQ(state.setUserStateItemWithPersona(501, 501, 1, "com.b", "/b"), ENOSPC);
    state.beginBatch();
    EXPECT_EQ(state.setUserStateItemWithPersona(501, 501, 1, "com.a", nullptr), 0);
    EXPECT_EQ(state.endBatch(), ENOSPC);
    EXPECT_EQ(items(state, 501), (std::vector<std::string>{"1:com.a:501=/old"}));
    FailpointClearAll();

    // The same pushes again are real changes now and reach the disk.
    EXPECT_EQ(state.setUserStateItemWithPersona(501, 501, 1, "com.a", "/new"), 0);
    EXPECT_EQ(state.setUserStateItemWithPersona(501, 501, 1, "com.b", "/b"), 0);
    FileSandboxUserState restarted(dir());
    EXPECT_EQ(items(restarted, 501),
              (std::vector<std::string>{"1:com.a:501=/new", "1:com.b:501=/b"}));
}

TEST_F(SandboxUserStateTest, MalformedStateFilesCountAsEmpty) {
    fs::create_directories(dir());
    std::ofstream(PathJoin(dir(), "501.plist")) << "not a property list";
    FileSandboxUserState state(dir());
    EXPECT_TRUE(items(state, 501).empty());
    // And are replaced by the next write.
    EXPECT_EQ(state.setUserStateItemWithPersona(501, 501, 1, "com.c", "/c"), 0);
    FileSandboxUserState restarted(dir());
    EXPECT_EQ(items(restarted, 501).size(), 1u);
}

class SandboxExtensionTest : public test::ScratchRootTest {};

TEST_F(SandboxExtensionTest, TokensBindClassPathAndProcess) {
    SandboxAuditToken me{};
    me[0] = 7;
    SandboxAuditToken other = me;
    other[31] = 1;
    int error = 0;
    auto token = SandboxExtensionIssueFile(kSandboxExtensionClassContainer, "/c/A;B", me, &error);
    ASSERT_TRUE(token) << error;
    EXPECT_EQ(token->rfind("1;com.ostrea.sandbox.container;", 0), 0u);
    EXPECT_TRUE(SandboxExtensionVerify(*token, kSandboxExtensionClassContainer, "/c/A;B", me));
    EXPECT_FALSE(
        SandboxExtensionVerify(*token, kSandboxExtensionClassApplicationGroup, "/c/A;B", me));
    EXPECT_FALSE(SandboxExtensionVerify(*token, kSandboxExtensionClassContainer, "/c/A", me));
    EXPECT_FALSE(SandboxExtensionVerify(*token, kSandboxExtensionClassContainer, "/c/A;B", other));
    std::string forged = *token;
    forged.back() = forged.back() == '0' ? '1' : '0';
    EXPECT_FALSE(SandboxExtensionVerify(forged, kSandboxExtensionClassContainer, "/c/A;B", me));

    struct stat st;
    ASSERT_EQ(::stat(SandboxExtensionKeyPath().c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);
    EXPECT_EQ(st.st_size, 32);

    // A new boot (the key gone) invalidates old tokens.
    fs::remove(SandboxExtensionKeyPath());
    EXPECT_FALSE(SandboxExtensionVerify(*token, kSandboxExtensionClassContainer, "/c/A;B", me));

    EXPECT_FALSE(SandboxExtensionIssueFile("bad;class", "/p", me, &error));
    EXPECT_EQ(error, EINVAL);
    EXPECT_FALSE(SandboxExtensionIssueFile(kSandboxExtensionClassContainer, "", me, &error));
}

}  // namespace
}  // namespace tarn
