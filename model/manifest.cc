#include "model/manifest.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <thread>

#include "model/log.h"
#include "model/record_pipeline.h"
#include "model/tree_walker.h"
#include "platform/file_manager.h"
#include "platform/file_tree.h"
#include "platform/item_io.h"
#include "platform/paths.h"
#include "platform/termination.h"
#include "platform/utf8.h"

namespace vtr {
namespace {

// The routines that report what cannot be walked, named as the log has
// always named them.
constexpr char kFillErrorHandler[] =
    "__77-[VTRManifest enumerateAndCollectMetaData:relativeTo:skip:inclusive:handler:]_block_invoke";
constexpr char kTotalSizeErrorHandler[] = "__48-[VTRManifest calculateTotalFileSize:skipPaths:]_block_invoke";

// Records in flight during a parallel fill: enough for the workers to run
// ahead of a large file being hashed, few enough (a record is about a
// kilobyte) that memory does not grow with the tree.
constexpr size_t kRecordWindow = 1024;

// One worker per core beside the caller's: the caller's thread makes records
// too whenever it would otherwise wait. More than a few only contend for the
// disk.
unsigned DefaultRecordThreads() {
  const unsigned cores = std::max(std::thread::hardware_concurrency(), 1u);
  return std::min(cores - 1, 4u);
}

// The item's URL as the log prints it: "file://" and the path, with bytes
// outside the path characters of a URL percent-encoded.
std::string FileURLString(const std::string& path) {
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string url = "file://";
  for (const unsigned char c : path) {
    const bool plain = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                       std::string_view("-._~/!$&'()*+,;=:@").find(static_cast<char>(c)) != std::string_view::npos;
    if (plain) {
      url += static_cast<char>(c);
    } else {
      url += '%';
      url += kHex[c >> 4];
      url += kHex[c & 15];
    }
  }
  return url;
}

// path may hold a name that is not UTF-8 (what the walker reports as
// EILSEQ); the log shows it with replacement characters.
std::string UnwalkableMessage(const char* routine, const std::string& path, const Error& error) {
  const std::string shown = ToValidUtf8(path);
  return Format("%s: Could not enumerate %@, url=%@, error=%@", routine, shown, FileURLString(shown), error);
}

std::string ReplaceAll(std::string_view text, std::string_view pattern, std::string_view replacement) {
  std::string out;
  out.reserve(text.size());
  for (size_t at; (at = text.find(pattern)) != std::string_view::npos;) {
    out.append(text.substr(0, at));
    out.append(replacement);
    text.remove_prefix(at + pattern.size());
  }
  out.append(text);
  return out;
}

// The size an item's record read, whatever its type: what a fill adds to
// the progress for it.
uint64_t RecordedSize(const VTRFileMetadata& record) {
  const Dictionary* attributes = record.getFileAttributes();
  const Value* size = attributes != nullptr ? attributes->find(kNSFileSize) : nullptr;
  return size != nullptr ? size->unsignedInteger().value_or(0) : 0;
}

// Whether every string and key in value is valid UTF-8: what a property
// list can carry. A record may hold text from the disk (a link's target,
// extended-attribute names) that is not.
bool HoldsOnlyUtf8(const Value& value) {
  std::vector<const Value*> pending{&value};
  while (!pending.empty()) {
    const Value* v = pending.back();
    pending.pop_back();
    if (const std::string* text = v->string()) {
      if (!IsValidUtf8(*text)) return false;
    } else if (const Array* array = v->array()) {
      for (const Value& item : *array) pending.push_back(&item);
    } else if (const Dictionary* dictionary = v->dictionary()) {
      for (const auto& [key, item] : *dictionary) {
        if (!IsValidUtf8(key)) return false;
        pending.push_back(&item);
      }
    }
  }
  return true;
}

}  // namespace

// One fill: the per-item steps after the walk, which must run in walk order
// on the caller's thread.
class VTRManifest::Fill {
 public:
  enum class Outcome { kGoOn, kStopAnswerYes, kStopAnswerNo };

  Fill(const VTRManifest& manifest, const Handler& handler) : manifest_(manifest), handler_(handler) {}

  Outcome walk(const std::string& treePath, const std::vector<std::string>& skip);
  Outcome processTreeItself(const std::string& treePath, const std::vector<std::string>& skip);

 private:
  // Key (from keyPath), handler and progress for the item at path whose
  // record was made (or not).
  Outcome deliver(const std::string& path, const std::string& keyPath, const std::optional<VTRFileMetadata>& record);

  const VTRManifest& manifest_;
  void omit(const std::string& path, const Error& error) const {
    if (manifest_.omissionHandler_) manifest_.omissionHandler_(path, error);
  }

