#include "Platform/PlatformLog.h"

#include <sys/stat.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <cstdio>
#include <atomic>
#include <cstring>
#include <mutex>

namespace tarn {

namespace {

std::atomic<bool> gVerbose{::getenv("TARN_PLATFORM_LOG_VERBOSE") != nullptr};

struct Sink {
    std::mutex mu;
    FILE* file = nullptr;  // guarded by mu
    bool quiet = false;    // guarded by mu
    bool journal = false;  // decided once
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
}

bool PlatformLogVerbose() { return gVerbose.load(std::memory_order_relaxed); }

void PlatformLogSetQuiet(bool quiet) {
    auto& s = sink();
    std::lock_guard lock(s.mu);
    s.quiet = quiet;
}

void PlatformLogWrite(const char* category, PlatformLogType type, const std::string& message) {
    auto& s = sink();
    const char* subsystem = subsystemFor(category);
    std::lock_guard lock(s.mu);
    if (s.file) std::fprintf(s.file, "%s[%s] %s\n", subsystem, category, message.c_str());
    if (s.quiet) return;
    if (s.journal) {
        sd_journal_send("MESSAGE=%s", message.c_str(), "PRIORITY=%d", priorityFor(type),
                        "TARN_SUBSYSTEM=%s", subsystem, "TARN_CATEGORY=%s", category,
                        "SYSLOG_IDENTIFIER=tarnkeeperd", nullptr);
    } else {
        std::fprintf(stderr, "%s[%s] %s\n", subsystem, category, message.c_str());
    }
}

SignpostInterval::SignpostInterval(const char* category, std::string name,
                                   std::vector<std::pair<std::string, std::string>> attributes)
    : category_(category), recording_(PlatformLogVerbose()) {
    if (!recording_) return;
    name_ = std::move(name);
    start_ = std::chrono::steady_clock::now();
    std::string text = "signpost begin " + name_;
    for (auto& [k, v] : attributes) text += " " + k + "=" + v;
    PlatformLogWrite(category_, PlatformLogType::Debug, text);
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
