// The final location of staged content ("/var/backup") and how a staging
// folder reaches it so that neither a kill nor a power cut leaves part of a
// tree there, and a retry after one can only finish the work or find nothing
// to do.
//
// The helper keeps its own entries beside the final location (NAME is its
// last component, "backup"), in its parent, which the client cannot write
// itself:
//   .NAME.incoming-XXXXXX  a copy being made from another file system;
//   .NAME.ready            new content, whole and synced, to be put in place;
//   .NAME.placing          a file holding the inode number of the content
//                          being exchanged into place, while the replaced
//                          content may still bear the ready name;
//   .NAME.outgoing         the content it replaced, being removed;
//   .NAME.source           a file naming the staging folder renamed aside
//                          (".STAGING.moving" in its own folder) once its
//                          copy was ready, while it is removed.
// A staging folder on the final location's file system is renamed to
// .NAME.ready at once and the file system synced. One on another file
// system is copied to .NAME.incoming-XXXXXX, synced (syncfs) and renamed
// to .NAME.ready; then
// it is renamed aside on its own file system, so that a retry finds no
// staging folder, and only then removed. .NAME.ready is put in place by
// one exchange of names (RENAME_EXCHANGE) with the old content, so that at
// every moment the final location holds the old content whole or the new
// whole.
//
// Used one command at a time (the helper runs one), and at start-up.
#ifndef VTR_VITD_HELPER_FINAL_LOCATION_H_
#define VTR_VITD_HELPER_FINAL_LOCATION_H_

#include <sys/stat.h>

#include <optional>
#include <string>

#include "platform/result.h"
#include "platform/unique_fd.h"
#include "vitd_helper/client_path_resolver.h"

namespace vtr {

class FinalLocation {
 public:
  // The final location path (its parent open as parent, its last component
  // name); resolver resolves the staging folders named in .NAME.source.
  FinalLocation(UniqueFd parent, std::string path, const ClientPathResolver& resolver);

  // Finishes what an interrupted move left, one log line for each thing
  // found: a partial copy is removed, ready content is put in place,
  // replaced content and a staging folder renamed aside are removed.
  void finishInterruptedMove();

  // Takes the staging directory stagingName of stagingParent (the
  // directory whose identity the caller checked as staged) as the new
  // content, whole and synced as .NAME.ready, the staging folder gone from
  // its place. On failure the staging folder stays as it was and nothing
  // of a copy remains. stagingPath names it in errors and in .NAME.source.
  Status receive(int stagingParent, const std::string& stagingName, const struct stat& staged,
                 const std::string& stagingPath);

  // Puts .NAME.ready in place of the final location and removes what it
  // replaced, and the staging folder renamed aside by receive(). Fails only
  // when the new content could not be put in place.
  Status putReadyInPlace();

  // Removes the final location's content (a failed move discards it all the
  // same). Errors are ignored.
  void discard();

 private:
  // The name of the helper's entry ".NAME" + suffix.
  std::string entry(const char* suffix) const { return "." + name_ + suffix; }
  bool exists(const std::string& name) const;
  // A small file of the helper's beside the final location: written whole
  // and synced, and read back (nullopt when there is none, or what bears
  // the name is not a regular file of the helper's with one link).
  Status writeRecord(const std::string& name, const std::string& text);
  std::optional<std::string> readRecord(const std::string& name) const;
  // Removes the helper's entry name (logging why when it cannot).
  void removeEntry(const std::string& name);
  // Removes the staging folder renamed aside that .NAME.source names, then
  // the record.
  void removeMovedSource();
  // Makes the copy of stagingName across file systems, as receive() says.
  Status copyAcross(int stagingParent, const std::string& stagingName, const struct stat& staged,
                    const std::string& stagingPath);
  // Renames the copied staging folder aside, after recording where; put
  // back when what was renamed is not the directory staged, or the rename
  // cannot be synced.
  Status moveSourceAside(int stagingParent, const std::string& stagingName, const struct stat& staged,
                         const std::string& stagingPath);

  UniqueFd parent_;
  std::string path_;
  std::string parentPath_;
  std::string name_;
  const ClientPathResolver& resolver_;
};

}  // namespace vtr

#endif  // VTR_VITD_HELPER_FINAL_LOCATION_H_
