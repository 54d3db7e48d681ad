#include "Platform/PlatformLog.h"

#include <sys/stat.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <atomic>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <system_error>
#include <thread>
#include <vector>

namespace tarn {

namespace {

std::atomic<bool> gVerbose{::getenv("TARN_PLATFORM_LOG_VERBOSE") != nullptr};
// Quiet and no file: no line goes anywhere.
std::atomic<bool> gSilent{false};

// Lines at Default severity and below reach stderr or journald in batches
// from a writer thread, at most this long after they were logged: a write per
// line would cost every request a system call. Error and Fault lines, and the
// platform-log file that tests and tools read back at once, stay synchronous;
// a synchronous line first flushes the batch, so the order is kept.
constexpr auto kBatchInterval = std::chrono::milliseconds(20);
// A batch this large is written at once by the thread that fills it.
constexpr size_t kMaxBatchBytes = 64 * 1024;

struct Pending {
    PlatformLogType type;
    std::string category;
    std::string message;
};

struct Sink {
    std::mutex mu;
    FILE* file = nullptr;  // guarded by mu
    bool quiet = false;    // guarded by mu
    bool journal = false;  // decided once

    std::mutex batchMu;  // after mu when both are held
    std::condition_variable batchReady;
    std::vector<Pending> batch;  // guarded by batchMu
    size_t batchBytes = 0;       // guarded by batchMu
    bool writerStarted = false;  // guarded by batchMu
    bool writerIdle = false;     // guarded by batchMu: blocked until a line comes
};

Sink& sink() {
    static Sink* s = [] {
        auto* s = new Sink;
        struct stat st;
        // journald answers on this socket whenever it runs on the host.
        s->journal = ::stat("/run/systemd/journal/socket", &st) == 0 && S_ISSOCK(st.st_mode) &&
                     ::getenv("TARN_PLATFORM_LOG_STDERR") == nullptr;
        return s;
    }();
    return *s;
}

const char* subsystemFor(const char* category) {
    return std::strcmp(category, "daemon") == 0 ? "com.ostrea.tarnkeeperd" : "com.ostrea.keeper";
}

int priorityFor(PlatformLogType t) {
    switch (t) {
        case PlatformLogType::Debug: return LOG_DEBUG;
        case PlatformLogType::Info: return LOG_INFO;
        case PlatformLogType::Default: return LOG_NOTICE;
        case PlatformLogType::Error: return LOG_ERR;
        case PlatformLogType::Fault: return LOG_CRIT;
    }
    return LOG_NOTICE;
}

}  // namespace

void PlatformLogSetFile(const std::string& path) {
    auto& s = sink();
    std::lock_guard lock(s.mu);
    if (s.file) std::fclose(s.file);
    s.file = path.empty() ? nullptr : std::fopen(path.c_str(), "ae");
    if (s.file) std::setvbuf(s.file, nullptr, _IOLBF, 0);
    gVerbose = s.file != nullptr || ::getenv("TARN_PLATFORM_LOG_VERBOSE") != nullptr;
    gSilent = s.quiet && !s.file;
}

bool PlatformLogVerbose() { return gVerbose.load(std::memory_order_relaxed); }

void PlatformLogSetQuiet(bool quiet) {
    auto& s = sink();
    std::lock_guard lock(s.mu);
    s.quiet = quiet;
    gSilent = s.quiet && !s.file;
}

bool PlatformLogWanted(PlatformLogType type) {
    if (type <= PlatformLogType::Info && !PlatformLogVerbose()) return false;
    return !gSilent.load(std::memory_order_relaxed);
}

namespace {

// Writes lines to journald or stderr. Requires s.mu.
void emit(Sink& s, const std::vector<Pending>& lines) {
    if (s.journal) {
        for (const Pending& p : lines) {
            sd_journal_send("MESSAGE=%s", p.message.c_str(), "PRIORITY=%d", priorityFor(p.type),
                            "TARN_SUBSYSTEM=%s", subsystemFor(p.category.c_str()), "TARN_CATEGORY=%s",
                            p.category.c_str(), "SYSLOG_IDENTIFIER=tarnkeeperd", nullptr);
        }
        return;
    }
    std::string text;
    for (const Pending& p : lines) {
        text += subsystemFor(p.category.c_str());
        text += '[';
        text += p.category;
        text += "] ";
        text += p.message;
        text += '\n';
    }
    (void)std::fwrite(text.data(), 1, text.size(), stderr);  // nowhere to report a failure
}

std::vector<Pending> takeBatch(Sink& s) {
    std::lock_guard lock(s.batchMu);
    s.batchBytes = 0;
    return std::move(s.batch);
}

// Requires s.mu: writes whatever is batched, ahead of what comes next.
void flushLocked(Sink& s) {
    std::vector<Pending> lines = takeBatch(s);
    if (!lines.empty() && !s.quiet) emit(s, lines);
}

void writerLoop(Sink& s) {
    for (;;) {
        {
            std::unique_lock lock(s.batchMu);
            while (s.batch.empty()) {
                s.writerIdle = true;
                s.batchReady.wait(lock);
                s.writerIdle = false;
            }
        }
        // Let the batch fill; lines logged meanwhile need no wake-up.
        std::this_thread::sleep_for(kBatchInterval);
        std::lock_guard lock(s.mu);
        flushLocked(s);
    }
}

void flushAtExit() {
    auto& s = sink();
    std::lock_guard lock(s.mu);
    flushLocked(s);
}

// Queues a line for the writer thread; false when the caller should write it
// itself (no thread could be started).
bool enqueue(Sink& s, const char* category, PlatformLogType type, std::string& message) {
    bool wake = false, full = false;
    {
        std::lock_guard lock(s.batchMu);
        if (!s.writerStarted) {
            try {
                std::thread([&s] { writerLoop(s); }).detach();
            } catch (const std::system_error&) {
                return false;
            }
            s.writerStarted = true;
            std::atexit(flushAtExit);
        }
        s.batchBytes += message.size();
        s.batch.push_back(Pending{type, category, std::move(message)});
        wake = s.writerIdle;
        s.writerIdle = false;  // one wake-up per batch
        full = s.batchBytes >= kMaxBatchBytes;
    }
    if (wake) s.batchReady.notify_one();
    if (full) {
        std::lock_guard lock(s.mu);
        flushLocked(s);
    }
    return true;
}

}  // namespace

void PlatformLogFlush() {
    auto& s = sink();
    std::lock_guard lock(s.mu);
    flushLocked(s);
    if (s.file) std::fflush(s.file);
}

void PlatformLogWrite(const char* category, PlatformLogType type, std::string message) {
    auto& s = sink();
    const char* subsystem = subsystemFor(category);
    bool queue;
    {
        std::lock_guard lock(s.mu);
        if (s.file) std::fprintf(s.file, "%s[%s] %s\n", subsystem, category, message.c_str());
        if (s.quiet) return;
        queue = type <= PlatformLogType::Default;
        if (!queue) {
            flushLocked(s);
            emit(s, {Pending{type, category, std::move(message)}});
            return;
        }
    }
    // Takes the message when it queues it; leaves it when it returns false.
    if (!enqueue(s, category, type, message)) {
        std::lock_guard lock(s.mu);
        if (!s.quiet) emit(s, {Pending{type, category, message}});
    }
}

SignpostInterval::SignpostInterval(const char* category, std::string_view name,
                                   std::vector<std::pair<std::string, std::string>> attributes)
    : category_(category), recording_(PlatformLogVerbose()) {
    if (!recording_) return;
    name_ = std::string(name);
    start_ = std::chrono::steady_clock::now();
    std::string text = "signpost begin " + name_;
    for (auto& [k, v] : attributes) text += " " + k + "=" + v;
    PlatformLogWrite(category_, PlatformLogType::Debug, text);
}

void SignpostEvent(const char* category, std::string_view name,
                   const std::vector<std::pair<std::string, std::string>>& attributes) {
    if (!PlatformLogVerbose()) return;
    std::string text = "signpost event " + std::string(name);
    for (const auto& [k, v] : attributes) text += " " + k + "=" + v;
    PlatformLogWrite(category, PlatformLogType::Debug, text);
}

SignpostInterval::~SignpostInterval() {
    if (!ended_) end();
}

void SignpostInterval::end(std::vector<std::pair<std::string, std::string>> attributes) {
    if (ended_) return;
    ended_ = true;
    if (!recording_) return;
    auto us = std::chrono::duration_cast<std::chrono::microseconds>(
                  std::chrono::steady_clock::now() - start_)
                  .count();
    std::string text = "signpost end " + name_ + " duration_us=" + std::to_string(us);
    for (auto& [k, v] : attributes) text += " " + k + "=" + v;
    PlatformLogWrite(category_, PlatformLogType::Debug, text);
}

}  // namespace tarn
