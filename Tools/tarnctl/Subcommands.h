// tarnctl's subcommands. Each lives in its own file and registers itself
// through a setup function listed in main.cc (kSubcommands): the function adds
// a CLI11 subcommand to the app and, in its callback, stores the process exit
// code in Options::exitCode.
#pragma once

#include <CLI/CLI.hpp>

#include <chrono>
#include <optional>
#include <string>

#include "Platform/PropertyList.h"

namespace tarnctl {

// Exit codes shared by every subcommand (documented in --help).
enum ExitCode : int {
    kExitOk = 0,           // the daemon answered (whatever its "ReplyError")
    kExitBadInput = 1,     // the request given on the command line is not usable
    kExitUsage = 2,        // command-line syntax
    kExitUnavailable = 3,  // cannot reach the daemon
    kExitNoReply = 4,      // no reply: timeout, connection closed or a malformed reply
    kExitReplyError = 5,   // a verb's reply carries an error code (printed on stderr)
};

// Options every subcommand sees.
struct Options {
    std::string root;    // --root DIR
    std::string socket;  // --socket PATH
    double timeoutSeconds = 30;
    bool json = false;  // --json: replies as one JSON object (the send format)
    int exitCode = kExitOk;

    // --socket, else the service socket below --root (or below "/").
    std::string socketPath() const;
    std::chrono::milliseconds timeout() const;
};

using SubcommandSetup = void (*)(CLI::App& app, Options& options);

// Sends one request and waits for its reply. On failure prints a message on
// stderr, sets options.exitCode and returns empty.
std::optional<tarn::PlistValue> SendRequest(Options& options, const tarn::PlistValue& request);

void SetupSendCommand(CLI::App& app, Options& options);
void SetupUpcallCommand(CLI::App& app, Options& options);  // Upcall.cc
// Tools/tarnctl/Verify.cc
void SetupVerifyCommand(CLI::App& app, Options& options);
void SetupErrorsCommand(CLI::App& app, Options& options);
// Must run last: it describes every subcommand registered before it.
void SetupCompletionCommand(CLI::App& app, Options& options);

}  // namespace tarnctl
