#include "bench/Floor.h"

#include <sqlite3.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <string_view>

#include "base/MessagePack.h"
#include "store/database/Tables.h"

namespace quarvel {

namespace {

constexpr std::string_view kReply("\x94\x01\x07\xc0\xc0", 5);
constexpr int kRowsPerCommit = 1024;

void Check(bool ok, const char* what) {
  if (ok) return;
  std::perror(what);
  std::_Exit(1);
}

/// The service's tables, written as plainly as SQLite allows: prepared inserts of
/// one row. Owned by `RunFloor`; one thread.
class Tables {
 public:
  Tables(const std::filesystem::path& file, const std::string& json, int rowsPerMessage)
      : json_(json), rowsPerMessage_(rowsPerMessage) {
    if (rowsPerMessage == 0) return;
    Check(sqlite3_open(file.c_str(), &database_) == SQLITE_OK, "open");
    execute("PRAGMA journal_mode=WAL; PRAGMA synchronous=NORMAL");
    message_ = prepare(kMessageTable);
    event_ = prepare(kAnalyticsEventTable);
  }
  void add() {
    if (rowsPerMessage_ == 0) return;
    if (rows_ == 0) execute("BEGIN IMMEDIATE");
    insert(message_);
    if (rowsPerMessage_ == 2) insert(event_);
    if (rows_ >= kRowsPerCommit) commit();
  }
  void commit() {
    if (rows_ > 0) execute("COMMIT");
    rows_ = 0;
  }

 private:
  /// An insert of a row such as the service writes; NULL for `id` takes the next one.
  sqlite3_stmt* prepare(const TableDescription& table) {
    execute(CreateTableSql(table).c_str());
    const std::string sql = InsertSql(table);
    sqlite3_stmt* insert = nullptr;
    Check(sqlite3_prepare_v2(database_, sql.c_str(), -1, &insert, nullptr) == SQLITE_OK,
          sql.c_str());
    int parameter = 1;
    for (const StoreColumn& column : InsertedColumns(table)) bind(insert, ++parameter, column.kind);
    return insert;
  }
  void bind(sqlite3_stmt* insert, int parameter, StoreColumn::Kind kind) {
    switch (kind) {
      case StoreColumn::Kind::json:
        sqlite3_bind_text(insert, parameter, json_.data(), static_cast<int>(json_.size()),
                          SQLITE_STATIC);
        break;
      case StoreColumn::Kind::text:
        sqlite3_bind_text(insert, parameter, "tarnwick.quarvel", -1, SQLITE_STATIC);
        break;
      case StoreColumn::Kind::time:
        sqlite3_bind_int64(insert, parameter, 1769865901123456);
        break;
      default:
        sqlite3_bind_int64(insert, parameter, 1);
    }
  }
  void insert(sqlite3_stmt* statement) {
    ++rows_;
    Check(sqlite3_step(statement) == SQLITE_DONE, "insert");
    sqlite3_reset(statement);
  }
  void execute(const char* sql) {
    Check(sqlite3_exec(database_, sql, nullptr, nullptr, nullptr) == SQLITE_OK, sql);
  }

  const std::string& json_;
  const int rowsPerMessage_;
  sqlite3* database_ = nullptr;
  sqlite3_stmt* message_ = nullptr;
  sqlite3_stmt* event_ = nullptr;
  int rows_ = 0;
};

}  // namespace

void RunFloor(const std::filesystem::path& directory, const std::string& json, int rows) {
  Tables tables(directory / "telemetry.db", json, rows);
  const int listener = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  (directory / "reporting.sock").string().copy(address.sun_path, sizeof address.sun_path - 1);
  Check(bind(listener, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0, "bind");
  Check(listen(listener, 64) == 0, "listen");
  const int poller = epoll_create1(EPOLL_CLOEXEC);
  const auto watch = [poller](int descriptor) {
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.fd = descriptor;
    epoll_ctl(poller, EPOLL_CTL_ADD, descriptor, &event);
  };
  watch(listener);

  std::map<int, std::string> pending;
  std::string replies;
  static std::array<char, 65536> buffer;
  for (;;) {
    std::array<epoll_event, 64> events;
    const int ready = epoll_wait(poller, events.data(), static_cast<int>(events.size()), -1);
    for (int i = 0; i < ready; ++i) {
      const int descriptor = events[static_cast<std::size_t>(i)].data.fd;
      if (descriptor == listener) {
        watch(accept4(listener, nullptr, nullptr, SOCK_CLOEXEC));
        continue;
      }
      const ssize_t count = read(descriptor, buffer.data(), buffer.size());
      if (count <= 0) {
        close(descriptor);
        pending.erase(descriptor);
        continue;
      }
      std::string& bytes = pending[descriptor];
      bytes.append(buffer.data(), static_cast<std::size_t>(count));
      MessagePackScanner scanner(1 << 20, 32);
      std::size_t at = 0;
      replies.clear();
      while (scanner.scan(std::string_view(bytes).substr(at)) ==
             MessagePackScanner::Progress::complete) {
        at += scanner.length();
        scanner.reset();
        tables.add();
        replies += kReply;
      }
      bytes.erase(0, at);
      Check(write(descriptor, replies.data(), replies.size()) >= 0, "write");
    }
    tables.commit();
  }
}

}  // namespace quarvel
