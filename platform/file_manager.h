// The file manager: the file operations the helper performs as root, with
// the attribute dictionaries its metadata records and requests are made of.
//
// Every operation works on the path it is given without following a
// symbolic link at the last component. Walks of a tree (MoveItem
// across file systems, LinkItem of a directory, RemoveItem) descend by
// descriptor with O_NOFOLLOW, so a link planted or swapped in during the walk
// cannot lead them out of the tree, and they stop at kMaxTreeDepth levels.
//
// Errors carry the errno of the failing call and the path it was made on.
// All functions may be called from any thread; they share no state except
// the process-wide account database (platform/accounts.h).
#ifndef VTR_PLATFORM_FILE_MANAGER_H_
#define VTR_PLATFORM_FILE_MANAGER_H_

#include <sys/stat.h>
#include <sys/types.h>

#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/remove_item.h"  // RemoveItem: recursive removal, links never followed
#include "platform/result.h"
#include "platform/value.h"

namespace vtr {

// Keys of an attribute dictionary.
inline constexpr char kNSFileType[] = "NSFileType";
inline constexpr char kNSFileSize[] = "NSFileSize";
inline constexpr char kNSFilePosixPermissions[] = "NSFilePosixPermissions";
inline constexpr char kNSFileReferenceCount[] = "NSFileReferenceCount";
inline constexpr char kNSFileOwnerAccountID[] = "NSFileOwnerAccountID";
inline constexpr char kNSFileOwnerAccountName[] = "NSFileOwnerAccountName";
inline constexpr char kNSFileGroupOwnerAccountID[] = "NSFileGroupOwnerAccountID";
inline constexpr char kNSFileGroupOwnerAccountName[] = "NSFileGroupOwnerAccountName";
inline constexpr char kNSFileModificationDate[] = "NSFileModificationDate";
inline constexpr char kNSFileCreationDate[] = "NSFileCreationDate";
inline constexpr char kNSFileSystemNumber[] = "NSFileSystemNumber";
inline constexpr char kNSFileSystemFileNumber[] = "NSFileSystemFileNumber";
inline constexpr char kNSFileImmutable[] = "NSFileImmutable";
inline constexpr char kNSFileAppendOnly[] = "NSFileAppendOnly";
inline constexpr char kNSFileExtensionHidden[] = "NSFileExtensionHidden";
inline constexpr char kNSFileDeviceIdentifier[] = "NSFileDeviceIdentifier";
inline constexpr char kNSFileBusy[] = "NSFileBusy";
inline constexpr char kNSFileHFSCreatorCode[] = "NSFileHFSCreatorCode";
inline constexpr char kNSFileHFSTypeCode[] = "NSFileHFSTypeCode";
// The data-protection class. Linux keeps none per file: AttributesOfItem
// never produces it and SetAttributes accepts any class without effect.
inline constexpr char kNSFileProtectionKey[] = "NSFileProtectionKey";
inline constexpr char kNSFileProtectionNone[] = "NSFileProtectionNone";

// Values of kNSFileType.
inline constexpr char kNSFileTypeRegular[] = "NSFileTypeRegular";
inline constexpr char kNSFileTypeDirectory[] = "NSFileTypeDirectory";
inline constexpr char kNSFileTypeSymbolicLink[] = "NSFileTypeSymbolicLink";
inline constexpr char kNSFileTypeCharacterSpecial[] = "NSFileTypeCharacterSpecial";
inline constexpr char kNSFileTypeBlockSpecial[] = "NSFileTypeBlockSpecial";
inline constexpr char kNSFileTypeSocket[] = "NSFileTypeSocket";
inline constexpr char kNSFileTypeUnknown[] = "NSFileTypeUnknown";  // fifos

// Deepest directory nesting that MoveItem (across file systems) and LinkItem
// replicate. Each level holds two descriptors while it is walked.
inline constexpr int kMaxTreeDepth = 256;

// The attribute dictionary of the item at path itself (one statx, the last
// component not followed): NSFileType (string, see above), NSFileSize
// (unsigned), NSFilePosixPermissions (mode & 07777), NSFileReferenceCount,
// NSFileOwnerAccountID, NSFileGroupOwnerAccountID (integers),
// NSFileOwnerAccountName, NSFileGroupOwnerAccountName (strings, only where
// the account database knows the id), NSFileModificationDate,
// NSFileCreationDate (birth time, or the modification time where the file
// system records none), NSFileSystemNumber (integer), NSFileSystemFileNumber
// (unsigned), NSFileImmutable, NSFileAppendOnly (booleans; false where the
// file system keeps no such flags), NSFileExtensionHidden (false), and for
// character and block devices NSFileDeviceIdentifier (integer).
Result<Value> AttributesOfItem(const std::string& path);

// AttributesOfItem of the entry name of the open directory dirFd (AT_FDCWD
// for the working directory): the entry is looked up in that directory
// alone, so nothing renamed or swapped above it changes which item is
// described. A symbolic link there is described itself. pathForErrors names
// the item in the error. dirFd stays the caller's.
Result<Value> AttributesOfItemAt(int dirFd, const std::string& name, const std::string& pathForErrors);

// What SetAttributes does when the last component of its path is a symbolic
// link (it never follows it).
enum class LinkAtPath {
  kOwnerOnly,  // owner and group apply to the link itself; any other change fails with ELOOP
  kRefuse,     // any change fails with ELOOP
};

// Changes the attributes of the item at path:
//   NSFileOwnerAccountName / NSFileOwnerAccountID: the owner, by name (looked
//     up in the account database) or by id; a name the database knows wins
//     over an id, an unknown name without an id fails with EINVAL.
//   NSFileGroupOwnerAccountName / NSFileGroupOwnerAccountID: the group, alike.
//   NSFilePosixPermissions: the mode bits (masked with 07777).
//   NSFileModificationDate: a date.
//   NSFileImmutable, NSFileAppendOnly: the file system's flags; changed only
//     when they differ from the current state, on regular files and
//     directories only (EOPNOTSUPP for other items).
//   NSFileCreationDate, NSFileBusy, NSFileHFSCreatorCode, NSFileHFSTypeCode,
//   NSFileExtensionHidden, NSFileProtectionKey and unknown keys: accepted and
//     passed over; Linux cannot set them.
// Every value is checked before anything is changed: a value of the wrong
// kind fails with EINVAL and changes nothing. Ownership is changed before
// the mode (a change of owner clears set-id bits), and flags that would
// forbid the other changes are lifted first and set again last. A failure
// part way leaves the changes made before it. An empty dictionary succeeds
// without touching the disk.
Status SetAttributes(const Dictionary& attributes, const std::string& path,
                     LinkAtPath linkAtPath = LinkAtPath::kOwnerOnly);

// SetAttributes on the regular file or directory open as fd (read-only will
// do), nothing resolved: a descriptor of another kind fails with
// EOPNOTSUPP. A regular file with more than one link is never given to an
// owner or group other than root (EMLINK, nothing changed): the inode lives
// elsewhere too. When onlyKeys is not empty, entries under other keys are
// passed over as if absent (a record's attributes are used as they stand,
// without a filtered copy).
Status SetAttributesOfDescriptor(const Dictionary& attributes, int fd, const std::string& pathForErrors,
                                 std::span<const std::string_view> onlyKeys = {});

// The flags that keep an item from changing.
struct ItemFlags {
  bool immutable = false;
  bool appendOnly = false;
  bool any() const { return immutable || appendOnly; }
  friend bool operator==(const ItemFlags&, const ItemFlags&) = default;
};

// SetAttributesOfDescriptor without its last step, for a caller that changes
// the item further (its extended attributes) before the flags forbid it:
// flags the item has are lifted first when the attributes change the inode
// or unlockForMore is set, and the flags to set last (with
// SetFlagsOfDescriptor) are the answer; nullopt when they are to stay as
// they are.
Result<std::optional<ItemFlags>> SetAttributesOfDescriptorExceptFlags(const Dictionary& attributes, int fd,
                                                                      const std::string& pathForErrors,
                                                                      std::span<const std::string_view> onlyKeys,
                                                                      bool unlockForMore);

// Sets the immutable and append-only flags of the regular file or directory
// open as fd (EOPNOTSUPP for another kind; the request would reach a
// device's driver), and reads them.
Status SetFlagsOfDescriptor(int fd, ItemFlags wanted, const std::string& pathForErrors);
Result<ItemFlags> FlagsOfDescriptor(int fd, const std::string& pathForErrors);

// Owner, group and mode (07777 bits) of the item whose status is current
// once SetAttributesOfDescriptor(attributes, ..., onlyKeys) would have set
// them; the attributes' values are checked as it checks them. A change of
// owner that clears set-id bits is not counted: the answer errs towards more.
struct ItemOwnership {
  uid_t uid;
  gid_t gid;
  mode_t mode;
};
Result<ItemOwnership> OwnershipAfter(const Dictionary& attributes, const struct stat& current,
                                     const std::string& pathForErrors, std::span<const std::string_view> onlyKeys);

// Owner and group of the item at path itself (a symbolic link is changed,
// not followed). An id of -1 leaves that one as it is.
Status ChangeOwnerOfItem(const std::string& path, uid_t uid, gid_t gid);

// Mode bits of the item at path, never through a symbolic link: a link at
// the last component fails (Linux gives links no mode of their own, so the
// kernel answers EOPNOTSUPP).
Status ChangeModeOfItem(const std::string& path, mode_t mode);

// Moves src to dst, which must not exist (EEXIST otherwise; a dangling link
// counts as existing). Within one file system this is one rename. Across
// file systems the whole tree is copied (data, mode, owner, times, extended
// attributes; symbolic links are copied as links, never followed) and the
// source removed after; if the copy fails, what was copied is removed again
// and the source is left as it was. If only the removal of the source fails,
// both stay and its error is returned.
Status MoveItem(const std::string& src, const std::string& dst);

// MoveItem of the entry srcName of srcDir to the entry dstName of dstDir,
// nothing resolved but those two names. Across file systems the copy keeps
// holes, is made only when the destination has room for it (ENOSPC
// otherwise, before anything is written) and the source is removed only
// once the copy is whole.
Status MoveItemAt(int srcDir, const std::string& srcName, int dstDir, const std::string& dstName,
                  const std::string& srcPath, const std::string& dstPath);

// The copy MoveItemAt makes across file systems, the source left as it is:
// holes kept, made only when the destination has room for it (ENOSPC
// otherwise, before anything is written), removed again when it cannot be
// finished. Nothing is synced.
Status CopyItemAt(int srcDir, const std::string& srcName, int dstDir, const std::string& dstName,
                  const std::string& srcPath, const std::string& dstPath);

// Makes dst a hard link of src, which must not exist (EEXIST otherwise). For
// a directory, dst is a new directory tree with the source's directories
// recreated (mode, owner, times, extended attributes), its files hard-linked
// and its symbolic links recreated (never followed). A symbolic link at src
// is itself recreated at dst. Fails with EXDEV when dst is on another file
// system. If the tree cannot be finished, what was made of it is removed.
Status LinkItem(const std::string& src, const std::string& dst);

// The names in the directory at path (not "." and ".."), sorted by bytes.
// A symbolic link at path is not followed (fails with ELOOP or ENOTDIR).
Result<std::vector<std::string>> ContentsOfDirectory(const std::string& path);

// The target text of the symbolic link at path, as stored (not resolved).
// Fails with EINVAL when path is not a symbolic link.
Result<std::string> DestinationOfSymbolicLink(const std::string& path);

// DestinationOfSymbolicLink of the entry name of the open directory dirFd
// (readlinkat); pathForErrors names the link in the error.
Result<std::string> DestinationOfSymbolicLinkAt(int dirFd, const std::string& name,
                                                const std::string& pathForErrors);

}  // namespace vtr

#endif  // VTR_PLATFORM_FILE_MANAGER_H_
