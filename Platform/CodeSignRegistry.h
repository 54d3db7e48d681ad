// Code-signing identity of a peer process. On Linux there is no code
// signature, so the daemon reads a registry of property-list files
// DIR/etc/tarnkeeper/codesign/*.plist, each a dictionary:
//
//   "Executable"          absolute path of the program (matched against the
//                         real path of the peer's executable; a path below
//                         the root prefix is tried first)
//   "SigningIdentifier"   string, the code-signing identifier
//   "Entitlements"        dictionary
//   "Sandboxed"           bool (default false)
//   "PersonaUniqueString" string, optional: the persona the program runs under
//
// An executable without an entry has no signing identifier. The registry is
// re-read when its directory changes. Thread-safe.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "Platform/PropertyList.h"

namespace tarn {

struct CodeSignInfo {
    std::string executable;  // as written in the file
    std::string signingIdentifier;
    PlistValue entitlements;  // a dictionary, or Null when malformed/missing
    bool sandboxed = false;
    std::optional<std::string> personaUniqueString;
};

class CodeSignRegistry {
public:
    static CodeSignRegistry& shared();
    // The entry for an executable's real path, if any.
    std::shared_ptr<const CodeSignInfo> infoForExecutable(const std::string& realPath);
    // Forces a re-read (tests; the watcher does this on its own).
    void reload();

private:
    CodeSignRegistry();
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace tarn
