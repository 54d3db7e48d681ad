// Base fixture of the tests that kill, restart and check the daemon: a
// scratch root, the daemon harness on it (not started), a fully entitled
// client, personas off. This process's failpoints are cleared first, so that
// a TARN_FAILPOINTS set for a daemon child is never read here. Skips (from
// SetUp) when the binaries are not built or the process is not root.
#pragma once

#include <cstdlib>
#include <memory>
#include <optional>
#include <string>

#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/Failpoints.h"
#include "Platform/FirstBootMarker.h"
#include "support/DaemonHarness.h"

namespace tarn::test {

class CrashTest : public ScratchRootTest {
  protected:
    void SetUp() override {
        TARN_REQUIRE_DAEMON_BINARIES();
        TARN_REQUIRE_ROOT();
        TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
        FailpointClearAll();
        daemon_ = std::make_unique<DaemonHarness>(root_);
        admin_ = daemon_->addPrivilegedClient();
    }
    void TearDown() override {
        if (daemon_) daemon_->kill9();
        // The daemon's first start made it; it must not outlive the scratch root.
        (void)FirstBootMarkerRemove();
        TarnUserIdentityCache::TEST_setPersonasAreSupported(std::nullopt);
    }

    // "ReplyError" of a reply, 0 when none arrived.
    static uint64_t errorOf(const std::optional<PlistValue>& reply) {
        const PlistValue* e = reply ? reply->find("ReplyError") : nullptr;
        return e ? e->asUInt64().value_or(0) : 0;
    }

    // Starts the daemon with `failpoints` dormant until it receives SIGUSR2,
    // so that hit counts start with the request rather than with start-up;
    // `trace` names a file that gets every failpoint passed.
    void startArmed(const std::string& failpoints, const std::string& trace = "") {
        ::setenv("TARN_FAILPOINTS_GATE", "1", 1);
        ::setenv("TARN_FAILPOINTS", failpoints.c_str(), 1);
        if (!trace.empty()) ::setenv("TARN_FAILPOINTS_TRACE", trace.c_str(), 1);
        daemon_->start();
        ::unsetenv("TARN_FAILPOINTS_GATE");
        ::unsetenv("TARN_FAILPOINTS");
        ::unsetenv("TARN_FAILPOINTS_TRACE");
    }

    // Makes admin_ a privileged client that may also wipe, which takes an
    // entitlement of its own.
    void useWipingAdmin(const std::string& name, const std::string& identifier) {
        PlistValue entitlements{PlistDict{}};
        entitlements.set("com.ostrea.private.TarnKeeper.allowed", true);
        entitlements.set("com.ostrea.private.TarnKeeper.deleteContainerContent", true);
        admin_ = daemon_->addClient(name, identifier, entitlements);
    }

    std::unique_ptr<DaemonHarness> daemon_;
    std::string admin_;
};

}  // namespace tarn::test
