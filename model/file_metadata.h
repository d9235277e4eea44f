// VTRFileMetadata: what the system records of one file-system item so that it
// can lay the item down again elsewhere: its attributes, its extended
// attributes, the SHA-1 of a regular file's content and a symbolic link's
// target text.
//
// A record *is* its dictionary form, the shape manifests store:
//   "VTRManifestFileAttributes"          dictionary: the file manager's
//                                        attributes of the item itself
//   "VTRManifestFileExtendedAttributes"  dictionary, name to data (empty when
//                                        the item has none)
//   "VTRManifestFileHash"                data: the SHA-1 of a regular file;
//                                        empty for anything else and for a
//                                        file that could not be read
//   "VTRManifestSymbolicLinkTargetFile"  string: a link's target as stored;
//                                        empty for anything else
// Read from disk, the dictionary is built in that order and stops at the
// first value that could not be had: without readable extended attributes a
// record holds the attributes alone, and a link whose target could not be
// read has no target entry. Readers go through the getters, which answer
// nothing for a missing key or a value of the wrong kind, so a malformed
// manifest entry gives absent values, never a failure.
//
// Failures are logged (one line each, texts as below) and answered with an
// absent result. A record is immutable; records may be used from several
// threads at once. Functions returning a Value answer nil for "absent".
//
// The helper reads items as root inside trees that clients may own, so an
// item is read as an entry of its open directory (initWithItemAt), never by
// resolving its full path again: whatever a client renames or swaps for a
// symbolic link above the item meanwhile, no link leads a read elsewhere.
// The path-based operations open the item's directory once (following links
// above the item, as any path does) and read the item from there; none
// follows a symbolic link at the last component. Only on kernels older than
// 6.13, which lack listxattrat and getxattrat, are a link's own extended
// attributes read by path.
#ifndef VTR_MODEL_FILE_METADATA_H_
#define VTR_MODEL_FILE_METADATA_H_

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/value.h"

namespace vtr {

inline constexpr char kVTRManifestFileAttributes[] = "VTRManifestFileAttributes";
inline constexpr char kVTRManifestFileExtendedAttributes[] = "VTRManifestFileExtendedAttributes";
inline constexpr char kVTRManifestFileHash[] = "VTRManifestFileHash";
inline constexpr char kVTRManifestSymbolicLinkTargetFile[] = "VTRManifestSymbolicLinkTargetFile";

// An extended attribute that differs from device to device by design and is
// left out of comparisons.
inline constexpr char kIgnoredExtendedAttribute[] = "com.orvane.glimd.dbRebuildUuid";

// The codes of VTRFileMetadata::compareWith, in the order the checks run.
enum VTRFileComparison : int {
  kVTRFileOtherAbsent = 0,
  kVTRFileTypeDiffers = 1,
  kVTRFileHashDiffers = 2,
  kVTRFileTargetDiffers = 3,
  kVTRFileOwnershipDiffers = 4,
  kVTRFileExtendedAttributesDiffer = 5,
  kVTRFileSame = 6,
};

// The account that laid the content down (mobile): a restore may hand it
// its own files freely; anything more is privilege.
struct ClientAccount {
  uid_t uid = static_cast<uid_t>(-1);
  gid_t gid = static_cast<gid_t>(-1);
};

class VTRFileMetadata {
 public:
  // ---- Making records ----

  // The record of the item at path, read from disk: nullopt after "Cannot
  // get file attribute for %@" when its attributes cannot be read, and
  // (without a further message) when an item that is not a link vanishes
  // before it is hashed. An unreadable regular file still gives a record,
  // with an empty hash.
  static std::optional<VTRFileMetadata> initWithPath(const std::string& path);

  // The record of the entry name of the open directory dirFd, as initWithPath
  // makes it (same content, same messages) for an item that stays put.
  // Attributes, link target and extended attributes are read relative to
  // dirFd; a regular file or directory is opened there without following a
  // link and its extended attributes and content read through that
  // descriptor. path is the item's full path, for messages only. dirFd stays
  // the caller's and must stay open for the call.
  static std::optional<VTRFileMetadata> initWithItemAt(int dirFd, const std::string& name,
                                                       const std::string& path);
  static std::optional<VTRFileMetadata> fileMetadatatWithPath(const std::string& path) { return initWithPath(path); }

