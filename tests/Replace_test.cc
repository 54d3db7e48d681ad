// Replacing one container by another in this process: where the new
// container ends up (with and without the old one's directory and UUID, with
// and without a two-way rename), promotion when there is no old container,
// the failure path that puts a parked old container back, and start-up
// recovery reading the replace files left behind, good and bad.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnPropertyListFile.h"
#include "Daemon/TarnSQLiteDB.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/Failpoints.h"
#include "Platform/PlatformLog.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;

constexpr TarnContainerClass kAppData = 2;

class ReplaceTest : public test::ScratchRootTest {
  protected:
    void SetUp() override {
        TARN_REQUIRE_ROOT();
        FailpointClearAll();
        PlatformLogSetQuiet(true);
        logPath_ = root_.at("/platform.log");
        PlatformLogSetFile(logPath_);
        TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
        root_.mkdirs("/private/var/root/Library/TarnKeeper");
        TarnCodeSigningMapping::TEST_setSharedInstance(std::make_unique<TarnCodeSigningMapping>(
            nullptr, DispatchQueue::createSerial("com.ostrea.TarnKeeper.EntitlementQueue"),
            TarnSQLiteDB::initWithParentDirectoryURL(
                root_.at("/private/var/root/Library/TarnKeeper"))));
    }
    void TearDown() override {
        FailpointClearAll();
        PlatformLogSetFile("");
        PlatformLogSetQuiet(false);
        TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt);
        TarnCodeSigningMapping::TEST_setSharedInstance(nullptr);
        EXPECT_EQ(gTarnLocks.TEST_allReaderWriterState(), 0);
    }

    static TarnUserIdentityRef mobile() { return TarnUserIdentityCache::defaultUserIdentity(); }

    // A container of the class made the daemon's way, with a file `marker`
    // in it that tells its contents apart.
    TarnMetadataRef make(const std::string& identifier, bool transient, const std::string& marker,
                         TarnContainerClass c = kAppData) {
        auto identity =
            TarnContainerIdentity::containerIdentityWithUserIdentity(mobile(), identifier, c);
        EXPECT_TRUE(identity.ok());
        auto made = connection_.createOrLookupContainerWithContainerIdentity(
            *identity, /*createIfNecessary=*/true, transient, /*useLocking=*/true);
        EXPECT_TRUE(made.ok()) << made.code(TarnSuccess);
        if (!made.ok()) return nullptr;
        std::ofstream(PathJoin((*made)->url(), marker)) << marker;
        return *made;
    }

    static bool holds(const FileURL& dir, const std::string& marker) {
        return fs::exists(PathJoin(dir, marker));
    }
    static size_t entriesIn(const FileURL& dir) {
        if (!fs::exists(dir)) return 0;
        return static_cast<size_t>(
            std::distance(fs::directory_iterator(dir), fs::directory_iterator()));
    }
    static size_t directoriesIn(const FileURL& dir) {
        size_t n = 0;
        if (fs::exists(dir))
            for (const auto& e : fs::directory_iterator(dir)) n += e.is_directory() ? 1 : 0;
        return n;
    }
    static FileURL replaceDirectory() {
        return TarnGlobalConfiguration::sharedInstance().replaceDirectory();
    }
    static FileURL staging() {
        return TarnGlobalConfiguration::sharedInstance().stagingDirectoryURLForUserIdentity(
            mobile(), kAppData);
    }
    static FileURL live(bool transient = false) {
        return *TarnGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
            mobile(), kAppData, transient);
    }
    static Uuid uuidOnDisk(const FileURL& dir) {
        auto read = TarnMetadata::readAndValidateMetadataAtUrl(dir, mobile(), false);
        EXPECT_TRUE(read.ok()) << dir;
        return read.ok() ? (*read)->uuid() : Uuid();
    }

    std::string log() {
        std::ifstream in(logPath_);
        std::stringstream s;
        s << in.rdbuf();
        return s.str();
    }

    TarnStatus replace(const TarnMetadataRef& old, const TarnMetadataRef& neu, bool preserve) {
        return connection_.replaceContainerIdentity(old ? old->containerIdentity() : nullptr,
                                                    neu->containerIdentity(), preserve,
                                                    /*startDeletionThread=*/false);
    }

    TarnClientConnection connection_;
    std::string logPath_;
};

