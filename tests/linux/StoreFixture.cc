#include "tests/linux/StoreFixture.h"

#include <sqlite3.h>
#include <stdlib.h>

#include "tests/linux/FileCalls.h"

namespace quarvel::testing {

namespace {

std::filesystem::path NewDirectory(bool memory) {
  const std::filesystem::path shared = "/dev/shm";
  const bool inMemory = memory && std::filesystem::is_directory(shared);
  std::string name =
      ((inMemory ? shared : std::filesystem::temp_directory_path()) / "quarvel-store-XXXXXX")
          .string();
  EXPECT_NE(mkdtemp(name.data()), nullptr);
  return name;
}

std::vector<std::string> RunSql(const std::filesystem::path& path, const std::string& sql) {
  sqlite3* connection = nullptr;
  EXPECT_EQ(sqlite3_open(path.c_str(), &connection), SQLITE_OK);
  sqlite3_busy_timeout(connection, 10'000);
  std::vector<std::string> rows;
  const auto collect = [](void* out, int columns, char** values, char**) {
    std::string row;
    for (int i = 0; i < columns; ++i) {
      if (i > 0) row += '|';
      row += values[i] == nullptr ? "-" : values[i];
    }
    static_cast<std::vector<std::string>*>(out)->push_back(std::move(row));
    return 0;
  };
  EXPECT_EQ(sqlite3_exec(connection, sql.c_str(), collect, &rows, nullptr), SQLITE_OK)
      << sqlite3_errmsg(connection);
  sqlite3_close(connection);
  return rows;
}

}  // namespace

StoreFixture::StoreFixture(bool memory) : directory_(NewDirectory(memory)) {}

StoreFixture::~StoreFixture() {
  FileCalls::watch({});
  std::filesystem::remove_all(directory_);
}

std::unique_ptr<TelemetryStore> StoreFixture::open(TelemetryStore::Options options) const {
  options.path = path_;
  auto store = TelemetryStore::open(std::move(options));
  EXPECT_TRUE(store) << store.error().description();
  return store ? std::move(store.value()) : nullptr;
}

std::vector<std::string> StoreFixture::rows(const std::string& query) const {
  return RunSql(path_, query);
}

std::string StoreFixture::value(const std::string& query) const {
  const std::vector<std::string> found = rows(query);
  EXPECT_EQ(found.size(), 1U) << query;
  return found.empty() ? "" : found.front();
}

void StoreFixture::execute(const std::string& statements) const {
  (void)RunSql(path_, statements);
}

}  // namespace quarvel::testing
