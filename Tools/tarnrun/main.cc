// tarnrun: runs a program confined to its containers.
//
//   tarnrun [--root DIR] [--user NAME|UID] [options] PROGRAM [ARGS...]
//
// As root, and acting for the kernel, it asks tarnkeeperd's upcall socket for
// the program's containers: its data container, the application and system
// groups and the system container its code-signing entitlements name (the
// entry for the program's real path in DIR/etc/tarnkeeper/codesign). Then it
// becomes the user, sets HOME to the data container and TMPDIR to its "tmp",
// starts in the data container, puts on a Landlock ruleset that allows
// writing only in those containers and reading and executing the system
// directories (and the program), and executes the program in its own place,
// so that its exit status is tarnrun's.
//
// Without Landlock it refuses to run the program, unless --allow-unconfined.
#include <grp.h>
#include <limits.h>
#include <stdlib.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <iostream>
#include <optional>
#include <string>
#include <vector>

#include "Platform/Accounts.h"
#include "Platform/CodeSignRegistry.h"
#include "Platform/Landlock.h"
#include "Platform/RootPrefix.h"
#include "Platform/UpcallQuery.h"
#include "Platform/UpcallSocket.h"

namespace {

// Exit codes of tarnrun's own failures (sysexits), distinct from a program's
// usual ones; 126 and 127 as a shell answers for a program it cannot run.
constexpr int kExitUsage = 64;
constexpr int kExitNoUser = 67;
constexpr int kExitUnavailable = 69;
constexpr int kExitSystemError = 71;
constexpr int kExitNotPermitted = 77;
constexpr int kExitCannotExecute = 126;
constexpr int kExitNotFound = 127;

constexpr const char* kAppGroupsEntitlement = "com.ostrea.security.application-groups";
constexpr const char* kSystemGroupsEntitlement = "com.ostrea.security.system-groups";
constexpr const char* kOldSystemGroupsEntitlement = "com.ostrea.security.system-group-containers";
constexpr const char* kSystemContainerEntitlement = "com.ostrea.security.system-container";
constexpr const char* kSystemGroupPrefix = "systemgroup.";

// What a confined program may read and execute besides its containers.
const char* const kSystemDirectories[] = {"/usr",    "/bin", "/sbin", "/lib",  "/lib32", "/lib64",
                                          "/libx32", "/etc", "/opt",  "/proc", "/dev"};
const char* const kReadWriteDevices[] = {"/dev/null", "/dev/zero", "/dev/full", "/dev/tty"};

struct Options {
    std::string root = "/";
    std::string user = "mobile";
    std::optional<uint32_t> persona;
    uint32_t containerType = 0;
    std::vector<std::string> readable;
    bool allowUnconfined = false;
    bool verbose = false;
    double timeoutSeconds = 30;
    std::vector<std::string> command;
};

[[noreturn]] void fail(int code, const std::string& message) {
    std::cerr << "tarnrun: " << message << "\n";
    std::exit(code);
}

// PROGRAM's real path, looked up in PATH when it has no slash.
std::optional<std::string> resolveProgram(const std::string& program) {
    auto real = [](const std::string& path) -> std::optional<std::string> {
        char buffer[PATH_MAX];
        if (::access(path.c_str(), X_OK) != 0 || !::realpath(path.c_str(), buffer))
            return std::nullopt;
        return std::string(buffer);
    };
    if (program.find('/') != std::string::npos) return real(program);
    const char* path = std::getenv("PATH");
    std::string directories = path ? path : "/usr/local/bin:/usr/bin:/bin";
    for (size_t start = 0; start <= directories.size();) {
        size_t end = directories.find(':', start);
        if (end == std::string::npos) end = directories.size();
        const std::string directory = directories.substr(start, end - start);
        if (auto found = real((directory.empty() ? "." : directory) + "/" + program)) return found;
        start = end + 1;
    }
    return std::nullopt;
}

// An entitlement that is an array of strings or one string.
std::vector<std::string> stringsOf(const tarn::PlistValue& entitlements, const char* key) {
    std::vector<std::string> out;
    const tarn::PlistValue* value = entitlements.find(key);
    if (!value) return out;
    if (const std::string* one = value->asString()) {
        out.push_back(*one);
    } else if (const tarn::PlistArray* many = value->asArray()) {
        for (const tarn::PlistValue& item : *many)
            if (const std::string* s = item.asString()) out.push_back(*s);
    }
    return out;
}

// The query the kernel would send for the program `info` run by `uid`.
tarn::upcall::ProcessContainersQuery queryFor(const tarn::CodeSignInfo& info, uid_t uid,
                                              const Options& options) {
    tarn::upcall::ProcessContainersQuery query;
    query.uid = uid;
    query.persona = options.persona;
    query.codeSigningID = info.signingIdentifier;
    query.containerType = options.containerType;
    const tarn::PlistValue& entitlements = info.entitlements;
    query.appGroups = stringsOf(entitlements, kAppGroupsEntitlement);
    std::vector<std::string> systemGroups = stringsOf(entitlements, kSystemGroupsEntitlement);
    if (systemGroups.empty()) systemGroups = stringsOf(entitlements, kOldSystemGroupsEntitlement);
    for (std::string& group : systemGroups)
        if (group.starts_with(kSystemGroupPrefix)) query.systemGroups.push_back(std::move(group));
    const tarn::PlistValue* system = entitlements.find(kSystemContainerEntitlement);
    if (system && system->asBool().value_or(false)) query.systemContainer = info.signingIdentifier;
    return query;
}

struct Containers {
    std::string data;
    std::string temporary;
    std::vector<std::string> writable;  // every container, the data container first
};

Containers askForContainers(const tarn::upcall::ProcessContainersQuery& query,
                            const Options& options) {
    std::string why;
    tarn::upcall::QueryFailure failure = tarn::upcall::QueryFailure::kNone;
    const auto timeout =
        std::chrono::milliseconds(static_cast<int64_t>(options.timeoutSeconds * 1000));
    auto answer = tarn::upcall::QueryProcessContainers(tarn::upcall::UpcallSocketPath(), query,
                                                       timeout, &failure, &why);
    if (!answer) fail(kExitUnavailable, "cannot ask tarnkeeperd for the containers: " + why);
    if (answer->returnCode != 0)
        fail(kExitUnavailable, "tarnkeeperd refused the container query: return code " +
                                   std::to_string(answer->returnCode));
    Containers containers;
    std::optional<uint32_t> status;
    for (const tarn::upcall::AnswerItem& item : answer->items) {
        if (item.type == tarn::upcall::kAnswerStatus) {
            if (const auto* number = std::get_if<uint32_t>(&item.value)) status = *number;
            continue;
        }
        const auto* path = std::get_if<std::string>(&item.value);
        if (!path) continue;
        switch (item.type) {
            case tarn::upcall::kAnswerDataContainer:
                containers.data = *path;
                containers.writable.insert(containers.writable.begin(), *path);
                break;
            case tarn::upcall::kAnswerTemporaryDirectory:
                containers.temporary = *path;
                break;
            case tarn::upcall::kAnswerAppGroup:
            case tarn::upcall::kAnswerSystemContainer:
            case tarn::upcall::kAnswerSystemGroup:
                containers.writable.push_back(*path);
                break;
            default:
                break;  // the user's home: not the program's to write in
        }
        if (options.verbose && item.type != tarn::upcall::kAnswerHomeDirectory)
            std::cerr << "tarnrun: container " << (item.key ? *item.key : std::string("")) << " "
                      << *path << "\n";
    }
    if (status != 1u || containers.data.empty())
        fail(kExitUnavailable, "tarnkeeperd could not make every container of " +
                                   query.codeSigningID.value_or("") + " (see its log)");
    return containers;
}

void becomeUser(uid_t uid, gid_t gid) {
    // Only the user's own group: the host's group file may not be the root's.
    if (::setgroups(1, &gid) != 0 || ::setgid(gid) != 0 || ::setuid(uid) != 0)
        fail(kExitSystemError, std::string("cannot become user ") + std::to_string(uid) + ": " +
                                   std::strerror(errno));
    if (uid != 0 && ::setuid(0) == 0) fail(kExitSystemError, "could not drop root privileges");
}

}  // namespace

