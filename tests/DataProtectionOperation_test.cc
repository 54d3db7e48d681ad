// The data-protection change without a daemon: reading and checking pending
// files, their names, how set failures end a pass, and how the handler of
// command 21 keeps to one reply when the request's queued commands fail.
#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCommandQueue.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnDataProtectionChangeOperation.h"
#include "Daemon/TarnDataProtectionCommands.h"
#include "Daemon/TarnDataProtectionManager.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/Failpoints.h"
#include "Platform/FileSystem.h"
#include "Platform/PlatformLog.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;

class DataProtectionOperationTest : public test::ScratchRootTest {
  protected:
    void SetUp() override {
        PlatformLogSetQuiet(true);
        TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
        FailpointClearAll();
    }
    void TearDown() override {
        FailpointClearAll();
        TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt);
        PlatformLogSetQuiet(false);
    }

    static PlistValue validFile() {
        PlistValue d{PlistDict{}};
        d.set(kTarnDataOperationIdentifierKey, "com.example.vault");
        d.set(kTarnDataOperationContainerClassKey, uint64_t{2});
        d.set(kTarnDataOperationProtectionClassKey, int32_t{1});
        d.set(kTarnDataOperationChangeTypeKey, uint32_t{7});
        d.set(kTarnDataOperationRetryIfLockedKey, true);
        d.set(kTarnDataOperationInternalIDKey, Uuid::generate().string());
        d.set(kTarnDataOperationUserIdentityKey,
              TarnUserIdentityCache::defaultUserIdentity()->plist());
        return d;
    }
    static TarnResult<TarnDataProtectionUpdate> check(const PlistValue& d) {
        auto bytes = d.toBinary();
        return TarnDataProtectionChangeOperation::_validateDataProtectionUpdate(
            std::string(bytes.begin(), bytes.end()), "/pending.plist",
            TarnUserIdentitySharedCache::sharedInstance());
    }
    static TarnContainerIdentityRef identity(const std::string& identifier) {
        return TarnContainerIdentity::containerIdentityWithUserIdentity(
                   TarnUserIdentityCache::defaultUserIdentity(), identifier, 2)
            .value();
    }
};

TEST_F(DataProtectionOperationTest, PendingFilesAreCheckedEntryByEntry) {
    TarnResult<TarnDataProtectionUpdate> good = check(validFile());
    ASSERT_TRUE(good.ok());
    EXPECT_EQ(good->identifier, "com.example.vault");
    EXPECT_EQ(good->changeType, 7u);
    EXPECT_TRUE(good->retryIfLocked);
    ASSERT_TRUE(good->userIdentity);

    // The older format names the owner by user id: the personal identity of that user.
    PlistValue older = validFile();
    older.erase(kTarnDataOperationUserIdentityKey);
    older.set(kTarnDataOperationUserIdKey, uint64_t{501});
    TarnResult<TarnDataProtectionUpdate> legacy = check(older);
    ASSERT_TRUE(legacy.ok());
    EXPECT_EQ(legacy->userIdentity->posixUID(), 501u);
    EXPECT_EQ(legacy->legacyUserId, 501u);

    struct Case {
        const char* key;
        PlistValue value;  // null: the key is removed
    };
    const Case bad[] = {
        {kTarnDataOperationIdentifierKey, PlistValue(uint64_t{7})},
        {kTarnDataOperationContainerClassKey, PlistValue(uint64_t{14})},
        {kTarnDataOperationContainerClassKey, PlistValue("2")},
        {kTarnDataOperationUserIdentityKey, PlistValue("someone")},
        {kTarnDataOperationProtectionClassKey, PlistValue()},
        {kTarnDataOperationChangeTypeKey, PlistValue("7")},
        {kTarnDataOperationRetryIfLockedKey, PlistValue("yes")},
        {kTarnDataOperationInternalIDKey, PlistValue(uint64_t{1})},
        {kTarnDataOperationInternalIDKey, PlistValue("not-a-uuid")},
    };
    for (const Case& c : bad) {
        PlistValue d = validFile();
        if (c.value.isNull())
            d.erase(c.key);
        else
            d.set(c.key, c.value);
        EXPECT_EQ(check(d).code(TarnSuccess), TarnErrorInvalidMetadata) << c.key;
    }
    PlistValue noOwner = validFile();
    noOwner.erase(kTarnDataOperationUserIdentityKey);
    EXPECT_EQ(check(noOwner).code(TarnSuccess), TarnErrorInvalidMetadata);

    auto raw = [](const std::string& bytes) {
        return TarnDataProtectionChangeOperation::_validateDataProtectionUpdate(
                   bytes, "/p", TarnUserIdentitySharedCache::sharedInstance())
            .code(TarnSuccess);
    };
    EXPECT_EQ(raw("not a property list"), TarnErrorReadFailed);
    auto array = PlistValue(PlistArray{PlistValue("x")}).toBinary();
    EXPECT_EQ(raw(std::string(array.begin(), array.end())), TarnErrorReadFailed);
    EXPECT_EQ(TarnDataProtectionChangeOperation::_readAndValidateDataProtectionUpdateAtURL(
                  "", TarnUserIdentitySharedCache::sharedInstance())
                  .code(TarnSuccess),
              TarnErrorBadInput);
}

