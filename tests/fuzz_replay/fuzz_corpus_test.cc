// Replays every committed fuzz corpus file through the fuzz targets' property checks, so the
// inputs that once broke something keep being tried in every build, sanitizers included.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>

#include "providers/survey_log_providers.h"
#include "tests/fuzz/bus_statement_checks.h"
#include "tests/fuzz/fuzz_checks.h"

namespace {

namespace fs = std::filesystem;

TEST(FuzzCorpusTest, EveryCorpusFileKeepsItsTargetsProperties) {
  const struct {
    const char* target;
    std::string (*check)(const uint8_t*, size_t);
  } kTargets[] = {
      {"row_splitter", fuzz_checks::CheckRowSplitter},
      {"bus_guard", fuzz_checks::CheckBusGuard},
      {"bus_statement", fuzz_checks::CheckBusStatement},
      {"vconf_store", fuzz_checks::CheckVconfStore},
  };
  const fs::path root = fs::path(__FILE__).parent_path().parent_path() / "fuzz" / "corpus";
  for (const auto& target : kTargets) {
    const fs::path dir = root / target.target;
    ASSERT_TRUE(fs::is_directory(dir)) << dir;
    int files = 0;
    for (const fs::directory_entry& entry : fs::directory_iterator(dir)) {
      SCOPED_TRACE(entry.path().string());
      std::ifstream in(entry.path(), std::ios::binary);
      std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
      EXPECT_EQ(target.check(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size()), "");
      ++files;
    }
    EXPECT_GT(files, 0) << dir;
  }
}

// The bus guard target is built without the providers and carries its own copy of the shared
// tables; a table or column added to the providers must reach the fuzzer too.
TEST(FuzzCorpusTest, BusGuardTargetKnowsTheSharedTablesAsDeclared) {
  using _CorvaneLogManager::SurveyTable;
  std::vector<std::string> shared;
  for (int t = 0; t <= static_cast<int>(SurveyTable::kReportAppStatus); ++t) {
    const auto& info = _CorvaneLogManager::GetSurveyTableInfo(static_cast<SurveyTable>(t));
    if (info.busObject) shared.push_back(std::string(info.tableName) + ":" + info.columnList);
  }
  std::vector<std::string> fuzzed;
  for (const fuzz_checks::BusTableShape& shape : fuzz_checks::kBusTables)
    fuzzed.push_back(std::string(shape.name) + ":" + shape.columnList);
  EXPECT_EQ(fuzzed, shared);
}

}  // namespace
