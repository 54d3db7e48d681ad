// Staged deletion through the command queue: containers leave their live
// place for death row (or are removed in place), leave the cache, and bundles
// take their code-signing records with them; the queue stops at the first
// failing command.
#include "Daemon/TarnCommandStageForDelete.h"

#include <gtest/gtest.h>

#include <filesystem>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnDaemon.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnSQLiteDB.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/Failpoints.h"
#include "Platform/PlatformLog.h"
#include "support/ResultCode.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;
using test::withCode;

constexpr const char* kLibrary = "/private/var/root/Library/TarnKeeper";

// A command that only fails, to stand first in a queue.
class FailingCommand : public TarnCommand {
  public:
    uint64_t command() const override { return 99; }
    TarnStatus fromQueue(TarnCommandQueue*) override {
        ++runs;
        return TARN_ERROR_CODE(TarnErrorCacheRemoveFailed, nullptr);
    }
    int runs = 0;
};

class TarnCommandStageForDeleteTest : public test::ScratchRootTest {
  protected:
    void SetUp() override {
        TARN_REQUIRE_ROOT();
        PlatformLogSetQuiet(true);
        TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
        root_.mkdirs(kLibrary);
        TarnCodeSigningMapping::TEST_setSharedInstance(std::make_unique<TarnCodeSigningMapping>(
            nullptr, DispatchQueue::createSerial("com.ostrea.TarnKeeper.EntitlementQueue"),
            TarnSQLiteDB::initWithParentDirectoryURL(root_.at(kLibrary))));
        // Deletion passes wait, so that death row shows what was staged.
        TarnDeathRowQueue()->suspend();
    }
    void TearDown() override {
        if (IsSkipped()) return;
        TarnDeathRowQueue()->resume();
        FailpointClearAll();
        TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt);
        TarnCodeSigningMapping::TEST_setSharedInstance(nullptr);
    }

    static TarnContainerIdentityRef identity(const std::string& identifier,
                                             TarnContainerClass containerClass) {
        return TarnContainerIdentity::containerIdentityWithUserIdentity(
                   TarnUserIdentityCache::defaultUserIdentity(), identifier, containerClass)
            .value();
    }
    TarnMetadataRef create(const std::string& identifier, TarnContainerClass containerClass,
                           bool transient = false) {
        uint64_t code = TarnSuccess;
        TarnMetadataRef made =
            withCode(connection_.createOrLookupContainerWithContainerIdentity(
                         identity(identifier, containerClass), true, transient, true),
                     &code)
                .valueOr(nullptr);
        EXPECT_TRUE(made) << code;
        return made;
    }
    bool cached(const std::string& identifier, TarnContainerClass containerClass) {
        return connection_
                   .createOrLookupContainerWithContainerIdentity(
                       identity(identifier, containerClass), false, false, true)
                   .valueOr(nullptr) != nullptr;
    }
    static FileURL deathRowItem(const TarnMetadataRef& m) {
        return PathJoin(TarnGlobalConfiguration::sharedInstance().deathrowDirectory(),
                        PathLastComponent(m->url()));
    }
    static std::shared_ptr<TarnCommandStageForDelete> stage(
        std::vector<TarnContainerIdentityRef> identities,
        TarnCommandStageForDelete::ErrorCallback onError = nullptr) {
        return TarnCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
            std::move(identities), true, std::move(onError));
    }

    void store(const std::string& id, std::vector<std::string> children = {}) {
        auto entry = std::make_shared<TarnCodeSigningEntry>(
            PlistDict{{kTarnEntitlementsKey, PlistDict{}}}, 3);
        entry->setChildBundleIdentifiers(std::move(children));
        auto* mapping = TarnCodeSigningMapping::sharedInstance();
        TarnStatus added;
        mapping->queue()->sync(
            [&] { added = mapping->codeSigningMappingDB()->addCodeSigningEntry(entry, id); });
        ASSERT_TRUE(added.ok()) << added.error()->description();
    }
    static bool stored(const std::string& id) {
        return TarnCodeSigningMapping::sharedInstance()->codeSigningEntryForIdentifier(id).ok();
    }

    TarnClientConnection connection_;
};

TEST_F(TarnCommandStageForDeleteTest, DeletionIsQueuedAndStagesTheContainerOnDeathRow) {
    auto made = create("com.example.doomed", 2);
    ASSERT_TRUE(made);
    TarnStatus queued =
        connection_.deleteContainerWithContainerIdentity(identity("com.example.doomed", 2), false);
    EXPECT_TRUE(queued.ok()) << queued.code(TarnSuccess);
    EXPECT_TRUE(fs::exists(made->url())) << "nothing happens before the queue runs";
    EXPECT_EQ(connection_.commandQueue()->TEST_count(), 1u);

    uint64_t code = TarnSuccess;
    EXPECT_TRUE(connection_.completeWithError(&code));
    EXPECT_EQ(code, TarnSuccess);
    EXPECT_FALSE(fs::exists(made->url()));
    EXPECT_TRUE(fs::exists(PathJoin(deathRowItem(made), kTarnMetadataFileName)));
    EXPECT_FALSE(cached("com.example.doomed", 2));

    // Deleting what is not there queues nothing.
    code = TarnSuccess;
    (void)withCode(
        connection_.deleteContainerWithContainerIdentity(identity("com.example.doomed", 2), false),
        &code);
    EXPECT_EQ(code, TarnErrorNotFound);
    EXPECT_EQ(connection_.commandQueue()->TEST_count(), 0u);
}

