#include "bench/Subject.h"

#include <fmt/format.h>
#include <sqlite3.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <thread>
#include <utility>

#include "base/Json.h"
#include "base/Payload.h"
#include "bench/Floor.h"

namespace quarvel {

namespace {

constexpr std::size_t kWindow = 64;

/// Checks the condition every half millisecond; fails after a minute.
template <class Condition>
void Await(const char* what, Condition condition) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) Fail(what);
    std::this_thread::sleep_for(std::chrono::microseconds(500));
  }
}

}  // namespace

std::unique_ptr<Server> Subject::start() const {
  auto server =
      std::make_unique<Server>([this](const std::filesystem::path& directory) { run(directory); });
  connect(*server, 0);
  return server;
}

void Subject::restart(Server& server) const {
  server.restart([this](const std::filesystem::path& directory) { run(directory); });
}

std::unique_ptr<WireClient> Subject::connect(const Server& server, std::int64_t /*number*/) const {
  return std::make_unique<WireClient>(socket(server));
}

std::string Subject::frame(std::int64_t clientNumber) const {
  return SendMessageFrame(7, clientNumber);
}

void Subject::send(WireClient& client, std::int64_t clientNumber, std::size_t count) const {
  client.pipeline(frame(clientNumber), count, kWindow);
}

void Subject::awaitStored(const Server& server, std::size_t messages) const {
  sqlite3* database = nullptr;
  sqlite3_stmt* query = nullptr;
  const std::string path = server.directory() / "telemetry.db";
  Await("rows are missing", [&] {
    if (query == nullptr) {
      sqlite3_close(database);
      sqlite3_open_v2(path.c_str(), &database, SQLITE_OPEN_READONLY, nullptr);
      sqlite3_prepare_v2(database, "SELECT coalesce(max(id), 0) FROM message", -1, &query, nullptr);
    }
    const bool there = sqlite3_step(query) == SQLITE_ROW &&
                       sqlite3_column_int64(query, 0) >= static_cast<std::int64_t>(messages);
    sqlite3_reset(query);
    return there;
  });
  sqlite3_finalize(query);
  sqlite3_close(database);
}

std::uintmax_t Subject::fileBytes(const Server& server) const {
  std::uintmax_t bytes = 0;
  for (const auto& file : std::filesystem::directory_iterator(server.directory())) {
    if (file.is_regular_file()) bytes += file.file_size();
  }
  return bytes;
}

std::filesystem::path Subject::socket(const Server& server) const {
  return server.directory() / "reporting.sock";
}

namespace {

class Service final : public Subject {
 public:
  Service(std::string quarveld, int rows)
      : Subject(fmt::format("service, {}", rows == 1 ? "one row" : "two rows")),
        quarveld_(std::move(quarveld)),
        wanted_(rows == 1 ? "" : "\"*\"") {}

  [[nodiscard]] std::unique_ptr<WireClient> connect(const Server& server,
                                                    std::int64_t number) const override {
    auto client = Subject::connect(server, number);
    if (number > 0) client->startSession(number);
    return client;
  }

 private:
  void run(const std::filesystem::path& directory) const override {
    const std::string path = directory;
    std::ofstream(directory / "quarvel.toml")
        << "[log]\nlevel = \"error\"\n[analytics]\nwanted = [" << wanted_ << "]\n"
        << "[limits]\nconnections = 20000\n";
    for (const char* name : {"RUNTIME_DIRECTORY", "STATE_DIRECTORY", "CONFIGURATION_DIRECTORY"}) {
      setenv(name, path.c_str(), 1);
    }
    unsetenv("QUARVEL_SOCKET");
    execl(quarveld_.c_str(), quarveld_.c_str(), nullptr);
    Fail("exec " + quarveld_);
  }

  const std::string quarveld_;
  const std::string wanted_;
};

class Floor final : public Subject {
 public:
  explicit Floor(int rows)
      : Subject(rows == 0 ? "echo" : fmt::format("floor, {}", rows == 1 ? "one row" : "two rows")),
        rows_(rows) {}
  [[nodiscard]] bool stores() const override { return rows_ > 0; }

