// Socket and process primitives behind Conduit (Linux). Used by the Conduit
// implementation and its test/benchmark harness only; the daemon talks to
// Conduit.h.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "Platform/ConduitWire.h"

namespace tarn::conduit::sock {

// Sends each record as one SOCK_SEQPACKET record. A full send buffer is
// waited out for at most `timeout` per record. No SIGPIPE.
bool SendRecords(int fd, const std::vector<std::vector<uint8_t>>& records,
                 std::chrono::milliseconds timeout, std::string* why);

// Sends one record (same rules as SendRecords).
bool SendRecord(int fd, const uint8_t* data, size_t size, std::chrono::milliseconds timeout,
                std::string* why);
// Frames and sends a message EncodeMessage() put in `encoded`; keeps the
// buffer's capacity for the next message unless it grew large.
bool SendEncodedMessage(int fd, const RecordHeader& header, std::vector<uint8_t>* encoded,
                        std::chrono::milliseconds timeout, std::string* why);

enum class RecvResult { Record, WouldBlock, Closed, Error };
// Receives one record into `buffer` (resized to the record). A record longer
// than `limit` is reported as Error with a reason, without keeping its bytes.
// Without `wait` it never blocks; with it, a blocking socket waits up to its
// SO_RCVTIMEO, and WouldBlock then means that time passed with nothing read.
RecvResult ReceiveRecord(int fd, size_t limit, std::vector<uint8_t>* buffer, std::string* why,
                         bool wait = false);

// Sets SO_RCVTIMEO (0: wait without limit).
bool SetReceiveTimeout(int fd, std::chrono::milliseconds timeout);

// Waits until `fd` is readable; false on timeout (why = "timed out") or error.
bool WaitReadable(int fd, std::chrono::milliseconds timeout, std::string* why);

void CloseFd(int fd);

// The peer of a connected Unix socket as the kernel recorded it at connect time.
struct PeerCredentials {
    uid_t euid = 0;
    gid_t egid = 0;
    pid_t pid = 0;
    uint64_t startTime = 0;  // clock ticks after boot
    int pidfd = -1;          // owned by the caller
    // The peer's /proc/PID/exe link itself (O_PATH|O_NOFOLLOW), owned by the
    // caller; -1 when it could not be opened. Opened while the pidfd showed the
    // process alive, so it names that process and no other: reading it gives
    // what that process runs now, and fails once the process is gone even if
    // its PID is reused.
    int exeLinkFd = -1;
};
// Takes SO_PEERCRED and the peer's pidfd (SO_PEERPIDFD, or pidfd_open checked
// against the accept time), and the start time read while the pidfd shows the
// process alive. Empty with a reason when the peer is already gone.
std::optional<PeerCredentials> ReadPeerCredentials(int fd, std::string* why);

// Field 22 of /proc/PID/stat; empty when the process is gone.
std::optional<uint64_t> ProcessStartTime(pid_t pid);
// True while the process behind `pidfd` has not exited.
bool PidfdAlive(int pidfd);
// readlink of /proc/PID/exe.
std::optional<std::string> ProcessExecutable(pid_t pid);
// What the link opened as PeerCredentials::exeLinkFd names now: one
// readlinkat, without a path walk. Empty once the process has exited.
std::optional<std::string> ExecutableLinkAt(int exeLinkFd);
// Device and inode of the file /proc/PID/exe names: a new exec of another
// file changes them even when the path stays the same.
struct FileIdentity {
    uint64_t dev = 0;
    uint64_t ino = 0;
    bool operator==(const FileIdentity&) const = default;
};
std::optional<FileIdentity> ProcessExecutableFile(pid_t pid);

}  // namespace tarn::conduit::sock
