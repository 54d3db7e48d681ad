// The daemon as a process: start-up order, the command table and entitlement
// gate over IPC, first-boot work, and resilience to garbage on the socket.
#include <gtest/gtest.h>

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <optional>
#include <thread>

#include "Daemon/TarnError.h"
#include "Platform/Conduit.h"
#include "Platform/ConduitHarness.h"
#include "support/DaemonHarness.h"

namespace tarn {
namespace {

using test::DaemonHarness;

class DaemonSpineTest : public test::ScratchRootTest {
protected:
    void SetUp() override {
        TARN_REQUIRE_DAEMON_BINARIES();
        daemon_ = std::make_unique<DaemonHarness>(root_);
        admin_ = daemon_->addPrivilegedClient();
        guest_ = daemon_->addClient("guest", "com.ostrea.test.guest", PlistValue(PlistDict{}));
    }
    // Registers this test process as "com.ostrea.test.self" with `entitlements`.
    void registerSelf(const PlistValue& entitlements) {
        PlistValue reg{PlistDict{}};
        reg.set("Executable", conduit::harness::SelfExecutablePath());
        reg.set("SigningIdentifier", "com.ostrea.test.self");
        reg.set("Entitlements", entitlements);
        const auto bytes = reg.toBinary();
        root_.writeFile("/etc/tarnkeeper/codesign/self.plist", std::string(bytes.begin(), bytes.end()));
    }
    // A connection of this process to the started daemon.
    std::unique_ptr<conduit::Client> connectSelf() {
        std::string why;
        auto client = conduit::Client::connect(daemon_->socketPath(), &why);
        EXPECT_TRUE(client) << why;
        return client;
    }
    // {"Command": n}, for a test to add to.
    static PlistValue command(uint64_t n) {
        PlistValue request{PlistDict{}};
        request.set("Command", n);
        return request;
    }
    // One request on `client`; the reply, or none (with the reason added as a failure).
    static std::optional<PlistValue> sendOn(conduit::Client& client, const PlistValue& request) {
        std::string why;
        auto reply = client.sendSync(request, std::chrono::seconds(10), &why);
        EXPECT_TRUE(reply) << why;
        return reply;
    }
    size_t count(const std::string& needle) {
        std::string log = daemon_->platformLog();
        size_t n = 0;
        for (size_t pos = log.find(needle); pos != std::string::npos; pos = log.find(needle, pos + 1)) ++n;
        return n;
    }
    std::unique_ptr<DaemonHarness> daemon_;
    std::string admin_, guest_;
};

TEST_F(DaemonSpineTest, CommandTableAndGateOverIpc) {
    daemon_->start();
    EXPECT_EQ(daemon_->sendError(admin_, R"({"Command": 27})"), TarnErrorInvalidCommand);
    EXPECT_EQ(daemon_->sendError(admin_, R"({"Command": 33})"), TarnErrorInvalidCommand);
    EXPECT_EQ(daemon_->sendError(admin_, R"({"Command": 4000000000})"), TarnErrorInvalidCommand);
    // The unentitled client is refused before the handler of 27 could answer.
    EXPECT_EQ(daemon_->sendError(guest_, R"({"Command": 27})"), TarnErrorNotEntitled);
    // A request without "Command" is command 0.
    auto reply = daemon_->send(admin_, R"({"Identifier": "x"})");
    ASSERT_TRUE(reply) << daemon_->lastResult().err;
    EXPECT_TRUE(reply->find("ReplyError"));
    EXPECT_GE(count("command=0, client="), 1u);
    EXPECT_GE(count("command=27, client=<unknown>, error=55"), 1u);
    EXPECT_GE(count("command=27, client=com.ostrea.test.admin, error=49"), 1u);
    // A creation is marked in the log without its private attributes.
    EXPECT_EQ(
        daemon_->sendError(
            admin_, R"({"Identifier": "com.x", "ContainerClass": 2, "CreateIfNecessary": true})"),
        TarnSuccess);
    EXPECT_EQ(count("signpost event CreatingContainer uuid=<private> identifier=<private> class=2"), 1u);
    EXPECT_EQ(count("identifier=com.x"), 0u);
}

// A caller without a registration is still served a command any client may
// send; its line names no client, unlike a request refused outright.
TEST_F(DaemonSpineTest, AnUnregisteredCallerIsLoggedAsNil) {
    daemon_->start();
    auto client = connectSelf();
    ASSERT_TRUE(client);
    PlistValue request = command(0);
    request.set("Identifier", "com.ostrea.test.nobody");
    request.set("ContainerClass", uint64_t{2});
    ASSERT_TRUE(sendOn(*client, request));
    EXPECT_EQ(count("command=0, client=(null), error="), 1u);
}

// A registration without usable entitlements is reported by every request,
// also when the connection's identity is reused.
TEST_F(DaemonSpineTest, MalformedEntitlementsAreReportedOnEveryRequest) {
    registerSelf(PlistValue(PlistArray{PlistValue("not a dictionary")}));
    daemon_->start();
    auto client = connectSelf();
    ASSERT_TRUE(client);
    for (int i = 0; i < 3; ++i) ASSERT_TRUE(sendOn(*client, command(27)));
    EXPECT_EQ(count("Missing or malformed entitlements for pid"), 3u);
}

// One connection sends many requests; its identity is reused between them,
// but a change to the peer's registration shows on the very same connection.
TEST_F(DaemonSpineTest, ARegistrationChangeShowsOnAnOpenConnection) {
    auto registerAllowed = [&](bool allowed) {
        PlistValue entitlements{PlistDict{}};
        if (allowed) entitlements.set("com.ostrea.private.TarnKeeper.allowed", true);
        registerSelf(entitlements);
    };
    registerAllowed(false);
    daemon_->start();
    auto client = connectSelf();
    ASSERT_TRUE(client);
    auto answer = [&] {
        auto reply = sendOn(*client, command(27));
        const PlistValue* e = reply ? reply->find("ReplyError") : nullptr;
        return e && e->asUInt64() ? *e->asUInt64() : uint64_t{0};
    };
    ASSERT_EQ(answer(), TarnErrorNotEntitled);
    ASSERT_EQ(answer(), TarnErrorNotEntitled);
    for (bool allowed : {true, false}) {
        registerAllowed(allowed);
        const uint64_t want = allowed ? TarnErrorInvalidCommand : TarnErrorNotEntitled;
        const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
        uint64_t got = 0;
        while ((got = answer()) != want && std::chrono::steady_clock::now() < deadline)
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        EXPECT_EQ(got, want) << "allowed=" << allowed;
    }
}

TEST_F(DaemonSpineTest, GarbageOnTheSocketOnlyDropsThatPeer) {
    daemon_->start();
    for (int i = 0; i < 3; ++i) {
        int fd = ::socket(AF_UNIX, SOCK_SEQPACKET, 0);
        ASSERT_GE(fd, 0);
        sockaddr_un addr{};
        addr.sun_family = AF_UNIX;
        ::strncpy(addr.sun_path, daemon_->socketPath().c_str(), sizeof addr.sun_path - 1);
        ASSERT_EQ(::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
        std::string junk(100 + i * 1000, static_cast<char>(0xA5 + i));
        (void)!::write(fd, junk.data(), junk.size());
        char buf[16];
        // The daemon closes this connection rather than answering.
        EXPECT_LE(::read(fd, buf, sizeof buf), 0);
        ::close(fd);
    }
    EXPECT_EQ(daemon_->sendError(admin_, R"({"Command": 27})"), TarnErrorInvalidCommand);
}

TEST_F(DaemonSpineTest, FirstBootWorkRunsOncePerBoot) {
    daemon_->start();
    EXPECT_TRUE(daemon_->waitForNotification("com.ostrea.tarnkeeper.reboot-cleanup-complete",
                                             std::chrono::seconds(10)));
    EXPECT_EQ(daemon_->stop(), 0);
    EXPECT_EQ(count("tarnkeeperd performing first boot initialization"), 1u);
    daemon_->start();
    EXPECT_EQ(daemon_->sendError(admin_, R"({"Command": 27})"), TarnErrorInvalidCommand)
        << daemon_->lastResult().err;
    EXPECT_EQ(daemon_->stop(), 0);
    EXPECT_EQ(count("tarnkeeperd performing first boot initialization"), 1u);
    EXPECT_EQ(count("signpost begin BootSetup"), 2u);

    auto r = daemon_->tarnctl(admin_, {"simulate-reboot"});
    EXPECT_EQ(r.exitCode, 0) << r.err;
    daemon_->start();
    EXPECT_EQ(count("tarnkeeperd performing first boot initialization"), 2u);
}

TEST_F(DaemonSpineTest, RequestsWaitForStartUp) {
    // Start-up stalls in its first step; a request sent meanwhile is answered after it.
    setenv("TARN_FAILPOINTS", "daemon.startup=sleep:1500", 1);
    daemon_->start(/*waitReady=*/false);
    unsetenv("TARN_FAILPOINTS");
    std::string why;
    std::unique_ptr<conduit::Client> client;
    for (int i = 0; i < 200 && !client; ++i) {
        client = conduit::Client::connect(daemon_->socketPath(), &why);
        if (!client) std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    ASSERT_TRUE(client) << why;
    PlistValue req{PlistDict{}};
    req.set("Command", uint64_t{27});
    auto reply = client->sendSync(req, std::chrono::seconds(20), &why);
    ASSERT_TRUE(reply) << why;
    std::string log = daemon_->platformLog();
    size_t started = log.find("signpost end StartingUp");
    size_t handled = log.find("command=27,");
    ASSERT_NE(started, std::string::npos);
    ASSERT_NE(handled, std::string::npos);
    EXPECT_LT(started, handled);
}

TEST_F(DaemonSpineTest, LockStateCommandsDriveTheDaemon) {
    daemon_->start();
    EXPECT_EQ(daemon_->tarnctl(admin_, {"lock"}).exitCode, 0);
    EXPECT_EQ(daemon_->tarnctl(admin_, {"unlock"}).exitCode, 0);
    // The daemon is still serving after the suspend/resume round.
    EXPECT_EQ(daemon_->sendError(admin_, R"({"Command": 27})"), TarnErrorInvalidCommand);
    auto r = daemon_->tarnctl(admin_, {"wait-notification", "com.ostrea.never", "--timeout", "0.2"});
    EXPECT_NE(r.exitCode, 0);
}

}  // namespace
}  // namespace tarn

namespace tarn {
namespace {

class DaemonCommandsTest : public test::ScratchRootTest {
protected:
    void SetUp() override {
        TARN_REQUIRE_DAEMON_BINARIES();
        daemon_ = std::make_unique<test::DaemonHarness>(root_);
        admin_ = daemon_->addPrivilegedClient();
        PlistValue allowedOnly{PlistDict{}};
        allowedOnly.set("com.ostrea.private.TarnKeeper.allowed", true);
        allowed_ = daemon_->addClient("allowed", "com.ostrea.test.allowed", allowedOnly);
    }
    std::unique_ptr<test::DaemonHarness> daemon_;
    std::string admin_, allowed_;
};

TEST_F(DaemonCommandsTest, TestLocksNeedTestabilityEvenWithAllowed) {
    daemon_->start();
    EXPECT_EQ(daemon_->sendError(admin_, R"({"Command": 31, "TestLock": 7, "Enable": true})"),
              TarnErrorBadInput);
    EXPECT_EQ(daemon_->sendError(admin_, R"({"Command": 31, "TestLock": 7, "Enable": false})"),
              TarnSuccess);
    EXPECT_EQ(daemon_->sendError(allowed_, R"({"Command": 31, "TestLock": 7, "Enable": false})"),
              TarnErrorNotEntitled);
}

TEST_F(DaemonCommandsTest, TestLocksAreInertOnCustomerBuilds) {
    PlistValue host{PlistDict{}};
    host.set("InternalBuild", false);
    daemon_->writeHostConfig(host);
    daemon_->start();
    EXPECT_EQ(daemon_->sendError(admin_, R"({"Command": 31, "TestLock": 7, "Enable": true})"),
              TarnSuccess);
}

TEST_F(DaemonCommandsTest, CodeSigningInfoIsNotFoundForAnUnknownIdentifier) {
    daemon_->start();
    EXPECT_EQ(daemon_->sendError(admin_, R"({"Command": 19, "Identifier": "com.ostrea.none"})"),
              TarnErrorNotFound);
    EXPECT_TRUE(std::filesystem::exists(
        root_.at("/private/var/root/Library/TarnKeeper/containers.sqlite3")));
}

}  // namespace
}  // namespace tarn
