// TarnMetadata: the record of one container, and the reader and writer of its
// hidden metadata file ".com.ostrea.tarn_keeper.metadata.plist". The file is
// the record of truth: the container cache is rebuilt by reading these files.
//
// A metadata object is made mutable (TarnMutableMetadataRef), given its
// transient/existed/url/... by its creator, and then shared between threads
// as TarnMetadataRef (const). To change a shared one, copy() it first.
//
// Writing goes to "temp_metadata-<UUID>.plist" in the staging directory of
// the container's user and class (same volume as the container), fsynced,
// and is then renamed over the final file: a reader never sees a partial file.
// Reading rejects anything malformed as a whole (TarnErrorInvalidMetadata;
// unreadable: TarnErrorReadFailed).
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "Daemon/TarnContainerClass.h"
#include "Daemon/TarnContainerIdentity.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnResult.h"
#include "Daemon/TarnUserIdentity.h"
#include "Platform/Path.h"
#include "Platform/PropertyList.h"

namespace tarn {

class FsFd;
class TarnMetadata;
using TarnMetadataRef = std::shared_ptr<const TarnMetadata>;
using TarnMutableMetadataRef = std::shared_ptr<TarnMetadata>;

// Keys of the metadata file.
inline constexpr const char* kTarnMetadataIdentifierKey = "TarnMetadataIdentifier";
inline constexpr const char* kTarnMetadataContentClassKey = "TarnMetadataContentClass";
inline constexpr const char* kTarnMetadataUUIDKey = "TarnMetadataUUID";
inline constexpr const char* kTarnMetadataVersionKey = "TarnMetadataVersion";
inline constexpr const char* kTarnMetadataUserIdentityKey = "TarnMetadataUserIdentity";
inline constexpr const char* kTarnMetadataInfoKey = "TarnMetadataInfo";
inline constexpr const char* kTarnMetadataUserManagedAssetsDirNameKey =
    "TarnMetadataUserManagedAssetsDirName";
inline constexpr const char* kTarnMetadataPersonaKey = "TarnMetadataPersona";
// The file-system project whose quota usage is the container's size (see
// TarnFileManager::fastDiskUsageForURL). Optional: a value that cannot be an
// id is ignored on reading, and the container is then sized by walking it.
inline constexpr const char* kTarnMetadataProjectIDKey = "TarnMetadataProjectID";
// Known keys of the info dictionary.
inline constexpr const char* kTarnInfoContentProtectionClassKey =
    "com.ostrea.Pallet.ContentProtectionClass";
inline constexpr const char* kTarnInfoCachedCodeSigningInfoKey =
    "com.ostrea.Pallet.CachedCodeSigningInfo";
inline constexpr const char* kTarnInfoGroupContainerIDsKey = "com.ostrea.Pallet.GroupContainerIDs";

// What a metadata reader answers for a file it cannot read or parse at all
// (missing, unreadable, not a property-list dictionary). A cache rebuild meets
// such entries among the containers and has no use for them: kQuiet fails
// without an error value and without a line; kReport fails with
// TarnErrorReadFailed.
enum class TarnMetadataUnreadable { kReport, kQuiet };

class TarnMetadata {
    struct FieldsTag {};

public:
    // Copies user identity, UUID, class and identifier from `containerIdentity`.
    TarnMetadata(const TarnConcreteContainerIdentityRef& containerIdentity,
                 std::optional<PlistValue> info, FileURL url,
                 std::optional<std::string> userManagedAssetsDirName);
    // The fields of an identity already checked (a metadata file read back):
    // no identity object is made for them. For make_shared only.
    TarnMetadata(FieldsTag, TarnContainerClass containerClass, TarnUserIdentityRef userIdentity,
                 std::string identifier, const Uuid& uuid, std::optional<PlistValue> info,
                 FileURL url, std::optional<std::string> userManagedAssetsDirName);
    static TarnMutableMetadataRef initWithContainerIdentity(
        const TarnConcreteContainerIdentityRef& containerIdentity, std::optional<PlistValue> info,
        FileURL url, std::optional<std::string> userManagedAssetsDirName);

    // A mutable copy of a shared record.
    TarnMutableMetadataRef copy() const { return std::make_shared<TarnMetadata>(*this); }

