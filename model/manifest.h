// VTRManifest: the file metadata of one tree, as a dictionary from each
// item's path relative to a root ("/" for the root itself, "/Library/x" below
// it) to the dictionary form of the item's VTRFileMetadata record.
//
// A manifest is filled once, by walking a tree (addFilesFromPath, or
// enumerateAndCollectMetaData to hand each record to a handler instead of
// keeping it, which is how a whole device's manifest is streamed to a file),
// or loaded from a dictionary read from a file and then queried by path.
//
// The fill walks the tree in pre-order with the entries of each directory in
// byte order of their names (model/tree_walker.h), never following a link.
// For each item, in that order:
//   - an item matched by the skip list (see folder) is passed over, and a
//     skipped directory is not entered: everything below it would be passed
//     over by the same rule, so nothing there is read or reported;
//   - a fifo, socket or device is logged "%@ is special file. Leave it along"
//     and passed over, never opened;
//   - the key is made from the item's path (see RelativeKey); an item whose
//     path does not contain the root gets the previous item's key again,
//     replacing that entry (the first such item gets "/");
//   - the record is made; when it cannot be ("Couldn't get meta data for
//     %@"), the fill ends there and answers true, leaving the manifest
//     partial; a record or key holding text that is not UTF-8 (a link
//     target, an extended-attribute name) is reported as not walkable and
//     passed over, since no property list could carry it;
//   - the handler gets (record, key); when it answers false ("Couldn't run
//     handler against %@"), the fill ends and answers false;
//   - the progress updater, if any, is advanced by the item's size as its
//     record read it (directories and links included, so progress may pass
//     100 percent).
// With inclusive, the tree path itself follows as the last item (its type
// read with lstat; when that fails, "Could not get resource for key %@" and
// false). What cannot be walked is logged "%s: Could not enumerate %@,
// url=%@, error=%@" and passed over; the walk goes on.
//
// Records are made on worker threads (model/record_pipeline.h) while the
// handler, keys, progress and every log line stay on the calling thread in
// walk order: the output is exactly that of a sequential fill, and so is the
// log. Each record is made from the item's entry in the directory the walk
// opened, never by resolving its path again, so a directory swapped for a
// link during the fill cannot lead the helper elsewhere. Items whose path
// reaches PATH_MAX are reported as not walkable: their keys and log lines
// name them by path.
//
// Threads: a manifest is used by one thread at a time; the handler and the
// progress updater are called on the thread that called the fill.
#ifndef VTR_MODEL_MANIFEST_H_
#define VTR_MODEL_MANIFEST_H_

#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "model/file_metadata.h"
#include "model/progress_updater.h"
#include "model/tree_walker.h"
#include "platform/value.h"

namespace vtr {

class VTRManifest {
 public:
  // Takes each record and its key during a fill; false ends the fill.
  using Handler = std::function<bool(const VTRFileMetadata& record, const std::string& key)>;

  // An empty manifest: no entries, no root path, no progress updater.
  VTRManifest();

  // A manifest holding the entries of dictionary (any values; metadataForFile
  // answers only for dictionaries). It has no root path and may be filled
  // once.
  static VTRManifest initWithDictionary(const Dictionary& dictionary);

  // ---- Contents ----

  // The entries as a dictionary value (path to record dictionary).
  Value dict() const;
  size_t count() const { return entries_.size(); }
  // The relative paths held.
  std::set<std::string> pathSet() const;
  // The record stored under path, or nullopt when there is none or it is not
  // a dictionary.
  std::optional<VTRFileMetadata> metadataForFile(const std::string& path) const;
  // Stores record's dictionary under path, replacing an earlier entry.
  void setMetadata(const VTRFileMetadata& record, const std::string& path);

  // The path keys are made relative to: absent until the first fill starts,
  // then kept (a filled manifest refuses further fills).
  const std::optional<std::string>& rootPath() const { return rootPath_; }

  // Receives the total and the increments of a fill; null (the default) for
  // none. Not owned; must outlive the fills.
  VTRProgressUpdater* progressUpdater() const { return progressUpdater_; }
  void setProgressUpdater(VTRProgressUpdater* updater) { progressUpdater_ = updater; }

  // Where the tree of the next fill stands, opened by the caller without
  // following links; the tree path then only spells item paths and keys.
  // Without it the tree path is resolved as text.
  void setTreeLocation(TreeLocation location) { treeLocation_ = std::move(location); }

