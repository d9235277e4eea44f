#include "vitd_helper/restore_workers.h"

#include "model/file_metadata.h"
#include "platform/file_manager.h"
#include "platform/open_beneath.h"
#include "platform/paths.h"
#include "vitd_helper/client_path_resolver.h"

namespace vtr {
namespace {

// Records handed over at a time, and batches waiting at most: enough to
// keep the workers busy, little memory.
constexpr size_t kBatchSize = 64;
constexpr size_t kMaxQueuedBatches = 8;

// Lays record onto the item key names beneath the staging root; false when
// the record is no dictionary or cannot be laid.
bool RestoreRecord(OpenDirectoryChain& directories, const std::string& root, const ClientAccount& client,
                   const std::string& key, const Value& value) {
  if (value.dictionary() == nullptr) return false;
  const VTRFileMetadata record(value);
  const std::string target = AppendPathComponent(root, key);
  // The record's own path, beneath the staging root: no "..", no link on
  // the way; "/" is the root itself.
  Result<std::vector<std::string>> components = SplitPathComponents("/" + key);
  Result<int> parent = components.ok()
                           ? directories.open(*components, components->empty() ? 0 : components->size() - 1)
                           : Result<int>(components.error());
  if (!parent.ok()) {
    LogRefusal(target, parent.error());
    return false;
  }
  const std::string name = components->empty() ? "." : components->back();
  return record.restoreAttribuesToItemAt(*parent, name, target, client);
}

bool IsDirectory(const Value& record) {
  const std::string* type = VTRFileMetadata(record).getFileType();
  return type != nullptr && *type == kNSFileTypeDirectory;
}

// The modification date a directory record sets, or null for any other
// record.
const Value* DirectoryDate(const Value& record) {
  return IsDirectory(record) ? VTRFileMetadata(record).getFileAttributes()->find(kNSFileModificationDate) : nullptr;
}

}  // namespace

RestoreWorkers::RestoreWorkers(int stagingDir, std::string root, ClientAccount client, unsigned workers)
    : stagingDir_(stagingDir), root_(std::move(root)), client_(client) {
  filling_.records.reserve(kBatchSize);
  for (unsigned i = 0; i < std::max(workers, 1u); ++i) threads_.emplace_back([this] { work(); });
}

RestoreWorkers::~RestoreWorkers() {
  if (!threads_.empty()) finish();
}

bool RestoreWorkers::add(std::string key, Value record) {
  if (failed_.load(std::memory_order_relaxed)) return false;
  if (IsDirectory(record)) {
    if (!filling_.records.empty()) push(std::move(filling_));
    Batch folder;
    folder.records.emplace_back(std::move(key), std::move(record));
    folder.folder = true;
    push(std::move(folder));
    filling_ = Batch();
    filling_.records.reserve(kBatchSize);
    return !failed_.load(std::memory_order_relaxed);
  }
  filling_.records.emplace_back(std::move(key), std::move(record));
  if (filling_.records.size() == kBatchSize) {
    push(std::move(filling_));
    filling_ = Batch();
    filling_.records.reserve(kBatchSize);
  }
  return !failed_.load(std::memory_order_relaxed);
}

void RestoreWorkers::push(Batch batch) {
  batch.foldersBefore = foldersAdded_;
  if (batch.folder) ++foldersAdded_;
  std::unique_lock lock(mutex_);
  changed_.wait(lock, [this] { return queue_.size() < kMaxQueuedBatches || failed_; });
  if (failed_) return;
  queue_.push_back(std::move(batch));
  changed_.notify_all();
}

bool RestoreWorkers::finish() {
  if (!filling_.records.empty()) push(std::move(filling_));
  {
    std::lock_guard lock(mutex_);
    closed_ = true;
  }
  changed_.notify_all();
  for (std::thread& thread : threads_) thread.join();
  threads_.clear();
  return !failed_ && setDirectoryDatesAgain();
}

bool RestoreWorkers::setDirectoryDatesAgain() {
  OpenDirectoryChain directories(stagingDir_);
  for (const auto& [key, date] : directoryDates_) {
    const std::string target = AppendPathComponent(root_, key);
    Result<std::vector<std::string>> components = SplitPathComponents("/" + key);
    Result<int> directory = components.ok() ? directories.open(*components, components->size())
                                            : Result<int>(components.error());
    const Dictionary attributes({{kNSFileModificationDate, date}});
    Status set = directory.ok() ? SetAttributesOfDescriptor(attributes, *directory, target) : directory.error();
    if (!set.ok()) {
      LogRefusal(target, set.error());
      return false;
    }
  }
  return true;
}

void RestoreWorkers::work() {
  OpenDirectoryChain directories(stagingDir_);
  for (;;) {
    Batch batch;
    {
      std::unique_lock lock(mutex_);
      // A batch begins only once every folder added before it is laid.
      auto ready = [this] { return !queue_.empty() && foldersDone_ >= queue_.front().foldersBefore; };
      changed_.wait(lock, [&] { return ready() || (closed_ && queue_.empty()) || failed_; });
      if (failed_ || !ready()) return;
      batch = std::move(queue_.front());
      queue_.pop_front();
    }
    changed_.notify_all();
    for (const auto& [key, record] : batch.records) {
      if (failed_.load(std::memory_order_relaxed)) return;
      if (!RestoreRecord(directories, root_, client_, key, record)) {
        std::lock_guard lock(mutex_);
        failed_ = true;
        changed_.notify_all();
        return;
      }
      if (const Value* date = DirectoryDate(record)) {
        std::lock_guard lock(mutex_);
        directoryDates_.emplace_back(key, *date);
      }
    }
    if (batch.folder) {
      std::lock_guard lock(mutex_);
      ++foldersDone_;
      changed_.notify_all();
    }
  }
}

}  // namespace vtr