    // A new concrete identity from the fields; nullptr when that fails.
    TarnConcreteContainerIdentityRef containerIdentity() const;

    // Writes to url() + the metadata file name. Failures are TarnErrorWriteFailed.
    TarnStatus writeMetadataToDiskWithError() const;
    TarnStatus writeMetadataToFileURL(const FileURL& fileURL) const;
    // The dictionary that would be written.
    PlistValue dictionaryRepresentation() const;

    // Reads the metadata of the container directory `url`. On success the
    // record is never null.
    static TarnResult<TarnMutableMetadataRef> readAndValidateMetadataAtUrl(
        const FileURL& url, const TarnUserIdentityRef& forUserIdentity, bool checkClassPath,
        TarnMetadataUnreadable unreadable = TarnMetadataUnreadable::kReport);
    static TarnResult<TarnMutableMetadataRef> readAndValidateMetadataAtFileUrl(
        const FileURL& fileURL, const TarnUserIdentityRef& forUserIdentity, bool checkClassPath,
        TarnMetadataUnreadable unreadable = TarnMetadataUnreadable::kReport);
    // The reader of a class rebuild: the answer of readAndValidateMetadataAtUrl
    // for a container directory `url` directly inside the class directory held
    // open as `classDirectory`; the file is opened relative to that.
    static TarnResult<TarnMutableMetadataRef> readAndValidateMetadataInClassDirectory(
        const FsFd& classDirectory, FileURL url, const TarnUserIdentityRef& forUserIdentity,
        bool checkClassPath, TarnMetadataUnreadable unreadable = TarnMetadataUnreadable::kReport);

    bool transient() const { return transient_; }
    bool existed() const { return existed_; }
    TarnContainerClass containerClass() const { return containerClass_; }
    const TarnUserIdentityRef& userIdentity() const { return userIdentity_; }
    const std::string& identifier() const { return identifier_; }
    const Uuid& uuid() const { return uuid_; }
    const FileURL& url() const { return url_; }
    const std::optional<std::string>& userManagedAssetsDirName() const {
        return userManagedAssetsDirName_;
    }
    // A dictionary, or nullopt.
    const std::optional<PlistValue>& info() const { return info_; }
    // The project id given to the container's tree when it was made, if any.
    std::optional<uint32_t> projectID() const { return projectID_; }

    void setTransient(bool transient) { transient_ = transient; }
    void setExisted(bool existed) { existed_ = existed; }
    void setUuid(const Uuid& uuid) { uuid_ = uuid; }
    void setUrl(FileURL url) { url_ = std::move(url); }
    void setUserManagedAssetsDirName(std::optional<std::string> name) {
        userManagedAssetsDirName_ = std::move(name);
    }
    void setInfo(std::optional<PlistValue> info) { info_ = std::move(info); }
    void setProjectID(std::optional<uint32_t> projectID) { projectID_ = projectID; }

    std::string description() const;

private:
  // Where a metadata file is: its container directory, and the file's own
  // URL when the caller has one (otherwise the standard name inside).
  struct MetadataLocation {
      FileURL container;
      const FileURL* file = nullptr;
      FileURL fileURL() const;
  };
  // Parses and checks `bytes` (readError: how reading them failed, or 0).
  static TarnResult<TarnMutableMetadataRef> validate(int readError, const std::string& bytes,
                                                     MetadataLocation where,
                                                     const TarnUserIdentityRef& forUserIdentity,
                                                     bool checkClassPath,
                                                     TarnMetadataUnreadable unreadable);
  struct ParsedFields;
  // One validator per field, each taking what it checks out of the entries.
  struct FieldValidator;
  // The checks of validate() on the decoded entries, one field after
  // another; takes values out of them.
  static TarnResult<TarnMutableMetadataRef> validateFields(
      ParsedFields& fields, MetadataLocation where, const TarnUserIdentityRef& forUserIdentity,
      bool checkClassPath);

  bool transient_ = false;
  bool existed_ = false;
  const TarnContainerClass containerClass_;
  const TarnUserIdentityRef userIdentity_;
  const std::string identifier_;
  Uuid uuid_;
  FileURL url_;
  std::optional<std::string> userManagedAssetsDirName_;
  std::optional<PlistValue> info_;
  std::optional<uint32_t> projectID_;
};

}  // namespace tarn
