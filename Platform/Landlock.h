// Landlock: an unprivileged file-system sandbox the calling thread puts on
// itself; it holds across exec and for every child, and can only be
// tightened. What the ruleset handles is denied unless a rule under some
// parent directory of the path allows it.
//
// Use: LandlockRuleset::create() (while the paths are still reachable, e.g.
// before dropping privileges), then enforce() right before exec.
#pragma once

#include <memory>
#include <string>
#include <vector>

namespace tarn {

// The highest Landlock ABI the kernel offers; 0 (and why in *why) when it
// offers none (not built in, or not enabled at boot).
int LandlockABIVersion(std::string* why);

struct LandlockPolicy {
    // Directories where everything is allowed: read, write, create, remove,
    // execute. Each must exist.
    std::vector<std::string> writable;
    // Files or directories that may be read and executed. Missing ones are
    // left out (not every system has every system directory).
    std::vector<std::string> readable;
    // Files that may be read and written but not removed (character devices
    // like /dev/null). Missing ones are left out.
    std::vector<std::string> readWriteFiles;
};

class LandlockRuleset {
  public:
    // Handles every file-system right of the kernel's ABI. nullptr with a
    // reason naming the call or path on failure.
    static std::unique_ptr<LandlockRuleset> create(const LandlockPolicy& policy, std::string* why);
    ~LandlockRuleset();
    LandlockRuleset(const LandlockRuleset&) = delete;
    LandlockRuleset& operator=(const LandlockRuleset&) = delete;

    // Sets no_new_privs and confines the calling thread. 0 or an errno.
    int enforce(std::string* why);

  private:
    explicit LandlockRuleset(int fd) : fd_(fd) {}
    int fd_;
};

}  // namespace tarn
