// Operations on one existing container: info values through the metadata
// file, remembered bundle sizes, structure repair and directory renaming, and
// which identifier lock each of them takes.
#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>
#include <sstream>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnTestLocks.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Daemon/TarnWhitelist.h"
#include "Platform/Failpoints.h"
#include "Platform/FileSystem.h"
#include "Platform/HostConfiguration.h"
#include "Platform/PlatformLog.h"
#include "support/ResultCode.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using test::withCode;

constexpr gid_t kSystemUsersGID = 1020;  // seeded by the scratch root

// Runs `work` on its own thread; tells whether it is still held up.
template <class T>
class Background {
  public:
    explicit Background(std::function<T()> work)
        : future_(std::async(std::launch::async, std::move(work))) {}
    bool blocked() { return future_.wait_for(150ms) != std::future_status::ready; }
    // Waits for the result (bounded, so a deadlock fails instead of hanging).
    std::optional<T> result() {
        if (future_.wait_for(10s) != std::future_status::ready) return std::nullopt;
        return future_.get();
    }

  private:
    std::future<T> future_;
};

class TarnPerContainerOpsTest : public test::ScratchRootTest {
  protected:
    void SetUp() override {
        savedHost_ = HostConfiguration::shared();
        TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
        PlatformLogSetQuiet(true);
        logPath_ = root_.at("/platform.log");
        PlatformLogSetFile(logPath_);
    }
    void TearDown() override {
        FailpointClearAll();
        TarnTestLocks::sharedInstance().setEnabled(false);
        PlatformLogSetFile("");
        PlatformLogSetQuiet(false);
        TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt);
        HostConfiguration::TEST_setShared(savedHost_);
        EXPECT_EQ(gTarnLocks.TEST_allReaderWriterState(), 0);
        EXPECT_EQ(gTarnLocks.TEST_identifierReaderCount(), 0u);
        EXPECT_EQ(gTarnLocks.TEST_identifierWriterCount(), 0u);
    }

    void setFastSizing(bool on) {
        HostConfiguration config = savedHost_;
        config.featureFlags["fast_container_sizing"] = on;
        HostConfiguration::TEST_setShared(config);
    }

    TarnUserIdentityRef mobile() { return TarnUserIdentityCache::defaultUserIdentity(); }

    // A container on disk (metadata written, directory named by a fresh UUID
    // unless `name` is given), recorded in the shared cache.
    TarnConcreteContainerIdentityRef makeContainer(TarnContainerClass c,
                                                   const std::string& identifier,
                                                   std::string name = "") {
        Uuid uuid = Uuid::generate();
        if (name.empty()) name = Uuid::generate().string();
        FileURL dir = PathJoin(
            *TarnGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
                mobile(), c, false),
            name);
        fs::create_directories(dir);
        auto identity =
            TarnConcreteContainerIdentity::containerIdentityWithUUID(uuid, mobile(), identifier, c)
                .value();
        auto m = TarnMetadata::initWithContainerIdentity(identity, std::nullopt, dir, std::nullopt);
        TarnStatus written = m->writeMetadataToDiskWithError();
        EXPECT_TRUE(written.ok()) << (written.error() ? written.error()->description() : "");
        TarnStatus added = TarnContainerCache::sharedInstance().addContainerMetadata(
            m, dir, /*transient=*/false, /*updateSandbox=*/true);
        EXPECT_TRUE(added.ok()) << (added.error() ? added.error()->description() : "");
        return identity;
    }

    TarnConcreteContainerIdentityRef missing(TarnContainerClass c = 2) {
        return TarnConcreteContainerIdentity::containerIdentityWithUUID(
                   Uuid::generate(), mobile(), std::string("com.ostrea.nowhere"), c)
            .value();
    }

    FileURL urlOf(const TarnConcreteContainerIdentityRef& identity) {
        auto m = TarnContainerCache::sharedInstance().containerForContainerIdentity(identity);
        return m ? m->url() : FileURL();
    }

    // The info dictionary as the metadata file holds it.
    std::optional<PlistValue> infoOnDisk(const FileURL& url) {
        auto m = TarnMetadata::readAndValidateMetadataAtUrl(url, mobile(), false);
        EXPECT_TRUE(m.ok()) << (m.error() ? m.error()->description() : "");
        return m.ok() ? (*m)->info() : std::nullopt;
    }
    // One value of it; empty when the file or the key is missing.
    std::optional<PlistValue> infoValueOnDisk(const FileURL& url, const char* key) {
        auto info = infoOnDisk(url);
        const PlistValue* v = info ? info->find(key) : nullptr;
        return v ? std::optional<PlistValue>(*v) : std::nullopt;
    }

    std::string log() {
        std::ifstream in(logPath_);
        std::stringstream s;
        s << in.rdbuf();
        return s.str();
    }

    static void writeBytes(const FileURL& url, size_t count) {
        std::ofstream(url, std::ios::binary) << std::string(count, 'x');
    }

    static std::optional<std::string> key(const char* k) { return std::string(k); }

    // An info value as a client reads it (with locking); empty after a failure.
    std::optional<PlistValue> infoValue(const TarnConcreteContainerIdentityRef& id, const char* k) {
        TarnResult<PlistValue> value = connection_.infoValueForKey(key(k), id, true);
        return value.ok() ? std::optional<PlistValue>(*value) : std::nullopt;
    }

    TarnClientConnection connection_;
    HostConfiguration savedHost_;
    std::string logPath_;
};

