// Request decoding of the container commands, in process: which persona a
// request acts for, which identities a request may name, and which sandboxed
// callers get extension tokens. (Staging and the replies are tested over IPC.)
#include <gtest/gtest.h>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnContainerCommands.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/HostConfiguration.h"
#include "Platform/Sandbox.h"
#include "support/ResultCode.h"
#include "support/ScratchRoot.h"

namespace tarn {
namespace {

using tarn::test::withCode;

class ContainerCommandsDecodingTest : public test::ScratchRootTest {
  protected:
    void SetUp() override {
        // Personal P; enterprise E1 and E2 with their own apps and one app
        // both list; a universal persona whose app every identity shares.
        auto entry = [](const char* type, const char* unique, uint64_t id, PlistArray bundles) {
            PlistValue p{PlistDict{}};
            p.set("Type", type);
            p.set("UniqueString", unique);
            p.set("PersonaID", id);
            p.set("BundleIDs", std::move(bundles));
            if (std::string(type) == "enterprise")
                p.set("LayoutPath", std::string("/personas/") + unique);
            return p;
        };
        PlistValue list(PlistArray{
            entry("personal", "P", 1000, {}),
            entry("enterprise", "E1", 1001, {PlistValue("com.e1.app"), PlistValue("com.both")}),
            entry("enterprise", "E2", 1002, {PlistValue("com.both")}),
            entry("universal", "U", 1003, {PlistValue("com.uni")}),
        });
        auto bytes = list.toBinary();
        root_.writeFile("/etc/tarnkeeper/personas.plist", std::string(bytes.begin(), bytes.end()));
        TarnUserIdentityCache::TEST_setPersonasAreSupported(true);
        savedHost_ = HostConfiguration::shared();
    }
    void TearDown() override {
        TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt);
        HostConfiguration::TEST_setShared(savedHost_);
    }

    static TarnUserIdentityCache& cache() { return TarnUserIdentitySharedCache::sharedInstance(); }
    static TarnUserIdentityRef persona(const char* unique) {
        return cache().userIdentityForCurrentUserWithPersonaUniqueString(std::string(unique));
    }
    static std::shared_ptr<TarnClientConnection> caller(TarnUserIdentityRef user,
                                                        bool sandboxed = false) {
        TarnAuditToken token{};
        token[0] = 0x5a;
        auto identity = TarnClientIdentity::initWithBundleIdentifier(
            "com.caller", 501, 501, 4242, std::move(user), PlistValue(PlistDict{}), sandboxed,
            token, false);
        return TarnClientConnection::initWithClientIdentity(identity, true, true, true,
                                                            std::nullopt, std::nullopt,
                                                            std::make_shared<TarnCommandQueue>());
    }
    static PlistValue request(PlistDict keys) { return PlistValue(std::move(keys)); }

