// Process and socket helpers for exercising Conduit from tests and benchmarks:
// child processes with other credentials, CPU pinning, and a bare
// SOCK_SEQPACKET echo that measures the transport without Conduit on top.
// Not used by the daemon itself.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace tarn::conduit::harness {

// A child process run from argv[0] (a path). Killed and reaped on destruction
// unless it was reaped already.
class ChildProcess {
public:
    struct Options {
        std::optional<uid_t> uid;  // switch real/effective/saved ids before exec (needs root)
        std::optional<gid_t> gid;
        std::string stdoutPath;  // empty: inherit
        std::string stderrPath;  // empty: inherit
    };
    static std::unique_ptr<ChildProcess> spawn(const std::vector<std::string>& argv,
                                               const Options& options, std::string* why);

    pid_t pid() const { return pid_; }
    // Exit status, or 128 + signal number; empty when `timeout` passed first.
    std::optional<int> wait(std::chrono::milliseconds timeout);
    // SIGTERM, then SIGKILL after `grace`; returns the status.
    int terminate(std::chrono::milliseconds grace = std::chrono::milliseconds(5000));

    explicit ChildProcess(pid_t pid) : pid_(pid) {}
    ~ChildProcess();
    ChildProcess(const ChildProcess&) = delete;
    ChildProcess& operator=(const ChildProcess&) = delete;

private:
    pid_t pid_;
    bool reaped_ = false;
};

// Real path of this process's executable (empty when unreadable).
std::string SelfExecutablePath();

// CPUs the calling thread may run on.
std::vector<int> AllowedCpus();
// Pins the calling thread (and the threads it starts later) to `cpus`.
bool SetThreadCpus(const std::vector<int>& cpus, std::string* why);
// Pins every thread another process has now (threads it starts later inherit
// from their creator).
bool SetProcessCpus(pid_t pid, const std::vector<int>& cpus, std::string* why);

// A SOCK_SEQPACKET socket pair whose far end sends every record back: from a
// thread of this process, or from a child process (`otherProcess`), which
// pays what any server process pays per hop, the switch of address space.
// The child inherits the calling thread's CPU placement.
class SeqpacketEcho {
public:
    static std::unique_ptr<SeqpacketEcho> start(std::string* why, bool otherProcess = false);
    // Sends `bytes` and waits for the echo into `reply`.
    bool roundTrip(const std::vector<uint8_t>& bytes, std::vector<uint8_t>* reply);
    // The echoing process, or -1 when the echo is a thread of this one.
    pid_t pid() const { return child_; }

    SeqpacketEcho(int near, int far, bool otherProcess);
    ~SeqpacketEcho();
    SeqpacketEcho(const SeqpacketEcho&) = delete;
    SeqpacketEcho& operator=(const SeqpacketEcho&) = delete;

private:
    const int near_;
    int far_;
    std::thread thread_;
    pid_t child_ = -1;
};

}  // namespace tarn::conduit::harness
