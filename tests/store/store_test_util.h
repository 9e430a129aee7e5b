#pragma once

#include <gtest/gtest.h>

#include <condition_variable>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/linux/reporting_store.h"
#include "platform/linux/reporting_store_reader.h"
#include "tests/fakes/LogCapture.h"
#include "tests/fakes/TempDir.h"

namespace qn::testing {

// Holds the writer thread inside a task until Release, so that a test can hand records
// over while the writer is known to be busy, and knows what lands in the next batch.
class WriterGate {
 public:
  // Queues the blocking task; returns once the writer is inside it.
  void Close(ReportingStore& store) {
    store.AfterWrite([this] {
      std::unique_lock lock(mu_);
      entered_ = true;
      cv_.notify_all();
      cv_.wait(lock, [this] { return open_; });
    });
    std::unique_lock lock(mu_);
    cv_.wait(lock, [this] { return entered_; });
  }
  void Release() {
    std::lock_guard lock(mu_);
    open_ = true;
    cv_.notify_all();
  }

 private:
  mutable std::mutex mu_;
  std::condition_variable cv_;
  bool entered_ = false;
  bool open_ = false;
};

// A reporting store in a fresh folder, its log captured.
class StoreTest : public ::testing::Test {
 protected:
  std::shared_ptr<ReportingStore> OpenStore(ReportingStore::Options options = {}) {
    std::optional<Error> error;
    auto store = ReportingStore::Open(db_path_, log_, options, &error);
    EXPECT_TRUE(store) << (error ? error->Description() : "");
    return store;
  }

  TempDir dir_;
  std::string db_path_ = dir_.File("reports.db");
  std::shared_ptr<LogCapture> log_ = std::make_shared<LogCapture>();
};

// Every row of `sink` (all sinks when nullopt) in the reader's order; fails the test when
// the database cannot be read.
inline std::vector<ReportingStoreRow> ReadRows(const std::string& db,
                                               std::optional<ReportingSink> sink = std::nullopt) {
  std::vector<ReportingStoreRow> rows;
  std::optional<Error> error;
  auto reader = ReportingStoreReader::Open(db, &error);
  EXPECT_TRUE(reader) << (error ? error->Description() : "");
  if (!reader) return rows;
  error = reader->ForEachRow(sink, [&](const ReportingStoreRow& row) {
    rows.push_back(row);
    return true;
  });
  EXPECT_FALSE(error) << error->Description();
  return rows;
}

}  // namespace qn::testing