TEST_F(TarnPerContainerOpsTest, InfoValuesGoThroughTheMetadataFileAndNilRemoves) {
    auto app = makeContainer(2, "com.ostrea.notes");
    const FileURL url = urlOf(app);
    ASSERT_FALSE(url.empty());

    TarnStatus colourSet = connection_.setInfoValue(PlistValue("red"), key("Colour"), app, true);
    TarnStatus counterSet =
        connection_.setInfoValue(PlistValue(uint64_t{3}), key("CrashCounter"), app, true);
    ASSERT_TRUE(colourSet.ok() && counterSet.ok());
    EXPECT_EQ(infoValue(app, "Colour"), PlistValue("red"));
    EXPECT_EQ(infoValueOnDisk(url, "CrashCounter"), PlistValue(uint64_t{3}));

    // nil and a Null value both remove, from the cache and from the file.
    TarnStatus colourRemoved = connection_.setInfoValue(std::nullopt, key("Colour"), app, true);
    TarnStatus counterRemoved =
        connection_.setInfoValue(PlistValue(), key("CrashCounter"), app, true);
    EXPECT_TRUE(colourRemoved.ok() && counterRemoved.ok());
    EXPECT_FALSE(infoValueOnDisk(url, "Colour"));
    EXPECT_FALSE(infoValueOnDisk(url, "CrashCounter"));
    uint64_t error = TarnSuccess;
    EXPECT_FALSE(withCode(connection_.infoValueForKey(key("Colour"), app, true), &error));
    EXPECT_EQ(error, TarnErrorInfoValueNotFound);
    EXPECT_EQ(log().find("Didn't find info value"), std::string::npos)
        << "an absent key is an ordinary answer and stays out of the log";

    // The container keeps its identity and place through the rewrites.
    error = TarnSuccess;
    TarnMetadataRef metadata =
        withCode(connection_.metadataWithContainerIdentity(app), &error).valueOr(nullptr);
    ASSERT_TRUE(metadata) << error;
    EXPECT_EQ(metadata->uuid(), app->uuid());
    EXPECT_EQ(metadata->url(), url);
}

