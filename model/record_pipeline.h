// RecordPipeline: makes the metadata records of a walk's items on worker
// threads and hands them back in the order the items were submitted, so that
// a manifest filled through it is the same, entry for entry and byte for
// byte, as one filled by making each record in turn.
//
// Reading an item (attributes, extended attributes, and above all the SHA-1
// of a regular file) is the slow part of a manifest and independent from item
// to item; ordering, keys, the caller's handler and progress stay sequential
// on the caller's thread. What a record logs while it is made on a worker is
// held with the item and given back with it, for the caller to log at the
// point where a sequential fill would have: the log reads as if every record
// had been made in turn.
//
// Each record is made from the item's entry in its open directory, whose
// shared descriptor the item holds until its record is made, so that nothing
// renamed above the item while it waits changes what is read. Since those
// descriptors count against the limit of open files, the items in flight
// span at most kMaxDirectoriesInFlight runs of items from one directory.
//
// At most `window` records are in flight; messages (items without a record,
// see submitMessage) take no worker and are not counted. A caller waiting in
// take() makes pending records itself rather than sleep, so that the caller's
// thread counts as one more worker whenever it has nothing else to do. With 0
// threads the record is made by take() itself, on the caller's thread, with
// its messages logged directly: the sequential fill, through the same code.
//
// Threads: one caller thread uses the object; the workers are its own.
#ifndef VTR_MODEL_RECORD_PIPELINE_H_
#define VTR_MODEL_RECORD_PIPELINE_H_

#include <atomic>
#include <condition_variable>
#include <cstddef>
#include <deque>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "model/file_metadata.h"
#include "platform/system_log.h"
#include "platform/unique_fd.h"

namespace vtr {

class RecordPipeline {
 public:
  // Directory descriptors that records in flight may hold open: well under
  // the usual limit of 1024 open files, beside what the walk itself holds.
  static constexpr size_t kMaxDirectoriesInFlight = 128;

  struct Item {
    std::string path;
    // The directory holding the item, and its name there; the directory is
    // let go once the record is made.
    std::shared_ptr<const UniqueFd> directory;
    std::string name;
    bool wantsRecord = false;
    bool startsDirectory = false;  // the first of a run of items in one directory
    // Messages for the caller to log, in order, before it uses the item: what
    // making the record logged on a worker, or the text of submitMessage.
    std::vector<LogLine> log;
    // The record of path (absent when it could not be made, or not wanted).
    std::optional<VTRFileMetadata> record;
  };

  // Starts `threads` workers (0 for none); window must be at least 1.
  RecordPipeline(unsigned threads, size_t window);
  // Drops what has not been taken; records being made are finished and
  // discarded (with their messages) before the workers are joined.
  ~RecordPipeline();
  RecordPipeline(const RecordPipeline&) = delete;
  RecordPipeline& operator=(const RecordPipeline&) = delete;

  // True once `window` records (or kMaxDirectoriesInFlight directories) are
  // in flight, and until take() has brought both down to half of that:
  // take() before submitting more. Refilling in bursts lets the workers run
  // through many items per wake-up.
  bool full() const { return !refilling_; }
  bool empty() const { return slots_.empty(); }

  // Queues the making of the record of the entry name of directory, whose
  // full path is path (for messages and for the caller).
  void submitRecord(std::string path, std::shared_ptr<const UniqueFd> directory, std::string name);
  // Queues an item without a record whose only content is message.
  void submitMessage(std::string message, LogPriority priority);

  // The oldest item, once its record is made. Only valid when !empty().
  Item take();

 private:
  struct Slot {
    Item item;
    // Set by whichever thread made the record, once the item is complete and
    // no longer touched by it; the caller reads the item only after seeing it.
    std::atomic<bool> done{false};
  };

  // Hands the records submitted since the last call to the workers.
  void publish();
  // Makes slot's record, its messages held with it, and marks it done.
  void makeRecord(Slot* slot);
  // The oldest record no worker has started, or null. Called with mutex_ held.
  Slot* nextPending();
  void work();

  const size_t window_;
  // The caller's own state: workers reach slots only through pointers taken
  // from pending_, and deque references stay valid as items come and go.
  std::deque<Slot> slots_;        // in submission order
  std::vector<Slot*> unpublished_;
  size_t recordsInFlight_ = 0;
  size_t directoriesInFlight_ = 0;  // runs of items from one directory
  // Kept, so that its address cannot be taken by another directory's.
  std::shared_ptr<const UniqueFd> lastDirectory_;
  bool refilling_ = true;

  // Shared with the workers, under mutex_.
  std::mutex mutex_;
  std::condition_variable workAvailable_;
  std::condition_variable itemDone_;
  std::deque<Slot*> pending_;  // records not yet started, oldest first
  size_t idleWorkers_ = 0;
  bool stopping_ = false;
  // The slots the caller sleeps on, or null: the oldest item and one some
  // way behind it, so that it wakes once to many finished items.
  std::atomic<Slot*> awaitedHead_{nullptr};
  std::atomic<Slot*> awaitedTarget_{nullptr};

  std::vector<std::thread> workers_;
};

}  // namespace vtr

#endif  // VTR_MODEL_RECORD_PIPELINE_H_
