// Runs the built tarnkeeperd on a scratch root and talks to it through copies
// of the built tarnctl, each registered in the code-signing registry as a
// different client (its own signing identifier and entitlements).
#pragma once

#include <sys/types.h>

#include <chrono>
#include <filesystem>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Platform/PropertyList.h"
#include "support/ScratchRoot.h"

namespace tarn::test {

struct ProcessResult {
    int exitCode = -1;  // -1: did not exit normally
    std::string out;
    std::string err;
};

// Runs argv[0] with the arguments, waiting at most `timeout`.
ProcessResult RunProcess(const std::vector<std::string>& argv,
                         std::chrono::milliseconds timeout = std::chrono::seconds(30));

std::string BuiltBinary(const std::string& name);  // TARN_BINARY_DIR/name
// The daemon the harness starts: $TARN_TEST_DAEMON when set (another build of
// it, e.g. under the thread sanitizer), else the one built with the tests.
std::string DaemonBinary();

class DaemonHarness {
public:
    explicit DaemonHarness(const ScratchRoot& root);
    ~DaemonHarness();

    // host.plist of the root; an internal build by default.
    void writeHostConfig(const PlistValue& host);
    // Copies tarnctl to ROOT/clients/NAME and registers it. Returns the copy's path.
    std::string addClient(const std::string& name, const std::string& signingIdentifier,
                          const PlistValue& entitlements, bool sandboxed = false,
                          std::optional<std::string> personaUniqueString = std::nullopt);
    // A client with "allowed" (and testability, userManagedAssets).
    std::string addPrivilegedClient(const std::string& name = "admin");

    // Starts the daemon; with `waitReady`, waits until start-up has finished
    // (boot clean-up posted) and the socket answers.
    void start(bool waitReady = true);
    // Waits for a post of NAME; with `sinceLastStart`, only posts of the running launch count.
    bool waitForNotification(const std::string& name, std::chrono::milliseconds timeout,
                             bool sinceLastStart = false);
    // SIGTERM and wait for exit; returns the exit status (or -1).
    int stop();
    void kill9();
    // Waits up to `timeout` for the daemon to end by itself (a failpoint's
    // kill); true when it has ended and was reaped.
    bool waitExit(std::chrono::milliseconds timeout);
    // Sends `sig` to the running daemon.
    void signal(int sig);
    bool running() const { return pid_ > 0; }
    pid_t pid() const { return pid_; }

    // Runs `tarnctl send JSON` as CLIENT and returns the parsed reply (empty when
    // tarnctl failed; its result is kept in lastResult()).
    std::optional<PlistValue> send(const std::string& client, const std::string& json);
    // "ReplyError" of the reply, or 0 when no reply arrived.
    uint64_t sendError(const std::string& client, const std::string& json);
    const ProcessResult& lastResult() const { return last_; }

    ProcessResult tarnctl(const std::string& client, const std::vector<std::string>& args);
    std::string platformLog() const;
    const std::string& socketPath() const { return socket_; }

private:
    const ScratchRoot& root_;
    std::string socket_;
    std::string platformLogPath_;
    pid_t pid_ = -1;
    size_t notificationsAtStart_ = 0;  // bytes of the notifications file before the last start
    // send() may run on several threads at once (the soak's clients).
    std::mutex lastMu_;
    ProcessResult last_;
};

}  // namespace tarn::test

// Skips the test unless the daemon and tarnctl it drives have been built.
#define TARN_REQUIRE_DAEMON_BINARIES()                                      \
    do {                                                                    \
        if (!std::filesystem::exists(::tarn::test::DaemonBinary()) ||       \
            !std::filesystem::exists(::tarn::test::BuiltBinary("tarnctl"))) \
            GTEST_SKIP() << "tarnkeeperd and tarnctl are not built";        \
    } while (0)
