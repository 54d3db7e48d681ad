#include "Platform/SandboxUserState.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <mutex>
#include <vector>

#include "Platform/Failpoints.h"
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

FileURL FileSandboxUserState::journalForUID(uint32_t uid) const {
    return PathJoin(directory_, std::to_string(uid) + ".journal");
}

namespace {

// Journal length that forces the next change to rewrite the snapshot.
constexpr size_t kJournalTorn = SIZE_MAX / 2;

// Journal record: 4-byte little-endian length, then a binary property list
// {"Type", "Identifier", "PersonaID", "Path" (absent: removed)}.
void appendRecord(std::vector<uint8_t>* out, uint64_t type, const std::string& identifier,
                  uint32_t persona, const std::optional<std::string>& path) {
    PlistDict d{{"Type", PlistValue(type)},
                {"Identifier", PlistValue(identifier)},
                {"PersonaID", PlistValue(uint64_t{persona})}};
    if (path) d["Path"] = PlistValue(*path);
    const std::vector<uint8_t> bytes = PlistValue(std::move(d)).toBinary();
    const auto n = static_cast<uint32_t>(bytes.size());
    for (int shift = 0; shift < 32; shift += 8) out->push_back(static_cast<uint8_t>(n >> shift));
    out->insert(out->end(), bytes.begin(), bytes.end());
}

}  // namespace

std::vector<const FileSandboxUserState::Table::value_type*> FileSandboxUserState::ordered(
    const Table& table) {
    std::vector<const Table::value_type*> entries;
    entries.reserve(table.size());
    for (const auto& entry : table) entries.push_back(&entry);
    std::sort(entries.begin(), entries.end(),
              [](const auto* a, const auto* b) { return view(a->first) < view(b->first); });
    return entries;
}

FileSandboxUserState::Table& FileSandboxUserState::_lock_tableForUID(uint32_t uid) {
    auto it = tables_.find(uid);
    if (it != tables_.end()) return it->second;
    Table& table = tables_[uid];
    std::vector<uint8_t> bytes;
    const FileURL file = fileForUID(uid);
    int err = readAll(file, kMaxStateFileBytes, &bytes);
    if (err != 0 && err != ENOENT) {
        PlatformLog("sandbox", PlatformLogType::Error, "Cannot read sandbox state %s: %s", file,
                    std::strerror(err));
    } else if (err == 0) {
        std::string why;
        auto root = PlistValue::fromBytes(bytes.data(), bytes.size(), &why);
        const PlistArray* items =
            root ? (root->find("Items") ? root->find("Items")->asArray() : nullptr) : nullptr;
        if (!items) {
            PlatformLog("sandbox", PlatformLogType::Error,
                        "Ignoring malformed sandbox state %s: %s", file,
                        why.empty() ? std::string("no item list") : why);
        } else {
            for (const PlistValue& item : *items) {
                const PlistValue* type = item.find("Type");
                const PlistValue* identifier = item.find("Identifier");
                const PlistValue* path = item.find("Path");
                const PlistValue* persona = item.find("PersonaID");
                auto t = type ? type->asUInt64() : std::nullopt;
                auto p = persona ? persona->asUInt64() : std::nullopt;
                if (!t || !p || *p > UINT32_MAX || !identifier || !identifier->asString() ||
                    !path || !path->asString()) {
                    PlatformLog("sandbox", PlatformLogType::Error,
                                "Skipping malformed sandbox item in %s", file);
                    continue;
                }
                table[Key{*t, *identifier->asString(), static_cast<uint32_t>(*p)}] =
                    *path->asString();
            }
        }
    }
    _lock_replayJournal(uid, table);
    return table;
}

void FileSandboxUserState::_lock_replayJournal(uint32_t uid, Table& table) {
    std::vector<uint8_t> bytes;
    const FileURL journal = journalForUID(uid);
    int err = readAll(journal, kMaxStateFileBytes, &bytes);
    if (err == ENOENT) return;
    if (err != 0) {
        PlatformLog("sandbox", PlatformLogType::Error, "Cannot read sandbox journal %s: %s",
                    journal, std::strerror(err));
        return;
    }
    size_t offset = 0, records = 0;
    while (offset < bytes.size()) {
        if (bytes.size() - offset < 4) break;
        uint32_t n = 0;
        for (int i = 0; i < 4; ++i) n |= static_cast<uint32_t>(bytes[offset + i]) << (8 * i);
        if (n > bytes.size() - offset - 4) break;
        std::string why;
        auto record = PlistValue::fromBytes(bytes.data() + offset + 4, n, &why);
        const PlistValue* type = record ? record->find("Type") : nullptr;
        const PlistValue* identifier = record ? record->find("Identifier") : nullptr;
        const PlistValue* persona = record ? record->find("PersonaID") : nullptr;
        const PlistValue* path = record ? record->find("Path") : nullptr;
        auto t = type ? type->asUInt64() : std::nullopt;
        auto p = persona ? persona->asUInt64() : std::nullopt;
        if (!t || !p || *p > UINT32_MAX || !identifier || !identifier->asString() ||
            (path && !path->asString()))
            break;
        Key key{*t, *identifier->asString(), static_cast<uint32_t>(*p)};
        if (path)
            table[key] = *path->asString();
        else
            table.erase(key);
        offset += 4 + n;
        ++records;
    }
    journalRecords_[uid] = records;
    if (offset < bytes.size()) {
        PlatformLog("sandbox", PlatformLogType::Error,
                    "Ignoring %zu bytes of a torn or malformed record at the end of %s",
                    bytes.size() - offset, journal);
        // Records appended behind it would never be replayed: the next change
        // rewrites the snapshot instead. (A reader never writes.)
        journalRecords_[uid] = kJournalTorn;
    }
}