TEST_F(ReplaceTest, NewContainerEndsWherePreservationSays) {
    struct Mode {
        const char* name;
        bool preserve;
        const char* failpoints;  // "" or what the run arms
    };
    const Mode modes[] = {
        {"keeps its own name", false, ""},
        {"preserving, swapped in one step", true, ""},
        {"preserving, where the file system cannot swap", true, "fm.exchange=errno:22"},
    };
    int round = 0;
    for (const Mode& mode : modes) {
        SCOPED_TRACE(mode.name);
        ASSERT_TRUE(FailpointConfigure(mode.failpoints));
        const std::string id = "com.replace.app" + std::to_string(round++);
        TarnMetadataRef old = make(id, /*transient=*/false, "old");
        TarnMetadataRef neu = make(id, /*transient=*/true, "new");
        ASSERT_TRUE(old && neu);

        TarnStatus replaced = replace(old, neu, mode.preserve);
        ASSERT_TRUE(replaced.ok()) << replaced.code(TarnSuccess);
        FailpointClearAll();

        const FileURL dest =
            mode.preserve ? old->url() : PathJoin(live(), PathLastComponent(neu->url()));
        const Uuid uuid = mode.preserve ? old->uuid() : neu->uuid();
        EXPECT_TRUE(holds(dest, "new"));
        EXPECT_FALSE(holds(dest, "old"));
        EXPECT_FALSE(fs::exists(neu->url()));
        if (!mode.preserve) EXPECT_FALSE(fs::exists(old->url()));
        // The cache and the metadata file agree on place and UUID, in the
        // permanent tree as the old container was.
        auto cached = TarnContainerCache::sharedInstance().containerForContainerIdentity(
            TarnConcreteContainerIdentity::containerIdentityWithUUID(uuid, mobile(), id, kAppData)
                .value());
        ASSERT_TRUE(cached);
        EXPECT_EQ(cached->url(), dest);
        EXPECT_FALSE(cached->transient());
        EXPECT_EQ(uuidOnDisk(dest), uuid);
        // Nothing is left behind but death row's share.
        EXPECT_EQ(entriesIn(replaceDirectory()), 0u);
        EXPECT_EQ(directoriesIn(staging()), 0u);
    }
}

TEST_F(ReplaceTest, WithoutOldContainerTheNewOneIsPromotedWithoutReplaceFile) {
    TarnMetadataRef neu = make("com.replace.promoted", /*transient=*/true, "new");
    ASSERT_TRUE(neu);
    // A replace file would fail here: none is written.
    ASSERT_TRUE(FailpointSet("replace.writeFile", "errno:5"));
    TarnStatus promoted = replace(nullptr, neu, false);
    ASSERT_TRUE(promoted.ok()) << promoted.code(TarnSuccess);
    const FileURL dest = PathJoin(live(), PathLastComponent(neu->url()));
    EXPECT_TRUE(holds(dest, "new"));
    EXPECT_EQ(entriesIn(replaceDirectory()), 0u);

    // A second one of the same identity finds the first in place.
    TarnMetadataRef again = make("com.replace.promoted", /*transient=*/true, "again");
    EXPECT_EQ(replace(nullptr, again, false).code(TarnSuccess), TarnErrorAlreadyExists);
    EXPECT_TRUE(holds(again->url(), "again"));
}