  // How keys are made. kRootOccurrences is the rule the helper applies to
  // the paths its clients send (RelativeKey). kExactPrefix cuts the root path
  // off the front of the item path and nothing else (PrefixKey), for callers
  // that give the tree and root in canonical form, so that no two items can
  // share a key.
  enum class KeyRule { kRootOccurrences, kExactPrefix };
  void setKeyRule(KeyRule rule) { keyRule_ = rule; }

  // Told, on the filling thread, of each item that belongs in the manifest
  // but is left out of it: one that cannot be walked or read, one whose key
  // or record holds text that is not UTF-8 (error EILSEQ), and the item whose
  // record could not be made (the fill ends there). The log lines stay as
  // they are; a tool uses this to report them in its own words.
  using OmissionHandler = std::function<void(const std::string& path, const Error& error)>;
  void setOmissionHandler(OmissionHandler handler) { omissionHandler_ = std::move(handler); }

  // Worker threads that make records during a fill; 0 makes each record in
  // turn on the calling thread. The default suits the machine.
  void setRecordThreads(unsigned threads) { recordThreads_ = threads; }
  unsigned recordThreads() const { return recordThreads_; }

  // ---- Filling ----

  // enumerateAndCollectMetaData with a handler that stores each record with
  // setMetadata.
  bool addFilesFromPath(const std::string& treePath, const std::string& rootPath,
                        const std::vector<std::string>& skip, bool inclusive);

  // Walks treePath as described above, keys relative to rootPath, and hands
  // every record to handler. False at once (nothing done) when the manifest
  // has been filled before; otherwise sets the root path, sets the progress
  // total (calculateTotalFileSize; only when an updater is attached, since
  // nothing else uses it) and walks. The result is as described above.
  bool enumerateAndCollectMetaData(const std::string& treePath, const std::string& rootPath,
                                   const std::vector<std::string>& skip, bool inclusive, const Handler& handler);

  // ---- Helpers of a fill ----

  // Whether path is one of the skip list's paths or lies beneath one: an
  // entry matches when it starts path and either is all of it or, joined
  // with the rest of path as a path component, gives path back. So "/a/b"
  // matches "/a/b" and "/a/b/c" but not "/a/bc"; an empty entry matches
  // nothing.
  static bool folder(const std::vector<std::string>& skip, const std::string& path);

  // The key of itemPath relative to rootPath: where rootPath first occurs at
  // the start of itemPath, itemPath with every occurrence of rootPath
  // removed; where it first occurs later, the rest after that occurrence
  // with every occurrence removed; "/" for an empty result. nullopt when
  // rootPath does not occur (or is empty).
  static std::optional<std::string> RelativeKey(const std::string& itemPath, const std::string& rootPath);
  // The key of itemPath below rootPath by exact prefix: "/" for the root
  // itself, the rest of itemPath (which begins with "/") for an item below
  // it; nullopt when itemPath does not lie at or below rootPath. A trailing
  // slash of rootPath is not part of it.
  static std::optional<std::string> PrefixKey(const std::string& itemPath, const std::string& rootPath);

  // The full paths of the entries directly in directory whose names begin
  // with "."; empty when it cannot be listed (not logged).
  static std::vector<std::string> immediateHiddenFilesUnderPath(const std::string& directory);
  // The same for the directory open as dirFd, whose path is directory (the
  // text the returned paths begin with). dirFd stays the caller's.
  static std::vector<std::string> immediateHiddenFilesIn(int dirFd, const std::string& directory);

  // The summed size of the regular files under treePath not matched by the
  // skip list (the tree path itself never counts). Unwalkable parts are
  // logged and passed over; 0 after "Cound not get attribute for item %@"
  // when a file's size cannot be read.
  static uint64_t calculateTotalFileSize(const std::string& treePath, const std::vector<std::string>& skip,
                                         const TreeLocation& location = {});

  // The size of the item at path as its attributes give it, 0 when they
  // cannot be read.
  static uint64_t fileSizeToAdjustPercentage(const std::string& path);

 private:
  class Fill;

  std::map<std::string, Value, std::less<>> entries_;
  std::optional<std::string> rootPath_;
  VTRProgressUpdater* progressUpdater_ = nullptr;
  TreeLocation treeLocation_;
  unsigned recordThreads_;
  KeyRule keyRule_ = KeyRule::kRootOccurrences;
  OmissionHandler omissionHandler_;
};

}  // namespace vtr

#endif  // VTR_MODEL_MANIFEST_H_