int FileSandboxUserState::_lock_writeSnapshot(uint32_t uid) {
    const Table& table = tables_[uid];
    PlistArray items;
    items.reserve(table.size());
    for (const auto* entry : ordered(table)) {
        const auto& [key, path] = *entry;
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
    if (::close(fd) != 0 && err == 0) err = errno;
    if (err == 0 && ::rename(tmp.c_str(), file.c_str()) != 0) err = errno;
    if (err != 0) {
        (void)::unlink(tmp.c_str());  // best effort: a leftover temp file is harmless
        return err;
    }
    // The snapshot holds everything now; a journal left behind by a failed
    // unlink would only be replayed to the same effect.
    if (::unlink(journalForUID(uid).c_str()) != 0 && errno != ENOENT) return errno;
    journalRecords_[uid] = 0;
    return 0;
}

int FileSandboxUserState::_lock_recordChanges(uint32_t uid, const std::vector<Change>& changes) {
    if (auto err = TARN_FAILPOINT("sandbox.recordChanges")) return *err;
    constexpr size_t kMinJournalRecords = 256;
    size_t& records = journalRecords_[uid];
    // Many changes at once (a class rebuild) cost less as one snapshot.
    if (changes.size() > kMinJournalRecords ||
        records + changes.size() > std::max(kMinJournalRecords, tables_[uid].size()))
        return _lock_writeSnapshot(uid);
    std::vector<uint8_t> bytes;
    for (const auto& [key, path] : changes)
        appendRecord(&bytes, std::get<0>(key), std::get<1>(key), std::get<2>(key), path);
    const FileURL journal = journalForUID(uid);
    auto openJournal = [&] {
        return ::open(journal.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
    };
    // The directory is made only when missing: an append is one open, not a
    // mkdir per path component first.
    int fd = openJournal();
    if (fd < 0 && errno == ENOENT) {
        if (int err = mkdirs(directory_, 0700); err != 0) return err;
        fd = openJournal();
    }
    if (fd < 0) return errno;
    int err = writeAll(fd, bytes);
    if (::close(fd) != 0 && err == 0) err = errno;
    // After a failed append the journal may end in a torn record, which would
    // hide every later one: start afresh from a snapshot.
    if (err != 0) return _lock_writeSnapshot(uid) == 0 ? 0 : err;
    records += changes.size();
    return 0;
}

int FileSandboxUserState::setUserStateItemWithPersona(uint32_t uid, uint32_t personaID,
                                                      uint64_t itemType, const char* identifier,
                                                      const char* path) {
    // An empty identifier is a valid one (a container may be named "").
    if (!identifier) return EINVAL;
    MutexLock lock(mu_);
    Table& table = _lock_tableForUID(uid);
    Key key{itemType, identifier, personaID};
    std::optional<std::string> before;
    if (auto it = table.find(key); it != table.end()) before = it->second;
    std::optional<std::string> after;
    if (path) after = path;
    if (before == after) return 0;
    if (after)
        table[key] = *after;
    else
        table.erase(key);
    if (batchDepth_ > 0) {
        batchOriginals_[uid].try_emplace(key, std::move(before));
        return 0;
    }
    int err = _lock_recordChanges(uid, {Change{key, after}});
    if (err != 0) {
        // The table must not run ahead of the disk: a later push of the same
        // pair would be skipped as already recorded and never reach the file.
        _lock_restore(table, key, before);
        PlatformLog("sandbox", PlatformLogType::Error, "Cannot write sandbox state for user %u: %s",
                    uid, std::strerror(err));
    }
    return err;
}

void FileSandboxUserState::_lock_restore(Table& table, const Key& key,
                                         const std::optional<std::string>& before) {
    if (before)
        table[key] = *before;
    else
        table.erase(key);
}

bool FileSandboxUserState::userStateItemIsRecordedWithPersona(uint32_t uid, uint32_t personaID,
                                                              uint64_t itemType,
                                                              const char* identifier,
                                                              const char* path) {
    if (!identifier) return false;
    MutexLock lock(mu_);
    const Table& table = _lock_tableForUID(uid);
    auto it = table.find(KeyView{itemType, identifier, personaID});
    if (it == table.end()) return path == nullptr;
    return path && it->second == path;
}

int FileSandboxUserState::iterateUserStateItems(uint32_t uid, const ItemCallback& callback) {
    std::vector<std::pair<uint64_t, SandboxUserStateItem>> snapshot;
    {
        MutexLock lock(mu_);
        const Table& table = _lock_tableForUID(uid);
        snapshot.reserve(table.size());
        for (const auto* entry : ordered(table)) {
            const auto& [key, path] = *entry;
            snapshot.emplace_back(std::get<0>(key),
                                  SandboxUserStateItem{std::get<1>(key), path, std::get<2>(key)});
        }
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
    for (const auto& [uid, originals] : batchOriginals_) {
        // Only what the batch changed on balance: re-pushing what is recorded
        // (a rebuild after a restart) costs no write.
        const Table& table = tables_[uid];
        std::vector<Change> changes;
        for (const auto& [key, before] : originals) {
            std::optional<std::string> now;
            if (auto it = table.find(key); it != table.end()) now = it->second;
            if (now != before) changes.emplace_back(key, std::move(now));
        }
        if (changes.empty()) continue;
        int err = _lock_recordChanges(uid, changes);
        if (err != 0) {
            Table& writable = tables_[uid];
            for (const auto& [key, before] : originals) _lock_restore(writable, key, before);
            PlatformLog("sandbox", PlatformLogType::Error,
                        "Cannot write sandbox state for user %u: %s", uid, std::strerror(err));
            if (first == 0) first = err;
        }
    }
    batchOriginals_.clear();
    return first;
}

}  // namespace tarn