 private:
  void run(const std::filesystem::path& directory) const override {
    RunFloor(directory, JsonText(Payload(TypicalPayload())), rows_);
  }

  const int rows_;
};

/// A program of another project, with the libraries unpacked beside it.
class Peer : public Subject {
 public:
  Peer(std::string name, std::filesystem::path root, const char* program)
      : Subject(std::move(name)), root_(std::move(root)), program_(root_ / program) {}
  [[nodiscard]] bool isInstalled() const { return std::filesystem::exists(program_); }

 protected:
  [[noreturn]] void execute(const std::vector<std::string>& arguments) const {
    if (root_ != "/") {
      setenv("LD_LIBRARY_PATH",
             fmt::format("{}:{}", path(kLibraries), path("usr/lib/syslog-ng")).c_str(), 1);
    }
    std::vector<char*> words{const_cast<char*>(program_.c_str())};
    for (const std::string& word : arguments) words.push_back(const_cast<char*>(word.c_str()));
    words.push_back(nullptr);
    if (std::freopen("/dev/null", "w", stdout) == nullptr) Fail("/dev/null");
    execv(program_.c_str(), words.data());
    Fail("exec " + program_.native());
  }
  /// The path of a file of the peer's packages.
  [[nodiscard]] std::string path(const char* file) const { return root_ / file; }

  static constexpr const char* kLibraries = "usr/lib/x86_64-linux-gnu";
  static constexpr const char* kSyslogNg = "usr/lib/syslog-ng/3.38";

 private:
  const std::filesystem::path root_;
  const std::filesystem::path program_;
};

class Redis final : public Peer {
 public:
  explicit Redis(const std::filesystem::path& root)
      : Peer("redis-server", root, "usr/bin/redis-server") {}
  [[nodiscard]] std::unique_ptr<WireClient> connect(const Server& server,
                                                    std::int64_t /*number*/) const override {
    return std::make_unique<WireClient>(socket(server), &CountReplies);
  }
  [[nodiscard]] std::string frame(std::int64_t /*clientNumber*/) const override {
    const std::string json = JsonText(Payload(TypicalPayload()));
    return fmt::format("*5\r\n$4\r\nXADD\r\n$1\r\ns\r\n$1\r\n*\r\n$1\r\np\r\n${}\r\n{}\r\n",
                       json.size(), json);
  }
  /// Returns at once: the server answers when the entry is in its append-only file.
  void awaitStored(const Server& /*server*/, std::size_t /*messages*/) const override {}
  [[nodiscard]] std::uintmax_t fileBytes(const Server& server) const override {
    std::uintmax_t bytes = 0;
    for (const auto& file :
         std::filesystem::directory_iterator(server.directory() / "appendonlydir")) {
      bytes += file.file_size();
    }
    return bytes;
  }

 private:
  /// Each reply is the name of the new entry in two lines: its length and its text.
  static std::size_t CountReplies(std::string& arrived) {
    const auto lines = static_cast<std::size_t>(std::ranges::count(arrived, '\n'));
    std::size_t end = 0;
    for (std::size_t i = 0; i < lines / 2 * 2; ++i) end = arrived.find('\n', end) + 1;
    arrived.erase(0, end);
    return lines / 2;
  }
  void run(const std::filesystem::path& directory) const override {
    execute({"--port", "0", "--unixsocket", directory / "reporting.sock", "--dir", directory,
             "--appendonly", "yes", "--appendfsync", "everysec", "--save", ""});
  }
};

/// A syslog daemon that writes one line per message into a file and sends no replies.
class Syslog : public Peer {
 public:
  using Peer::Peer;
  [[nodiscard]] bool acknowledges() const override { return false; }
  [[nodiscard]] std::string frame(std::int64_t /*clientNumber*/) const override {
    return "<13>quarvel: " + JsonText(Payload(TypicalPayload())) + "\n";
  }
  void awaitStored(const Server& server, std::size_t messages) const override {
    const std::uintmax_t wanted = messages * frame(1).size();
    Await("lines are missing", [&] { return fileBytes(server) >= wanted; });
  }
  [[nodiscard]] std::uintmax_t fileBytes(const Server& server) const override {
    std::error_code none;
    const std::uintmax_t bytes = std::filesystem::file_size(server.directory() / "out", none);
    return none ? 0 : bytes;
  }
};

class SyslogNg final : public Syslog {
 public:
  explicit SyslogNg(const std::filesystem::path& root)
      : Syslog("syslog-ng", root, "usr/sbin/syslog-ng") {}
  void send(WireClient& client, std::int64_t clientNumber, std::size_t count) const override {
    std::string batch;
    for (std::size_t i = 0; i < kWindow; ++i) batch += frame(clientNumber);
    for (std::size_t sent = 0; sent < count; sent += kWindow) {
      client.write(std::string_view(batch).substr(
          0, std::min(count - sent, kWindow) * frame(clientNumber).size()));
    }
  }

