// The steps of laying a metadata record onto an item that both ways of doing
// it share: onto the item itself (file_metadata_restore.cc) and onto a
// verified copy of a file that the record makes privileged
// (privileged_restore.cc). Internal to the model.
#ifndef VTR_MODEL_RESTORE_STEPS_H_
#define VTR_MODEL_RESTORE_STEPS_H_

#include <sys/stat.h>

#include <span>
#include <string>
#include <string_view>

#include "model/file_metadata.h"
#include "platform/result.h"
#include "platform/value.h"

namespace vtr {

// The attribute keys a restore sets (VTRFileMetadata::fileAttributesAllowSet).
std::span<const std::string_view> AttributesAllowedToSet();

// Sets the record's extended attributes on the item open as fd in name
// order; false, after its message, at the first that cannot be set.
bool SetRecordExtendedAttributesOf(const Dictionary* extendedAttributes, int fd, const std::string& path);

// The message of a failed attributes step: "Could not set file attributs at
// %@ with error - %@, attributes = %@".
void LogAttributesNotSet(const std::string& path, const Error& error, const Dictionary& attributes);

// Whether laying record onto the regular file whose status is st (before)
// would leave it privileged: owned by another user or group than client's,
// with a set-uid or set-gid bit, or with a "security." extended attribute.
// A record whose values cannot be used counts as privileged (it fails in
// either way of restoring).
bool GrantsPrivilege(const VTRFileMetadata& record, const struct stat& st, const ClientAccount& client);

// Drops the access lists of the item open as fd (a folder's default list
// too): mobile's own on what it staged, or what a copy inherited from the
// default list of mobile's folder. A named entry outlives any change of
// owner or mode and, under a record whose group may write, would let mobile
// write what was given to another (or, by default, what root makes in it
// later). A list the record holds is laid on again with its extended
// attributes. False, errno set, when one stays.
bool DropAccessLists(int fd);

// Lays record, which grants privilege, onto the regular file name of dirFd,
// open as item (status st): the record's size and SHA-1 must match the
// content, hashed from the descriptor that is then changed. In place when a
// WriterLease proves no one can write the file (one link); else through a
// copy: the content is copied into a FreshFile beside it and hashed as
// written, the record laid onto the copy, which then takes the name (the
// staged inode keeps its other links, its owner and mode). Answers as
// restoreAttribuesToItemAt; a file without the record's content fails with
// one line naming path and why.
bool RestoreOntoVerifiedCopy(const VTRFileMetadata& record, int dirFd, const std::string& name, int item,
                             const struct stat& st, const std::string& path);

}  // namespace vtr

#endif  // VTR_MODEL_RESTORE_STEPS_H_
