#include "tests/store/StoreFixture.h"

#include <sqlite3.h>

#include <fstream>
#include <iterator>
#include <memory>

#include "tests/Interposer.h"

namespace quarvel::testing {

StoreFixture::StoreFixture(bool memory)
    : made_(memory && std::filesystem::is_directory("/dev/shm")
                ? "/dev/shm"
                : std::filesystem::temp_directory_path()) {}

StoreFixture::~StoreFixture() {
  Interposer::watch({});
}

void StoreFixture::put(const Files& files) const {
  std::filesystem::remove_all(directory_);
  std::filesystem::create_directory(directory_);
  for (const auto& [name, content] : files) {
    std::ofstream(directory_ / name, std::ios::binary) << content;
  }
}

StoreFixture::Files StoreFixture::files() const {
  Files files;
  for (const auto& entry : std::filesystem::directory_iterator(directory_)) {
    std::ifstream file(entry.path(), std::ios::binary);
    files[entry.path().filename()] = std::string(std::istreambuf_iterator<char>(file), {});
  }
  return files;
}

std::unique_ptr<TelemetryStore> StoreFixture::open(TelemetryStore::Options options) const {
  options.path = path_;
  auto store = TelemetryStore::open(std::move(options));
  EXPECT_TRUE(store) << store.error().description();
  return store ? std::move(store.value()) : nullptr;
}

std::vector<std::string> StoreFixture::rows(const std::string& query) const {
  sqlite3* connection = nullptr;
  EXPECT_EQ(sqlite3_open(path_.c_str(), &connection), SQLITE_OK);
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
  EXPECT_EQ(sqlite3_exec(connection, query.c_str(), collect, &rows, nullptr), SQLITE_OK)
      << sqlite3_errmsg(connection);
  sqlite3_close(connection);
  return rows;
}

std::string StoreFixture::value(const std::string& query) const {
  const std::vector<std::string> found = rows(query);
  EXPECT_EQ(found.size(), 1U) << query;
  return found.empty() ? "" : found.front();
}

Outcome StoreFixture::send(TelemetryStore& store, const Payload& payload) {
  return store.addMessage({std::nullopt, 7, "client", "service", 1, 2, payload});
}

std::int64_t StoreFixture::addSession(TelemetryStore& store, std::int64_t sessionID,
                                      const Payload& userInfo) {
  const auto session =
      store.addAgentSession({sessionID, 19, 2.0, true, "token", "client", "service", userInfo});
  EXPECT_TRUE(session);
  return session ? session.value() : 0;
}

std::future<std::optional<Error>> StoreFixture::flush(TelemetryStore& store, std::int64_t session) {
  auto flushed = std::make_shared<std::promise<std::optional<Error>>>();
  EXPECT_TRUE(store.flush(session, [flushed](const auto& error) { flushed->set_value(error); }));
  return flushed->get_future();
}

}  // namespace quarvel::testing
