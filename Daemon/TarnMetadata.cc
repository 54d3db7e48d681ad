#include "Daemon/TarnMetadata.h"

#include <cerrno>
#include <cmath>

#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnPropertyListFile.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/PlatformLog.h"

namespace tarn {

namespace {

// A number's whole value: an integer, or a real without a fraction (a file
// written by another tool may store 2 as 2.0).
std::optional<int64_t> integralValue(const PlistValue& v) {
    if (v.isInteger()) return v.asInt64();
    if (auto real = v.asReal()) {
        if (std::isfinite(*real) && std::trunc(*real) == *real && std::fabs(*real) < 9.0e15)
            return static_cast<int64_t>(*real);
    }
    return std::nullopt;
}

std::string describe(const PlistValue* v) { return v ? v->description() : "(null)"; }

// PathParent without the copy.
std::string_view parentOf(std::string_view path) {
    while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
    auto pos = path.rfind('/');
    if (pos == std::string_view::npos) return {};
    if (pos == 0) return "/";
    return path.substr(0, pos);
}

// Whether the parent of `container` is PathJoin(grandparent of that parent,
// `relative`): the class directory a container of that class must sit in.
// Compared in place, since a rebuild asks it of every container.
bool isInClassDirectory(std::string_view container, std::string_view relative) {
    const std::string_view classDirectory = parentOf(container);
    std::string_view base = parentOf(parentOf(classDirectory));
    while (!relative.empty() && relative.front() == '/') relative.remove_prefix(1);
    while (base.size() > 1 && base.back() == '/') base.remove_suffix(1);
    if (relative.empty()) return classDirectory == base;
    while (relative.back() == '/') relative.remove_suffix(1);
    const bool separator = base.empty() || base.back() != '/';
    return classDirectory.size() == base.size() + separator + relative.size() &&
           classDirectory.starts_with(base) && (!separator || classDirectory[base.size()] == '/') &&
           classDirectory.ends_with(relative);
}

}  // namespace

TarnMetadata::TarnMetadata(const TarnConcreteContainerIdentityRef& containerIdentity,
                           std::optional<PlistValue> info, FileURL url,
                           std::optional<std::string> userManagedAssetsDirName)
    : containerClass_(containerIdentity->containerClass()),
      userIdentity_(containerIdentity->userIdentity()),
      identifier_(containerIdentity->identifier()),
      uuid_(containerIdentity->uuid()),
      url_(std::move(url)),
      userManagedAssetsDirName_(std::move(userManagedAssetsDirName)),
      info_(std::move(info)) {}

TarnMetadata::TarnMetadata(FieldsTag, TarnContainerClass containerClass,
                           TarnUserIdentityRef userIdentity, std::string identifier,
                           const Uuid& uuid, std::optional<PlistValue> info, FileURL url,
                           std::optional<std::string> userManagedAssetsDirName)
    : containerClass_(containerClass),
      userIdentity_(std::move(userIdentity)),
      identifier_(std::move(identifier)),
      uuid_(uuid),
      url_(std::move(url)),
      userManagedAssetsDirName_(std::move(userManagedAssetsDirName)),
      info_(std::move(info)) {}

TarnMutableMetadataRef TarnMetadata::initWithContainerIdentity(
    const TarnConcreteContainerIdentityRef& containerIdentity, std::optional<PlistValue> info,
    FileURL url, std::optional<std::string> userManagedAssetsDirName) {
    if (!containerIdentity) return nullptr;
    return std::make_shared<TarnMetadata>(containerIdentity, std::move(info), std::move(url),
                                          std::move(userManagedAssetsDirName));
}

TarnConcreteContainerIdentityRef TarnMetadata::containerIdentity() const {
    TarnResult<TarnConcreteContainerIdentityRef> identity =
        TarnConcreteContainerIdentity::containerIdentityWithUUID(uuid_, userIdentity_, identifier_,
                                                                 containerClass_);
    return identity.ok() ? std::move(*identity) : nullptr;
}

PlistValue TarnMetadata::dictionaryRepresentation() const {
    PlistDict d;
    if (info_) d[kTarnMetadataInfoKey] = *info_;
    d[kTarnMetadataContentClassKey] = PlistValue(containerClass_);
    if (TarnUserIdentity::isUserIdentityRequiredForContainerClass(containerClass_) && userIdentity_) {
        d[kTarnMetadataUserIdentityKey] = userIdentity_->plist();
    }
    d[kTarnMetadataIdentifierKey] = PlistValue(identifier_);
    d[kTarnMetadataUUIDKey] = PlistValue(uuid_.string());
    d[kTarnMetadataVersionKey] = PlistValue("2");
    if (userManagedAssetsDirName_) {
        d[kTarnMetadataUserManagedAssetsDirNameKey] = PlistValue(*userManagedAssetsDirName_);
    }
    if (projectID_) d[kTarnMetadataProjectIDKey] = PlistValue(uint64_t{*projectID_});
    return PlistValue(std::move(d));
}

TarnStatus TarnMetadata::writeMetadataToDiskWithError() const {
    return writeMetadataToFileURL(PathJoin(url_, kTarnMetadataFileName));
}

TarnStatus TarnMetadata::writeMetadataToFileURL(const FileURL& fileURL) const {
    const PlistValue dictionary = dictionaryRepresentation();
    // Staged on the container's own volume so that the final move is one rename.
    const FileURL temp = PathJoin(
        TarnGlobalConfiguration::sharedInstance().stagingDirectoryURLForUserIdentity(userIdentity_,
                                                                                     containerClass_),
        Format("temp_metadata-%@.plist", uuid_.string()));
    PlatformLog("metadata", PlatformLogType::Debug, "[%s] Writing metadata to [%@]: %@ => %@",
                __func__, fileURL, *this, dictionary);

    // Atomic as well as unprotected: the bytes are fsynced before any rename,
    // so a power cut cannot leave an empty metadata file behind the final move.
    if (TarnStatus written =
            Tarn_writeToURL(dictionary, temp, kTarnWriteAtomic | kTarnWriteNoFileProtection);
        !written.ok()) {
        const TarnErrorRef& underlying = written.error();
        return TARN_ERROR(TarnErrorWriteFailed, underlying,
                          "Failed to write metadata dictionary to URL %@ : %@:%ld", temp,
                          underlying ? underlying->domain() : std::string("(null)"),
                          underlying ? static_cast<long>(underlying->code()) : 0L);
    }
    // The container's project passes itself on only to what is made inside,
    // and a rename across projects fails. Where the file system has no
    // project ids (a container copied elsewhere) there is nothing to join,
    // and the rename below reports any failure that matters.
    if (projectID_) (void)TarnFileManager::defaultManager().moveIntoProject(temp, *projectID_);
    if (TarnStatus moved = TarnFileManager::defaultManager().moveItemAtURL(temp, fileURL);
        !moved.ok()) {
        TarnErrorRef e =
            TARN_ERROR(TarnErrorWriteFailed, moved.error(),
                       "Failed to move metadata from staging: %@ to final: %@", temp, fileURL);
        // The old file is still in place; the stray temporary one is only litter.
        (void)TarnFileManager::defaultManager().removeItemAtURL(temp);
        return e;
    }
    return {};
}

FileURL TarnMetadata::MetadataLocation::fileURL() const {
    return file ? *file : PathJoin(container, kTarnMetadataFileName);
}

TarnResult<TarnMutableMetadataRef> TarnMetadata::readAndValidateMetadataAtUrl(
    const FileURL& url, const TarnUserIdentityRef& forUserIdentity, bool checkClassPath,
    TarnMetadataUnreadable unreadable) {
    return readAndValidateMetadataAtFileUrl(PathJoin(url, kTarnMetadataFileName), forUserIdentity,
                                            checkClassPath, unreadable);
}

TarnResult<TarnMutableMetadataRef> TarnMetadata::readAndValidateMetadataAtFileUrl(
    const FileURL& fileURL, const TarnUserIdentityRef& forUserIdentity, bool checkClassPath,
    TarnMetadataUnreadable unreadable) {
    std::string bytes;
    // Why the read failed makes no difference: the file is unreadable either way.
    auto data = TarnFileManager::defaultManager().readDataAtURL(fileURL, kMaxPlistBytes);
    if (data.ok()) bytes = std::move(data).value();
    return validate(data.ok() ? 0 : EIO, bytes, MetadataLocation{PathParent(fileURL), &fileURL},
                    forUserIdentity, checkClassPath, unreadable);
}

TarnResult<TarnMutableMetadataRef> TarnMetadata::readAndValidateMetadataInClassDirectory(
    const FsFd& classDirectory, FileURL url, const TarnUserIdentityRef& forUserIdentity,
    bool checkClassPath, TarnMetadataUnreadable unreadable) {
    // A rebuild calls this once per container on one thread: the name and the
    // bytes reuse this thread's buffers instead of allocating per file.
    thread_local std::string relative;
    thread_local std::string bytes;
    relative.assign(PathLastComponentView(url)).append("/").append(kTarnMetadataFileName);
    int err = TarnFileManager::defaultManager().readDataInDirectory(classDirectory, relative,
                                                                    kMaxPlistBytes, &bytes);
    auto metadata = validate(err, bytes, MetadataLocation{std::move(url), nullptr}, forUserIdentity,
                             checkClassPath, unreadable);
    // One odd large file must not keep its size for the thread's lifetime.
    if (bytes.capacity() > 64 * 1024) std::string().swap(bytes);
    return metadata;
}

// The decoded root entries of a metadata file: either a list of entries or,
// when the whole dictionary had to be built, that dictionary.
struct TarnMetadata::ParsedFields {
    PlistEntries* entries = nullptr;
    PlistValue* dict = nullptr;
    // With `entries`: the stored user identity's own entries, when it is a
    // dictionary (its root entry is then left empty).
    const PlistEntries* identity = nullptr;

