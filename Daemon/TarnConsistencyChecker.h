// TarnConsistencyChecker: an fsck of the container tree below the current
// root prefix, for a stopped daemon. It reads the class directories, the
// replace and pending-update files, the code-signing store and the sandbox
// state, and reports what the daemon's promises say cannot be there.
//
// Two kinds of findings: violations (the tree is wrong: a half-built or
// foreign container is live, an identifier is live twice, a record file is
// malformed, the database is damaged) and notes (the tree is in a state the
// daemon repairs by itself: an orphan the next first-boot sweep takes, a
// stale sandbox item the next lookup drops, a replacement start-up recovery
// finishes). `tarnctl verify` prints both and fails on violations; crash
// tests use it as their oracle.
//
// Not thread-safe against a running daemon: the store is opened in the
// daemon's exclusive locking mode, and a tree under change gives false
// findings. Creates nothing except what opening the store creates beside an
// existing database file.
#pragma once

#include <string>
#include <vector>

namespace tarn {

struct TarnConsistencyFinding {
    std::string path;
    std::string problem;
};

struct TarnConsistencyReport {
    std::vector<TarnConsistencyFinding> violations;
    std::vector<TarnConsistencyFinding> notes;
    // Live containers seen: "<class>/<user identity>/<identifier>" -> path.
    size_t containersSeen = 0;

    bool clean() const { return violations.empty(); }
    // One line per finding, violations first: "violation: PATH: PROBLEM".
    std::string describe() const;
};

struct TarnConsistencyOptions {
    // A directory without a metadata file in a class directory is a
    // violation rather than a note. Creation never makes one (it builds in
    // staging and renames), so crash tests may be strict.
    bool orphansAreViolations = false;
};

TarnConsistencyReport TarnCheckContainerTree(const TarnConsistencyOptions& options = {});

}  // namespace tarn
