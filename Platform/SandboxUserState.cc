#include "Platform/SandboxUserState.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <mutex>
#include <vector>

#include "Platform/PlatformLog.h"
#include "Platform/PropertyList.h"
#include "Platform/RootPrefix.h"

namespace tarn {

namespace {

constexpr const char* kSandboxStateDirectory = "/run/tarnkeeper/sandbox";
// A table holds at most one item per container of a user; anything beyond is
// not ours and is refused before it is parsed.
constexpr size_t kMaxStateFileBytes = kMaxPlistBytes;

int mkdirs(const std::string& path, mode_t mode) {
    std::string partial;
    for (const auto& component : PathComponents(path)) {
        partial += "/" + component;
        if (::mkdir(partial.c_str(), mode) != 0 && errno != EEXIST) return errno;
    }
    return 0;
}

int writeAll(int fd, const std::vector<uint8_t>& bytes) {
    size_t done = 0;
    while (done < bytes.size()) {
        ssize_t n = ::write(fd, bytes.data() + done, bytes.size() - done);
        if (n < 0) {
            if (errno == EINTR) continue;
            return errno;
        }
        done += static_cast<size_t>(n);
    }
    return 0;
}

// Whole file, at most `limit` bytes; ENOENT when absent, EFBIG when larger.
int readAll(const std::string& path, size_t limit, std::vector<uint8_t>* out) {
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
    if (fd < 0) return errno;
    struct stat st;
    if (::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        int err = errno ? errno : EINVAL;
        ::close(fd);
        return err;
    }
    if (static_cast<uint64_t>(st.st_size) > limit) {
        ::close(fd);
        return EFBIG;
    }
    out->resize(static_cast<size_t>(st.st_size));
    size_t done = 0;
    while (done < out->size()) {
        ssize_t n = ::read(fd, out->data() + done, out->size() - done);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        done += static_cast<size_t>(n);
    }
    out->resize(done);
    ::close(fd);
    return 0;
}

}  // namespace

SandboxUserState& SandboxUserState::sharedInstance() {
    static std::mutex lock;
    static std::string root;
    // Leaked on purpose: other threads may still use an instance at exit.
    static auto& made = *new std::vector<std::unique_ptr<FileSandboxUserState>>();
    std::lock_guard<std::mutex> guard(lock);
    if (made.empty() || root != RootPrefix()) {
        made.push_back(
            std::make_unique<FileSandboxUserState>(FileSandboxUserState::defaultDirectory()));
        root = RootPrefix();
    }
    return *made.back();
}

FileSandboxUserState::FileSandboxUserState(FileURL directory) : directory_(std::move(directory)) {}

FileURL FileSandboxUserState::defaultDirectory() { return RootPath(kSandboxStateDirectory); }

FileURL FileSandboxUserState::fileForUID(uint32_t uid) const {
    return PathJoin(directory_, std::to_string(uid) + ".plist");
}

FileSandboxUserState::Table& FileSandboxUserState::_lock_tableForUID(uint32_t uid) {
    auto it = tables_.find(uid);
    if (it != tables_.end()) return it->second;
    Table& table = tables_[uid];
    std::vector<uint8_t> bytes;
    const FileURL file = fileForUID(uid);
    int err = readAll(file, kMaxStateFileBytes, &bytes);
    if (err == ENOENT) {
        persisted_[uid] = table;
        return table;
    }
    if (err != 0) {
        PlatformLog("sandbox", PlatformLogType::Error, "Cannot read sandbox state %s: %s", file,
                    std::strerror(err));
        return table;
    }
    std::string why;
    auto root = PlistValue::fromBytes(bytes.data(), bytes.size(), &why);
    const PlistArray* items =
        root ? (root->find("Items") ? root->find("Items")->asArray() : nullptr) : nullptr;
    if (!items) {
        PlatformLog("sandbox", PlatformLogType::Error, "Ignoring malformed sandbox state %s: %s",
                    file, why.empty() ? std::string("no item list") : why);
        return table;
    }
    for (const PlistValue& item : *items) {
        const PlistValue* type = item.find("Type");
        const PlistValue* identifier = item.find("Identifier");
        const PlistValue* path = item.find("Path");
        const PlistValue* persona = item.find("PersonaID");
        auto t = type ? type->asUInt64() : std::nullopt;
        auto p = persona ? persona->asUInt64() : std::nullopt;
        if (!t || !p || *p > UINT32_MAX || !identifier || !identifier->asString() || !path ||
            !path->asString() || identifier->asString()->empty()) {
            PlatformLog("sandbox", PlatformLogType::Error, "Skipping malformed sandbox item in %s",
                        file);
            continue;
        }
        table[Key{*t, *identifier->asString(), static_cast<uint32_t>(*p)}] = *path->asString();
    }
    persisted_[uid] = table;
    return table;
}

int FileSandboxUserState::_lock_writeTable(uint32_t uid) {
    const Table& table = tables_[uid];
    PlistArray items;
    items.reserve(table.size());
    for (const auto& [key, path] : table) {
        items.push_back(PlistValue(PlistDict{
            {"Type", PlistValue(std::get<0>(key))},
            {"Identifier", PlistValue(std::get<1>(key))},
            {"PersonaID", PlistValue(uint64_t{std::get<2>(key)})},
            {"Path", PlistValue(path)},
        }));
    }
    PlistValue root(PlistDict{{"Version", PlistValue(uint64_t{1})},
                              {"UID", PlistValue(uint64_t{uid})},
                              {"Items", PlistValue(std::move(items))}});
    const std::vector<uint8_t> bytes = root.toBinary();
    if (int err = mkdirs(directory_, 0700); err != 0) return err;

    const FileURL file = fileForUID(uid);
    std::string tmp = file + ".tmp-XXXXXX";
    int fd = ::mkostemp(tmp.data(), O_CLOEXEC);
    if (fd < 0) return errno;
    int err = writeAll(fd, bytes);
    if (err == 0 && ::fsync(fd) != 0) err = errno;
    if (::close(fd) != 0 && err == 0) err = errno;
    if (err == 0 && ::rename(tmp.c_str(), file.c_str()) != 0) err = errno;
    if (err != 0) {
        (void)::unlink(tmp.c_str());  // best effort: a leftover temp file is harmless
        return err;
    }
    persisted_[uid] = table;
    int dirFd = ::open(directory_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (dirFd >= 0) {
        if (::fsync(dirFd) != 0) err = errno;
        ::close(dirFd);
    }
    return err;
}

int FileSandboxUserState::setUserStateItemWithPersona(uint32_t uid, uint32_t personaID,
                                                      uint64_t itemType, const char* identifier,
                                                      const char* path) {
    if (!identifier || !*identifier) return EINVAL;
    MutexLock lock(mu_);
    Table& table = _lock_tableForUID(uid);
    Key key{itemType, identifier, personaID};
    if (path) {
        auto it = table.find(key);
        if (it != table.end() && it->second == path) return 0;
        table[key] = path;
    } else if (table.erase(key) == 0) {
        return 0;  // nothing to clear, nothing to write
    }
    if (batchDepth_ > 0) {
        dirty_.insert(uid);
        return 0;
    }
    int err = _lock_writeTable(uid);
    if (err != 0)
        PlatformLog("sandbox", PlatformLogType::Error, "Cannot write sandbox state for user %u: %s",
                    uid, std::strerror(err));
    return err;
}

int FileSandboxUserState::iterateUserStateItems(uint32_t uid, const ItemCallback& callback) {
    std::vector<std::pair<uint64_t, SandboxUserStateItem>> snapshot;
    {
        MutexLock lock(mu_);
        const Table& table = _lock_tableForUID(uid);
        snapshot.reserve(table.size());
        for (const auto& [key, path] : table)
            snapshot.emplace_back(std::get<0>(key),
                                  SandboxUserStateItem{std::get<1>(key), path, std::get<2>(key)});
    }
    for (const auto& [type, item] : snapshot) callback(type, &item);
    return 0;
}

void FileSandboxUserState::beginBatch() {
    MutexLock lock(mu_);
    ++batchDepth_;
}

int FileSandboxUserState::endBatch() {
    MutexLock lock(mu_);
    if (batchDepth_ == 0 || --batchDepth_ > 0) return 0;
    int first = 0;
    for (uint32_t uid : dirty_) {
        // Pushing what is already recorded (a rebuild after a restart) costs no write.
        auto persisted = persisted_.find(uid);
        if (persisted != persisted_.end() && persisted->second == tables_[uid]) continue;
        int err = _lock_writeTable(uid);
        if (err != 0) {
            PlatformLog("sandbox", PlatformLogType::Error,
                        "Cannot write sandbox state for user %u: %s", uid, std::strerror(err));
            if (first == 0) first = err;
        }
    }
    dirty_.clear();
    return first;
}

}  // namespace tarn