 private:
  void run(const std::filesystem::path& directory) const override {
    const std::string in = directory;
    std::ofstream(directory / "conf")
        << "@version: 3.38\noptions { stats-freq(0); };\nsource s { unix-stream(\"" << in
        << "/reporting.sock\" flags(no-parse) max-connections(64) log-iw-size(65536)); };\n"
        << "destination d { file(\"" << in << "/out\" template(\"$MSG\\n\")); };\n"
        << "log { source(s); destination(d); flags(flow-control); };\n";
    execute({"-F", "-f", in + "/conf", "--persist-file=" + in + "/persist",
             "--control=" + in + "/control", "--pidfile=" + in + "/pid",
             "--module-path=" + path(kSyslogNg)});
  }
};

class Rsyslog final : public Syslog {
 public:
  explicit Rsyslog(const std::filesystem::path& root)
      : Syslog("rsyslog", root, "usr/sbin/rsyslogd") {}
  [[nodiscard]] std::unique_ptr<WireClient> connect(const Server& server,
                                                    std::int64_t /*number*/) const override {
    return std::make_unique<WireClient>(socket(server), CountMessagePackReplies, SOCK_DGRAM);
  }
  /// Sends one datagram per message.
  void send(WireClient& client, std::int64_t clientNumber, std::size_t count) const override {
    const std::string message = frame(clientNumber);
    for (std::size_t i = 0; i < count; ++i) {
      client.write(std::string_view(message).substr(0, message.size() - 1));
    }
  }

 private:
  void run(const std::filesystem::path& directory) const override {
    const std::string in = directory;
    std::ofstream(directory / "conf")
        << "module(load=\"imuxsock\" SysSock.Use=\"off\")\ninput(type=\"imuxsock\" Socket=\"" << in
        << "/reporting.sock\" RateLimit.Interval=\"0\" UseSpecialParser=\"off\" "
           "ParseHostname=\"off\")\ntemplate(name=\"line\" type=\"string\" "
           "string=\"%rawmsg%\\n\")\naction(type=\"omfile\" file=\""
        << in << "/out\" template=\"line\")\n";
    execute({"-n", "-f", in + "/conf", "-i", in + "/pid", "-M",
             path(kLibraries) + std::string("/rsyslog")});
  }
};

}  // namespace

std::unique_ptr<Subject> ServiceSubject(const std::string& quarveld, int rows) {
  return std::make_unique<Service>(quarveld, rows);
}

std::unique_ptr<Subject> FloorSubject(int rows) {
  return std::make_unique<Floor>(rows);
}

std::vector<std::unique_ptr<Subject>> PeerSubjects(const std::filesystem::path& root) {
  std::vector<std::unique_ptr<Subject>> installed;
  const auto add = [&installed](auto peer) {
    if (peer->isInstalled()) installed.push_back(std::move(peer));
  };
  add(std::make_unique<Redis>(root));
  add(std::make_unique<SyslogNg>(root));
  add(std::make_unique<Rsyslog>(root));
  return installed;
}

}  // namespace quarvel