  const Handler& handler_;
  std::string previousKey_ = "/";
};

VTRManifest::Fill::Outcome VTRManifest::Fill::walk(const std::string& treePath, const std::vector<std::string>& skip) {
  const unsigned threads = manifest_.recordThreads_;
  RecordPipeline pipeline(threads, threads == 0 ? 1 : kRecordWindow);
  TreeWalker walker(
      treePath,
      [this, &pipeline](const std::string& path, const Error& error) {
        omit(path, error);
        pipeline.submitMessage(UnwalkableMessage(kFillErrorHandler, path, error), LogPriority::kError);
      },
      [&skip](const std::string& path) { return folder(skip, path); }, manifest_.treeLocation_);

  bool walking = true;
  for (;;) {
    if (TerminationRequested()) {
      VTRLogError("Scan of %@ stopped: the helper is terminating", treePath);
      return Outcome::kStopAnswerNo;
    }
    while (walking && !pipeline.full()) {
      if (!walker.next()) {
        walking = false;
      } else if (walker.type() == TreeWalker::ItemType::kOther) {
        pipeline.submitMessage(Format("%@ is special file. Leave it along", walker.path()), LogPriority::kNotice);
      } else {
        pipeline.submitRecord(walker.path(), walker.parentDirectory(), walker.name());
      }
    }
    if (pipeline.empty()) return Outcome::kGoOn;
    RecordPipeline::Item item = pipeline.take();
    for (const LogLine& line : item.log) VTRLogModel::sharedInstance().logMessage(line.text, line.priority);
    if (!item.wantsRecord) continue;
    if (Outcome outcome = deliver(item.path, item.path, item.record); outcome != Outcome::kGoOn) return outcome;
  }
}

VTRManifest::Fill::Outcome VTRManifest::Fill::processTreeItself(const std::string& treePath,
                                                                const std::vector<std::string>& skip) {
  std::string path = treePath;
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  if (folder(skip, path)) return Outcome::kGoOn;
  const TreeLocation& location = manifest_.treeLocation_;
  struct stat st;
  const bool statted =
      location.parent ? StatAt(location.parent->get(), location.name, &st) : StatAt(AT_FDCWD, path, &st);
  if (!statted) {
    omit(path, Error::FromErrno(path));
    VTRLogError("Could not get resource for key %@", "NSURLIsRegularFileKey");
    return Outcome::kStopAnswerNo;
  }
  if (!S_ISREG(st.st_mode) && !S_ISDIR(st.st_mode) && !S_ISLNK(st.st_mode)) {
    VTRLog("%@ is special file. Leave it along", path);
    return Outcome::kGoOn;
  }
  // The key comes from the tree path as given: with its trailing slash it
  // matches a root path spelled the same way, and the tree is keyed "/".
  return deliver(path, treePath,
                 location.parent ? VTRFileMetadata::initWithItemAt(location.parent->get(), location.name, path)
                                 : VTRFileMetadata::fileMetadatatWithPath(path));
}

VTRManifest::Fill::Outcome VTRManifest::Fill::deliver(const std::string& path, const std::string& keyPath,
                                                      const std::optional<VTRFileMetadata>& record) {
  // An item outside the root keeps the previous item's key, overwriting its
  // entry: long-standing behaviour that manifests in use rely on.
  std::optional<std::string> key = manifest_.keyRule_ == KeyRule::kExactPrefix
                                      ? PrefixKey(keyPath, *manifest_.rootPath_)
                                      : RelativeKey(keyPath, *manifest_.rootPath_);
  if (key) previousKey_ = std::move(*key);
  if (!record) {
    omit(path, Error(EIO, "its attributes could not be read"));
    VTRLogError("Couldn't get meta data for %@", path);
    return Outcome::kStopAnswerYes;
  }
  // Text that no property list can hold would make the whole manifest
  // unwritable; the item is passed over as one that cannot be walked.
  if (!IsValidUtf8(previousKey_) || !HoldsOnlyUtf8(record->dict())) {
    omit(path, Error(EILSEQ, ToValidUtf8(path)));
    const std::string shown = ToValidUtf8(path);
    VTRLogModel::sharedInstance().logMessage(UnwalkableMessage(kFillErrorHandler, shown, Error(EILSEQ, shown)),
                                             LogPriority::kError);
    return Outcome::kGoOn;
  }
  if (!handler_(*record, previousKey_)) {
    VTRLogError("Couldn't run handler against %@", path);
    return Outcome::kStopAnswerNo;
  }
  if (manifest_.progressUpdater_ != nullptr) {
    manifest_.progressUpdater_->updatePercentageWithIncrement(static_cast<int64_t>(RecordedSize(*record)));
  }
  return Outcome::kGoOn;
}

VTRManifest::VTRManifest() : recordThreads_(DefaultRecordThreads()) {}

VTRManifest VTRManifest::initWithDictionary(const Dictionary& dictionary) {
  VTRManifest manifest;
  for (const auto& [path, value] : dictionary) manifest.entries_.emplace(path, value);
  return manifest;
}

Value VTRManifest::dict() const {
  DictionaryBuilder builder;
  builder.reserve(entries_.size());
  for (const auto& [path, value] : entries_) builder.add(path, value);
  return builder.build();
}

std::set<std::string> VTRManifest::pathSet() const {
  std::set<std::string> paths;
  for (const auto& entry : entries_) paths.insert(paths.end(), entry.first);
  return paths;
}

std::optional<VTRFileMetadata> VTRManifest::metadataForFile(const std::string& path) const {
  const auto it = entries_.find(path);
  if (it == entries_.end() || it->second.dictionary() == nullptr) return std::nullopt;
  return VTRFileMetadata::fileMetaDataWithMetadataDictionary(it->second);
}

void VTRManifest::setMetadata(const VTRFileMetadata& record, const std::string& path) {
  entries_.insert_or_assign(path, record.dict());
}

bool VTRManifest::addFilesFromPath(const std::string& treePath, const std::string& rootPath,
                                   const std::vector<std::string>& skip, bool inclusive) {
  return enumerateAndCollectMetaData(treePath, rootPath, skip, inclusive,
                                     [this](const VTRFileMetadata& record, const std::string& key) {
                                       setMetadata(record, key);
                                       return true;
                                     });
}

bool VTRManifest::enumerateAndCollectMetaData(const std::string& treePath, const std::string& rootPath,
                                              const std::vector<std::string>& skip, bool inclusive,
                                              const Handler& handler) {
  if (rootPath_) {
    VTRDebugLog("rootPath already specified. Could not add more files.");
    return false;
  }
  rootPath_ = rootPath;
  if (progressUpdater_ != nullptr) {
    progressUpdater_->initializePercentageWithTotal(
        static_cast<int64_t>(calculateTotalFileSize(treePath, skip, treeLocation_)));
  }
  Fill fill(*this, handler);
  Fill::Outcome outcome = fill.walk(treePath, skip);
  if (outcome == Fill::Outcome::kGoOn && inclusive) outcome = fill.processTreeItself(treePath, skip);
  return outcome != Fill::Outcome::kStopAnswerNo;
}

bool VTRManifest::folder(const std::vector<std::string>& skip, const std::string& path) {
  for (const std::string& entry : skip) {
    if (entry.empty() || !HasPrefix(path, entry)) continue;
    if (path.size() == entry.size()) return true;
    if (AppendPathComponent(entry, std::string_view(path).substr(entry.size())) == path) return true;
  }
  return false;
}

std::optional<std::string> VTRManifest::RelativeKey(const std::string& itemPath, const std::string& rootPath) {
  if (rootPath.empty()) return std::nullopt;
  const size_t at = itemPath.find(rootPath);
  if (at == std::string::npos) return std::nullopt;
  const std::string_view rest =
      at == 0 ? std::string_view(itemPath) : std::string_view(itemPath).substr(at + rootPath.size());
  std::string key = ReplaceAll(rest, rootPath, "");
  if (key.empty()) key.push_back('/');
  return key;
}

std::optional<std::string> VTRManifest::PrefixKey(const std::string& itemPath, const std::string& rootPath) {
  std::string_view root = rootPath;
  while (!root.empty() && root.back() == '/') root.remove_suffix(1);
  std::string_view item = itemPath;
  while (item.size() > 1 && item.back() == '/') item.remove_suffix(1);
  if (!item.starts_with(root)) return std::nullopt;
  const std::string_view rest = item.substr(root.size());
  if (rest.empty() || rest == "/") return std::string("/");
  if (rest.front() != '/') return std::nullopt;
  return std::string(rest);
}

std::vector<std::string> VTRManifest::immediateHiddenFilesUnderPath(const std::string& directory) {
  UniqueFd dir = OpenAt(AT_FDCWD, directory, kDirectoryFlags);
  return dir ? immediateHiddenFilesIn(dir.get(), directory) : std::vector<std::string>();
}

std::vector<std::string> VTRManifest::immediateHiddenFilesIn(int dirFd, const std::string& directory) {
  std::vector<std::string> hidden;
  Result<std::vector<std::string>> names = DirectoryEntryNames(dirFd, directory);
  if (!names.ok()) return hidden;
  std::sort(names->begin(), names->end());
  for (const std::string& name : *names) {
    if (HasPrefix(name, ".")) hidden.push_back(AppendPathComponent(directory, name));
  }
  return hidden;
}

uint64_t VTRManifest::calculateTotalFileSize(const std::string& treePath, const std::vector<std::string>& skip,
                                             const TreeLocation& location) {
  TreeWalker walker(
      treePath,
      [](const std::string& path, const Error& error) {
        VTRLogModel::sharedInstance().logMessage(UnwalkableMessage(kTotalSizeErrorHandler, path, error),
                                                 LogPriority::kError);
      },
      [&skip](const std::string& path) { return folder(skip, path); }, location);
  uint64_t total = 0;
  while (walker.next()) {
    if (walker.type() != TreeWalker::ItemType::kRegular) continue;
    struct stat st;
    if (!StatAt(walker.parentFd(), walker.name(), &st)) {
      VTRLogError("Cound not get attribute for item %@", walker.path());
      return 0;
    }
    if (S_ISREG(st.st_mode)) total += static_cast<uint64_t>(st.st_size);
  }
  return total;
}

uint64_t VTRManifest::fileSizeToAdjustPercentage(const std::string& path) {
  Result<Value> attributes = AttributesOfItem(path);
  if (!attributes.ok()) return 0;
  return attributes->get(kNSFileSize).unsignedInteger().value_or(0);
}

}  // namespace vtr
