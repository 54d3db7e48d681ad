// The device lock state (LockStateService). On Linux it is the file
// DIR/run/tarnkeeper/lockstate: "1" locked, "0" (or absent) unlocked, any other
// number is passed through as is. The file is watched with inotify; changes
// call the registered callbacks on the main queue.
#pragma once

#include <functional>
#include <string>

namespace tarn {

inline constexpr const char* kLockStateNotification = "com.ostrea.tarnkeeper.lockstate";

// Current state: 0 unlocked, 1 locked (other values possible from the file).
int LockStateGet();
bool LockStateDeviceIsLocked();
// Writes the file (tarnctl lock/unlock, tests). Returns 0 or an errno.
int LockStateSet(int state);
// Registers for changes, delivered on the main queue. Returns 0 or a non-zero status.
int LockStateRegister(std::function<void()> callback);
// Tests without a file system watcher override the state in-process (-1 clears).
void LockStateTEST_override(int state);

}  // namespace tarn