    bool identityInlined(const PlistValue* stored) const {
        return entries && stored && stored->isDict();
    }
    // The stored user identity as the whole-tree reader gives it, for the
    // dictionary reader and for error lines.
    const PlistValue* storedIdentity(PlistValue* scratch) {
        const PlistValue* stored = find(kTarnMetadataUserIdentityKey);
        if (!identityInlined(stored)) return stored;
        PlistDict d;
        for (const auto& [key, value] : *identity) d.emplace(key, value);
        *scratch = PlistValue(std::move(d));
        return scratch;
    }

    PlistValue* find(std::string_view key) const {
        if (dict) {
            PlistDict& d = *dict->asDict();
            auto it = d.find(key);
            return it == d.end() ? nullptr : &it->second;
        }
        for (auto& [name, value] : *entries)
            if (name == key) return &value;
        return nullptr;
    }
};

TarnResult<TarnMutableMetadataRef> TarnMetadata::validate(
    int readError, const std::string& bytes, MetadataLocation where,
    const TarnUserIdentityRef& forUserIdentity, bool checkClassPath,
    TarnMetadataUnreadable unreadable) {
    // A rebuild reads thousands of these files: their few entries are decoded
    // into this thread's reused list, without a dictionary. Anything that
    // reader leaves alone (and the debug line, which shows the whole
    // dictionary) takes the general reader, whose refusals name the file.
    // The stored user identity's entries go to a list of their own, so that
    // its numbers are read without a nested dictionary either.
    thread_local PlistEntries entries;
    thread_local PlistEntries identity;
    if (readError == 0 && !PlatformLogVerbose() &&
        PlistBinaryRootEntries(bytes.data(), bytes.size(), &entries, kTarnMetadataUserIdentityKey,
                               &identity)) {
        ParsedFields fields{&entries, nullptr, &identity};
        auto metadata = validateFields(fields, std::move(where), forUserIdentity, checkClassPath);
        // The keys point into `bytes`.
        entries.clear();
        identity.clear();
        return metadata;
    }

    std::optional<PlistValue> dictionary;
    if (readError == 0) dictionary = PlistValue::fromBytes(bytes.data(), bytes.size());
    if (!dictionary || !dictionary->isDict()) {
        if (unreadable == TarnMetadataUnreadable::kQuiet) return TarnErrorRef();
        return TARN_ERROR(TarnErrorReadFailed, nullptr, "Failed to read metadata at URL %@",
                          where.fileURL());
    }
    ParsedFields fields{nullptr, &*dictionary};
    return validateFields(fields, std::move(where), forUserIdentity, checkClassPath);
}

namespace {

// The field validators are steps of validateFields(): their errors and lines
// carry its name.
constexpr const char* kValidateFields = "validateFields";

}  // namespace

// What validateFields() has read so far, and one validator per field. Each
// validator fails with TarnErrorInvalidMetadata and a line naming the field
// and the file, or keeps the field's value.
struct TarnMetadata::FieldValidator {
    FieldValidator(ParsedFields& fields, const MetadataLocation& where,
                   const TarnUserIdentityRef& forUserIdentity)
        : fields(fields),
          where(where),
          forUserIdentity(forUserIdentity),
          showDictionary(fields.dict && PlatformLogVerbose()) {}

