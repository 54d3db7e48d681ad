// PersonaRoster: the device's persona list, the persona the calling thread
// acts for, and notice of list changes.
//
// Linux layer: the list lives in DIR/etc/tarnkeeper/personas.plist, an array
// of dictionaries:
//   "Type"         "personal", "enterprise", "universal", "system", or any
//                  other string for other kinds
//   "UniqueString" string (optional)
//   "PersonaID"    integer, the kernel persona id (uint32)
//   "BundleIDs"    array of strings (optional)
//   "LayoutPath"   string, an enterprise persona's home (optional; placed
//                  under the root prefix)
// A missing file is an empty list; an unreadable or malformed one is no list
// at all (nullopt), which callers treat like the service being unavailable.
// Entries that are not dictionaries, or whose values have the wrong type,
// make the whole list malformed: half a roster would misassign applications.
//
// The file's directory is watched with inotify; a change calls
// personaListDidUpdate() on the registered observers, on the watcher's thread.
//
// The current persona is per thread: the request processor sets the peer's
// persona unique string for the duration of a request.
//
// Thread-safe.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Platform/Path.h"
#include "Platform/PropertyList.h"
#include "Platform/ThreadAnnotations.h"

namespace tarn {

// The kernel's persona type numbers (what its persona information query
// answers), by kind of persona.
enum KernelPersonaType : uint32_t {
    kKernelPersonaTypePersonal = 1,
    kKernelPersonaTypeEnterprise = 2,
    kKernelPersonaTypeOther = 3,  // any kind this list does not name
    kKernelPersonaTypeSystem = 4,
    kKernelPersonaTypeUniversal = 5,
};

// The kernel's persona information record; only the version this layer
// answers exists.
struct KernelPersonaInfo {
    static constexpr uint32_t kVersion = 1;
    uint32_t version = kVersion;
    uint32_t personaID = 0;
    uint32_t type = kKernelPersonaTypeOther;
};

struct PersonaAttributes {
    enum class Kind { Personal, Enterprise, Universal, System, Other };

    Kind kind = Kind::Other;
    std::string typeName;  // "Type" as written
    std::optional<std::string> uniqueString;
    uint32_t personaID = 0;
    std::vector<std::string> bundleIDs;
    std::optional<FileURL> layoutPath;  // root prefix applied

    bool isPersonalPersona() const { return kind == Kind::Personal; }
    bool isEnterprisePersona() const { return kind == Kind::Enterprise; }
    bool isUniversalPersona() const { return kind == Kind::Universal; }
    bool isSystemPersona() const { return kind == Kind::System; }
    const std::optional<std::string>& userPersonaUniqueString() const { return uniqueString; }
    uint32_t userPersona_id() const { return personaID; }
    const std::vector<std::string>& userPersonaBundleIDList() const { return bundleIDs; }
    const std::optional<FileURL>& personaLayoutPathURL() const { return layoutPath; }

    uint32_t kernelPersonaType() const;
    std::string description() const;

    // Parses one entry of the list file; nullopt (reason in *why) when malformed.
    static std::optional<PersonaAttributes> fromPlist(const PlistValue& value, std::string* why);
};

using PersonaAttributesRef = std::shared_ptr<const PersonaAttributes>;
using PersonaAttributesList = std::vector<PersonaAttributesRef>;

// "(a, b, c)" for log lines; "(null)" for no list.
std::string PersonaListDescription(const std::optional<PersonaAttributesList>& list);

class PersonaListUpdateObserver {
public:
    virtual ~PersonaListUpdateObserver() = default;
    virtual void personaListDidUpdate() = 0;
};

class PersonaRoster {
public:
    // The file-backed roster of the current root prefix (remade when the
    // prefix changes; earlier ones stop watching but stay alive).
    static PersonaRoster& sharedManager();

    virtual ~PersonaRoster() = default;

    // The whole list; nullopt when the list cannot be had.
    virtual std::optional<PersonaAttributesList> listAllPersonaWithAttributes() = 0;
    // Kernel persona information by persona id; nullptr when unknown.
    virtual PersonaAttributesRef personaInfoForPersonaID(uint32_t personaID);
    // The kernel's information record of a persona, as a structure of
    // `version`; nullopt when the persona is unknown or the version is not
    // KernelPersonaInfo::kVersion.
    std::optional<KernelPersonaInfo> kernelPersonaInfo(uint32_t personaID, uint32_t version);
    // The persona a request acts for: the list entry whose unique string is
    // the request's (the peer's, see TarnRequestContext); nullptr when the
    // request names none or the list does not know it.
    virtual PersonaAttributesRef currentPersona(const std::optional<std::string>& uniqueString);

    // Observers are held weakly. The completion handler runs before this
    // returns, with an error text when watching could not start.
    virtual void registerPersonaListUpdateObserver(
        std::weak_ptr<PersonaListUpdateObserver> observer, const std::string& withService,
        const std::function<void(const std::optional<std::string>& error)>& completionHandler);

protected:
    // Calls personaListDidUpdate() on every live observer.
    void notifyObservers();
    // Hook for subclasses that must start something when the first observer comes.
    virtual bool startWatching(std::string* why) { return true; }

private:
    std::mutex observersLock_;
    std::vector<std::weak_ptr<PersonaListUpdateObserver>> observers_;
};

class FileWatcher;

// The Linux roster: the list file and an inotify watch on its directory.
class FilePersonaRoster : public PersonaRoster {
public:
    explicit FilePersonaRoster(FileURL listFile);
    ~FilePersonaRoster() override;

    std::optional<PersonaAttributesList> listAllPersonaWithAttributes() override;
    void stopWatching();

    // Reads and parses a list file (no caching): missing file = empty list.
    static std::optional<PersonaAttributesList> readListFile(const FileURL& path,
                                                             std::string* why);

protected:
    bool startWatching(std::string* why) override;

private:
    const FileURL listFile_;
    std::mutex watcherLock_;
    std::unique_ptr<FileWatcher> watcher_;
};

// In-memory roster for tests: the list is set directly, fetches are counted,
// and updates are announced by hand.
class MemoryPersonaRoster : public PersonaRoster {
public:
    std::optional<PersonaAttributesList> listAllPersonaWithAttributes() override;

    void setList(std::optional<PersonaAttributesList> list);
    // The answers of the next fetches, one per fetch, before the set list.
    void queueAnswers(std::vector<std::optional<PersonaAttributesList>> answers);
    unsigned fetchCount();
    void TEST_announceUpdate() { notifyObservers(); }

private:
    std::mutex lock_;
    std::optional<PersonaAttributesList> list_ = PersonaAttributesList{};
    std::vector<std::optional<PersonaAttributesList>> queued_;
    unsigned fetches_ = 0;
};

}  // namespace tarn
