#include "Platform/PersonaRoster.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "Platform/FileWatcher.h"
#include "Platform/Format.h"
#include "Platform/PlatformLog.h"
#include "Platform/RootPrefix.h"

namespace tarn {

namespace {

constexpr const char* kListFile = "/etc/tarnkeeper/personas.plist";
// A roster is a handful of entries; anything near this is not a roster.
constexpr size_t kMaxListBytes = 1024 * 1024;
constexpr size_t kMaxPersonas = 4096;

PersonaAttributes::Kind kindForType(const std::string& type) {
    if (type == "personal") return PersonaAttributes::Kind::Personal;
    if (type == "enterprise") return PersonaAttributes::Kind::Enterprise;
    if (type == "universal") return PersonaAttributes::Kind::Universal;
    if (type == "system") return PersonaAttributes::Kind::System;
    return PersonaAttributes::Kind::Other;
}

}  // namespace

std::optional<PersonaAttributes> PersonaAttributes::fromPlist(const PlistValue& value,
                                                              std::string* why) {
    auto fail = [why](std::string reason) -> std::optional<PersonaAttributes> {
        if (why) *why = std::move(reason);
        return std::nullopt;
    };
    if (!value.isDict()) return fail("entry is not a dictionary");
    PersonaAttributes a;
    const PlistValue* type = value.find("Type");
    if (!type || !type->isString()) return fail("\"Type\" is missing or not a string");
    a.typeName = *type->asString();
    a.kind = kindForType(a.typeName);

    const PlistValue* id = value.find("PersonaID");
    auto idNumber = id ? id->asUInt64() : std::nullopt;
    if (!id || !id->isInteger() || !idNumber || *idNumber > UINT32_MAX) {
        return fail("\"PersonaID\" is missing or not a 32-bit unsigned integer");
    }
    a.personaID = static_cast<uint32_t>(*idNumber);

    if (const PlistValue* u = value.find("UniqueString")) {
        if (!u->isString()) return fail("\"UniqueString\" is not a string");
        a.uniqueString = *u->asString();
    }
    if (const PlistValue* b = value.find("BundleIDs")) {
        const PlistArray* list = b->asArray();
        if (!list) return fail("\"BundleIDs\" is not an array");
        for (const auto& item : *list) {
            if (!item.isString()) return fail("\"BundleIDs\" holds a value that is not a string");
            a.bundleIDs.push_back(*item.asString());
        }
    }
    if (const PlistValue* l = value.find("LayoutPath")) {
        const std::string* path = l->asString();
        if (!path || path->empty() || (*path)[0] != '/') {
            return fail("\"LayoutPath\" is not an absolute path");
        }
        a.layoutPath = RootPath(*path);
    }
    return a;
}

std::string PersonaAttributes::description() const {
    return Format("<PersonaAttributes: type = %@, personaID = %u, uniqueString = %@, bundleIDs = %zu, "
                  "layoutPath = %@>",
                  typeName, personaID, uniqueString, bundleIDs.size(), layoutPath);
}

uint32_t PersonaAttributes::kernelPersonaType() const {
    switch (kind) {
        case Kind::Personal:
            return kKernelPersonaTypePersonal;
        case Kind::Enterprise:
            return kKernelPersonaTypeEnterprise;
        case Kind::System:
            return kKernelPersonaTypeSystem;
        case Kind::Universal:
            return kKernelPersonaTypeUniversal;
        case Kind::Other:
            return kKernelPersonaTypeOther;
    }
    return kKernelPersonaTypeOther;
}

std::string PersonaListDescription(const std::optional<PersonaAttributesList>& list) {
    if (!list) return "(null)";
    std::string out = "(";
    for (size_t i = 0; i < list->size(); ++i) {
        if (i) out += ", ";
        out += (*list)[i] ? (*list)[i]->description() : std::string("(null)");
    }
    return out + ")";
}

// ---- PersonaRoster ----

PersonaRoster& PersonaRoster::sharedManager() {
    static std::mutex lock;
    // Never freed: references handed out under an earlier root stay valid (the
    // old ones only stop watching a tree that is gone), and nothing is torn
    // down at exit while other threads, the watchers' among them, may still
    // use it.
    static auto& root = *new std::string();
    static auto& made = *new std::vector<std::unique_ptr<FilePersonaRoster>>();
    std::lock_guard<std::mutex> guard(lock);
    if (made.empty() || root != RootPrefix()) {
        if (!made.empty()) made.back()->stopWatching();
        made.push_back(std::make_unique<FilePersonaRoster>(RootPath(kListFile)));
        root = RootPrefix();
    }
    return *made.back();
}

PersonaAttributesRef PersonaRoster::personaInfoForPersonaID(uint32_t personaID) {
    auto list = listAllPersonaWithAttributes();
    if (!list) return nullptr;
    for (const auto& p : *list) {
        if (p && p->personaID == personaID) return p;
    }
    return nullptr;
}

std::optional<KernelPersonaInfo> PersonaRoster::kernelPersonaInfo(uint32_t personaID,
                                                                  uint32_t version) {
    if (version != KernelPersonaInfo::kVersion) return std::nullopt;
    PersonaAttributesRef persona = personaInfoForPersonaID(personaID);
    if (!persona) return std::nullopt;
    return KernelPersonaInfo{
        .version = version, .personaID = personaID, .type = persona->kernelPersonaType()};
}

PersonaAttributesRef PersonaRoster::currentPersona(const std::optional<std::string>& unique) {
    if (!unique) return nullptr;
    auto list = listAllPersonaWithAttributes();
    if (!list) return nullptr;
    for (const auto& p : *list) {
        if (p && p->uniqueString == unique) return p;
    }
    return nullptr;
}

void PersonaRoster::registerPersonaListUpdateObserver(
    std::weak_ptr<PersonaListUpdateObserver> observer, const std::string& withService,
    const std::function<void(const std::optional<std::string>& error)>& completionHandler) {
    std::string why;
    bool ok = startWatching(&why);
    if (ok) {
        std::lock_guard<std::mutex> guard(observersLock_);
        observers_.push_back(std::move(observer));
    }
    if (completionHandler) {
        completionHandler(ok ? std::nullopt
                             : std::optional<std::string>(Format("%@: %@", withService, why)));
    }
}

void PersonaRoster::notifyObservers() {
    std::vector<std::shared_ptr<PersonaListUpdateObserver>> live;
    {
        std::lock_guard<std::mutex> guard(observersLock_);
        std::erase_if(observers_, [](const auto& w) { return w.expired(); });
        for (const auto& w : observers_) {
            if (auto o = w.lock()) live.push_back(std::move(o));
        }
    }
    for (const auto& o : live) o->personaListDidUpdate();
}

// ---- FilePersonaRoster ----

FilePersonaRoster::FilePersonaRoster(FileURL listFile) : listFile_(std::move(listFile)) {}

FilePersonaRoster::~FilePersonaRoster() { stopWatching(); }

std::optional<PersonaAttributesList> FilePersonaRoster::readListFile(const FileURL& path,
                                                                     std::string* why) {
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
    if (fd < 0) {
        if (errno == ENOENT) return PersonaAttributesList{};
        if (why) *why = Format("open %@: %s", path, std::strerror(errno));
        return std::nullopt;
    }
    std::string bytes;
    struct stat st {};
    if (::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode) ||
        static_cast<size_t>(st.st_size) > kMaxListBytes) {
        ::close(fd);
        if (why) *why = Format("%@ is not a regular file of at most %zu bytes", path, kMaxListBytes);
        return std::nullopt;
    }
    bytes.resize(static_cast<size_t>(st.st_size));
    size_t got = 0;
    while (got < bytes.size()) {
        ssize_t n = ::read(fd, bytes.data() + got, bytes.size() - got);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        got += static_cast<size_t>(n);
    }
    ::close(fd);
    bytes.resize(got);