TEST_F(DataProtectionOperationTest, PendingFileNamesStayInTheirDirectory) {
    const FileURL directory = TarnGlobalConfiguration::sharedInstance().pendingUpdatesDirectory();
    const std::string user = TarnUserIdentityCache::defaultUserIdentity()->identifier();
    EXPECT_EQ(TarnDataProtectionChangeOperation::urlForProtectionOperationWithContainerIdentity(
                  *identity("com.example.vault")),
              PathJoin(directory, "com.example.vault-2-" + user + ".plist"));
    const FileURL escaped =
        TarnDataProtectionChangeOperation::urlForProtectionOperationWithContainerIdentity(
            *identity("../../etc/x%"));
    EXPECT_EQ(PathJoin(directory, PathLastComponent(escaped)), escaped);
    EXPECT_EQ(PathLastComponent(escaped), "..%2F..%2Fetc%2Fx%25-2-" + user + ".plist");
}

TEST_F(DataProtectionOperationTest, ChangeTypeFollowsTheDirectionOfTheChange) {
    using M = TarnDataProtectionManager;
    EXPECT_EQ(M::changeTypeForClassChange(3, 1), kTarnChangeEverything);
    EXPECT_EQ(M::changeTypeForClassChange(1, 3), kTarnChangeDirectories);
    EXPECT_EQ(M::changeTypeForClassChange(0, 1), kTarnChangeEverything);
    EXPECT_EQ(M::changeTypeForClassChange(0, 3), kTarnChangeDirectories);
    EXPECT_EQ(M::changeTypeForClassChange(0, 4), kTarnChangeDirectories);
}

