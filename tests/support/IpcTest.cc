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

}  // namespace tarn::test
