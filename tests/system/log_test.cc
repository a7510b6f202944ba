#include "platform/Log.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <latch>
#include <string>
#include <thread>
#include <vector>

#include "platform/Process.h"
#include "platform/WorkQueue.h"
#include "system/LogControl.h"
#include "system/LogLine.h"
#include "system/LogWriter.h"
#include "system/ProcessExit.h"
#include "tests/UnixSocket.h"

namespace quarvel {
namespace {

using namespace std::chrono_literals;
using testing::HasSubstr;
using testing::MatchesRegex;

constexpr const char* kFunction = "-[Class op:]";

LogHandle registered(const char (&code)[5]) {
  return ZQLogRegister(FourCharacterCode(code), code, "tarnwick.quarvel", "reporting_verbose", 0,
                       31);
}

TEST(LogLineTest, ReadsAsAgreed) {
  const struct {
    const char* zone;
    LogLevel level;
    const char* message;
    const char* begins;
    const char* ends;
  } cases[] = {
      {"CET-1", LogLevel::standard, "message", "14:25:01.123456+01:00 default", "message\n"},
      {"NST3:30", LogLevel::error, "two\nlines\n", "09:55:01.123456-03:30 error",
       "two\\nlines\\n\n"},
      {"UTC", LogLevel::info, "", "13:25:01.123456+00:00 info", "\n"},
      {"UTC", LogLevel::debug, "{}", "13:25:01.123456+00:00 debug", "{}\n"},
  };
  const Date date = DateFromText("2026-01-31T13:25:01.123456Z").value();
  for (const auto& each : cases) {
    setenv("TZ", each.zone, 1);
    // Local time is kept a thread.
    std::thread([&] {
      fmt::memory_buffer buffer;
      const LogLine line = FormatLogLine(buffer, date, each.level, "tarnwick.quarvel[zqrs]",
                                         "File.cc", 88, kFunction, each.message);
      EXPECT_EQ(line.text,
                fmt::format("2026-01-31T{} tarnwick.quarvel[zqrs] File.cc:88:-[Class op:]: {}",
                            each.begins, each.ends));
      EXPECT_THAT(line.message(), testing::StartsWith("File.cc:88:-[Class op:]: "));
      EXPECT_THAT(line.message(), testing::Not(HasSubstr("\n")));
    }).join();
  }
  unsetenv("TZ");
}

TEST(LogScopeTest, LevelsAndVerboseSwitchDecideWhatIsWritten) {
  const LogHandle scope = registered("levl");
  const auto enabled = [scope](LogLevel least) {
    SetLogLevel(least);
    std::string letters;
    for (const LogHandle log : {LogHandle{}, scope}) {
      for (const auto& [level, letter] : {std::pair(LogLevel::error, 'e'),
                                          {LogLevel::standard, 'd'},
                                          {LogLevel::info, 'i'},
                                          {LogLevel::debug, 'v'}}) {
        if (ZQLogEnabled(level, log)) letters += letter;
      }
      letters += '|';
    }
    return letters;
  };
  EXPECT_EQ(enabled(LogLevel::error), "e|e|");
  EXPECT_EQ(enabled(LogLevel::standard), "ed|ed|");
  EXPECT_EQ(enabled(LogLevel::info), "edi|edi|");
  EXPECT_EQ(enabled(LogLevel::debug), "ediv|edi|");
  SetLogScopeVerbose(scope, true);
  EXPECT_EQ(enabled(LogLevel::error), "e|ev|");
  SetLogScopeVerbose(scope, false);
  EXPECT_EQ(enabled(LogLevel::standard), "ed|ed|");
}

/// Standard error as a pipe whose reader takes its time.
class PipedStandardError {
 public:
  PipedStandardError() : before_(dup(STDERR_FILENO)) {
    int ends[2];
    EXPECT_EQ(pipe2(ends, O_CLOEXEC), 0);
    dup2(ends[1], STDERR_FILENO);
    close(ends[1]);
    reading_ = fdopen(ends[0], "r");
  }
  PipedStandardError(const PipedStandardError&) = delete;
  PipedStandardError& operator=(const PipedStandardError&) = delete;
  ~PipedStandardError() {
    dup2(before_, STDERR_FILENO);
    close(before_);
    std::fclose(reading_);
  }

  std::string readLine() {
    char line[4096];
    return std::fgets(line, sizeof line, reading_) == nullptr ? "" : line;
  }