TEST_F(TarnPerContainerOpsTest, BadKeysMissingContainersAndFailedWrites) {
    auto app = makeContainer(2, "com.ostrea.notes");
    uint64_t error = TarnSuccess;
    EXPECT_FALSE(withCode(connection_.infoValueForKey(std::nullopt, app, true), &error));
    EXPECT_EQ(error, TarnErrorBadInput);
    error = TarnSuccess;
    (void)withCode(connection_.setInfoValue(PlistValue("x"), std::nullopt, app, true), &error);
    EXPECT_EQ(error, TarnErrorBadInput);
    EXPECT_NE(log().find("Can't set nil or non-string key: (null)"), std::string::npos);

    for (bool useLocking : {true, false}) {
        error = TarnSuccess;
        EXPECT_FALSE(
            withCode(connection_.infoValueForKey(key("k"), missing(), useLocking), &error));
        EXPECT_EQ(error, TarnErrorNotFound);
        error = TarnSuccess;
        (void)withCode(connection_.setInfoValue(PlistValue("v"), key("k"), missing(), useLocking),
                       &error);
        EXPECT_EQ(error, TarnErrorNotFound);
    }
    error = TarnSuccess;
    EXPECT_FALSE(withCode(connection_.metadataWithContainerIdentity(missing()), &error));
    EXPECT_EQ(error, TarnErrorNotFound);
    EXPECT_NE(log().find("No Container with user identity:"), std::string::npos);
    // Same identifier and class but another UUID is another container.
    auto sameNameOtherUUID = TarnConcreteContainerIdentity::containerIdentityWithUUID(
                                 Uuid::generate(), mobile(), std::string("com.ostrea.notes"), 2)
                                 .value();
    error = TarnSuccess;
    EXPECT_FALSE(withCode(connection_.metadataWithContainerIdentity(sameNameOtherUUID), &error));
    EXPECT_EQ(error, TarnErrorNotFound);

    // A metadata file that cannot be written leaves the cache as it was.
    ASSERT_TRUE(FailpointSet("fm.writeData", "errno:28"));
    error = TarnSuccess;
    (void)withCode(connection_.setInfoValue(PlistValue("lost"), key("k"), app, true), &error);
    EXPECT_EQ(error, TarnErrorWriteFailed);
    FailpointClearAll();
    error = TarnSuccess;
    EXPECT_FALSE(withCode(connection_.infoValueForKey(key("k"), app, true), &error));
    EXPECT_EQ(error, TarnErrorInfoValueNotFound);
}

TEST_F(TarnPerContainerOpsTest, BundleSizeIsRememberedOnlyWhileFastSizingIsOff) {
    for (bool fastSizing : {false, true}) {
        SCOPED_TRACE(fastSizing ? "fast sizing on" : "fast sizing off");
        setFastSizing(fastSizing);
        auto bundle = makeContainer(1, "com.ostrea.app" + std::to_string(fastSizing));
        const FileURL url = urlOf(bundle);
        writeBytes(PathJoin(url, "App.bin"), 64 * 1024);

        const uint64_t walks = TarnFileManager::TEST_diskUsageMeasurementCount();
        const TarnResult<uint64_t> firstMeasured =
            connection_.diskUsageWithContainerIdentity(bundle);
        EXPECT_TRUE(firstMeasured.ok());
        const uint64_t first = firstMeasured.valueOr(0);
        EXPECT_GE(first, 64u * 1024);
        EXPECT_EQ(TarnFileManager::TEST_diskUsageMeasurementCount(), walks + 1);

        // The bundle grows behind the daemon's back.
        writeBytes(PathJoin(url, "More.bin"), 256 * 1024);
        const TarnResult<uint64_t> secondMeasured =
            connection_.diskUsageWithContainerIdentity(bundle);
        EXPECT_TRUE(secondMeasured.ok());
        const uint64_t second = secondMeasured.valueOr(0);
        const std::optional<PlistValue> stored = infoValueOnDisk(url, "StaticDiskUsage");
        if (!fastSizing) {
            EXPECT_EQ(second, first) << "the remembered figure";
            EXPECT_EQ(TarnFileManager::TEST_diskUsageMeasurementCount(), walks + 1)
                << "no second walk";
            ASSERT_TRUE(stored);
            EXPECT_EQ(stored->asUInt64(), first);
        } else {
            EXPECT_GE(second, first + 256u * 1024);
            EXPECT_EQ(TarnFileManager::TEST_diskUsageMeasurementCount(), walks + 2);
            EXPECT_FALSE(stored) << "nothing remembered with fast sizing";
        }
    }

    // Data containers change all the time: always measured, never remembered.
    setFastSizing(false);
    auto data = makeContainer(2, "com.ostrea.data");
    const uint64_t walks = TarnFileManager::TEST_diskUsageMeasurementCount();
    TarnResult<uint64_t> once = connection_.diskUsageWithContainerIdentity(data);
    TarnResult<uint64_t> twice = connection_.diskUsageWithContainerIdentity(data);
    EXPECT_TRUE(once.ok() && twice.ok());
    EXPECT_EQ(TarnFileManager::TEST_diskUsageMeasurementCount(), walks + 2);
    EXPECT_FALSE(infoValueOnDisk(urlOf(data), "StaticDiskUsage"));

    uint64_t error = TarnSuccess;
    EXPECT_EQ(withCode(connection_.diskUsageWithContainerIdentity(missing(1)), &error).valueOr(0),
              0u);
    EXPECT_EQ(error, TarnErrorNotFound);
    EXPECT_EQ(TarnFileManager::TEST_diskUsageMeasurementCount(), walks + 2);
}

