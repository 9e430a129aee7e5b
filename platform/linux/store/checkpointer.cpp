#include "platform/linux/store/checkpointer.h"

#include <utility>

namespace qn::store {
namespace {

// WAL pages not yet copied after which a checkpoint is due (SQLite's own default).
constexpr int kCheckpointPages = 1000;

}  // namespace

std::unique_ptr<Checkpointer> Checkpointer::Start(const char* path, int busy_timeout_ms) {
  sqlite3* raw = nullptr;
  const int rc = sqlite3_open_v2(path, &raw, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
  DbHandle db(raw);
  if (rc != SQLITE_OK) return nullptr;
  sqlite3_busy_timeout(db.get(), busy_timeout_ms);
  // A connection learns that the database is in WAL mode when it first reads it; until
  // then a checkpoint through it does nothing at all and the WAL grows without end.
  if (sqlite3_exec(db.get(), "SELECT count(*) FROM sqlite_schema", nullptr, nullptr, nullptr) !=
      SQLITE_OK) {
    return nullptr;
  }
  return std::unique_ptr<Checkpointer>(new Checkpointer(std::move(db)));
}

Checkpointer::Checkpointer(DbHandle db) : db_(std::move(db)), thread_([this] { Run(); }) {}

Checkpointer::~Checkpointer() {
  {
    std::lock_guard lock(mu_);
    stop_ = true;
  }
  cv_.notify_all();
  thread_.join();
}

void Checkpointer::Committed(int wal_frames) {
  int copied = copied_.load(std::memory_order_relaxed);
  if (wal_frames < copied) copied = 0;  // the WAL has started over
  if (wal_frames - copied < kCheckpointPages) return;
  {
    std::lock_guard lock(mu_);
    if (running_) return;  // it looks again when that checkpoint is done
    due_ = true;
  }
  cv_.notify_all();
}

bool Checkpointer::Idle() {
  std::lock_guard lock(mu_);
  return !running_ && !due_;
}

void Checkpointer::Yield() {
  std::unique_lock lock(mu_);
  due_ = false;
  cv_.wait(lock, [&] { return !running_; });
}

void Checkpointer::Run() {
  std::unique_lock lock(mu_);
  for (;;) {
    cv_.wait(lock, [&] { return due_ || stop_; });
    if (stop_) return;
    due_ = false;
    running_ = true;
    lock.unlock();
    // PASSIVE: copies what it can without waiting for the writer, which goes on.
    int wal_frames = 0;
    int copied = 0;
    if (sqlite3_wal_checkpoint_v2(db_.get(), nullptr, SQLITE_CHECKPOINT_PASSIVE, &wal_frames,
                                  &copied) == SQLITE_OK) {
      copied_.store(copied, std::memory_order_relaxed);
    }
    lock.lock();
    running_ = false;
    cv_.notify_all();
  }
}

}  // namespace qn::store