    ParsedFields& fields;
    const MetadataLocation& where;
    const TarnUserIdentityRef& forUserIdentity;
    // The debug lines show the whole dictionary, when there is one: values
    // are then copied out of it, not taken.
    const bool showDictionary;

    std::string identifier;
    Uuid uuid;
    TarnContainerClass containerClass = 0;
    TarnUserIdentityRef owner;
    std::optional<PlistValue> info;
    std::optional<std::string> userManagedAssetsDirName;
    std::optional<uint32_t> projectID;

    // Only a failure names the file, so only a failure pays for its path.
    FileURL fileURL() const { return where.fileURL(); }

    TarnStatus identifierField() {
        const PlistValue* value = fields.find(kTarnMetadataIdentifierKey);
        if (!value || !value->isString()) {
            return TARN_ERROR_IN(kValidateFields, TarnErrorInvalidMetadata, nullptr,
                                 "Invalid metadata Identifier: %@ at %@", describe(value),
                                 fileURL());
        }
        // The parsed tree is ours and not shared: take the identifier out of
        // it unless the debug line at the end is going to show the whole
        // dictionary.
        identifier = showDictionary ? *value->asString()
                                    : std::move(const_cast<std::string&>(*value->asString()));
        return {};
    }

    TarnStatus uuidField() {
        const PlistValue* value = fields.find(kTarnMetadataUUIDKey);
        if (!value || !value->isString()) {
            return TARN_ERROR_IN(kValidateFields, TarnErrorInvalidMetadata, nullptr,
                                 "Invalid metadata UUID String: %@ at %@", describe(value),
                                 fileURL());
        }
        std::optional<Uuid> parsed = Uuid::parse(*value->asString());
        if (!parsed) {
            return TARN_ERROR_IN(kValidateFields, TarnErrorInvalidMetadata, nullptr,
                                 "Invalid metadata UUID: %@ at %@", *value->asString(), fileURL());
        }
        uuid = *parsed;
        return {};
    }