TEST_F(ReplaceTest, RefusalsMoveNothing) {
    TarnMetadataRef old = make("com.replace.a", false, "old");
    TarnMetadataRef neu = make("com.replace.a", true, "new");
    TarnMetadataRef other = make("com.replace.b", true, "other", /*class=*/10);
    ASSERT_TRUE(old && neu && other);
    EXPECT_EQ(replace(nullptr, neu, /*preserve=*/true).code(TarnSuccess), TarnErrorInvalidArgument);
    EXPECT_EQ(replace(old, other, false).code(TarnSuccess), TarnErrorReplaceClassMismatch);
    EXPECT_EQ(replace(old, old, false).code(TarnSuccess), TarnErrorReplaceSameContainer);
    auto missing = TarnConcreteContainerIdentity::containerIdentityWithUUID(
                       Uuid::generate(), mobile(), std::string("com.replace.a"), kAppData)
                       .value();
    EXPECT_EQ(connection_.replaceContainerIdentity(missing, neu->containerIdentity(), false, false)
                  .code(TarnSuccess),
              TarnErrorNotFound);
    EXPECT_TRUE(holds(old->url(), "old"));
    EXPECT_TRUE(holds(neu->url(), "new"));
    EXPECT_EQ(entriesIn(replaceDirectory()), 0u);
}

TEST_F(ReplaceTest, FailureBeforeTheNewArrivesPutsTheOldBack) {
    struct Case {
        const char* failpoint;
        bool preserve;
        uint64_t code;
    };
    const Case cases[] = {
        {"replace.writeFile", false, TarnErrorWriteFailed},
        {"replace.uncacheOld", false, TarnErrorCacheRemoveFailed},
        {"replace.park", false, TarnErrorReplaceStagingFailed},
        {"replace.moveNew", false, TarnErrorReplaceFailed},
        {"replace.park", true, TarnErrorReplaceFailed},
        {"fm.exchange", true, TarnErrorReplaceFailed},
    };
    int round = 0;
    for (const Case& c : cases) {
        SCOPED_TRACE(std::string(c.failpoint) + (c.preserve ? " preserving" : ""));
        const std::string id = "com.replace.fail" + std::to_string(round++);
        TarnMetadataRef old = make(id, false, "old");
        TarnMetadataRef neu = make(id, true, "new");
        ASSERT_TRUE(old && neu);
        ASSERT_TRUE(FailpointSet(c.failpoint, "errno:5"));
        const TarnStatus replaced = replace(old, neu, c.preserve);
        FailpointClearAll();
        EXPECT_EQ(replaced.code(TarnSuccess), c.code);
        EXPECT_TRUE(holds(old->url(), "old"));
        EXPECT_FALSE(holds(old->url(), "new"));
        EXPECT_EQ(uuidOnDisk(old->url()), old->uuid());
        EXPECT_TRUE(holds(neu->url(), "new"));
        EXPECT_EQ(uuidOnDisk(neu->url()), neu->uuid());
        EXPECT_EQ(entriesIn(replaceDirectory()), 0u);
        EXPECT_EQ(directoriesIn(staging()), 0u);
    }

    // Once the new one has arrived the replacement stands; only the parked
    // old copy is discarded.
    TarnMetadataRef old = make("com.replace.late", false, "old");
    TarnMetadataRef neu = make("com.replace.late", true, "new");
    ASSERT_TRUE(FailpointSet("replace.cacheNew", "errno:5"));
    EXPECT_EQ(replace(old, neu, false).code(TarnSuccess), TarnErrorCacheAddFailed);
    EXPECT_TRUE(holds(PathJoin(live(), PathLastComponent(neu->url())), "new"));
    EXPECT_FALSE(fs::exists(old->url()));
    EXPECT_EQ(directoriesIn(staging()), 0u);
}

