#include "Platform/HostConfiguration.h"

#include <fstream>
#include <iterator>
#include <memory>
#include <mutex>

#include "Platform/RootPrefix.h"

namespace tarn {

namespace {

std::mutex gMu;
HostConfiguration* gShared = nullptr;  // guarded by gMu; replaced only by tests
// Replaced configurations stay reachable: references handed out remain valid.
std::vector<std::unique_ptr<HostConfiguration>>& retired() {
    static auto* v = new std::vector<std::unique_ptr<HostConfiguration>>;
    return *v;
}

std::string unquote(std::string v) {
    if (v.size() >= 2 && (v.front() == '"' || v.front() == '\'') && v.back() == v.front())
        return v.substr(1, v.size() - 2);
    return v;
}

}  // namespace

bool HostConfiguration::featureEnabled(std::string_view name) const {
    auto it = featureFlags.find(name);
    return it != featureFlags.end() && it->second;
}

PlistValue HostConfiguration::systemVersionDictionary() const {
    PlistValue d{PlistDict{}};
    if (!buildVersion.empty()) d.set("ProductBuildVersion", buildVersion);
    d.set("ReleaseType", releaseType);
    return d;
}

HostConfiguration HostConfiguration::load() {
    HostConfiguration c;
    std::string hostPath = RootPath("/etc/tarnkeeper/host.plist");
    std::ifstream in(hostPath, std::ios::binary);
    if (in) {
        std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
        std::string why;
        auto v = PlistValue::fromBytes(bytes.data(), bytes.size(), &why);
        if (!v || !v->isDict()) {
            c.problems.push_back(hostPath + ": " + (v ? "root is not a dictionary" : why));
        } else {
            if (auto* f = v->find("MultiUserFlags")) {
                if (f->isInteger())
                    c.multiUserFlags = f->asUInt64();
                else
                    c.problems.push_back(hostPath + ": MultiUserFlags is not an integer");
            }
            auto flag = [&](const char* key, bool& out) {
                if (auto* f = v->find(key)) {
                    if (f->isBool())
                        out = *f->asBool();
                    else
                        c.problems.push_back(hostPath + ": " + key + " is not a boolean");
                }
            };
            flag("InternalBuild", c.internalBuild);
            flag("DeviceSupportsPersonas", c.deviceSupportsPersonas);
            flag("EphemeralStorage", c.ephemeralStorage);
            if (auto* ff = v->find("FeatureFlags")) {
                if (auto* d = ff->asDict()) {
                    for (auto& [k, val] : *d)
                        if (val.isBool()) c.featureFlags[k] = *val.asBool();
                } else {
                    c.problems.push_back(hostPath + ": FeatureFlags is not a dictionary");
                }
            }
        }
    }
    std::ifstream os(RootPath("/etc/os-release"));
    std::string line;
    while (std::getline(os, line)) {
        auto eq = line.find('=');
        if (eq == std::string::npos) continue;
        std::string key = line.substr(0, eq), value = unquote(line.substr(eq + 1));
        if (key == "BUILD_ID") c.buildVersion = value;
        if (key == "VARIANT_ID" && !value.empty()) c.releaseType = value;
    }
    return c;
}

const HostConfiguration& HostConfiguration::shared() {
    std::lock_guard lock(gMu);
    if (!gShared) {
        retired().push_back(std::make_unique<HostConfiguration>(load()));
        gShared = retired().back().get();
    }
    return *gShared;
}

void HostConfiguration::TEST_setShared(HostConfiguration config) {
    std::lock_guard lock(gMu);
    retired().push_back(std::make_unique<HostConfiguration>(std::move(config)));
    gShared = retired().back().get();
}

}  // namespace tarn
