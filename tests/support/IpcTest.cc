#include "support/IpcTest.h"

#include <gtest/gtest.h>

namespace tarn::test {

void IpcTest::SetUp() {
    TARN_REQUIRE_DAEMON_BINARIES();
    TARN_REQUIRE_ROOT();
    daemon_ = std::make_unique<DaemonHarness>(root_);
    admin_ = daemon_->addPrivilegedClient();
}

PlistValue IpcTest::send(const std::string& client, const std::string& json) {
    auto reply = daemon_->send(client, json);
    EXPECT_TRUE(reply) << json << ": " << daemon_->lastResult().err;
    return reply ? *reply : PlistValue(PlistDict{});
}

uint64_t IpcTest::errorOf(const PlistValue& reply) {
    const PlistValue* e = reply.find("ReplyError");
    return e ? e->asUInt64().value_or(0) : 0;
}

std::string IpcTest::stringOf(const PlistValue& reply, const std::string& key) {
    const PlistValue* v = reply.find(key);
    return v && v->asString() ? *v->asString() : std::string();
}

void IpcTest::enablePersonas(const std::vector<EnterprisePersona>& enterprise) {
    PlistValue host{PlistDict{}};
    host.set("InternalBuild", true);
    host.set("DeviceSupportsPersonas", true);
    daemon_->writeHostConfig(host);
    PlistValue personal{PlistDict{}};
    personal.set("Type", "personal");
    personal.set("UniqueString", "PERSONAL-0000");
    personal.set("PersonaID", uint64_t{1000});
    PlistArray list{personal};
    for (const EnterprisePersona& e : enterprise) {
        PlistValue p{PlistDict{}};
        p.set("Type", "enterprise");
        p.set("UniqueString", e.uniqueString);
        p.set("PersonaID", e.personaID);
        p.set("LayoutPath", e.layoutPath);
        PlistArray apps;
        for (const std::string& app : e.bundleIdentifiers) apps.emplace_back(app);
        p.set("BundleIDs", std::move(apps));
        list.push_back(std::move(p));
    }
    auto bytes = PlistValue(std::move(list)).toBinary();
    root_.writeFile("/etc/tarnkeeper/personas.plist", std::string(bytes.begin(), bytes.end()));
}

}  // namespace tarn::test