    TarnStatus classField() {
        const PlistValue* value = fields.find(kTarnMetadataContentClassKey);
        if (!value || !value->isNumber()) {
            return TARN_ERROR_IN(kValidateFields, TarnErrorInvalidMetadata, nullptr,
                                 "Invalid metadata Class: %@ at %@", describe(value), fileURL());
        }
        auto number = integralValue(*value);
        if (!number || !TarnContainerClassIsValid(*number)) {
            return TARN_ERROR_IN(kValidateFields, TarnErrorInvalidMetadata, nullptr,
                                 "Invalid metadata Content Class: %ld at %@",
                                 static_cast<long>(number.value_or(-1)), fileURL());
        }
        containerClass = static_cast<TarnContainerClass>(*number);
        return {};
    }

    // The owner: the default identity for a class without one; otherwise the
    // persona and the stored user identity, checked against the expected one.
    TarnStatus ownerFields() {
        TarnUserIdentityCache& cache = TarnUserIdentitySharedCache::sharedInstance();
        if (!TarnUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
            owner = TarnUserIdentityCache::defaultUserIdentity();
            return {};
        }
        if (!forUserIdentity) {
            PlistValue scratch;
            return TARN_ERROR_IN(kValidateFields, TarnErrorInvalidMetadata, nullptr,
                                 "Incorrect User Identity: %@, expecting: %@ for %@ at %@: %llu",
                                 describe(fields.storedIdentity(&scratch)), "(null)", identifier,
                                 fileURL(), uint64_t{TarnSuccess});
        }
        const uint32_t expectedUID = forUserIdentity->posixUIDForContainerClass(containerClass);
        const PlistValue* persona = TARN_TRY(personaField(expectedUID));
        return userIdentityField(cache, persona, expectedUID);
    }

