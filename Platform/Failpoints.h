// Failpoints: named places where tests make an operation fail, crash or stall.
//
// Compiled in only when TARN_FAILPOINTS=1 (builds that include tests). They
// are armed through the environment variable TARN_FAILPOINTS, read on first
// use, e.g.
//     TARN_FAILPOINTS="fm.remove=errno:28,fm.writeData.beforeRename=kill,fm.move=sleep:500"
// or in-process through FailpointSet(). Actions: "errno:N" makes the site
// fail with N; "kill" ends the process with SIGKILL at once (no clean-up);
// "sleep:MS" stalls the site, then lets it go on. A trailing "@N" fires only
// on the Nth hit (1-based), e.g. "errno:5@3".
//
// Two more variables serve sweeps that arm a daemon child for one request:
// TARN_FAILPOINTS_GATE (any value) keeps every failpoint dormant, hit counts
// included, until the process receives SIGUSR2, so that "@N" counts from the
// request rather than from start-up; TARN_FAILPOINTS_TRACE=FILE appends the
// name of every hit (after the gate) to FILE, one per line, which tells a
// sweep where an operation passes.
//
//     if (auto err = TARN_FAILPOINT("fm.move")) return fail(*err);
//
// Thread-safe; an unarmed failpoint costs one atomic load.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace tarn {

// Every failpoint of the daemon. Crash tests walk this list; a site whose
// name is missing here is a programming error (asserted in test builds).
inline constexpr const char* kFailpointNames[] = {
    // TarnFileManager
    "fm.createDirectory",
    "fm.createTemporaryDirectory",
    "fm.move",
    "fm.move.afterCopy",
    "fm.copy",
    "fm.remove",
    "fm.writeData",
    "fm.writeData.beforeRename",
    "fm.writeData.afterRename",
    "fm.setDataProtectionClass",
    "fm.standardizeOwnership",
    "fm.setTopLevelACL",
    "fm.standardizeACLs",
    "fm.setMode",
    "fm.setOwner",
    // Sandbox state (the durable write of a user's table)
    "sandbox.recordChanges",
    // Code-signing store: before a transaction's COMMIT
    "db.commit",
    // Daemon start-up (tests of requests that arrive during start-up)
    "daemon.startup",
    // Boot set-up and clean-up: a start-up step that throws (the Nth hit is
    // the Nth step run), a restored item whose destination cannot be removed
    "daemon.startup.step",
    "boot.restore.removeTarget",
    // Replacement (TarnClientConnectionReplace.cc): each names the step it
    // stands before, so "kill" there dies between two steps and "errno:N"
    // fails that step. "fm.exchange" is the facade's two-way rename.
    "fm.exchange",
    "replace.writeFile",
    "replace.uncacheOld",
    "replace.invalidate",
    "replace.park",
    "replace.moveNew",
    "replace.uncacheNew",
    "replace.cacheNew",
    "replace.discardStaging",
    "replace.discardFile",
    "replace.recover.restore",
    "replace.recover.discard",
    // Kernel upcall: one container of an upcall that cannot be made
    "upcall.createOrLookup",
    // Landlock as if the kernel had none (tarnrun's refusal)
    "landlock.abi",
};

bool FailpointIsKnown(std::string_view name);

// Hit of a failpoint: the errno to fail with, or nullopt to go on.
std::optional<int> FailpointHit(std::string_view name);

// Test API. `actionText` as in the environment variable ("errno:28", "kill",
// "sleep:500", optionally "@N"). Returns false for a malformed action or an
// unknown name.
bool FailpointSet(std::string_view name, std::string_view actionText);
void FailpointClear(std::string_view name);
void FailpointClearAll();
// Parses a whole TARN_FAILPOINTS value, replacing what is armed.
bool FailpointConfigure(std::string_view value);

}  // namespace tarn

#if defined(TARN_FAILPOINTS) && TARN_FAILPOINTS
#define TARN_FAILPOINT(name) (::tarn::FailpointHit(name))
#else
#define TARN_FAILPOINT(name) (std::optional<int>{})
#endif