TEST_F(ReplaceTest, RecoveryRestoresFromGoodFilesAndDiscardsBadOnes) {
    const FileURL parked = PathJoin(staging(), Uuid::generate().string());
    const FileURL oldURL = PathJoin(live(), Uuid::generate().string());
    const FileURL newURL = PathJoin(live(true), Uuid::generate().string());
    fs::create_directories(parked);
    std::ofstream(PathJoin(parked, "old")) << "old";
    const auto write = [&](const std::string& name, const std::string& bytes) {
        std::ofstream(PathJoin(replaceDirectory(), name), std::ios::binary) << bytes;
    };
    const auto dictionary = [&](const FileURL& dest, const char* dropKey, bool numberForNew) {
        PlistValue d{PlistDict{}};
        d.set("TarnReplaceOperationOldURL", oldURL);
        d.set("TarnReplaceOperationNewURL",
              numberForNew ? PlistValue(uint64_t{7}) : PlistValue(newURL));
        d.set("TarnReplaceOperationStagingURL", parked);
        d.set("TarnReplaceOperationDestURL", dest);
        if (dropKey) d.erase(dropKey);
        const std::vector<uint8_t> bytes = d.toBinary();
        return std::string(bytes.begin(), bytes.end());
    };
    // Bad files, each of which would restore if it were read.
    write("missing.plist", dictionary(oldURL, "TarnReplaceOperationDestURL", false));
    write("type.plist", dictionary(oldURL, nullptr, true));
    write("garbage.plist", "\x00\x01garbage bytes\xff");
    write("relative.plist", dictionary("private/var/x", nullptr, false));
    ASSERT_TRUE(connection_._recoverFromReplaceOperationsWithError().ok());
    EXPECT_FALSE(fs::exists(oldURL));
    EXPECT_TRUE(holds(parked, "old"));
    EXPECT_EQ(entriesIn(replaceDirectory()), 0u);
    EXPECT_NE(log().find("Invalid replace data"), std::string::npos);
    EXPECT_NE(log().find("Bad Data in replace file"), std::string::npos);

    // A destination that holds something means the new one arrived.
    const FileURL arrived = PathJoin(live(), Uuid::generate().string());
    fs::create_directories(arrived);
    write("arrived.plist", dictionary(arrived, nullptr, false));
    ASSERT_TRUE(connection_._recoverFromReplaceOperationsWithError().ok());
    EXPECT_FALSE(fs::exists(oldURL));

    // Neither there: the parked old container goes back.
    write("good.plist", dictionary(PathJoin(live(), Uuid::generate().string()), nullptr, false));
    ASSERT_TRUE(connection_._recoverFromReplaceOperationsWithError().ok());
    EXPECT_TRUE(holds(oldURL, "old"));
    EXPECT_FALSE(fs::exists(parked));
    EXPECT_EQ(entriesIn(replaceDirectory()), 0u);
}

TEST_F(ReplaceTest, WrittenReplaceFileReadsBack) {
    const FileURL file = PathJoin(replaceDirectory(), "x.plist");
    const FileURL a = root_.at("/a"), b = root_.at("/b"), c = root_.at("/c"), d = root_.at("/d");
    EXPECT_EQ(TarnClientConnection::_writeToDiskReplaceAt(file, a, b, "", d).code(TarnSuccess),
              TarnErrorInvalidReplaceInfo);
    ASSERT_TRUE(TarnClientConnection::_writeToDiskReplaceAt(file, a, b, c, d).ok());
    auto info = TarnClientConnection::_readAndValidateReplaceFileAtUrl(file);
    ASSERT_TRUE(info.ok());
    EXPECT_EQ(info->oldURL, a);
    EXPECT_EQ(info->newURL, b);
    EXPECT_EQ(info->stagingURL, c);
    EXPECT_EQ(info->destURL, d);
    // Paths outside the root or climbing out of it are not ours to move.
    PlistValue outside{PlistDict{}};
    for (const char* key : {"TarnReplaceOperationOldURL", "TarnReplaceOperationNewURL",
                            "TarnReplaceOperationStagingURL", "TarnReplaceOperationDestURL"})
        outside.set(key, a);
    outside.set("TarnReplaceOperationStagingURL", root_.at("/a/../../etc"));
    EXPECT_EQ(TarnClientConnection::_validateReplaceDictionary(outside, file).code(TarnSuccess),
              TarnErrorReplaceRecoveryFailed);
    EXPECT_EQ(TarnClientConnection::_readAndValidateReplaceFileAtUrl(root_.at("/none.plist"))
                  .code(TarnSuccess),
              TarnErrorReplaceRecoveryFailed);
}

}  // namespace
}  // namespace tarn
