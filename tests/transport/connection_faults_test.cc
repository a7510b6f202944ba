#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <future>
#include <set>

#include "tests/Interposer.h"
#include "tests/UnixSocket.h"
#include "tests/transport/ConnectionFixture.h"

// Every call that listening and serving make of the system fails, once and for ever: the service
// says why it cannot begin, or goes on, and serves a polite client as soon as the fault is over.

namespace quarvel {
namespace {

using testing::Interposer;

struct Site {
  const char* function;
  std::vector<int> errors;
  std::size_t from = 0;  // the first call that may fail
};

// Each with the errors that its manual page has for a call that is right, and EIO for those where
// anything else would be a surprise.
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
    // Asio watches its own two descriptors without looking whether it could.
    {"epoll_ctl", {ENOSPC, ENOMEM}, 2},
    {"epoll_wait", {EINTR}},
    {"eventfd", {EMFILE, ENFILE, ENOMEM}},
    {"timerfd_create", {EMFILE, ENFILE, ENOMEM}},
    {"timerfd_settime", {}},  // a right call does not fail
    {"write", {}},            // to a new event counter; a right call does not fail
    {"mkdir", {ENOSPC, EIO}},
    {"open", {EMFILE, ENFILE, EIO}},
    {"flock", {EINTR, EIO}},
    {"fchmod", {EIO}},
    {"chmod", {EIO}},
    {"lstat", {EIO}},
    {"unlink", {EIO}},
};

/// Whether nothing would ever be done if a call failed with it for ever.
bool IsPassing(int error) {
  return error == EINTR || error == EAGAIN || error == ECONNABORTED || error == EPROTO;
}

/// What clients do while something may fail; any of them may be turned away.
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

/// A listener from its beginning to its end, with one fault. Says what went wrong, if anything did.
class Life {
 public:
  explicit Life(std::optional<Interposer::Fault> fault) {
    Interposer& calls = Interposer::watch();
    if (fault) calls.inject(*fault);
    // A socket file that a killed service has left.
    const std::filesystem::path path = directory_.path() / "socket";
    ::close(BoundSocket(path, SOCK_STREAM));
    if (!listen(path)) return;
    auto served = std::async(std::launch::async, [this] {
      const Interposer::WatchedThread watched;
      listener_->resume();
    });
    const Client bystander(path);
    BeClients(path);
    countsWhileFailing_ = calls.calls();
    if (fault && fault->forever) {
      expectRest();
      calls.lift();
    }
    // What fails once may fail for the first of them.
    if (!Client(path).isServed() && !Client(path).isServed()) {
      finding_ = "a polite client is not served";
    }
    listener_->requestEnd();
    if (served.wait_for(kPatience) != std::future_status::ready) {
      std::fprintf(stderr, "%s %zu fails with %d: the service does not end\n",
                   fault ? fault->function.c_str() : "", fault ? fault->at : 0,
                   fault ? fault->error : 0);
      std::abort();
    }
  }

  [[nodiscard]] const std::string& finding() const { return finding_; }
  [[nodiscard]] bool refused() const { return refused_; }
  /// How many calls of a function something may fail for ever before.
  [[nodiscard]] std::size_t callsWhileFailing(const std::string& function) const {
    return countsWhileFailing_.contains(function) ? countsWhileFailing_.at(function) : 0;
  }

 private:
  bool listen(const std::filesystem::path& path) {
    const Interposer::WatchedThread watched;
    auto socket = ListeningSocket::listeningAt(path);
    if (!socket) return refuse(socket.error());
    SocketListener::Options options;
    options.limits.frame = std::chrono::milliseconds(10);
    auto listener = SocketListener::create(std::move(socket.value()), std::move(options));
    if (!listener) return refuse(listener.error());
    listener_ = std::move(listener.value());
    listener_->setDelegate(DelegateFor(served_));
    return true;
  }

  bool refuse(const Error& error) {
    refused_ = true;
    if (error.userInfo.find("reason") == nullptr)
      finding_ = "the service does not begin and does not say why";
    return false;
  }

  /// Whatever fails for ever, the service does not try again and again.
  void expectRest() {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    const auto made = [] {
      std::size_t sum = 0;
      for (const auto& [function, count] : Interposer::instance().calls()) sum += count;
      return sum;
    };
    const std::size_t before = made();
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    if (made() > before + 100) finding_ = fmt::format("{} calls in 20 ms", made() - before);
  }

  TemporaryDirectory directory_;
  Served served_;
  std::map<std::string, std::size_t> countsWhileFailing_;
  std::unique_ptr<SocketListener> listener_;
  std::string finding_;
  bool refused_ = false;
};

TEST(ConnectionFaults, EveryCallMayFail) {
  const Life faultless(std::nullopt);
  ASSERT_EQ(faultless.finding(), "");
  const auto counts = Interposer::instance().calls();
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
          // Which calls are made in the end is a matter of who is faster.
          for (int attempt = 0; attempt < 5 && !reached; ++attempt) {
            const Life life(Interposer::Fault{
                .at = at, .error = error, .forever = forever, .function = site.function});
            EXPECT_EQ(life.finding(), "") << site.function << " " << at << " fails with " << error
                                          << (forever ? " for ever" : "");
            reached = Interposer::instance().failedCalls() > 0;
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
