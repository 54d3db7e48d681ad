// Per-container commands as a client sees them: info values (5, 6), disk
// usage (23) held at test gate 2, and directory renaming (9), against the
// daemon process on a scratch root.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <future>

#include "Daemon/TarnError.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Daemon/TarnWhitelist.h"
#include "Tools/tarnctl/Json.h"
#include "support/DaemonHarness.h"

namespace tarn {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

struct Container {
    Uuid uuid;
    FileURL url;
};

class PerContainerCommandsTest : public test::ScratchRootTest {
  protected:
    void SetUp() override {
        TARN_REQUIRE_DAEMON_BINARIES();
        daemon_ = std::make_unique<test::DaemonHarness>(root_);
        admin_ = daemon_->addPrivilegedClient();
    }

    // A container written on disk before the daemon starts; the daemon finds
    // it when it scans the class.
    Container makeContainer(TarnContainerClass c, const std::string& identifier,
                            std::string name = "") {
        Container made{Uuid::generate(), {}};
        if (name.empty()) name = Uuid::generate().string();
        auto user = TarnUserIdentityCache::defaultUserIdentity();
        made.url = PathJoin(
            *TarnGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(user, c,
                                                                                            false),
            name);
        fs::create_directories(made.url);
        auto identity =
            TarnConcreteContainerIdentity::containerIdentityWithUUID(made.uuid, user, identifier, c)
                .value();
        EXPECT_TRUE(
            TarnMetadata::initWithContainerIdentity(identity, std::nullopt, made.url, std::nullopt)
                ->writeMetadataToDiskWithError()
                .ok());
        return made;
    }

    // A request naming the container by its concrete identity.
    static std::string request(int command, const std::string& identifier, TarnContainerClass c,
                               const Uuid& uuid, const std::string& more = "") {
        return "{\"Command\": " + std::to_string(command) + ", \"Identifier\": \"" + identifier +
               "\", \"ContainerClass\": " + std::to_string(c) + ", \"UUID\": {\"$uuid\": \"" +
               uuid.string() + "\"}" + more + "}";
    }

    std::optional<PlistValue> infoOnDisk(const FileURL& url) {
        auto m = TarnMetadata::readAndValidateMetadataAtUrl(
            url, TarnUserIdentityCache::defaultUserIdentity(), false);
        EXPECT_TRUE(m.ok()) << "the metadata file stays readable";
        return m.ok() ? (*m)->info() : std::nullopt;
    }
    // One value of it; empty when the file or the key is missing.
    std::optional<PlistValue> infoValueOnDisk(const FileURL& url, const char* key) {
        auto info = infoOnDisk(url);
        const PlistValue* v = info ? info->find(key) : nullptr;
        return v ? std::optional<PlistValue>(*v) : std::nullopt;
    }

    static uint64_t replyError(const std::optional<PlistValue>& reply) {
        const PlistValue* e = reply ? reply->find("ReplyError") : nullptr;
        return e ? e->asUInt64().value_or(0) : 0;
    }