 private:
  int before_;
  FILE* reading_ = nullptr;
};

TEST(LogTest, FullQueueHoldsItsCallersBackAndNobodyElseAndLosesNothing) {
  constexpr int kQueues = 4;
  constexpr int kLines = 1000;
  const std::string filler(1000, '.');
  std::atomic<int> logged{0};
  std::vector<std::unique_ptr<WorkQueue>> queues;
  PipedStandardError standardError;
  for (int queue = 0; queue < kQueues; ++queue) {
    queues.push_back(CreateSerialQueue("log.test", QualityOfService::utility));
    queues.back()->async([&, queue] {
      for (int i = 0; i < kLines; ++i) {
        ZQLogWrite(nullptr, LogLevel::standard, "File.cc", 1, kFunction,
                   fmt::format("{} {} {}", queue, i, filler));
        ++logged;
      }
    });
  }
  // Nobody reads, so a quarter of the lines at most can be on their way.
  while (logged < kLines / 2) std::this_thread::yield();
  const auto other = CreateSerialQueue("log.test", QualityOfService::utility);
  std::latch others(1);
  other->async([&others] { others.count_down(); });
  others.wait();
  EXPECT_LT(logged, kQueues * kLines);

  std::vector<int> next(kQueues, 0);
  for (int line = 0; line < kQueues * kLines; ++line) {
    const std::string text = standardError.readLine();
    int queue = 0;
    int i = -1;
    if (std::sscanf(text.c_str(), "%*s default [default] File.cc:1:-[Class op:]: %d %d", &queue,
                    &i) != 2 ||
        i != next[static_cast<std::size_t>(queue)]++) {
      ADD_FAILURE() << text;
    }
  }
  EXPECT_TRUE(LogWriter::instance().flush());
}

// Each in a process of its own, whose standard error is what is looked at.
class LogDeathTest : public testing::Test {
 protected:
  void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST_F(LogDeathTest, LinesLeaveBeforeTheProcessHoweverItEnds) {
  const auto logMany = [] {
    ZQ_FUNCTION("+[Class all]");
    const LogHandle scope = registered("zqrs");
    for (int i = 0; i < 5000; ++i) ZQ_LOG(scope, standard, "line {}", i);
    ZQ_LOG(scope, debug, "not asked for");
  };
  const auto everyLine = testing::AllOf(
      testing::ContainsRegex("\n[0-9T:.+-]* default tarnwick.quarvel.zqrs. "
                             "log_test.cc:[0-9]*:.{1,2}Class all.: line 4999\n"),
      testing::ResultOf([](const std::string& text) { return std::ranges::count(text, '\n'); },
                        testing::Ge(5000)),
      testing::Not(HasSubstr("not asked for")));
  const struct {
    void (*end)();
    int status;
  } endings[] = {{[] { std::exit(3); }, 3}, {[] { ExitProcess(2); }, 2}};
  for (const auto& [end, status] : endings) {
    EXPECT_EXIT((logMany(), end()), testing::ExitedWithCode(status), everyLine);
  }
  EXPECT_EXIT(
      {
        std::atexit([] {
          ZQ_FUNCTION("late");
          ZQ_LOG(nullptr, error, "after the flush");
        });
        logMany();
        std::exit(0);
      },
      testing::ExitedWithCode(0), testing::AllOf(everyLine, HasSubstr("after the flush")));
}

TEST_F(LogDeathTest, ExitWorkRunsOnceLastFirstAndMayLog) {
  EXPECT_EXIT(
      {
        ZQ_FUNCTION("exit");
        AtProcessExit([] {
          ZQ_LOG(nullptr, error, "first registered");
          ExitProcess(9);
        });
        AtProcessExit([] { ZQ_LOG(nullptr, error, "last registered"); });
        std::thread other;
        AtProcessExit([&other] {
          other = std::thread([] { ExitProcess(8); });
          ZQ_LOG(nullptr, error, "while another thread ends the process too");
        });
        ExitProcess(7);
      },
      testing::ExitedWithCode(9),
      MatchesRegex("[^\n]*another thread[^\n]*\n[^\n]*last registered\n[^\n]*first registered\n"));
}

TEST_F(LogDeathTest, StandardErrorThatNobodyReadsDoesNotKeepTheProcess) {
  EXPECT_EXIT(
      {
        PipedStandardError standardError;
        ZQ_FUNCTION("exit");
        for (int i = 0; i < 100; ++i) ZQ_LOG(nullptr, error, "{}", std::string(2000, '.'));
        ExitProcess(0);
      },
      testing::ExitedWithCode(0), "");
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
  if (journal < 0) std::_Exit(kNoNamespaces);
  struct stat own {};
  fstat(STDERR_FILENO, &own);
  setenv("JOURNAL_STREAM", fmt::format("{}:{}", own.st_dev, own.st_ino).c_str(), 1);
  ZQLogWrite(registered("zqrs"), LogLevel::info, "File.cc", 88, kFunction, "a\nb");
  std::string entry(65536, '\0');
  entry.resize(static_cast<std::size_t>(recv(journal, entry.data(), entry.size(), 0)));
  const std::string fields = '\n' + entry;
  for (const char* field :
       {"MESSAGE=File.cc:88:-[Class op:]: a\\nb", "PRIORITY=6", "CODE_FILE=File.cc", "CODE_LINE=88",
        "CODE_FUNC=-[Class op:]", "QUARVEL_SCOPE=tarnwick.quarvel[zqrs]"}) {
    if (fields.find(fmt::format("\n{}\n", field)) == std::string::npos) {
      fmt::print(stderr, "no {} in {}", field, fields);
      std::_Exit(1);
    }
  }
  // A journal that is gone loses nothing.
  close(journal);
  ZQLogWrite(nullptr, LogLevel::error, "File.cc", 89, kFunction, "nobody listens");
  std::exit(0);
}

TEST_F(LogDeathTest, JournalGetsTheFieldsWhenStandardErrorIsItsStream) {
  bool namespaces = true;
  const auto endedWell = [&namespaces](int status) {
    namespaces = !testing::ExitedWithCode(kNoNamespaces)(status);
    return !namespaces || testing::ExitedWithCode(0)(status);
  };
  EXPECT_EXIT(logOneLineToJournal(), endedWell, "");
  if (!namespaces) GTEST_SKIP() << "no mount namespaces here";
  EXPECT_EXIT(logOneLineToJournal(), testing::ExitedWithCode(0),
              MatchesRegex("[^\n]*File.cc:89:[^\n]*nobody listens\n"));
}

}  // namespace
}  // namespace quarvel
