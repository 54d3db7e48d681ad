// The kernel sandbox's per-user container state: for every user id, a table
// of items (item type, identifier, path, persona id) that tells the sandbox
// where a process's containers are without asking the daemon.
//
// Linux layer: the daemon keeps the tables itself, one durable file per user
// in DIR/run/tarnkeeper/sandbox/<uid>.plist (binary property list, written to
// a temporary file, fsynced, renamed into place, directory fsynced). They
// survive a daemon restart within one boot, as the kernel's state does, and
// vanish with DIR/run at reboot. A table is read from its file on first use
// and kept in memory afterwards; a malformed file counts as an empty table
// (logged), the way a fresh kernel would answer.
//
// An item is identified by (item type, identifier, persona id): setting it
// with a path records or replaces the path; setting it without a path
// removes it. Iteration visits a user's items in (type, identifier, persona)
// order.
//
// Durability batching: while a Batch is open on the instance, changes stay in
// memory and the touched users' files are written once when the last Batch
// closes, and not at all when the batch left a table as its file has it. The
// container cache opens one around a class rebuild, which pushes thousands
// of items, and around each clear-then-set pair of one push.
//
// Thread-safe: one mutex per instance guards the tables; callbacks of
// iterateUserStateItems run with it released on a snapshot.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <tuple>

#include "Platform/Path.h"
#include "Platform/ThreadAnnotations.h"

namespace tarn {

// Item types as the kernel numbers them.
enum : uint64_t {
    kSandboxItemTypeData = 1,         // data containers (classes 2, 4, 6, 9, 10, 11)
    kSandboxItemTypeAppGroup = 2,     // application groups (7)
    kSandboxItemTypeSystem = 4,       // system containers (12)
    kSandboxItemTypeSystemGroup = 8,  // system group containers (13)
};

struct SandboxUserStateItem {
    std::string identifier;
    std::optional<std::string> path;
    uint32_t personaID = 0;
};

class SandboxUserState {
  public:
    // Called once per item; `item` may be null (the kernel may report a
    // slot without an item struct).
    using ItemCallback = std::function<void(uint64_t itemType, const SandboxUserStateItem* item)>;

    // The file-backed state of the current root prefix, made on first use
    // (again when the prefix changes; earlier ones stay alive).
    static SandboxUserState& sharedInstance();

    virtual ~SandboxUserState() = default;

    // Records (path given) or removes (path null) one item. 0 on success,
    // otherwise an errno value; an empty identifier is EINVAL.
    virtual int setUserStateItemWithPersona(uint32_t uid, uint32_t personaID, uint64_t itemType,
                                            const char* identifier, const char* path) = 0;
    // Calls `callback` for each item of `uid`. 0 on success, an errno value
    // when the state cannot be read.
    virtual int iterateUserStateItems(uint32_t uid, const ItemCallback& callback) = 0;

    virtual void beginBatch() {}
    // Writes what the batch changed; 0 or the first errno met.
    virtual int endBatch() { return 0; }

    class Batch {
      public:
        explicit Batch(SandboxUserState& state) : state_(state) { state_.beginBatch(); }
        ~Batch() { (void)state_.endBatch(); }  // failures are logged by the state itself
        Batch(const Batch&) = delete;
        Batch& operator=(const Batch&) = delete;

      private:
        SandboxUserState& state_;
    };
};

class FileSandboxUserState : public SandboxUserState {
  public:
    // `directory`: where the per-user files live (created on first write).
    explicit FileSandboxUserState(FileURL directory);
    // DIR/run/tarnkeeper/sandbox below the current root prefix.
    static FileURL defaultDirectory();

    int setUserStateItemWithPersona(uint32_t uid, uint32_t personaID, uint64_t itemType,
                                    const char* identifier, const char* path) override;
    int iterateUserStateItems(uint32_t uid, const ItemCallback& callback) override;
    void beginBatch() override;
    int endBatch() override;

    const FileURL& directory() const { return directory_; }
    FileURL fileForUID(uint32_t uid) const;

  private:
    using Key = std::tuple<uint64_t, std::string, uint32_t>;  // type, identifier, persona
    using Table = std::map<Key, std::string>;                 // -> path

    Table& _lock_tableForUID(uint32_t uid) REQUIRES(mu_);
    int _lock_writeTable(uint32_t uid) REQUIRES(mu_);

    // Constant after construction.
    const FileURL directory_;

    Mutex mu_;
    std::map<uint32_t, Table> tables_ GUARDED_BY(mu_);
    // What each user's file holds, so a batch that changed nothing on balance writes nothing.
    std::map<uint32_t, Table> persisted_ GUARDED_BY(mu_);
    int batchDepth_ GUARDED_BY(mu_) = 0;
    std::set<uint32_t> dirty_ GUARDED_BY(mu_);
};

}  // namespace tarn
