#pragma once

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <cstdlib>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

#include "platform/linux/reporting_store_reader.h"

namespace qn::testing {

// A fresh directory under the system's temporary folder, removed with its contents.
class TempDir {
 public:
  TempDir() {
    std::string pattern = (std::filesystem::temp_directory_path() / "qn-store-XXXXXX").string();
    char* made = mkdtemp(pattern.data());
    EXPECT_NE(made, nullptr);
    path_ = pattern;
  }
  ~TempDir() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;

  const std::string& path() const { return path_; }
  std::string File(const std::string& name) const { return path_ + "/" + name; }

 private:
  std::string path_;
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

inline nlohmann::json ParseJson(const std::string& text) {
  return nlohmann::json::parse(text, nullptr, /*allow_exceptions=*/false);
}

}  // namespace qn::testing