    HostConfiguration savedHost_;
};

TEST_F(ContainerCommandsDecodingTest, CallerWithoutPersonaActsForTheApplicationsPersona) {
    auto anyPersona = caller(cache().unspecificUserIdentity());
    struct Case {
        const char* identifier;
        TarnContainerClass containerClass;
        const char* expected;  // persona unique string; nullptr: TarnErrorPersonaMismatch
    } cases[] = {
        {"com.e1.app", 2, "E1"},  {"com.unlisted", 7, "P"},
        {"com.uni", 2, "P"},       // listed everywhere: the caller's own (unspecific) identity
        {"com.both", 2, nullptr},  // two enterprise personas, neither the caller's
        {"com.both", 1, "P"},      // global classes keep the caller's identity
    };
    for (const Case& c : cases) {
        uint64_t error = TarnSuccess;
        TarnUserIdentityRef user =
            withCode(userIdentityForContainerIdentifier(*anyPersona, std::string(c.identifier),
                                                        c.containerClass),
                     &error)
                .valueOr(nullptr);
        if (!c.expected) {
            EXPECT_FALSE(user) << c.identifier;
            EXPECT_EQ(error, TarnErrorPersonaMismatch) << c.identifier;
            continue;
        }
        ASSERT_TRUE(user) << c.identifier;
        EXPECT_EQ(error, TarnSuccess);
        EXPECT_EQ(user->personaUniqueString().value_or(""), c.expected) << c.identifier;
    }

    // A caller of a specific persona always acts for it.
    uint64_t error = TarnSuccess;
    auto e1 = caller(persona("E1"));
    EXPECT_EQ(withCode(userIdentityForContainerIdentifier(*e1, std::string("com.both"), 2), &error)
                  .valueOr(nullptr)
                  ->identifier(),
              "E1");
    auto anonymous = TarnClientConnection::initWithClientIdentity(
        nullptr, false, false, false, std::nullopt, std::nullopt,
        std::make_shared<TarnCommandQueue>());
    EXPECT_FALSE(
        withCode(userIdentityForContainerIdentifier(*anonymous, std::string("x"), 2), &error)
            .valueOr(nullptr));
    EXPECT_EQ(error, TarnErrorPersonaMismatch);
}

TEST_F(ContainerCommandsDecodingTest, PersonaStringMustBeOneTheCallerMayActFor) {
    auto anyPersona = caller(cache().unspecificUserIdentity());
    auto e1 = caller(persona("E1"));
    uint64_t error = TarnSuccess;
    EXPECT_EQ(withCode(userIdentityForPersonaUniqueString(*anyPersona, std::string("E2")), &error)
                  .valueOr(nullptr)
                  ->identifier(),
              "E2");
    EXPECT_TRUE(withCode(userIdentityForPersonaUniqueString(*anyPersona, std::nullopt), &error)
                    .valueOr(nullptr)
                    ->isNoSpecificPersona());
    EXPECT_EQ(withCode(userIdentityForPersonaUniqueString(*e1, std::string("E1")), &error)
                  .valueOr(nullptr)
                  ->identifier(),
              "E1");
    EXPECT_EQ(error, TarnSuccess);

    for (auto [connection, unique] :
         {std::pair{e1, "E2"}, std::pair{e1, "NOPE"}, std::pair{anyPersona, "NOPE"}}) {
        error = TarnSuccess;
        EXPECT_FALSE(
            withCode(userIdentityForPersonaUniqueString(*connection, std::string(unique)), &error)
                .valueOr(nullptr))
            << unique;
        EXPECT_EQ(error, TarnErrorPersonaMismatch) << unique;
    }

    // Shared-device mode: the caller's own identity, whatever the string says.
    HostConfiguration host = savedHost_;
    host.multiUserFlags = 0x80000000u;
    HostConfiguration::TEST_setShared(host);
    error = TarnSuccess;
    EXPECT_EQ(withCode(userIdentityForPersonaUniqueString(*e1, std::string("NOPE")), &error)
                  .valueOr(nullptr)
                  ->identifier(),
              "E1");
    EXPECT_EQ(error, TarnSuccess);
}

TEST_F(ContainerCommandsDecodingTest, IdentitiesFromRequests) {
    auto c = caller(persona("E1"));
    uint64_t error = TarnSuccess;
    auto own =
        withCode(validatedContainerIdentity(request({{"ContainerClass", PlistValue(uint64_t{2})}}),
                                            *c, nullptr, "ContainerClass"),
                 &error)
            .valueOr(nullptr);
    ASSERT_TRUE(own);
    EXPECT_EQ(own->identifier(), "com.caller") << "defaults to the caller";
    EXPECT_EQ(own->userIdentity()->identifier(), "E1");

    struct Case {
        PlistDict keys;
        const char* identifierKey;
        uint64_t expected;
    } validated[] = {
        {{{"Identifier", PlistValue(uint64_t{5})}, {"ContainerClass", PlistValue(uint64_t{2})}},
         nullptr,
         TarnErrorMissingIdentifier},
        {{{"ContainerClass", PlistValue(uint64_t{2})}}, "Identifier", TarnErrorMissingIdentifier},
        {{{"Identifier", PlistValue("a")}}, nullptr, TarnErrorInvalidContainerClass},
        {{{"Identifier", PlistValue("a")}, {"ContainerClass", PlistValue(uint64_t{14})}},
         nullptr,
         TarnErrorInvalidContainerClass},
        {{{"Identifier", PlistValue("a")}, {"ContainerClass", PlistValue("2")}},
         nullptr,
         TarnErrorInvalidContainerClass},
    };
    for (auto& v : validated) {
        error = TarnSuccess;
        EXPECT_FALSE(withCode(validatedContainerIdentity(request(v.keys), *c, v.identifierKey,
                                                         "ContainerClass"),
                              &error)
                         .valueOr(nullptr));
        EXPECT_EQ(error, v.expected) << request(v.keys).description();
    }

    const Uuid uuid = Uuid::generate();
    struct Concrete {
        PlistDict keys;
        uint64_t expected;
    } concrete[] = {
        {{{"ContainerClass", PlistValue(uint64_t{2})}, {"UUID", PlistValue(uuid)}},
         TarnErrorMissingIdentifier},
        // The decoder does not range-check: the identity refuses class 14 as an argument.
        {{{"Identifier", PlistValue("a")},
          {"ContainerClass", PlistValue(uint64_t{14})},
          {"UUID", PlistValue(uuid)},
          {"PersonaUniqueString", PlistValue("E1")}},
         TarnErrorInvalidArgument},
        {{{"Identifier", PlistValue("a")},
          {"ContainerClass", PlistValue(uint64_t{2})},
          {"UUID", PlistValue(uuid.string())},
          {"PersonaUniqueString", PlistValue("E1")}},
         TarnErrorInvalidArgument},
        // An enterprise caller must name its persona: none means "no specific persona".
        {{{"Identifier", PlistValue("a")},
          {"ContainerClass", PlistValue(uint64_t{2})},
          {"UUID", PlistValue(uuid)}},
         TarnErrorPersonaMismatch},
        {{{"Identifier", PlistValue("a")},
          {"ContainerClass", PlistValue(uint64_t{2})},
          {"UUID", PlistValue(uuid)},
          {"PersonaUniqueString", PlistValue("E2")}},
         TarnErrorPersonaMismatch},
        {{{"Identifier", PlistValue("a")},
          {"ContainerClass", PlistValue(uint64_t{2})},
          {"UUID", PlistValue(uuid)},
          {"PersonaUniqueString", PlistValue("E1")}},
         TarnSuccess},
        // Global classes ignore the persona string.
        {{{"Identifier", PlistValue("a")},
          {"ContainerClass", PlistValue(uint64_t{12})},
          {"UUID", PlistValue(uuid)},
          {"PersonaUniqueString", PlistValue("NOPE")}},
         TarnSuccess},
    };
    for (auto& v : concrete) {
        error = TarnSuccess;
        auto identity =
            withCode(concreteContainerIdentity(request(v.keys), *c, {}), &error).valueOr(nullptr);
        EXPECT_EQ(error, v.expected) << request(v.keys).description();
        EXPECT_EQ(bool(identity), v.expected == TarnSuccess);
        if (identity) {
            EXPECT_EQ(identity->uuid(), uuid);
        }
    }
}

TEST_F(ContainerCommandsDecodingTest, TokensOnlyForSandboxedCallersOfEnterpriseContainers) {
    auto container = [](TarnUserIdentityRef user, TarnContainerClass containerClass) {
        auto identity =
            TarnConcreteContainerIdentity::containerIdentityWithUUID(
                Uuid::generate(), std::move(user), std::string("com.caller"), containerClass)
                .value();
        return TarnMetadata::initWithContainerIdentity(
            identity, std::nullopt, "/private/var/c/" + identity->uuid().string(), std::nullopt);
    };
    auto sandboxed = caller(persona("E1"), true);
    const TarnClientIdentity* client = sandboxed->clientIdentity().get();
    struct Case {
        const char* owner;
        TarnContainerClass containerClass;
        const char* extensionClass;  // nullptr: no token
    } cases[] = {
        {"E1", 2, kSandboxExtensionClassContainer},
        {"E1", 10, kSandboxExtensionClassContainer},
        {"E1", 7, kSandboxExtensionClassApplicationGroup},
        {"E1", 9, nullptr},
        {"E1", 11, nullptr},
        {"P", 2, nullptr},
    };
    for (const Case& c : cases) {
        auto metadata = container(persona(c.owner), c.containerClass);
        PlistValue reply{PlistDict{}};
        issueSandboxExtension(reply, "ReplySandboxToken", *metadata, client);
        const PlistValue* token = reply.find("ReplySandboxToken");
        ASSERT_EQ(bool(token), c.extensionClass != nullptr) << c.owner << " " << c.containerClass;
        if (token) {
            EXPECT_TRUE(SandboxExtensionVerify(*token->asString(), c.extensionClass,
                                               metadata->url(), client->auditToken()));
        }
    }

    PlistValue reply{PlistDict{}};
    issueSandboxExtension(reply, "ReplySandboxToken", *container(persona("E1"), 2),
                          caller(persona("E1"), false)->clientIdentity().get());
    EXPECT_FALSE(reply.find("ReplySandboxToken")) << "an unsandboxed caller needs none";
}

// A queued command that fails before the death-row pass starts is the reply;
// no pass (and so no second, asynchronous reply) follows.
TEST_F(ContainerCommandsDecodingTest, DeathRowCommandRunsQueuedWorkFirst) {
    struct Failing : TarnCommand {
        uint64_t command() const override { return 99; }
        TarnStatus fromQueue(TarnCommandQueue*) override {
            return TARN_ERROR_CODE(TarnErrorCacheRemoveFailed, nullptr);
        }
    };
    struct Counting : TarnCommand {
        explicit Counting(int* n) : n(n) {}
        uint64_t command() const override { return 98; }
        TarnStatus fromQueue(TarnCommandQueue*) override {
            ++*n;
            return {};
        }
        int* n;
    };
    int laterRan = 0;
    auto queue = std::make_shared<TarnCommandQueue>();
    queue->insertCommand(std::make_shared<Failing>());
    queue->insertCommand(std::make_shared<Counting>(&laterRan));
    auto connection = TarnClientConnection::initWithClientIdentity(
        nullptr, true, true, true, std::nullopt, std::nullopt, queue);
    PlistValue reply{PlistDict{}};
    uint64_t error = TarnSuccess;
    TarnHandleDeleteDeathRowCommand({}, PlistValue(PlistDict{}), reply, connection.get(), &error);
    EXPECT_EQ(error, TarnErrorCacheRemoveFailed);
    // What followed the failure never runs, not even in the processor's own
    // run after the handler.
    EXPECT_TRUE(queue->commands().empty());
    EXPECT_TRUE(connection->completeWithError(&error));
    EXPECT_EQ(laterRan, 0);
}

}  // namespace
}  // namespace tarn
