#include "support/DaemonHarness.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <stdexcept>
#include <thread>

#include "Tools/tarnctl/Json.h"

extern char** environ;

namespace fs = std::filesystem;

namespace tarn::test {

std::string BuiltBinary(const std::string& name) { return std::string(TARN_BINARY_DIR) + "/" + name; }

std::string DaemonBinary() {
    const char* other = std::getenv("TARN_TEST_DAEMON");
    return other && *other ? std::string(other) : BuiltBinary("tarnkeeperd");
}

ProcessResult RunProcess(const std::vector<std::string>& argv, std::chrono::milliseconds timeout) {
    ProcessResult r;
    int outPipe[2], errPipe[2];
    if (::pipe2(outPipe, O_CLOEXEC) != 0 || ::pipe2(errPipe, O_CLOEXEC) != 0) return r;
    posix_spawn_file_actions_t fa;
    posix_spawn_file_actions_init(&fa);
    posix_spawn_file_actions_adddup2(&fa, outPipe[1], 1);
    posix_spawn_file_actions_adddup2(&fa, errPipe[1], 2);
    std::vector<char*> args;
    for (auto& a : argv) args.push_back(const_cast<char*>(a.c_str()));
    args.push_back(nullptr);
    pid_t pid = -1;
    int rc = posix_spawn(&pid, args[0], &fa, nullptr, args.data(), environ);
    posix_spawn_file_actions_destroy(&fa);
    ::close(outPipe[1]);
    ::close(errPipe[1]);
    if (rc != 0) {
        ::close(outPipe[0]);
        ::close(errPipe[0]);
        r.err = "spawn failed";
        return r;
    }
    auto deadline = std::chrono::steady_clock::now() + timeout;
    pollfd fds[2] = {{outPipe[0], POLLIN, 0}, {errPipe[0], POLLIN, 0}};
    int open = 2;
    while (open > 0) {
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
            deadline - std::chrono::steady_clock::now());
        if (left.count() <= 0) {
            ::kill(pid, SIGKILL);
            break;
        }
        if (::poll(fds, 2, static_cast<int>(left.count())) <= 0) continue;
        for (int i = 0; i < 2; ++i) {
            if (fds[i].fd < 0 || !(fds[i].revents & (POLLIN | POLLHUP))) continue;
            char buf[4096];
            ssize_t n = ::read(fds[i].fd, buf, sizeof buf);
            if (n <= 0) {
                ::close(fds[i].fd);
                fds[i].fd = -1;
                --open;
            } else {
                (i == 0 ? r.out : r.err).append(buf, static_cast<size_t>(n));
            }
        }
    }
    for (auto& f : fds)
        if (f.fd >= 0) ::close(f.fd);
    int status = 0;
    ::waitpid(pid, &status, 0);
    r.exitCode = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    return r;
}

DaemonHarness::DaemonHarness(const ScratchRoot& root)
    : root_(root),
      socket_(root.at("/run/com.ostrea.tarnkeeperd.socket")),
      platformLogPath_(root.at("/platform.log")) {
    PlistValue host{PlistDict{}};
    host.set("InternalBuild", true);
    writeHostConfig(host);
    root_.mkdirs("/etc/tarnkeeper/codesign");
    root_.mkdirs("/clients");
}

DaemonHarness::~DaemonHarness() {
    if (pid_ > 0) stop();
}

void DaemonHarness::writeHostConfig(const PlistValue& host) {
    auto bytes = host.toBinary();
    root_.writeFile("/etc/tarnkeeper/host.plist", std::string(bytes.begin(), bytes.end()));
}

std::string DaemonHarness::addClient(const std::string& name, const std::string& signingIdentifier,
                                     const PlistValue& entitlements, bool sandboxed,
                                     std::optional<std::string> personaUniqueString) {
    std::string copy = root_.at("/clients/" + name);
    fs::copy_file(BuiltBinary("tarnctl"), copy, fs::copy_options::overwrite_existing);
    fs::permissions(copy, fs::perms::owner_all | fs::perms::group_exec | fs::perms::others_exec);
    PlistValue reg{PlistDict{}};
    reg.set("Executable", copy);
    reg.set("SigningIdentifier", signingIdentifier);
    reg.set("Entitlements", entitlements.isNull() ? PlistValue(PlistDict{}) : entitlements);
    reg.set("Sandboxed", sandboxed);
    if (personaUniqueString) reg.set("PersonaUniqueString", *personaUniqueString);
    auto bytes = reg.toBinary();
    root_.writeFile("/etc/tarnkeeper/codesign/" + name + ".plist",
                    std::string(bytes.begin(), bytes.end()));
    return copy;
}

