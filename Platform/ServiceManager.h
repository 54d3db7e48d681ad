// The service manager's side of the daemon's life: readiness and stopping
// notifications (sd_notify; no-ops when not run by systemd) and the
// termination signals, which are turned into one callback on a thread of
// their own so that no handler runs in signal context.
#pragma once

#include <functional>

namespace tarn {

void ServiceNotifyReady();
void ServiceNotifyStopping();
// Blocks SIGTERM and SIGINT in the calling thread (call before any other
// thread exists, so all inherit the mask) and calls `onTerminate` once, on a
// dedicated thread, when one arrives.
void ServiceHandleTerminationSignals(std::function<void()> onTerminate);

}  // namespace tarn