  // A record holding dictionary as it is (shared, neither copied nor checked).
  explicit VTRFileMetadata(Value dictionary) : dict_(std::move(dictionary)) {}
  static VTRFileMetadata fileMetaDataWithMetadataDictionary(Value dictionary) {
    return VTRFileMetadata(std::move(dictionary));
  }

  // ---- Using records ----

  // Lays this record's attributes onto the item at path, never through a
  // symbolic link at its last component:
  // - a link record: owner and group (ids, read as 32-bit numbers) and mode
  //   go onto the link itself; their results are not checked;
  // - any other record: the allowed attributes are set (a link at path is
  //   refused), on failure "Could not set file attributs at %@ with error -
  //   %@, attributes = %@" and NO; then the protection class (which Linux
  //   accepts without effect), on failure "Could not set file protection key
  //   at %@ with error - %@, attributes = %@" and NO.
  // Then each extended attribute in name order, stopping at the first that
  // fails ("Got Non-string key" for a name that cannot be one, "Got non-data
  // value", "Could not set extended attributes on %@"); attributes already on
  // the item are kept. The answer is YES when the attributes step was done OR
  // every extended attribute was set, so an item that is not a link answers
  // YES despite an extended attribute that failed, and a link answers exactly
  // whether its extended attributes were set. This asymmetry is deliberate.
  bool restoreAttribuesToPath(const std::string& path) const;
  // The same onto the entry name of the open directory dirFd ("." for the
  // directory itself), nothing resolved but that name and no link followed.
  // path names the item in messages; dirFd stays the caller's.
  // - A link record goes only onto a symbolic link, opened itself (O_PATH),
  //   which gets its owner and extended attributes; anything else there
  //   fails the attributes step.
  // - A regular file or directory is opened and set through its
  //   descriptor; its extended attributes go on before the immutable and
  //   append-only flags, which are lifted first when it has them and set
  //   last. A file with more than one link is never handed over to client
  //   from another owner (the inode lives elsewhere too).
  // - A record that leaves a regular file privileged (an owner or group
  //   other than client's, a set-uid or set-gid bit, a "security."
  //   extended attribute) is laid only onto the record's content (its
  //   NSFileSize and its SHA-1 "VTRManifestFileHash", hashed from the
  //   descriptor then changed), on an inode no one else can write: in place
  //   when the file has one link and a read lease proves it has no writer,
  //   else on a copy the helper makes beside it, which replaces it (mobile's
  //   writable descriptors, mappings and other links keep reaching the old
  //   inode). Otherwise "Not granting privilege to %@: %@" (path, why) and
  //   NO, the item as it was.
  // - Anything else fails the attributes step.
  bool restoreAttribuesToItemAt(int dirFd, const std::string& name, const std::string& path,
                                const ClientAccount& client) const;

  // The first difference from other, as a VTRFileComparison code: other
  // absent; type (an absent type here counts as different); content hash of
  // a regular file; target of a link; owner id, group id or mode; extended
  // attributes (kIgnoredExtendedAttribute left out on both sides; an absent
  // dictionary counts as empty); else kVTRFileSame. Dates, sizes, names,
  // counts and the protection class are not compared. Logs nothing.
  int compareWith(const VTRFileMetadata* other) const;

  // attributes less every key the restore may not set; nothing is added.
  // Allowed: NSFileBusy, NSFileHFSCreatorCode, NSFileHFSTypeCode,
  // NSFileImmutable, NSFileCreationDate, NSFileExtensionHidden,
  // NSFileGroupOwnerAccountID, NSFileGroupOwnerAccountName,
  // NSFileModificationDate, NSFileOwnerAccountID, NSFileOwnerAccountName,
  // NSFilePosixPermissions.
  static Dictionary fileAttributesAllowSet(const Dictionary& attributes);

  // Typed views of the dictionary; null when missing or of another kind.
  // Pointers stay valid as long as the record.
  const Bytes* getHash() const;
  const Dictionary* getFileAttributes() const;
  const Dictionary* getExtendedAttributes() const;
  const std::string* getFileType() const;
  const std::string* getTargetFile() const;
  // NSFileSize of a record whose type is NSFileTypeRegular; 0 for any other
  // record, whatever size it holds.
  uint64_t getFileSize() const;

  const Value& dict() const { return dict_; }

 private:
  Value dict_;
};

}  // namespace vtr

#endif  // VTR_MODEL_FILE_METADATA_H_
