// Base fixture of the tests that talk to a running daemon over IPC: a
// scratch root, the daemon harness on it (not started) and a fully entitled
// client, with the reply readers every such test uses. Skips (from SetUp)
// when the daemon binaries are not built or the process is not root; a
// derived SetUp calls this one first and returns when IsSkipped().
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "Platform/PropertyList.h"
#include "support/DaemonHarness.h"
#include "support/ScratchRoot.h"

namespace tarn::test {

class IpcTest : public ScratchRootTest {
  protected:
    void SetUp() override;

    // The reply of `json` sent as `client`; an empty dictionary (and a failed
    // expectation) when none arrived.
    PlistValue send(const std::string& client, const std::string& json);
    // "ReplyError" of the reply of `json` sent as `client`.
    uint64_t ask(const std::string& client, const std::string& json) {
        return errorOf(send(client, json));
    }
    // "ReplyError", or 0 when missing.
    static uint64_t errorOf(const PlistValue& reply);
    // The string under `key`, or "" when missing or not a string.
    static std::string stringOf(const PlistValue& reply, const std::string& key);

    // Personas on (host configuration, internal build): one personal persona,
    // "PERSONAL-0000" (id 1000), and these enterprise ones.
    struct EnterprisePersona {
        std::string uniqueString;
        uint64_t personaID;
        std::string layoutPath;
        std::vector<std::string> bundleIdentifiers;
    };
    void enablePersonas(const std::vector<EnterprisePersona>& enterprise);

    std::unique_ptr<DaemonHarness> daemon_;
    std::string admin_;
};

}  // namespace tarn::test
