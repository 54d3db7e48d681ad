// The notification service: post a named notification, observe one.
// A post runs the in-process observers (on the poster's thread) and appends
// the name as one line to DIR/run/tarnkeeper/notifications, so that other
// processes (`tarnctl wait-notification NAME`) can wait for it.
// Thread-safe.
#pragma once

#include <cstdint>
#include <functional>
#include <string>

namespace tarn {

// Returns 0, or a non-zero status when the notification could not be recorded.
uint32_t NotifyPost(const std::string& name);
// Returns a token for NotifyCancel.
int NotifyRegister(const std::string& name, std::function<void()> callback);
void NotifyCancel(int token);

}  // namespace tarn
