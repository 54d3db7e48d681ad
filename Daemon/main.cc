// Process entry of tarnkeeperd.
//
//   tarnkeeperd [--root DIR] [--platform-log FILE]
//
// Order matters: the listener queue gets the start-up work before the
// listener is resumed, so no request is handled before start-up has finished.
#include <CLI/CLI.hpp>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <mutex>

#include "Daemon/TarnDaemon.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnRequestProcessor.h"
#include "Platform/Conduit.h"
#include "Platform/Dispatch.h"
#include "Platform/PlatformLog.h"
#include "Platform/RootPrefix.h"
#include "Platform/ServiceManager.h"

using namespace tarn;

namespace {

constexpr auto kShutdownBound = std::chrono::seconds(20);
// Set up on the main thread, cancelled from the signal thread: the lock orders
// the two (a stop may arrive while the listener is still being made).
std::mutex gListenerMu;
std::shared_ptr<conduit::Listener> gListener;

void newConnection(const conduit::ConnectionRef& peer) {
    std::weak_ptr<conduit::Connection> weak = peer;
    // Events of one peer run one at a time, so the slot needs no lock.
    auto reuse = std::make_shared<TarnClientIdentity::Reuse>();
    peer->setEventHandler([weak, reuse](const conduit::Event& event) {
        if (auto p = weak.lock()) TarnProcessConduitEvent(p, event, reuse.get());
    });
    peer->setQoSFloor(QoS::Default);
    peer->resume();
}

}  // namespace

int main(int argc, char** argv) {
    CLI::App app{"tarnkeeperd: the container-directory manager daemon"};
    std::string root = "/";
    std::string platformLog;
    app.add_option("--root", root, "Root prefix for every path the daemon uses (default /)");
    app.add_option("--platform-log", platformLog,
                   "Also append platform-log lines (structured lines, signposts) to FILE");
    CLI11_PARSE(app, argc, argv);

    SetRootPrefix(root);
    if (!platformLog.empty()) PlatformLogSetFile(platformLog);

    // Before any thread exists, so every thread inherits the blocked mask.
    ServiceHandleTerminationSignals([] {
        ServiceNotifyStopping();
        {
            std::lock_guard lock(gListenerMu);
            if (gListener) gListener->cancel();
        }
        // Background work holds transactions; give it a bounded time to finish.
        (void)Transaction::waitForIdle(std::chrono::duration_cast<std::chrono::milliseconds>(kShutdownBound));
        std::_Exit(0);
    });

    auto listenerQueue = DispatchQueue::createSerial("com.ostrea.tarnkeeperd.listener");
    Transaction::begin();
    listenerQueue->async([listenerQueue] {
        TarnDaemonStartupWork(listenerQueue, [] { ServiceNotifyReady(); });
        Transaction::end();
    });

    {
        std::lock_guard lock(gListenerMu);
        std::string why;
        gListener = conduit::Listener::create("com.ostrea.tarnkeeperd", listenerQueue, &why);
        if (!gListener) {
            TarnLog(kLogError, "main", "unable to start conduit service!");
            PlatformLog("daemon", PlatformLogType::Error, "conduit listener: %s", why);
        } else {
            gListener->setNewConnectionHandler(newConnection);
            gListener->resume();
            PlatformLog("daemon", PlatformLogType::Default, "listening on %s",
                        gListener->socketPath());
        }
    }
    DispatchQueue::runMain();
    return 0;
}
