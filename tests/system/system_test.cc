#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <thread>

#include "queues/BlockingScope.h"
#include "system/Log.h"
#include "system/ProcessExit.h"
#include "system/ServiceManager.h"
#include "tests/FolderPlatform.h"
#include "tests/Gate.h"
#include "tests/TemporaryDirectory.h"
#include "tests/UnixSocket.h"

namespace quarvel {
namespace {

using std::chrono::milliseconds, std::chrono::seconds;
using testing::Gate, ::testing::HasSubstr, ::testing::MatchesRegex;

constexpr const char* kFunction = "-[Class op:]";

LogHandle registered(const char (&code)[5]) {
  return LogScopes::process().add(FourCharacterCode(code), code, "tarnwick.quarvel",
                                  "reporting_verbose", 31);
}

void say(Log& log, std::string_view text) {
  log.write(nullptr, LogLevel::error, "File.cc", 1, kFunction, text);
}

TEST(LogLineTest, ReadsAsAgreed) {
  const Date date = DateFromText("2026-01-31T13:25:01.123456Z").value();
  const auto expect = [&](const char* zone, LogLevel level, const char* message, const char* begin,
                          const char* end) {
    setenv("TZ", zone, 1);
    // Local time is kept a thread.
    std::thread([&] {
      fmt::memory_buffer buffer;
      const LogLine line = FormatLogLine(buffer, date, level, "tarnwick.quarvel[zqrs]", "File.cc",
                                         88, kFunction, message);
      EXPECT_EQ(line.text,
                fmt::format("2026-01-31T{} tarnwick.quarvel[zqrs] File.cc:88:-[Class op:]: {}\n",
                            begin, end));
      EXPECT_EQ(line.message(), fmt::format("File.cc:88:-[Class op:]: {}", end));
    }).join();
  };
  expect("CET-1", LogLevel::standard, "message", "14:25:01.123456+01:00 default", "message");
  expect("NST3:30", LogLevel::error, "two\nlines\n", "09:55:01.123456-03:30 error",
         "two\\nlines\\n");
  expect("UTC", LogLevel::info, "", "13:25:01.123456+00:00 info", "");
  expect("UTC", LogLevel::debug, "{}", "13:25:01.123456+00:00 debug", "{}");
  unsetenv("TZ");
}

TEST(LogScopeTest, LevelsAndVerboseSwitchDecideWhatIsWritten) {
  const LogHandle scope = registered("levl");
  EXPECT_EQ(registered("levl"), scope) << "registered again";
  // The levels that are written, by their first letters: of the default log, then of the scope.
  const auto enabled = [scope](LogLevel least) {
    std::string letters;
    for (const LogHandle log : {LogHandle{}, scope}) {
      if (Log::isEnabled(LogLevel::error, log, least)) letters += 'e';
      if (Log::isEnabled(LogLevel::standard, log, least)) letters += 's';
      if (Log::isEnabled(LogLevel::info, log, least)) letters += 'i';
      if (Log::isEnabled(LogLevel::debug, log, least)) letters += 'd';
      letters += '|';
    }
    return letters;
  };
  EXPECT_EQ(enabled(LogLevel::error), "e|e|");
  EXPECT_EQ(enabled(LogLevel::standard), "es|es|");
  EXPECT_EQ(enabled(LogLevel::info), "esi|esi|");
  EXPECT_EQ(enabled(LogLevel::debug), "esid|esi|");
  scope->setVerbose(true);
  EXPECT_EQ(enabled(LogLevel::error), "e|ed|");
  scope->setVerbose(false);
}

/// Standard error as a pipe whose reader takes its time.
class PipedStandardError {
 public:
  PipedStandardError() : before_(dup(STDERR_FILENO)) {
    int ends[2];
    EXPECT_EQ(pipe2(ends, O_CLOEXEC), 0);
    dup2(ends[1], STDERR_FILENO);
    close(ends[1]);
    reader = fdopen(ends[0], "r");
  }
  PipedStandardError(const PipedStandardError&) = delete;
  ~PipedStandardError() {
    dup2(before_, STDERR_FILENO);
    close(before_);
    std::fclose(reader);
  }
  FILE* reader = nullptr;