    // The stored uid of a per-user class, when there is one, is the expected
    // user's. Answers the entry (null when absent) for userIdentityField().
    TarnResult<const PlistValue*> personaField(uint32_t expectedUID) {
        const PlistValue* persona = fields.find(kTarnMetadataPersonaKey);
        if (!TarnContainerClassIsPerUser(containerClass)) return persona;
        if (!persona) {
            // Absent means the expected user (see userIdentityField()); only
            // the debug line needs to show it filled in.
            if (showDictionary) fields.dict->set(kTarnMetadataPersonaKey, PlistValue(expectedUID));
        } else if (integralValue(*persona) != std::optional<int64_t>(expectedUID)) {
            return TARN_ERROR_IN(kValidateFields, TarnErrorInvalidMetadata, nullptr,
                                 "Incorrect UserId: %@, expecting: %u for %@ at %@",
                                 persona->description(), expectedUID, identifier, fileURL());
        }
        return persona;
    }

    TarnStatus userIdentityField(TarnUserIdentityCache& cache, const PlistValue* persona,
                                 uint32_t expectedUID) {
        const PlistValue* stored = fields.find(kTarnMetadataUserIdentityKey);
        if (!stored) {
            // Written before identities were stored: the owner's uid is all we
            // have. No such identity leaves the owner missing: ownerExists()
            // then reports it.
            const uint32_t uid =
                persona ? static_cast<uint32_t>(integralValue(*persona).value_or(0)) : expectedUID;
            owner = cache.userIdentityForPersonalPersonaWithUID(uid, uid);
            return {};
        }
        uint64_t code = TarnSuccess;
        PlistValue scratch;
        if (!fields.identityInlined(stored) ||
            !TarnUserIdentity::userIdentityWithEntries(*fields.identity, cache, &owner)) {
            TarnResult<TarnUserIdentityRef> read =
                TarnUserIdentity::userIdentityWithPlist(*fields.storedIdentity(&scratch), cache);
            code = read.code(TarnErrorInvalidUserIdentityData);
            owner = read.ok() ? std::move(*read) : nullptr;
        }
        if (!owner) {
            return TARN_ERROR_IN(kValidateFields, TarnErrorInvalidMetadata, nullptr,
                                 "Invalid metadata User Identity: %@ for %@ at %@: %llu",
                                 *fields.storedIdentity(&scratch), identifier, fileURL(), code);
        }
        if (!owner->isEqualToUserIdentity(*forUserIdentity)) {
            return TARN_ERROR_IN(kValidateFields, TarnErrorInvalidMetadata, nullptr,
                                 "Incorrect User Identity: %@, expecting: %@ for %@ at %@: %llu",
                                 owner, forUserIdentity, identifier, fileURL(), code);
        }
        return {};
    }

    TarnStatus infoField() {
        PlistValue* value = fields.find(kTarnMetadataInfoKey);
        if (!value) return {};
        if (!value->isDict()) {
            return TARN_ERROR_IN(kValidateFields, TarnErrorInvalidMetadata, nullptr,
                                 "Invalid metadata Info: %@ at %@", *value, fileURL());
        }
        // The parsed tree is ours: move the info out unless the debug line is
        // going to show the whole dictionary.
        if (showDictionary)
            info = *value;
        else
            info = std::move(*value);
        return {};
    }

