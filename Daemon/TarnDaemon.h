// The daemon's process-wide start-up state: log, queues, lock state, boot
// completions. Start-up work runs once, on the listener queue, before the
// listener's first event.
#pragma once

#include <cstdint>

#include "Platform/Dispatch.h"

namespace tarn {

// Runs the start-up work (log, queues, boot set-up, kernel upcall service,
// lock state, clean-ups) on `listenerQueue`, which the upcall queue targets.
// `onFinished` runs at its very end (readiness notification).
void TarnDaemonStartupWork(const DispatchQueueRef& listenerQueue,
                           const std::function<void()>& onFinished);

DispatchQueueRef TarnDeathRowQueue();   // "com.ostrea.tarnkeeperd.deathrow"
DispatchQueueRef TarnLockStateQueue();  // "com.ostrea.tarnkeeperd.lockstate"
uint32_t TarnLogRotationCount();

// Acts on the current lock state: suspends the lock-state queue when the
// device becomes locked, resumes it when it is unlocked after a suspension.
// Runs on the main queue (and once directly at start-up).
void TarnLockStateCallback();
uint32_t TEST_savedLockState();
void TEST_resetLockState();

}  // namespace tarn