    std::string reason;
    auto root = PlistValue::fromBytes(bytes.data(), bytes.size(), &reason);
    if (!root) {
        if (why) *why = Format("%@: %@", path, reason);
        return std::nullopt;
    }
    const PlistArray* entries = root->asArray();
    if (!entries || entries->size() > kMaxPersonas) {
        if (why) *why = Format("%@: top level is not an array of at most %zu entries", path,
                               kMaxPersonas);
        return std::nullopt;
    }
    PersonaAttributesList list;
    for (size_t i = 0; i < entries->size(); ++i) {
        auto a = PersonaAttributes::fromPlist((*entries)[i], &reason);
        if (!a) {
            if (why) *why = Format("%@: entry %zu: %@", path, i, reason);
            return std::nullopt;
        }
        list.push_back(std::make_shared<const PersonaAttributes>(std::move(*a)));
    }
    return list;
}

std::optional<PersonaAttributesList> FilePersonaRoster::listAllPersonaWithAttributes() {
    std::string why;
    auto list = readListFile(listFile_, &why);
    if (!list) {
        PlatformLog("persona", PlatformLogType::Error, "Unusable persona list: %@", why);
    }
    return list;
}

bool FilePersonaRoster::startWatching(std::string* why) {
    std::lock_guard<std::mutex> guard(watcherLock_);
    if (watcher_) return true;
    const std::string name = PathLastComponent(listFile_);
    watcher_ = FileWatcher::watchDirectory(
        PathParent(listFile_),
        [this, name](const std::string& changed) {
            // An empty name: the directory itself went or events were lost.
            if (changed.empty() || changed == name) notifyObservers();
        },
        why);
    return watcher_ != nullptr;
}

void FilePersonaRoster::stopWatching() {
    std::unique_ptr<FileWatcher> watcher;
    {
        std::lock_guard<std::mutex> guard(watcherLock_);
        watcher = std::move(watcher_);
    }
    if (watcher) watcher->stop();
}

// ---- MemoryPersonaRoster ----

std::optional<PersonaAttributesList> MemoryPersonaRoster::listAllPersonaWithAttributes() {
    std::lock_guard<std::mutex> guard(lock_);
    ++fetches_;
    if (!queued_.empty()) {
        auto answer = std::move(queued_.front());
        queued_.erase(queued_.begin());
        return answer;
    }
    return list_;
}

void MemoryPersonaRoster::setList(std::optional<PersonaAttributesList> list) {
    std::lock_guard<std::mutex> guard(lock_);
    list_ = std::move(list);
}

void MemoryPersonaRoster::queueAnswers(std::vector<std::optional<PersonaAttributesList>> answers) {
    std::lock_guard<std::mutex> guard(lock_);
    for (auto& a : answers) queued_.push_back(std::move(a));
}

unsigned MemoryPersonaRoster::fetchCount() {
    std::lock_guard<std::mutex> guard(lock_);
    return fetches_;
}

}  // namespace tarn
