// RestoreWorkers: the records of a manifest laid onto the items beneath a
// staging root by worker threads, so that restoring a whole device uses
// every core while the caller reads the next records.
//
// Records are taken in batches in the order they were added; each worker
// keeps the directories of its last record open (OpenDirectoryChain), so
// records in tree order cost few opens. Every record is resolved beneath
// the staging root's descriptor without following links and laid onto the
// item by descriptor (VTRFileMetadata::restoreAttribuesToItemAt): a record
// that grants privilege copies and hashes its file there, so the workers
// hash on every core while the caller reads the next records. The first
// record that fails stops the run: workers take no record after it, add()
// says so, and finish() answers false. Which other records were restored by
// then is not defined. Once all are restored, finish() sets the
// modification dates of the directories again (the copies put in place
// beneath them changed them). add() and finish() are called from one
// thread.
//
// A directory's record is laid before any record added after it is begun:
// once a folder is given to another, mobile can no longer swap what is laid
// into it (another worker could otherwise restore a file of the folder
// while it was still mobile's, and mobile put its own in its place).
#ifndef VTR_VITD_HELPER_RESTORE_WORKERS_H_
#define VTR_VITD_HELPER_RESTORE_WORKERS_H_

#include <atomic>
#include <condition_variable>
#include <deque>
#include <mutex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "model/file_metadata.h"
#include "platform/value.h"

namespace vtr {

class RestoreWorkers {
 public:
  // stagingDir (the caller's, open for the workers' life) is the directory
  // of root, the path messages name; client is the account that laid the
  // content down (what is more than its own is verified first). At least
  // one worker runs (workers 0, as hardware_concurrency() may answer, means
  // one).
  RestoreWorkers(int stagingDir, std::string root, ClientAccount client, unsigned workers);
  // Stops the workers after the queued records (as finish does).
  ~RestoreWorkers();
  RestoreWorkers(const RestoreWorkers&) = delete;
  RestoreWorkers& operator=(const RestoreWorkers&) = delete;

  // Queues the record of key (a path beginning with "/" relative to the
  // staging root); waits while the queue is full. False once a record has
  // failed: adding more is pointless.
  bool add(std::string key, Value record);
  // Waits until every queued record is handled; true when all were
  // restored. Call once.
  bool finish();

 private:
  struct Batch {
    std::vector<std::pair<std::string, Value>> records;
    bool folder = false;        // one directory's record, which later batches wait for
    size_t foldersBefore = 0;   // folder batches added before this one
  };

  void work();
  void push(Batch batch);
  // Sets the dates of the directories restored once more: putting copies
  // in place beneath them changed them. False after the message when one
  // cannot be set.
  bool setDirectoryDatesAgain();

  const int stagingDir_;
  const std::string root_;
  const ClientAccount client_;
  Batch filling_;
  std::mutex mutex_;
  std::condition_variable changed_;
  std::deque<Batch> queue_;
  size_t foldersAdded_ = 0;  // by the adding thread
  size_t foldersDone_ = 0;   // under mutex_
  bool closed_ = false;
  std::atomic<bool> failed_{false};
  std::vector<std::thread> threads_;
  std::vector<std::pair<std::string, Value>> directoryDates_;  // key, date; under mutex_
};

}  // namespace vtr

#endif  // VTR_VITD_HELPER_RESTORE_WORKERS_H_