int main(int argc, char** argv) {
    Options options;
    CLI::App app{
        "tarnrun: run PROGRAM as a user, confined to its containers.\n"
        "Asks tarnkeeperd (as the kernel would) for the data container, groups and system "
        "container the program's code-signing entry names, then runs it with HOME and TMPDIR in "
        "its data container, writing only in its containers and reading the system directories."};
    app.add_option("--root", options.root, "Root prefix tarnkeeperd runs under (default /)");
    app.add_option("--user", options.user, "User to run as: a name or a uid (default mobile)");
    app.add_option("--persona", options.persona, "Kernel persona id (default: none)");
    app.add_option("--container-type", options.containerType, "0 application, 1 plug-in")
        ->check(CLI::Range(0, 1));
    app.add_option("--read", options.readable, "Also allow reading PATH (repeatable)")
        ->expected(1)
        ->multi_option_policy(CLI::MultiOptionPolicy::TakeAll);
    app.add_flag("--allow-unconfined", options.allowUnconfined,
                 "Run the program even when the kernel has no Landlock (unconfined)");
    app.add_flag("-v,--verbose", options.verbose, "Print the containers to stderr");
    app.add_option("--timeout", options.timeoutSeconds, "Seconds to wait for tarnkeeperd")
        ->check(CLI::PositiveNumber);
    // Everything from PROGRAM on is the program's, options included.
    app.prefix_command();
    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        const int code = app.exit(e);
        return code == 0 ? 0 : kExitUsage;
    }
    options.command = app.remaining();
    if (options.command.empty()) {
        std::cerr << app.help();
        return kExitUsage;
    }

    if (::geteuid() != 0)
        fail(kExitNotPermitted, "must run as root: only root is answered as the kernel");
    tarn::SetRootPrefix(options.root);

    const std::string& program = options.command.front();
    const std::optional<std::string> executable = resolveProgram(program);
    if (!executable) fail(kExitNotFound, program + ": no such executable program");
    const std::shared_ptr<const tarn::CodeSignInfo> info =
        tarn::CodeSignRegistry::shared().infoForExecutable(*executable);
    if (!info || info->signingIdentifier.empty())
        fail(kExitNotPermitted, *executable + " has no code-signing entry below " +
                                    tarn::RootPath("/etc/tarnkeeper/codesign") +
                                    ", so it has no containers");

    std::optional<tarn::AccountUser> account;
    const bool numeric =
        !options.user.empty() && options.user.find_first_not_of("0123456789") == std::string::npos;
    if (numeric) {
        const uid_t uid = static_cast<uid_t>(std::stoul(options.user));
        account = tarn::AccountUserByUID(uid);
        if (!account) account = tarn::AccountUser{.name = "", .uid = uid, .gid = uid, .home = ""};
    } else {
        account = tarn::AccountUserByName(options.user);
    }
    if (!account) fail(kExitNoUser, "no user " + options.user);

    // Decided before anything is made for the program.
    std::string why;
    const bool confined = tarn::LandlockABIVersion(&why) > 0;
    if (!confined && !options.allowUnconfined)
        fail(kExitNotPermitted, "Landlock is not available (" + why + "); refusing to run " +
                                    program + " unconfined (--allow-unconfined runs it anyway)");
    if (!confined)
        std::cerr << "tarnrun: warning: Landlock is not available (" << why << "); running "
                  << program << " unconfined as asked\n";

    const Containers containers = askForContainers(queryFor(*info, account->uid, options), options);

    // Built while still root: the paths may not be reachable as the user.
    std::unique_ptr<tarn::LandlockRuleset> ruleset;
    if (confined) {
        tarn::LandlockPolicy policy;
        policy.writable = containers.writable;
        policy.readable.assign(std::begin(kSystemDirectories), std::end(kSystemDirectories));
        policy.readable.push_back(*executable);
        policy.readable.insert(policy.readable.end(), options.readable.begin(),
                               options.readable.end());
        policy.readWriteFiles.assign(std::begin(kReadWriteDevices), std::end(kReadWriteDevices));
        ruleset = tarn::LandlockRuleset::create(policy, &why);
        if (!ruleset) fail(kExitSystemError, "cannot build the Landlock ruleset: " + why);
    }

    becomeUser(account->uid, account->gid);
    if (::chdir(containers.data.c_str()) != 0)
        fail(kExitSystemError, "cannot enter " + containers.data + ": " + std::strerror(errno));
    ::setenv("HOME", containers.data.c_str(), 1);
    ::setenv("TMPDIR", containers.temporary.c_str(), 1);
    if (!account->name.empty()) {
        ::setenv("USER", account->name.c_str(), 1);
        ::setenv("LOGNAME", account->name.c_str(), 1);
    }
    if (ruleset && ruleset->enforce(&why) != 0)
        fail(kExitSystemError, "cannot confine " + program + ": " + why);

    std::vector<char*> args;
    for (std::string& arg : options.command) args.push_back(arg.data());
    args.push_back(nullptr);
    ::execv(executable->c_str(), args.data());
    const int err = errno;
    fail(err == ENOENT ? kExitNotFound : kExitCannotExecute,
         "cannot execute " + *executable + ": " + std::strerror(err));
}