TEST_F(TarnCommandStageForDeleteTest, ContainersAlreadyGoneAreSkippedWithoutFailing) {
    auto vanished = create("com.example.vanished", 2);
    auto kept = create("com.example.kept", 2);
    ASSERT_TRUE(vanished && kept);
    fs::remove_all(vanished->url());  // behind the cache's back
    auto neverMade =
        TarnConcreteContainerIdentity::containerIdentityWithUUID(
            Uuid::generate(), TarnUserIdentityCache::defaultUserIdentity(), "com.example.never", 2)
            .value();

    bool called = false;
    auto command =
        stage({identity("com.example.vanished", 2), neverMade}, [&](uint64_t) { called = true; });
    TarnCommandQueue queue;
    queue.insertCommand(command);
    TarnStatus ran = queue.executeAllUntilExhaustedOrError();
    EXPECT_TRUE(ran.ok()) << ran.code(TarnSuccess);
    EXPECT_FALSE(called);
    EXPECT_TRUE(fs::exists(kept->url()));
}

TEST_F(TarnCommandStageForDeleteTest, AFailedRenameFallsBackToRemovalInPlace) {
    auto moved = create("com.example.fallback", 2);
    auto stuck = create("com.example.stuck", 2);
    ASSERT_TRUE(moved && stuck);

    ASSERT_TRUE(FailpointSet("fm.move", "errno:13"));
    TarnCommandQueue queue;
    queue.insertCommand(stage({moved->containerIdentity()}));
    EXPECT_TRUE(queue.executeAllUntilExhaustedOrError().ok());
    EXPECT_FALSE(fs::exists(moved->url()));
    EXPECT_FALSE(fs::exists(deathRowItem(moved)));
    EXPECT_FALSE(cached("com.example.fallback", 2));

    // Neither rename nor removal works: logged only, the container stays live and cached.
    ASSERT_TRUE(FailpointSet("fm.remove", "errno:1"));
    queue.insertCommand(stage({stuck->containerIdentity()}));
    EXPECT_TRUE(queue.executeAllUntilExhaustedOrError().ok());
    FailpointClearAll();
    EXPECT_TRUE(fs::exists(stuck->url()));
    EXPECT_TRUE(cached("com.example.stuck", 2));
}

TEST_F(TarnCommandStageForDeleteTest, TheQueueStopsAtTheFirstFailingCommand) {
    auto made = create("com.example.behind", 2);
    ASSERT_TRUE(made);
    auto failing = std::make_shared<FailingCommand>();
    connection_.commandQueue()->insertCommand(failing);
    connection_.commandQueue()->insertCommand(stage({made->containerIdentity()}));

    uint64_t code = TarnSuccess;
    EXPECT_FALSE(connection_.completeWithError(&code));
    EXPECT_EQ(code, TarnErrorCacheRemoveFailed);
    EXPECT_EQ(failing->runs, 1);
    EXPECT_EQ(connection_.commandQueue()->TEST_count(), 1u) << "the second stays queued";
    EXPECT_TRUE(fs::exists(made->url()));
    EXPECT_TRUE(cached("com.example.behind", 2));
}

TEST_F(TarnCommandStageForDeleteTest, BundlesTakeTheirCodeSigningRecordsUnlessAPermanentCopyStays) {
    store("com.example.app", {"com.example.app.widget"});
    store("com.example.app.widget");
    auto permanent = create("com.example.app", 1);
    auto transient = create("com.example.app", 1, true);
    ASSERT_TRUE(permanent && transient);
    ASSERT_TRUE(transient->transient());

    // The transient copy goes; the permanent one still needs the records.
    TarnCommandQueue queue;
    queue.insertCommand(stage({transient->containerIdentity()}));
    EXPECT_TRUE(queue.executeAllUntilExhaustedOrError().ok());
    EXPECT_FALSE(fs::exists(transient->url()));
    EXPECT_TRUE(stored("com.example.app"));
    EXPECT_TRUE(stored("com.example.app.widget"));

    // The permanent one goes, and its records and its children's with it.
    queue.insertCommand(stage({identity("com.example.app", 1)}));
    EXPECT_TRUE(queue.executeAllUntilExhaustedOrError().ok());
    EXPECT_FALSE(fs::exists(permanent->url()));
    EXPECT_FALSE(stored("com.example.app"));
    EXPECT_FALSE(stored("com.example.app.widget"));
    EXPECT_FALSE(cached("com.example.app", 1));
}

}  // namespace
}  // namespace tarn
