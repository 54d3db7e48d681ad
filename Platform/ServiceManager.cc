#include "Platform/ServiceManager.h"

#include <pthread.h>
#include <signal.h>
#include <systemd/sd-daemon.h>

#include <thread>

namespace tarn {

void ServiceNotifyReady() { (void)sd_notify(0, "READY=1"); }
void ServiceNotifyStopping() { (void)sd_notify(0, "STOPPING=1"); }

void ServiceHandleTerminationSignals(std::function<void()> onTerminate) {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGTERM);
    sigaddset(&set, SIGINT);
    pthread_sigmask(SIG_BLOCK, &set, nullptr);
    // SIGPIPE would kill the daemon when a client vanishes mid-reply.
    signal(SIGPIPE, SIG_IGN);
    std::thread([set, onTerminate = std::move(onTerminate)] {
        int sig = 0;
        while (sigwait(&set, &sig) != 0) {
        }
        onTerminate();
    }).detach();
}

}  // namespace tarn
