#include "Daemon/TarnContainerClass.h"

namespace tarn {

namespace {

struct ClassRow {
    const char* relativeDirectory;
    const char* shortName;
    uint32_t sandboxItemType;
};

constexpr ClassRow kClassTable[] = {
    {nullptr, "Undefined", 0},
    {"Bundle/Application", "app", 0},
    {"Data/Application", "appData", 1},
    {"Bundle/AddonModule", "plugin", 0},
    {"Data/AddonModule", "pluginData", 1},
    {"Bundle/VPNPlugin", "vpn", 0},
    {"Data/VPNPlugin", "vpnData", 1},
    {"Shared/AppGroup", "appGroup", 2},
    {"Bundle/Framework", "framework", 0},
    {"Data/ConduitService", "conduitService", 1},
    {"Data/InternalDaemon", "daemon", 1},
    {"Data/TempDir", "tempDir", 1},
    {"Data/System", "systemData", 4},
    {"Shared/SystemGroup", "systemGroup", 8},
    {nullptr, "MAX", 0},
};

}  // namespace

const char* TarnContainerClassRelativeDirectory(TarnContainerClass c) {
    return TarnContainerClassIsValid(c) ? kClassTable[c].relativeDirectory : nullptr;
}

const char* TarnContainerClassShortName(TarnContainerClass c) {
    return c <= TarnContainerClassMax ? kClassTable[c].shortName : nullptr;
}

uint32_t TarnContainerClassSandboxItemType(TarnContainerClass c) {
    return TarnContainerClassIsValid(c) ? kClassTable[c].sandboxItemType : 0;
}

}  // namespace tarn
