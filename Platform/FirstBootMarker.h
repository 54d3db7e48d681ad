// The first-boot marker: a named POSIX semaphore that exists once the
// first-launch-since-boot clean-up has finished and lives until reboot.
// Under a scratch root its name carries a hash of the root, so scratch roots
// never share a marker with each other or with the device.
#pragma once

#include <string>

namespace tarn {

std::string FirstBootMarkerName();        // "tarnkeeperd.fb_check" (+ ".<hash>")
bool FirstBootMarkerExists();            // opens without creating, closes again
// Creates it (mode 0444, value 0). Returns 0 or an errno.
int FirstBootMarkerCreate();
// Removes it (simulated reboot). Returns 0 or an errno; ENOENT is success.
int FirstBootMarkerRemove();

}  // namespace tarn