    std::unique_ptr<test::DaemonHarness> daemon_;
    std::string admin_;
};

TEST_F(PerContainerCommandsTest, InfoValuesRoundTripAndAbsentValueRemovesTheKey) {
    const std::string id = "com.ostrea.infoapp";
    Container app = makeContainer(1, id);
    daemon_->start();

    EXPECT_EQ(daemon_->sendError(
                  admin_, request(5, id, 1, app.uuid, R"(, "Key": "Colour", "Value": "red")")),
              TarnSuccess);
    auto reply = daemon_->send(admin_, request(6, id, 1, app.uuid, R"(, "Key": "Colour")"));
    ASSERT_EQ(replyError(reply), TarnSuccess) << daemon_->lastResult().err;
    ASSERT_TRUE(reply->find("ReplyInfoValue"));
    EXPECT_EQ(*reply->find("ReplyInfoValue"), PlistValue("red"));
    EXPECT_EQ(infoValueOnDisk(app.url, "Colour"), PlistValue("red"));

    // No "Value": the key goes, in the daemon and in the file.
    EXPECT_EQ(daemon_->sendError(admin_, request(5, id, 1, app.uuid, R"(, "Key": "Colour")")),
              TarnSuccess);
    EXPECT_EQ(daemon_->sendError(admin_, request(6, id, 1, app.uuid, R"(, "Key": "Colour")")),
              TarnErrorInfoValueNotFound);
    EXPECT_FALSE(infoValueOnDisk(app.url, "Colour"));

    EXPECT_EQ(daemon_->sendError(admin_, request(6, id, 1, app.uuid, R"(, "Key": 7)")),
              TarnErrorBadInput);
    EXPECT_EQ(daemon_->sendError(admin_, request(6, id, 1, Uuid::generate(), R"(, "Key": "k")")),
              TarnErrorNotFound);
    // The line is tagged with the operation that failed.
    const std::string log = daemon_->platformLog();
    EXPECT_NE(log.find("[infoValueForKey] "), std::string::npos);
    EXPECT_EQ(log.find("[operator()]"), std::string::npos);
}

TEST_F(PerContainerCommandsTest, DiskUsageIsHeldAtGateTwoAndRememberedForBundles) {
    const std::string id = "com.ostrea.sized";
    Container bundle = makeContainer(1, id);
    std::ofstream(PathJoin(bundle.url, "App.bin")) << std::string(100 * 1024, 'a');
    daemon_->start();

    ASSERT_EQ(daemon_->sendError(admin_, R"({"Command": 31, "TestLock": 2, "Enable": true})"),
              TarnSuccess);
    // The tarnctl run of the background request is its own client connection.
    const std::string client = admin_;
    const std::string rootPath = root_.path();
    const std::string json = request(23, id, 1, bundle.uuid);
    auto measuring = std::async(std::launch::async, [=] {
        return test::RunProcess({client, "--root", rootPath, "send", json});
    });
    EXPECT_EQ(measuring.wait_for(300ms), std::future_status::timeout);
    // The same container can be written while its measurement waits.
    EXPECT_EQ(
        daemon_->sendError(admin_, request(5, id, 1, bundle.uuid, R"(, "Key": "k", "Value": "v")")),
        TarnSuccess);
    EXPECT_EQ(measuring.wait_for(0ms), std::future_status::timeout);
    ASSERT_EQ(daemon_->sendError(admin_, R"({"Command": 31, "TestLock": 2, "Enable": false})"),
              TarnSuccess);

    ASSERT_EQ(measuring.wait_for(20s), std::future_status::ready);
    test::ProcessResult result = measuring.get();
    std::string why;
    auto reply = tarnctl::JsonToPlist(result.out, &why);
    ASSERT_EQ(replyError(reply), TarnSuccess) << result.err << why;
    ASSERT_TRUE(reply->find("ReplyDiskUsage"));
    const uint64_t first = reply->find("ReplyDiskUsage")->asUInt64().value_or(0);
    EXPECT_GE(first, 100u * 1024);

    // A bundle is measured once: growth behind the daemon's back is not seen.
    std::ofstream(PathJoin(bundle.url, "More.bin")) << std::string(300 * 1024, 'b');
    reply = daemon_->send(admin_, json);
    ASSERT_EQ(replyError(reply), TarnSuccess);
    EXPECT_EQ(reply->find("ReplyDiskUsage")->asUInt64(), first);
    EXPECT_EQ(infoValueOnDisk(bundle.url, "StaticDiskUsage"), PlistValue(first));
}

TEST_F(PerContainerCommandsTest, RegeneratingAWellKnownDirectoryIsRefused) {
    auto wellKnown = TarnWhitelist::sharedWhitelist().wellknownSystemContainers();
    if (wellKnown.empty()) GTEST_SKIP() << "the well-known list names no system container";
    const std::string id = wellKnown.front();
    Container system = makeContainer(12, id, id);
    Container bundle = makeContainer(1, "com.ostrea.renamed");
    daemon_->start();

    EXPECT_EQ(daemon_->sendError(admin_, request(9, id, 12, system.uuid)),
              TarnErrorInvalidArgument);
    EXPECT_TRUE(fs::exists(PathJoin(system.url, kTarnMetadataFileName)));

    EXPECT_EQ(daemon_->sendError(admin_, request(9, "com.ostrea.renamed", 1, bundle.uuid)),
              TarnSuccess);
    EXPECT_FALSE(fs::exists(bundle.url));
    auto reply = daemon_->send(admin_, request(7, "com.ostrea.renamed", 1, bundle.uuid));
    ASSERT_EQ(replyError(reply), TarnSuccess);
    ASSERT_TRUE(reply->find("ReplyPath") && reply->find("ReplyPath")->asString());
    const std::string moved = *reply->find("ReplyPath")->asString();
    EXPECT_EQ(PathParent(moved), PathParent(bundle.url));
    EXPECT_TRUE(fs::exists(PathJoin(moved, kTarnMetadataFileName)));
}

}  // namespace
}  // namespace tarn