// A file that cannot take a class for its kind (EBADF) is skipped; any other
// failure ends the change with a code and leaves the recorded class alone.
TEST_F(DataProtectionOperationTest, OnlyUnsuitableItemsAreSkipped) {
    TARN_REQUIRE_ROOT();
    auto& manager = TarnDataProtectionManager::defaultManager();
    auto connection = TarnClientConnection::privilegedClientConnectionWithUserIdentity(
        TarnUserIdentityCache::defaultUserIdentity());
    TarnResult<TarnMetadataRef> made = connection->createOrLookupContainerWithContainerIdentity(
        identity("com.example.skip"), /*createIfNecessary=*/true, /*transient=*/false,
        /*useLocking=*/true);
    ASSERT_TRUE(made.ok());
    const FileURL docs = PathJoin((*made)->url(), "Documents");
    auto classOf = [](const FileURL& url) {
        return TarnFileManager::defaultManager().dataProtectionClassOfItemAtURL(url).valueOr(-1);
    };
    auto change = [&](int32_t cls) {
        std::atomic<uint64_t> code{0};
        manager.setDataProtectionOnDataContainerForContainerIdentity(
            identity("com.example.skip"), cls, false, false, [&](uint64_t c) { code = c; });
        return code.load();  // no retry: the completion ran before the return
    };

    const FileURL tmp = PathJoin((*made)->url(), "tmp");
    // The first item set is Documents (a leaf, visited first on the way back up).
    ASSERT_TRUE(FailpointSet("fm.setDataProtectionClass", "errno:9@1"));
    EXPECT_EQ(change(3), TarnSuccess);
    EXPECT_EQ(classOf(docs), 0);
    EXPECT_EQ(classOf(tmp), 3);

    ASSERT_TRUE(FailpointSet("fm.setDataProtectionClass", "errno:5"));
    EXPECT_EQ(change(4), TarnErrorInvalidArgument) << "a file-layer failure has no code of ours";
    FailpointClearAll();
    EXPECT_EQ(classOf(tmp), 3);
    TarnMetadataRef after =
        TarnContainerCache::sharedInstance()
            .containerForContainerIdentity(identity("com.example.skip"), false, false)
            .value();
    EXPECT_EQ(TarnDataProtectionManager::recordedDataProtectionClassOfContainer(*after), 3);
    EXPECT_TRUE(fs::is_empty(TarnGlobalConfiguration::sharedInstance().pendingUpdatesDirectory()));
}

// The request's queued commands run before the change starts, so a failing
// one is the only answer (through the error slot, sent by the processor) and
// a succeeding one leaves the completion's reply as the only one.
TEST_F(DataProtectionOperationTest, OneReplyWhateverTheQueuedCommandsDo) {
    struct CountingReply : TarnDeferredReply {
        PlistValue reply{PlistDict{}};
        std::atomic<int> sent{0};
        std::atomic<uint64_t> code{0};
        PlistValue& body() override { return reply; }
        void send(uint64_t c) override {
            code = c;
            ++sent;
        }
    };
    struct Queued : TarnCommand {
        uint64_t result;
        explicit Queued(uint64_t r) : result(r) {}
        uint64_t command() const override { return 99; }
        TarnStatus fromQueue(TarnCommandQueue*) override {
            if (result == TarnSuccess) return {};
            return TARN_ERROR_CODE(result, nullptr);
        }
    };
    const PlistValue request = [] {
        PlistValue r{PlistDict{}};
        r.set("Identifier", "com.example.absent");
        r.set("ContainerClass", uint64_t{2});
        r.set("DataProtectionClass", int64_t{1});
        return r;
    }();

    for (uint64_t queuedResult : {uint64_t{TarnErrorDatabase}, uint64_t{TarnSuccess}}) {
        SCOPED_TRACE(queuedResult);
        auto connection = TarnClientConnection::privilegedClientConnectionWithUserIdentity(
            TarnUserIdentityCache::defaultUserIdentity());
        connection->commandQueue()->insertCommand(std::make_shared<Queued>(queuedResult));
        connection->commandQueue()->insertCommand(std::make_shared<Queued>(TarnSuccess));
        auto deferred = std::make_shared<CountingReply>();
        TarnRequestContext context{.commandQueue = connection->commandQueue(),
                                   .deferredReply = deferred};
        PlistValue reply{PlistDict{}};
        uint64_t error = TarnSuccess;
        TarnHandleSetDataProtectionCommand(context, request, reply, connection.get(), &error);
        connection->completeWithError(&error);  // what the processor does next

        const bool processorReplies = error != TarnSuccess;
        EXPECT_EQ(deferred->sent.load() + (processorReplies ? 1 : 0), 1);
        EXPECT_EQ(connection->commandQueue()->TEST_count(), 0u);
        if (queuedResult == TarnSuccess)
            EXPECT_EQ(deferred->code.load(), TarnErrorNotFound) << "the change's own answer";
        else
            EXPECT_EQ(error, TarnErrorDatabase);
    }
}

}  // namespace
}  // namespace tarn
