// The kernel sandbox's per-user container state: for every user id, a table
// of items (item type, identifier, path, persona id) that tells the sandbox
// where a process's containers are without asking the daemon.
//
// Linux layer: the daemon keeps the tables itself, per user in
// DIR/run/tarnkeeper/sandbox: a snapshot <uid>.plist (binary property list,
// written to a temporary file and renamed into place) and a journal
// <uid>.journal of the changes made since, one appended record per change.
// Loading reads the snapshot and replays the journal; a torn record at the
// journal's end (the daemon died while appending) ends the replay. When the
// journal outgrows the table, the snapshot is rewritten and the journal
// removed; replaying a journal onto a newer snapshot is harmless because
// every record sets or removes an item outright.
//
// Nothing is fsynced: the state stands in for kernel memory, which outlives
// the daemon (the page cache does too) but not the boot; DIR/run goes at
// reboot and start-up pushes the mappings again. A creation therefore costs
// one small append, not a rewrite of every mapping of the user.
//
// A table is read on first use and kept in memory afterwards; a malformed
// snapshot counts as an empty table (logged), the way a fresh kernel would
// answer.
//
// An item is identified by (item type, identifier, persona id): setting it
// with a path records or replaces the path; setting it without a path
// removes it. Iteration visits a user's items in (type, identifier, persona)
// order.
//
// Batching: while a Batch is open on the instance, changes stay in memory
// and are appended when the last Batch closes, only those that left an item
// different from before the batch. The container cache opens one around a
// class rebuild, which pushes thousands of items, and around each
// clear-then-set pair of one push.
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
#include <string_view>
#include <tuple>
#include <unordered_map>
#include <utility>
#include <vector>

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
    // otherwise an errno value; a null identifier is EINVAL (an empty one is valid).
    virtual int setUserStateItemWithPersona(uint32_t uid, uint32_t personaID, uint64_t itemType,
                                            const char* identifier, const char* path) = 0;
    // Whether the item is recorded with exactly `path`: a push that would
    // change nothing can then be skipped. False when unknown.
    virtual bool userStateItemIsRecordedWithPersona(uint32_t uid, uint32_t personaID,
                                                    uint64_t itemType, const char* identifier,
                                                    const char* path) {
        (void)uid, (void)personaID, (void)itemType, (void)identifier, (void)path;
        return false;
    }
    // Calls `callback` for each item of `uid`. 0 on success, an errno value
    // when the state cannot be read.
    virtual int iterateUserStateItems(uint32_t uid, const ItemCallback& callback) = 0;

    virtual void beginBatch() {}
    // Writes what the batch changed; 0 or the first errno met.
    virtual int endBatch() { return 0; }

    class Batch {
      public:
        explicit Batch(SandboxUserState& state) : state_(state) { state_.beginBatch(); }
        ~Batch() { (void)end(); }  // failures are logged by the state itself
        Batch(const Batch&) = delete;
        Batch& operator=(const Batch&) = delete;
        // Ends the batch now: 0, or the errno of the write it made. Inside
        // an enclosing batch nothing is written yet, and the answer is 0.
        int end() {
            if (ended_) return 0;
            ended_ = true;
            return state_.endBatch();
        }

      private:
        SandboxUserState& state_;
        bool ended_ = false;
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
    bool userStateItemIsRecordedWithPersona(uint32_t uid, uint32_t personaID, uint64_t itemType,
                                            const char* identifier, const char* path) override;
    int iterateUserStateItems(uint32_t uid, const ItemCallback& callback) override;
    void beginBatch() override;
    int endBatch() override;

    const FileURL& directory() const { return directory_; }
    FileURL fileForUID(uint32_t uid) const;
    FileURL journalForUID(uint32_t uid) const;

  private:
    using Key = std::tuple<uint64_t, std::string, uint32_t>;  // type, identifier, persona
    using KeyView = std::tuple<uint64_t, std::string_view, uint32_t>;
    static KeyView view(const Key& k) { return {std::get<0>(k), std::get<1>(k), std::get<2>(k)}; }
    static const KeyView& view(const KeyView& k) { return k; }
    // Hashed, with look-ups by view, so that the check of every push of a
    // rebuild costs one hash and no string copy; ordered only when iterated
    // or written.
    struct KeyHash {
        using is_transparent = void;
        template <class K>
        size_t operator()(const K& k) const {
            const KeyView& v = view(k);
            return std::hash<std::string_view>()(std::get<1>(v)) ^
                   (std::get<0>(v) * 0x9E3779B97F4A7C15ull) ^ (size_t{std::get<2>(v)} << 1);
        }
    };
    struct KeyEqual {
        using is_transparent = void;
        template <class A, class B>
        bool operator()(const A& a, const B& b) const {
            return view(a) == view(b);
        }
    };
    using Table = std::unordered_map<Key, std::string, KeyHash, KeyEqual>;  // -> path
    // The table's entries in (type, identifier, persona) order.
    static std::vector<const Table::value_type*> ordered(const Table& table);

    // One change: the item's path, or none for a removal.
    using Change = std::pair<Key, std::optional<std::string>>;

    Table& _lock_tableForUID(uint32_t uid) REQUIRES(mu_);
    void _lock_replayJournal(uint32_t uid, Table& table) REQUIRES(mu_);
    // Appends the changes (or rewrites the snapshot when the journal has grown
    // past the table); 0 or an errno value.
    int _lock_recordChanges(uint32_t uid, const std::vector<Change>& changes) REQUIRES(mu_);
    // Puts one entry back as it was before an unrecorded change.
    static void _lock_restore(Table& table, const Key& key,
                              const std::optional<std::string>& before);
    int _lock_writeSnapshot(uint32_t uid) REQUIRES(mu_);

    // Constant after construction.
    const FileURL directory_;

    Mutex mu_;
    std::map<uint32_t, Table> tables_ GUARDED_BY(mu_);
    // Records in each user's journal, to know when to rewrite the snapshot.
    std::map<uint32_t, size_t> journalRecords_ GUARDED_BY(mu_);
    int batchDepth_ GUARDED_BY(mu_) = 0;
    // Per user, the items the open batch touched, with their value before it.
    std::map<uint32_t, std::map<Key, std::optional<std::string>>> batchOriginals_ GUARDED_BY(mu_);
};

}  // namespace tarn