std::string DaemonHarness::addPrivilegedClient(const std::string& name) {
    PlistValue ent{PlistDict{}};
    ent.set("com.ostrea.private.TarnKeeper.allowed", true);
    ent.set("com.ostrea.private.TarnKeeper.testability", true);
    ent.set("com.ostrea.private.TarnKeeper.userManagedAssets", true);
    return addClient(name, "com.ostrea.test." + name, ent);
}

void DaemonHarness::start(bool waitReady) {
    std::error_code ec;
    auto size = fs::file_size(root_.at("/run/tarnkeeper/notifications"), ec);
    notificationsAtStart_ = ec ? 0 : static_cast<size_t>(size);
    std::vector<std::string> argv = {DaemonBinary(), "--root", root_.path(), "--platform-log",
                                     platformLogPath_};
    std::vector<char*> args;
    for (auto& a : argv) args.push_back(const_cast<char*>(a.c_str()));
    args.push_back(nullptr);
    // The daemon's own stderr goes to a file: platform lines are in the log file anyway.
    int devnull = ::open(root_.at("/daemon.stderr").c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
    posix_spawn_file_actions_t fa;
    posix_spawn_file_actions_init(&fa);
    if (devnull >= 0) posix_spawn_file_actions_adddup2(&fa, devnull, 2);
    std::vector<std::string> envStore;
    std::vector<char*> env;
    for (char** e = environ; *e; ++e) env.push_back(*e);
    envStore.push_back("TARN_PLATFORM_LOG_STDERR=1");  // keep test runs out of the journal
    env.push_back(envStore.back().data());
    env.push_back(nullptr);
    int rc = posix_spawn(&pid_, args[0], &fa, nullptr, args.data(), env.data());
    posix_spawn_file_actions_destroy(&fa);
    if (devnull >= 0) ::close(devnull);
    if (rc != 0) throw std::runtime_error("cannot start tarnkeeperd");
    if (!waitReady) return;
    if (!waitForNotification("com.ostrea.tarnkeeper.cleanup-complete", std::chrono::seconds(30),
                             /*sinceLastStart=*/true))
        throw std::runtime_error("tarnkeeperd did not finish start-up");
}

bool DaemonHarness::waitForNotification(const std::string& name, std::chrono::milliseconds timeout,
                                        bool sinceLastStart) {
    auto deadline = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < deadline) {
        std::ifstream in(root_.at("/run/tarnkeeper/notifications"));
        std::error_code ec;
        // simulate-reboot removes the file; an offset past its end then means "from the start".
        auto size = fs::file_size(root_.at("/run/tarnkeeper/notifications"), ec);
        if (sinceLastStart && !ec && size >= notificationsAtStart_)
            in.seekg(static_cast<std::streamoff>(notificationsAtStart_));
        std::string line;
        while (std::getline(in, line))
            if (line == name) return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
}

int DaemonHarness::stop() {
    if (pid_ <= 0) return -1;
    ::kill(pid_, SIGTERM);
    int status = 0;
    ::waitpid(pid_, &status, 0);
    pid_ = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

void DaemonHarness::kill9() {
    if (pid_ <= 0) return;
    ::kill(pid_, SIGKILL);
    int status = 0;
    ::waitpid(pid_, &status, 0);
    pid_ = -1;
}

bool DaemonHarness::waitExit(std::chrono::milliseconds timeout) {
    if (pid_ <= 0) return true;
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    do {
        int status = 0;
        if (::waitpid(pid_, &status, WNOHANG) == pid_) {
            pid_ = -1;
            return true;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    } while (std::chrono::steady_clock::now() < deadline);
    return false;
}

void DaemonHarness::signal(int sig) {
    if (pid_ > 0) ::kill(pid_, sig);
}

ProcessResult DaemonHarness::tarnctl(const std::string& client, const std::vector<std::string>& args) {
    std::vector<std::string> argv = {client, "--root", root_.path()};
    argv.insert(argv.end(), args.begin(), args.end());
    return RunProcess(argv);
}

std::optional<PlistValue> DaemonHarness::send(const std::string& client, const std::string& json) {
    ProcessResult result = tarnctl(client, {"send", json});
    std::optional<PlistValue> reply;
    if (result.exitCode == 0) {
        std::string why;
        reply = tarnctl::JsonToPlist(result.out, &why);
    }
    std::lock_guard lock(lastMu_);
    last_ = std::move(result);
    return reply;
}

uint64_t DaemonHarness::sendError(const std::string& client, const std::string& json) {
    auto reply = send(client, json);
    if (!reply) return 0;
    const PlistValue* e = reply->find("ReplyError");
    return e ? e->asUInt64().value_or(0) : 0;
}

std::string DaemonHarness::platformLog() const {
    std::ifstream in(platformLogPath_);
    return std::string((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
}

}  // namespace tarn::test