TEST_F(TarnPerContainerOpsTest, MeasuringWaitsOnGateTwoWithoutHoldingAnyLock) {
    setFastSizing(false);
    auto bundle = makeContainer(1, "com.ostrea.big");
    auto other = makeContainer(2, "com.ostrea.other");
    TarnTestLocks& testLocks = TarnTestLocks::sharedInstance();
    testLocks.setEnabled(true);
    testLocks.acquireLock(2);

    Background<uint64_t> measuring([&] {
        TarnClientConnection connection;
        return connection.diskUsageWithContainerIdentity(bundle).valueOr(0);
    });
    EXPECT_TRUE(measuring.blocked());

    // Other containers, and the measured one itself, can be written and even
    // renamed under the global write lock while the measurement waits. (On
    // a thread of its own, so that a lock wrongly held fails the test rather
    // than hanging it.)
    Background<uint64_t> writes([&] {
        TarnClientConnection connection;
        TarnStatus done = connection.setInfoValue(PlistValue("v"), key("k"), other, true);
        if (done.ok()) done = connection.setInfoValue(PlistValue("v"), key("k"), bundle, true);
        if (done.ok()) done = connection.regenerateDirectoryUUIDWithContainerIdentity(other);
        uint64_t error = TarnSuccess;
        (void)withCode(std::move(done), &error);
        return error;
    });
    const std::optional<uint64_t> written = writes.result();
    const bool stillWaiting = measuring.blocked();

    testLocks.releaseLock(2);
    EXPECT_EQ(written, TarnSuccess);
    EXPECT_TRUE(stillWaiting);
    auto bytes = measuring.result();
    ASSERT_TRUE(bytes) << "the measurement finishes once the gate opens";
    EXPECT_GT(*bytes, 0u);
}

TEST_F(TarnPerContainerOpsTest, EachOperationTakesTheLockOfItsRow) {
    auto app = makeContainer(2, "com.ostrea.locked");
    // A reader of the container's UUID string (canonical form) is in the way
    // of writers and of the global write lock, never of other readers.
    gTarnLocks.read_lock_identifier(app->uuid().string());

    auto run = [&](std::function<void(TarnClientConnection&, uint64_t*)> op) {
        return Background<uint64_t>([op] {
            TarnClientConnection connection;
            uint64_t code = TarnSuccess;
            op(connection, &code);
            return code;
        });
    };
    auto readers = run([&](TarnClientConnection& c, uint64_t* e) {
        if (!withCode(c.metadataWithContainerIdentity(app), e).valueOr(nullptr)) return;
        (void)withCode(c.infoValueForKey(key("k"), app, true), e);
        if (*e != TarnErrorInfoValueNotFound) return;
        *e = TarnSuccess;
        // Without locking nothing is waited for, not even by a writer.
        (void)withCode(c.setInfoValue(PlistValue("unlocked"), key("k"), app, false), e);
    });
    EXPECT_EQ(readers.result(), TarnSuccess);
    auto setter = run([&](TarnClientConnection& c, uint64_t* e) {
        (void)withCode(c.setInfoValue(PlistValue("locked"), key("k"), app, true), e);
    });
    auto repair = run([&](TarnClientConnection& c, uint64_t* e) {
        (void)withCode(c.recreateDefaultStructureWithContainerIdentity(app), e);
    });
    auto rename = run([&](TarnClientConnection& c, uint64_t* e) {
        (void)withCode(c.regenerateDirectoryUUIDWithContainerIdentity(app), e);
    });
    EXPECT_TRUE(setter.blocked());
    EXPECT_TRUE(repair.blocked());
    EXPECT_TRUE(rename.blocked());

    gTarnLocks.unlock_identifier(app->uuid().string());
    EXPECT_EQ(setter.result(), TarnSuccess);
    EXPECT_EQ(repair.result(), TarnSuccess);
    EXPECT_EQ(rename.result(), TarnSuccess);
    // The rename took the record as it stood under its lock, not the one it
    // saw before waiting.
    EXPECT_EQ(infoValue(app, "k"), PlistValue("locked"));
}

