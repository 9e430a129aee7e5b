#pragma once

#include <atomic>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <thread>

#include "platform/linux/store/sqlite.h"

namespace qn::store {

// Copies the WAL into the database file on a thread and a connection of its own, so that
// the writer's commits never wait for a checkpoint (which fsyncs the database and, after a
// burst, copies tens of megabytes: long enough to stall every client the store holds back).
// The writer turns its own automatic checkpoints off and tells this one of each commit from
// its WAL hook.
class Checkpointer {
 public:
  // Null when the second connection cannot be opened (the writer then checkpoints itself).
  static std::unique_ptr<Checkpointer> Start(const char* path, int busy_timeout_ms);

  // Stops the thread (after the checkpoint in progress) and closes the connection.
  ~Checkpointer();

  // Writer thread, after each commit that left `wal_frames` in the WAL: wakes the thread
  // once 1,000 of them wait to be copied. (Waking it after every commit made it copy a
  // commit or two and fsync the database over a hundred times a second.)
  void Committed(int wal_frames);

  // Whether no checkpoint runs or is due.
  bool Idle();

  // Waits for the checkpoint in progress, if any, and drops a due one: the caller is about
  // to checkpoint through its own connection.
  void Yield();

 private:
  explicit Checkpointer(DbHandle db);
  void Run();

  DbHandle db_;
  std::mutex mu_;
  std::condition_variable cv_;
  bool due_ = false;            // guarded by mu_
  bool stop_ = false;           // guarded by mu_
  bool running_ = false;        // guarded by mu_
  std::atomic<int> copied_{0};  // WAL frames the last checkpoint left copied
  std::thread thread_;
};

}  // namespace qn::store
