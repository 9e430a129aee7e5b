#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/linux/reporting_store.h"
#include "platform/linux/reporting_store_reader.h"
#include "tests/fakes/LogCapture.h"
#include "tests/fakes/TempDir.h"

namespace qn::testing {

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
