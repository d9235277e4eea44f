#include "model/record_pipeline.h"

#include <algorithm>

#include "model/log_model.h"

namespace vtr {
namespace {

// Records handed to the workers at once: one lock and one wake-up for many
// items instead of one each.
constexpr size_t kPublishBatch = 64;
// How far behind the oldest item a waiting caller also waits for, so that it
// wakes once to a run of finished items instead of once per item.
constexpr size_t kWakeBatch = 32;

// Makes item's record, then lets its directory go (closing it, when it was
// the last item there to be made).
void MakeRecord(RecordPipeline::Item* item) {
  item->record = VTRFileMetadata::initWithItemAt(item->directory->get(), item->name, item->path);
  item->directory.reset();
}

}  // namespace

RecordPipeline::RecordPipeline(unsigned threads, size_t window) : window_(window == 0 ? 1 : window) {
  workers_.reserve(threads);
  for (unsigned i = 0; i < threads; ++i) workers_.emplace_back([this] { work(); });
}

RecordPipeline::~RecordPipeline() {
  {
    std::lock_guard<std::mutex> lock(mutex_);
    stopping_ = true;
    pending_.clear();
  }
  workAvailable_.notify_all();
  for (std::thread& worker : workers_) worker.join();
}

void RecordPipeline::submitRecord(std::string path, std::shared_ptr<const UniqueFd> directory, std::string name) {
  Slot& slot = slots_.emplace_back();
  slot.item.startsDirectory = directory != lastDirectory_;
  lastDirectory_ = directory;
  if (slot.item.startsDirectory) ++directoriesInFlight_;
  if (++recordsInFlight_ >= window_ || directoriesInFlight_ >= kMaxDirectoriesInFlight) refilling_ = false;
  slot.item.path = std::move(path);
  slot.item.directory = std::move(directory);
  slot.item.name = std::move(name);
  slot.item.wantsRecord = true;
  if (workers_.empty()) return;  // take() makes it
  unpublished_.push_back(&slot);
  if (unpublished_.size() >= kPublishBatch) publish();
}

void RecordPipeline::submitMessage(std::string message, LogPriority priority) {
  Slot& slot = slots_.emplace_back();
  slot.item.log.push_back({std::move(message), priority});
  slot.done.store(true, std::memory_order_relaxed);
}

void RecordPipeline::publish() {
  if (unpublished_.empty()) return;
  size_t idle;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    pending_.insert(pending_.end(), unpublished_.begin(), unpublished_.end());
    idle = idleWorkers_;
  }
  unpublished_.clear();
  if (idle > 0) workAvailable_.notify_all();
}

RecordPipeline::Item RecordPipeline::take() {
  Slot& head = slots_.front();
  if (workers_.empty()) {
    if (head.item.wantsRecord) MakeRecord(&head.item);
  } else if (!head.done.load(std::memory_order_acquire)) {
    publish();
    Slot* target = &slots_[std::min(kWakeBatch, slots_.size()) - 1];
    std::unique_lock<std::mutex> lock(mutex_);
    while (!head.done.load()) {
      if (Slot* slot = nextPending()) {
        lock.unlock();
        makeRecord(slot);
        lock.lock();
        continue;
      }
      awaitedHead_.store(&head);
      awaitedTarget_.store(target);
      itemDone_.wait(lock, [&] { return head.done.load() && target->done.load(); });
      awaitedHead_.store(nullptr);
      awaitedTarget_.store(nullptr);
    }
  }
  Item item = std::move(head.item);
  slots_.pop_front();
  if (item.wantsRecord) {
    --recordsInFlight_;
    if (item.startsDirectory) --directoriesInFlight_;
    if (recordsInFlight_ <= window_ / 2 && directoriesInFlight_ <= kMaxDirectoriesInFlight / 2) refilling_ = true;
  }
  return item;
}

RecordPipeline::Slot* RecordPipeline::nextPending() {
  if (pending_.empty()) return nullptr;
  Slot* slot = pending_.front();
  pending_.pop_front();
  return slot;
}

void RecordPipeline::makeRecord(Slot* slot) {
  {
    ScopedLogDiversion diversion(&slot->item.log);
    MakeRecord(&slot->item);
  }
  slot->done.store(true);
}

void RecordPipeline::work() {
  std::unique_lock<std::mutex> lock(mutex_);
  for (;;) {
    ++idleWorkers_;
    workAvailable_.wait(lock, [this] { return stopping_ || !pending_.empty(); });
    --idleWorkers_;
    if (stopping_) return;
    Slot* slot = nextPending();
    lock.unlock();
    makeRecord(slot);
    // The caller announces what it sleeps on before it checks the slots
    // (both sequentially consistent), so either it sees this slot done or
    // this sees it waiting; the lock orders the wake-up after its wait.
    const bool awaited = awaitedHead_.load() == slot || awaitedTarget_.load() == slot;
    lock.lock();
    if (awaited) itemDone_.notify_one();
  }
}

}  // namespace vtr