 private:
  int before_;
};

TEST(LogTest, FullQueueHoldsItsCallersBackAndNobodyElseAndLosesNothing) {
  constexpr int kQueues = 4, kLines = 1000;
  const std::string filler(1000, '.');
  std::atomic<int> logged{0};
  std::vector<std::unique_ptr<WorkQueue>> queues;
  PipedStandardError standardError;
  Log log;
  for (int queue = 0; queue < kQueues; ++queue) {
    queues.push_back(CreateSerialQueue("log.test", QualityOfService::utility));
    queues.back()->async([&, queue] {
      for (int i = 0; i < kLines; ++i) {
        say(log, fmt::format("{} {} {}", queue, i, filler));
        ++logged;
      }
    });
  }
  // Without a reader, a quarter of the lines at most can be in flight.
  while (logged < kLines / 2) std::this_thread::yield();
  const auto other = CreateSerialQueue("log.test", QualityOfService::utility);
  Gate others;
  other->async([&others] { others.arrive(); });
  others.wait();
  EXPECT_LT(logged, kQueues * kLines);

  std::vector<int> next(kQueues, 0);
  for (int line = 0; line < kQueues * kLines; ++line) {
    char text[4096] = "";
    int queue = 0, i = -1;
    EXPECT_NE(std::fgets(text, sizeof text, standardError.reader), nullptr);
    EXPECT_EQ(std::sscanf(text, "%*s error [default] File.cc:1:-[Class op:]: %d %d", &queue, &i),
              2);
    EXPECT_EQ(i, next[static_cast<std::size_t>(queue)]++) << text;
  }
  EXPECT_TRUE(log.flush());
}

// Each in a process of its own, on whose standard error the assertions are made.
class LogDeathTest : public ::testing::Test {
 protected:
  void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

void logMany(Log& log) {
  for (int i = 0; i < 5000; ++i) {
    log.write(registered("zqrs"), LogLevel::standard, "File.cc", 1, kFunction,
              fmt::format("line {}", i));
  }
}

TEST_F(LogDeathTest, LinesLeaveBeforeTheProcessAndBeforeTheLog) {
  const auto everyLine = ::testing::AllOf(
      ::testing::ContainsRegex("\n[0-9T:.+-]* default tarnwick.quarvel.zqrs. "
                               "File.cc:1:-.Class op:.: line 4999\n"),
      ::testing::ResultOf([](const std::string& text) { return std::ranges::count(text, '\n'); },
                          5000));
  const auto exitWithLog = [] {
    Log log;
    logMany(log);
    ProcessExit(log).exit(2);
  };
  const auto destroyLog = [] {
    logMany(*std::make_unique<Log>());
    _exit(3);
  };
  EXPECT_EXIT(exitWithLog(), ::testing::ExitedWithCode(2), everyLine);
  EXPECT_EXIT(destroyLog(), ::testing::ExitedWithCode(3), everyLine);
}

TEST_F(LogDeathTest, ExitWorkRunsOnceLastFirstAndMayLog) {
  const auto exitWithWork = [] {
    Log log;
    ProcessExit processExit(log);
    processExit.add([&] {
      say(log, "first added");
      processExit.exit(9);
    });
    processExit.add([&] { say(log, "last added"); });
    std::thread other;
    processExit.add([&] {
      other = std::thread([&] { processExit.exit(8); });
      say(log, "while another thread ends the process too");
    });
    processExit.exit(7);
  };
  EXPECT_EXIT(exitWithWork(), ::testing::ExitedWithCode(9),
              MatchesRegex("[^\n]*another thread[^\n]*\n[^\n]*last added\n[^\n]*first added\n"));
}

TEST_F(LogDeathTest, StandardErrorWithoutAReaderDoesNotKeepTheProcess) {
  const auto logToFullPipe = [] {
    PipedStandardError standardError;
    Log log;
    for (int i = 0; i < 100; ++i) say(log, std::string(2000, '.'));
    ProcessExit(log).exit(0);
  };
  EXPECT_EXIT(logToFullPipe(), ::testing::ExitedWithCode(0), "");
}

// The journal's socket, in a mount namespace of our own; whether there may be one.
int listenAsJournal() {
  const int flags = geteuid() == 0 ? CLONE_NEWNS : CLONE_NEWNS | CLONE_NEWUSER;
  if (unshare(flags) != 0 || mount("none", "/", "none", MS_REC | MS_PRIVATE, nullptr) != 0 ||
      mount("tmpfs", "/run", "tmpfs", 0, nullptr) != 0) {
    return -1;
  }
  std::filesystem::create_directories("/run/systemd/journal");
  return BoundSocket("/run/systemd/journal/socket", SOCK_DGRAM);
}

constexpr int kNoNamespaces = 77;

void logOneLineToJournal() {
  const int journal = listenAsJournal();
  if (journal < 0) {
    fmt::print(stderr, "none\n");
    std::_Exit(kNoNamespaces);
  }
  struct stat own {};
  fstat(STDERR_FILENO, &own);
  setenv("JOURNAL_STREAM", fmt::format("{}:{}", own.st_dev, own.st_ino).c_str(), 1);
  Log log;
  log.write(registered("zqrs"), LogLevel::info, "File.cc", 88, kFunction, "a\nb");
  std::string entry(65536, '\0');
  entry.resize(static_cast<std::size_t>(recv(journal, entry.data(), entry.size(), 0)));
  entry = '\n' + entry;
  for (const char* field :
       {"MESSAGE=File.cc:88:-[Class op:]: a\\nb", "PRIORITY=6", "CODE_FILE=File.cc", "CODE_LINE=88",
        "CODE_FUNC=-[Class op:]", "QUARVEL_SCOPE=tarnwick.quarvel[zqrs]"}) {
    if (entry.find(fmt::format("\n{}\n", field)) != entry.npos) continue;
    fmt::print(stderr, "no {} in {}", field, entry);
    std::_Exit(1);
  }
  // A journal that is gone loses nothing.
  close(journal);
  say(log, "no journal");
  ProcessExit(log).exit(0);
}

TEST_F(LogDeathTest, JournalGetsTheFieldsWhenStandardErrorIsItsStream) {
  bool namespaces = true;
  const auto endedWell = [&namespaces](int status) {
    namespaces = !::testing::ExitedWithCode(kNoNamespaces)(status);
    return !namespaces || ::testing::ExitedWithCode(0)(status);
  };
  EXPECT_EXIT(logOneLineToJournal(), endedWell,
              MatchesRegex("none\n|[^\n]*File.cc:1:[^\n]*no journal\n"));
  if (!namespaces) GTEST_SKIP() << "no mount namespaces here";
}

/// A service manager: the socket to which the process reports.
class ServiceManagerTest : public ::testing::Test {
 protected:
  ServiceManagerTest() { ::setenv("NOTIFY_SOCKET", path_.c_str(), 1); }
  ~ServiceManagerTest() override {
    ::unsetenv("NOTIFY_SOCKET");
    ::close(socket_);
  }