TEST_F(TarnPerContainerOpsTest, RegeneratingRenamesTheDirectoryButKeepsTheUUID) {
    auto app = makeContainer(2, "com.ostrea.moving");
    const FileURL before = urlOf(app);
    TarnStatus keptSet = connection_.setInfoValue(PlistValue("kept"), key("k"), app, true);
    TarnStatus renamed = connection_.regenerateDirectoryUUIDWithContainerIdentity(app);
    ASSERT_TRUE(keptSet.ok() && renamed.ok());

    const FileURL after = urlOf(app);
    EXPECT_NE(after, before);
    EXPECT_EQ(PathParent(after), PathParent(before));
    EXPECT_TRUE(Uuid::parse(PathLastComponent(after)));
    EXPECT_NE(*Uuid::parse(PathLastComponent(after)), app->uuid());
    EXPECT_FALSE(fs::exists(before));
    auto onDisk = TarnMetadata::readAndValidateMetadataAtUrl(after, mobile(), false);
    ASSERT_TRUE(onDisk.ok());
    EXPECT_EQ((*onDisk)->uuid(), app->uuid()) << "only the directory name changes";
    EXPECT_EQ(infoValue(app, "k"), PlistValue("kept"));

    // A rename that fails leaves the container where it was.
    ASSERT_TRUE(FailpointSet("fm.move", "errno:16"));
    uint64_t error = TarnSuccess;
    (void)withCode(connection_.regenerateDirectoryUUIDWithContainerIdentity(app), &error);
    EXPECT_EQ(error, TarnErrorUUIDMoveFailed);
    FailpointClearAll();
    EXPECT_EQ(urlOf(app), after);
    EXPECT_TRUE(fs::exists(after));

    error = TarnSuccess;
    (void)withCode(connection_.regenerateDirectoryUUIDWithContainerIdentity(missing()), &error);
    EXPECT_EQ(error, TarnErrorNotFound);
}

TEST_F(TarnPerContainerOpsTest, WellKnownDirectoryIsNeverRenamed) {
    auto wellKnown = TarnWhitelist::sharedWhitelist().wellknownSystemContainers();
    if (wellKnown.empty()) GTEST_SKIP() << "the well-known list names no system container";
    const std::string id = wellKnown.front();
    auto system = makeContainer(12, id, id);
    const FileURL url = urlOf(system);
    ASSERT_EQ(PathLastComponent(url), id);

    uint64_t error = TarnSuccess;
    (void)withCode(connection_.regenerateDirectoryUUIDWithContainerIdentity(system), &error);
    EXPECT_EQ(error, TarnErrorInvalidArgument);
    EXPECT_NE(log().find("Non-UUID last path component: " + id), std::string::npos);
    EXPECT_EQ(urlOf(system), url);
    EXPECT_EQ(std::distance(fs::directory_iterator(PathParent(url)), fs::directory_iterator()), 1)
        << "nothing was moved or made beside it";
}

TEST_F(TarnPerContainerOpsTest, RepairRecreatesSubdirectoriesAndSystemACLs) {
    TARN_REQUIRE_ROOT();
    auto app = makeContainer(2, "com.ostrea.broken");
    ASSERT_TRUE(connection_.recreateDefaultStructureWithContainerIdentity(app).ok());
    const FileURL appURL = urlOf(app);
    EXPECT_TRUE(fs::is_directory(PathJoin(appURL, "Library/Preferences")));
    fs::remove_all(PathJoin(appURL, "Library"));
    EXPECT_TRUE(connection_.recreateDefaultStructureWithContainerIdentity(app).ok());
    EXPECT_TRUE(fs::is_directory(PathJoin(appURL, "Library/Caches")));

    auto system = makeContainer(12, "com.ostrea.systemthing");
    ASSERT_TRUE(connection_.recreateDefaultStructureWithContainerIdentity(system).ok());
    const FileURL caches = PathJoin(urlOf(system), "Library/Caches");
    ASSERT_TRUE(fs::is_directory(caches));
    FsFd parent;
    std::string name;
    ASSERT_EQ(0, FsOpenParent(caches, &parent, &name));
    int access = -1, def = -1, mask = -1;
    int err = FsGetGroupACLAt(parent.get(), name, kSystemUsersGID, &access, &def, &mask);
    if (err == ENOTSUP) GTEST_SKIP() << "the scratch file system keeps no ACLs";
    ASSERT_EQ(err, 0);
    EXPECT_EQ(access, 07) << "the system-users group reaches the new directory";

    uint64_t error = TarnSuccess;
    (void)withCode(connection_.recreateDefaultStructureWithContainerIdentity(missing(12)), &error);
    EXPECT_EQ(error, TarnErrorNotFound);
}

}  // namespace
}  // namespace tarn
