#include "Daemon/TarnExceptionFence.h"

#include <pthread.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <typeinfo>

#include "Daemon/TarnGlobalConfiguration.h"
#include "Platform/PlatformLog.h"

namespace tarn {

TarnErrorRef TarnCaughtExceptionError(const char* function, const std::exception* exception) {
    if (TarnGlobalConfiguration::sharedInstance().isInternalImage())
        TarnFatalExceptionReport(exception);
    std::string name = exception ? typeid(*exception).name() : "unknown exception";
    std::string reason = exception ? exception->what() : "";
    return TarnErrorMake(function, __LINE__, TarnErrorException, nullptr, /*log=*/true,
                         Format("Got exception: %@ : %@", name, reason));
}

namespace {
std::mutex gCrashMu;
char gCrashMessage[4096];  // the crash message slot, read by a crash reporter or a debugger
}  // namespace

void TarnFatalExceptionReport(const std::exception* exception) {
    std::string text = "** INTERNAL ERROR: Uncaught Exception **\nException: ";
    char threadName[64] = {0};
    if (pthread_getname_np(pthread_self(), threadName, sizeof threadName) == 0 && threadName[0])
        text += std::string("<") + threadName + "> ";
    if (exception) {
        text += std::string(typeid(*exception).name()) + ": ";
        text += exception->what();
    }
    text += "\nStack:\n";
    gCrashMu.lock();  // never released: the process ends here
    std::strncpy(gCrashMessage, text.c_str(), sizeof gCrashMessage - 1);
    PlatformLogWrite("daemon", PlatformLogType::Fault, text);  // flushes batched lines first
    // Also where a quiet platform log (tools, tests) would swallow it.
    std::fprintf(stderr, "%s\n", text.c_str());
    std::abort();
}

}  // namespace tarn
