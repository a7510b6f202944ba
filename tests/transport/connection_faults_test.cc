#include <fmt/format.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <cstdio>
#include <map>
#include <set>
#include <thread>

#include "tests/transport/ConnectionFixture.h"
#include "tests/transport/SocketCalls.h"

// Every system call of the listener and its connections fails, once or for ever: the service
// reports why it cannot start, or it goes on and serves a good client as soon as the fault is over.

namespace quarvel {
namespace {

using testing::SocketCalls;

struct Site {
  const char* function;
  std::vector<int> errors;
  std::size_t from = 0;  // the first call that may fail
};

// With the errors that the manual page lists for a correct call; EIO where it lists none.
const std::vector<Site> kSites = {
    {"socket", {EMFILE, ENFILE, ENOMEM}},
    {"bind", {ENOSPC, EACCES, EIO}},
    {"listen", {EIO}},
    {"accept4", {EINTR, ECONNABORTED, EMFILE, ENFILE, ENOMEM, EPROTO, EIO}},
    {"connect", {EIO, EINTR}},
    {"recv", {EINTR, EAGAIN, ECONNRESET, ENOMEM, EIO}},
    {"send", {EINTR, EAGAIN, ECONNRESET, ENOBUFS, ENOMEM, EIO, 0}},
    {"shutdown", {ENOTCONN}},
    {"getsockopt", {EIO}},
    {"epoll_create1", {EMFILE, ENFILE, ENOMEM}},
    // Asio ignores the result of watching its own two descriptors.
    {"epoll_ctl", {ENOSPC, ENOMEM}, 2},
    {"epoll_wait", {EINTR}},
    {"eventfd", {EMFILE, ENFILE, ENOMEM}},
    {"timerfd_create", {EMFILE, ENFILE, ENOMEM}},
    {"timerfd_settime", {}},  // a correct call does not fail
    {"write", {}},            // to a new event counter; a correct call does not fail
    {"mkdir", {ENOSPC, EIO}},
    {"open", {EMFILE, ENFILE, EIO}},
    {"flock", {EINTR, EIO}},
    {"fchmod", {EIO}},
    {"chmod", {EIO}},
    {"lstat", {EIO}},
    {"unlink", {EIO}},
};

/// Whether the error means "try again", so that a caller may retry for ever.
bool IsPassing(int error) {
  return error == EINTR || error == EAGAIN || error == ECONNABORTED || error == EPROTO;
}

/// Three clients while system calls fail; any of them may be refused.
void BeClients(const std::filesystem::path& path) {
  Client first(path);
  Client second(path);
  for (std::uint32_t number = 0; number < 3; ++number) {
    if (!first.call(number, "echo:reply:", {number})) break;
    if (first.responseWithin(std::chrono::milliseconds(100)).empty()) break;
  }
  second.send("\x94");  // never completed
  (void)second.responseWithin(std::chrono::milliseconds(100));
  Client(path).send("\xc1");
  first.stopSending();
  (void)first.responseWithin(std::chrono::milliseconds(100));
}

/// One life of a service, from start to end, with at most one fault.
class Life {
 public:
  explicit Life(const std::optional<SocketCalls::Fault>& fault) {
    SocketCalls::instance().begin(fault);
    Configuration::Limits limits;
    limits.frame = std::chrono::milliseconds(10);
    Service service(limits, true, [](const Service::Work& work) {
      const SocketCalls::Watched watched;
      work();
    });
    if (service.failure) {
      refused_ = true;
      if (service.failure->userInfo.find("reason") == nullptr) finding_ = "no reason is given";
      return;
    }
    const Client bystander = service.connect();
    BeClients(service.socketPath());
    countsWhileFailing_ = SocketCalls::instance().counts();
    if (fault && fault->forever) {
      expectNoBusyLoop();
      SocketCalls::instance().lift();
    }
    // A single fault may hit the first one.
    if (!service.connect().isServed() && !service.connect().isServed()) {
      finding_ = "a good client is not served";
    }
  }

  /// The rule that was broken; empty when none was.
  [[nodiscard]] const std::string& finding() const { return finding_; }
  [[nodiscard]] bool refused() const { return refused_; }
  /// Calls of `function` before the fault was lifted: only these can fail for ever.
  [[nodiscard]] std::size_t callsWhileFailing(const std::string& function) const {
    return countsWhileFailing_.contains(function) ? countsWhileFailing_.at(function) : 0;
  }

 private:
  /// A call that fails for ever is not repeated without pause.
  void expectNoBusyLoop() {
    const auto callsMade = [] {
      std::this_thread::sleep_for(std::chrono::milliseconds(20));
      std::size_t sum = 0;
      for (const auto& [function, count] : SocketCalls::instance().counts()) sum += count;
      return sum;
    };
    const std::size_t before = callsMade();
    const std::size_t after = callsMade();
    if (after > before + 100) finding_ = fmt::format("{} calls in 20 ms", after - before);
  }

  std::map<std::string, std::size_t> countsWhileFailing_;
  std::string finding_;
  bool refused_ = false;
};

TEST(ConnectionFaults, EveryCallMayFail) {
  const Life faultless(std::nullopt);
  ASSERT_EQ(faultless.finding(), "");
  const auto counts = SocketCalls::instance().counts();
  std::set<std::string> known;
  for (const Site& site : kSites) known.insert(site.function);
  for (const auto& [function, count] : counts) {
    EXPECT_TRUE(known.contains(function)) << function << " is called and never fails here";
  }
  std::size_t points = 0;
  std::size_t missed = 0;
  std::size_t refusals = 0;
  for (const Site& site : kSites) {
    const auto found = counts.find(site.function);
    EXPECT_NE(found, counts.end()) << site.function << " is never called";
    if (found == counts.end()) continue;
    for (std::size_t at = site.from; at < found->second; ++at) {
      for (const int error : site.errors) {
        for (const bool forever : {false, true}) {
          if (forever && (IsPassing(error) || at >= faultless.callsWhileFailing(site.function))) {
            continue;
          }
          bool reached = false;
          // The calls at the end depend on which thread is faster.
          for (int attempt = 0; attempt < 5 && !reached; ++attempt) {
            SCOPED_TRACE(fmt::format("{} {} fails with {}{}", site.function, at, error,
                                     forever ? " for ever" : ""));
            const Life life(SocketCalls::Fault{site.function, at, error, forever});
            EXPECT_EQ(life.finding(), "");
            reached = SocketCalls::instance().failed() > 0;
            refusals += life.refused() ? 1U : 0U;
          }
          ++(reached ? points : missed);
        }
      }
    }
  }
  std::printf(
      "harness: socket faults: %zu of %zu points reached, %zu of them an error at the start\n",
      points, points + missed, refusals);
  EXPECT_LT(missed * 10, points);
}

}  // namespace
}  // namespace quarvel
