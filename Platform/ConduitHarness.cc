#include "Platform/ConduitHarness.h"

#include <fcntl.h>
#include <grp.h>
#include <sched.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>

#include "Platform/ConduitSocket.h"
#include "Platform/Format.h"

namespace tarn::conduit::harness {

std::unique_ptr<ChildProcess> ChildProcess::spawn(const std::vector<std::string>& argv,
                                                  const Options& options, std::string* why) {
    if (argv.empty()) {
        if (why) *why = "empty argv";
        return nullptr;
    }
    // Everything the child needs is prepared before fork: between fork and exec
    // only async-signal-safe calls are allowed.
    std::vector<char*> args;
    for (const auto& a : argv) args.push_back(const_cast<char*>(a.c_str()));
    args.push_back(nullptr);
    const char* out = options.stdoutPath.empty() ? nullptr : options.stdoutPath.c_str();
    const char* err = options.stderrPath.empty() ? nullptr : options.stderrPath.c_str();
    const bool setGid = options.gid.has_value();
    const gid_t gid = options.gid.value_or(0);
    const bool setUid = options.uid.has_value();
    const uid_t uid = options.uid.value_or(0);

    const pid_t pid = ::fork();
    if (pid < 0) {
        if (why) *why = Format("fork: %s", std::strerror(errno));
        return nullptr;
    }
    if (pid == 0) {
        if (out) {
            const int fd = ::open(out, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
            if (fd < 0 || ::dup2(fd, 1) < 0) ::_exit(126);
        }
        if (err) {
            const int fd = ::open(err, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
            if (fd < 0 || ::dup2(fd, 2) < 0) ::_exit(126);
        }
        if (setGid && (::setgroups(0, nullptr) != 0 || ::setresgid(gid, gid, gid) != 0))
            ::_exit(125);
        if (setUid && ::setresuid(uid, uid, uid) != 0) ::_exit(125);
        ::execv(args[0], args.data());
        ::_exit(127);
    }
    return std::make_unique<ChildProcess>(pid);
}

std::optional<int> ChildProcess::wait(std::chrono::milliseconds timeout) {
    if (reaped_) return std::nullopt;
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    for (;;) {
        int status = 0;
        const pid_t r = ::waitpid(pid_, &status, WNOHANG);
        if (r == pid_) {
            reaped_ = true;
            return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
        }
        if (r < 0 && errno != EINTR) {
            reaped_ = true;
            return std::nullopt;
        }
        if (std::chrono::steady_clock::now() >= deadline) return std::nullopt;
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
}

int ChildProcess::terminate(std::chrono::milliseconds grace) {
    if (reaped_) return -1;
    (void)::kill(pid_, SIGTERM);  // it may be gone already; wait() tells
    if (auto s = wait(grace)) return *s;
    (void)::kill(pid_, SIGKILL);
    return wait(std::chrono::milliseconds(10000)).value_or(-1);
}

ChildProcess::~ChildProcess() {
    if (reaped_) return;
    (void)::kill(pid_, SIGKILL);  // gone already is fine
    (void)wait(std::chrono::milliseconds(10000));
}

std::string SelfExecutablePath() {
    auto path = sock::ProcessExecutable(::getpid());
    if (!path) return {};
    std::error_code ec;
    auto real = std::filesystem::canonical(*path, ec);
    return ec ? *path : real.string();
}

std::vector<int> AllowedCpus() {
    cpu_set_t set;
    CPU_ZERO(&set);
    std::vector<int> cpus;
    if (::sched_getaffinity(0, sizeof set, &set) != 0) return cpus;
    for (int i = 0; i < CPU_SETSIZE; ++i)
        if (CPU_ISSET(i, &set)) cpus.push_back(i);
    return cpus;
}

namespace {

bool setCpus(pid_t pid, const std::vector<int>& cpus, std::string* why) {
    cpu_set_t set;
    CPU_ZERO(&set);
    for (int c : cpus)
        if (c >= 0 && c < CPU_SETSIZE) CPU_SET(c, &set);
    if (::sched_setaffinity(pid, sizeof set, &set) != 0) {
        if (why) *why = Format("sched_setaffinity: %s", std::strerror(errno));
        return false;
    }
    return true;
}

}  // namespace

bool SetThreadCpus(const std::vector<int>& cpus, std::string* why) { return setCpus(0, cpus, why); }

bool SetProcessCpus(pid_t pid, const std::vector<int>& cpus, std::string* why) {
    // sched_setaffinity moves one thread; a process is every task it has now.
    std::error_code ec;
    bool any = false;
    for (const auto& task :
         std::filesystem::directory_iterator("/proc/" + std::to_string(pid) + "/task", ec)) {
        const pid_t tid = static_cast<pid_t>(std::atoi(task.path().filename().c_str()));
        if (tid > 0 && !setCpus(tid, cpus, why)) return false;
        any = true;
    }
    return any || setCpus(pid, cpus, why);
}

std::unique_ptr<SeqpacketEcho> SeqpacketEcho::start(std::string* why, bool otherProcess) {
    int fds[2];
    if (::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, fds) != 0) {
        if (why) *why = Format("socketpair: %s", std::strerror(errno));
        return nullptr;
    }
    auto echo = std::make_unique<SeqpacketEcho>(fds[0], fds[1], otherProcess);
    if (otherProcess && echo->child_ < 0) {
        if (why) *why = Format("fork: %s", std::strerror(errno));
        return nullptr;
    }
    return echo;
}

namespace {

// Sends every record back until the other end closes. Only system calls:
// safe in a child forked from a process with threads.
void echoLoop(int fd, uint8_t* buf, size_t size) {
    for (;;) {
        const ssize_t n = ::recv(fd, buf, size, 0);
        if (n <= 0) {
            if (n < 0 && errno == EINTR) continue;
            return;  // the near end closed
        }
        if (::send(fd, buf, static_cast<size_t>(n), MSG_NOSIGNAL) != n) return;
    }
}

}  // namespace

SeqpacketEcho::SeqpacketEcho(int near, int far, bool otherProcess) : near_(near), far_(far) {
    if (otherProcess) {
        std::vector<uint8_t> buf(1 << 20);  // before fork: the child may not allocate
        child_ = ::fork();
        if (child_ == 0) {
            echoLoop(far_, buf.data(), buf.size());
            ::_exit(0);
        }
        sock::CloseFd(far_);  // the child's now
        far_ = -1;
        return;
    }
    thread_ = std::thread([fd = far_] {
        std::vector<uint8_t> buf(1 << 20);
        echoLoop(fd, buf.data(), buf.size());
    });
}

SeqpacketEcho::~SeqpacketEcho() {
    (void)::shutdown(near_, SHUT_RDWR);  // wakes the echo with end of stream
    if (thread_.joinable()) thread_.join();
    if (child_ > 0) {
        int status;
        while (::waitpid(child_, &status, 0) < 0 && errno == EINTR) {
        }
    }
    sock::CloseFd(near_);
    sock::CloseFd(far_);
}

bool SeqpacketEcho::roundTrip(const std::vector<uint8_t>& bytes, std::vector<uint8_t>* reply) {
    if (::send(near_, bytes.data(), bytes.size(), MSG_NOSIGNAL) !=
        static_cast<ssize_t>(bytes.size()))
        return false;
    reply->resize(bytes.size() + 1);
    ssize_t n;
    do {
        n = ::recv(near_, reply->data(), reply->size(), 0);
    } while (n < 0 && errno == EINTR);
    if (n < 0) return false;
    reply->resize(static_cast<size_t>(n));
    return true;
}

}  // namespace tarn::conduit::harness