  /// The next report; empty when none comes within the time.
  [[nodiscard]] std::string heard(milliseconds within) const {
    pollfd readable{socket_, POLLIN, 0};
    if (::poll(&readable, 1, static_cast<int>(within.count())) != 1) return {};
    char text[64];
    const ssize_t length = ::recv(socket_, text, sizeof text, 0);
    return {text, static_cast<std::size_t>(length)};
  }

 private:
  const TemporaryDirectory directory_;
  const std::string path_ = directory_.path() / "notify";
  const int socket_ = BoundSocket(path_, SOCK_DGRAM);
};

TEST_F(ServiceManagerTest, PingNeedsTheWorkOfClientsToMove) {
  const auto clients = CreateSerialQueue("test.clients", QualityOfService::userInteractive);
  ServiceManager manager;
  for (const bool lendsItsPlace : {false, true}) {
    Gate begun, release;
    clients->async([&] {
      std::unique_ptr<BlockingScope> blocking;
      if (lendsItsPlace) blocking = std::make_unique<BlockingScope>();
      begun.arrive();
      release.wait();
    });
    begun.wait();
    for (int i = 0; i < 3; ++i) manager.ping();
    if (!lendsItsPlace) {
      EXPECT_EQ(heard(milliseconds(200)), "") << "the work of clients hangs";
      release.arrive();
    }
    EXPECT_EQ(heard(seconds(30)), "WATCHDOG=1");
    EXPECT_TRUE(lendsItsPlace || heard(milliseconds(0)).empty()) << "pings that wait are one";
    release.arrive();
    (void)testing::FolderQueues().drain(std::chrono::steady_clock::now() + seconds(30));
  }
}

TEST_F(ServiceManagerTest, PingsTwiceInTheTimeThatTheManagerWaitsOrNever) {
  for (const char* wrong : {"", "soon", "-5"}) {
    ::setenv("WATCHDOG_USEC", wrong, 1);
    EXPECT_EQ(ServiceManager::pingInterval(), seconds(0)) << wrong;
  }
  ::setenv("WATCHDOG_USEC", "600000000", 1);
  EXPECT_EQ(ServiceManager::pingInterval(), std::chrono::minutes(5));
  ::setenv("WATCHDOG_PID", "1", 1);
  EXPECT_EQ(ServiceManager::pingInterval(), seconds(0)) << "another process is meant";
  ::unsetenv("WATCHDOG_USEC");
  ::unsetenv("WATCHDOG_PID");
}

}  // namespace
}  // namespace quarvel