    TarnStatus userManagedAssetsDirNameField() {
        const PlistValue* value = fields.find(kTarnMetadataUserManagedAssetsDirNameKey);
        if (!value) return {};
        if (!value->isString()) {
            return TARN_ERROR_IN(kValidateFields, TarnErrorInvalidMetadata, nullptr,
                                 "Invalid metadata User Managed Dir Name String: %@ at %@", *value,
                                 fileURL());
        }
        userManagedAssetsDirName = *value->asString();
        return {};
    }

    // Only sizing uses the project id, and it can always walk instead: a bad
    // value costs the fast answer, never the container.
    void projectIDField() {
        const PlistValue* value = fields.find(kTarnMetadataProjectIDKey);
        if (!value) return;
        const std::optional<int64_t> number =
            value->isNumber() ? integralValue(*value) : std::nullopt;
        if (!number || *number <= 0 || *number > int64_t{UINT32_MAX} - 1) {
            TarnLog(kLogNotice, kValidateFields, "Ignoring invalid metadata Project ID: %@ at %@",
                    *value, fileURL());
            return;
        }
        projectID = static_cast<uint32_t>(*number);
    }

    // The container sits in the directory of its class.
    TarnStatus classPath() const {
        const char* relative = TarnContainerClassRelativeDirectory(containerClass);
        if (isInClassDirectory(where.container, relative ? relative : "")) return {};
        const FileURL classDirectory = PathParent(where.container);
        const FileURL expected =
            PathJoin(PathParent(PathParent(classDirectory)), relative ? relative : "");
        return TARN_ERROR_IN(kValidateFields, TarnErrorInvalidMetadata, nullptr,
                             "Invalid metadata-URLs should match: %@ : %@", fileURL(), expected);
    }

    // Identifier and class are checked above, so only a missing owner can
    // fail the identity; the factory then reports it (log line and code) as
    // ever. A good file needs no identity object, only its fields.
    TarnStatus ownerExists() {
        if (owner) return {};
        const uint64_t code = TarnConcreteContainerIdentity::containerIdentityWithUUID(
                                  uuid, owner, std::move(identifier), containerClass)
                                  .code(TarnErrorInvalidArgument);
        return TARN_ERROR_IN(kValidateFields, TarnErrorInvalidMetadata, nullptr,
                             "Could not create user identity from %@: %llu", fileURL(), code);
    }
};

TarnResult<TarnMutableMetadataRef> TarnMetadata::validateFields(
    ParsedFields& fields, MetadataLocation where, const TarnUserIdentityRef& forUserIdentity,
    bool checkClassPath) {
    FieldValidator check(fields, where, forUserIdentity);
    TARN_TRY(check.identifierField());
    TARN_TRY(check.uuidField());
    TARN_TRY(check.classField());
    TARN_TRY(check.ownerFields());
    TARN_TRY(check.infoField());
    TARN_TRY(check.userManagedAssetsDirNameField());
    check.projectIDField();
    if (checkClassPath) TARN_TRY(check.classPath());
    TARN_TRY(check.ownerExists());

    auto metadata = std::make_shared<TarnMetadata>(
        FieldsTag{}, check.containerClass, std::move(check.owner), std::move(check.identifier),
        check.uuid, std::move(check.info), std::move(where.container),
        std::move(check.userManagedAssetsDirName));
    metadata->setProjectID(check.projectID);
    if (check.showDictionary)
        PlatformLog("metadata", PlatformLogType::Debug, "[%s] Read metadata from [%@]: %@ <= %@",
                    "readAndValidateMetadataAtFileUrl", check.fileURL(), *metadata, *fields.dict);
    return metadata;
}

std::string TarnMetadata::description() const {
    return Format(
        "<%@: %p; userIdentity = %@, uuid = %@, containerClass = %llu, identifier = %@, info = %@, "
        "url = %@, userManagedAssetsDirName = %@>",
        "TarnMetadata", static_cast<const void*>(this), userIdentity_, uuid_.string(),
        containerClass_, identifier_, info_, url_, userManagedAssetsDirName_);
}

}  // namespace tarn
