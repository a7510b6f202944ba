#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/wait.h>

#include <asio.hpp>
#include <filesystem>
#include <thread>

#include "tests/client/ClientTesting.h"

// A client without a thread: the program's own loop drives it.

namespace quarvel {
namespace {

using test::DrivenClient;
using test::Expected;
using test::IsCode;
using test::Text;
using vocabulary::Kind;
using namespace std::chrono_literals;

const auto kGeneric = Client::MessageType::generic;

void Poll(Client& client, const bool& done) {
  while (!done) {
    pollfd due{client.descriptor(), POLLIN, 0};
    ASSERT_EQ(::poll(&due, 1, 60'000), 1);
    client.dispatch();
  }
}

void Asio(Client& client, const bool& done) {
  asio::io_context context;
  asio::posix::stream_descriptor due(context, client.descriptor());
  const std::function<void()> watch = [&] {
    due.async_wait(asio::posix::stream_descriptor::wait_read, [&](const asio::error_code&) {
      client.dispatch();
      if (!done) watch();
    });
  };
  watch();
  context.run();
  due.release();  // the descriptor is the client's
}

// More than the socket takes at once, so that the loop must write what the calls could not.
TEST_F(DrivenClient, EveryLoopCarriesCallsOutAndGivesReplies) {
  constexpr int kCalls = 500;
  const auto threads = [] {
    const std::filesystem::directory_iterator tasks("/proc/self/task");
    return std::distance(begin(tasks), end(tasks));
  };
  for (const auto run : {Poll, Asio}) {
    Client& client = connect();
    const std::jthread service([this] {
      for (int i = 0; i < kCalls; ++i) service_.reply(*service_.receive(), true);
    });
    const auto before = threads();
    const Dictionary large{{"Samples", std::string(4'096, 'x')}};
    int replies = 0;
    bool done = false;
    for (int i = 0; i < kCalls; ++i) {
      const auto taken = client.setConfiguration(large, i, [&](const Result<bool>& reply) {
        EXPECT_TRUE(reply.ok()) << Text(reply);
        done = ++replies == kCalls;
      });
      ASSERT_EQ(taken, Client::Code::none);
    }
    EXPECT_EQ(threads(), before) << "none of the library's own";
    run(client, done);
    EXPECT_EQ(replies, kCalls);
    client_.reset();
    service_.hangUp();
  }
}

TEST_F(DrivenClient, NothingIsDueWhileNothingHappens) {
  Client& client = connect();
  client.createReportingSession(7);
  ASSERT_TRUE(service_.receive());
  client.dispatch();
  pollfd due{client.descriptor(), POLLIN, 0};
  EXPECT_EQ(::poll(&due, 1, 0), 0);
  service_.hangUp();
  ASSERT_EQ(::poll(&due, 1, 60'000), 1);
  EXPECT_EQ(client.dispatch(), Client::Code::connectionLost);
  EXPECT_EQ(::poll(&due, 1, 0), 0) << "a lost connection is told of once";
}

TEST_F(DrivenClient, NeverWaitsAndRefusesWhatIsTooMuch) {
  options_.gatheredBytes = 100'000;
  Client& client = connect();
  const Dictionary large{{"Samples", std::string(4'096, 'x')}};
  int taken = 0;
  while (client.sendMessage(large, Kind::volume, kGeneric, 7) == Client::Code::none) ++taken;
  Expected<bool> refused;
  EXPECT_EQ(client.stopReportingSessionForID(7, refused.reply()), Client::Code::heldBack);
  EXPECT_FALSE(refused.given()) << "replies are given by the driver alone";
  client.dispatch();
  EXPECT_TRUE(IsCode(refused.get().error(), Client::Code::heldBack));

  std::jthread service([&] {
    for (int i = 0; i < taken; ++i) EXPECT_TRUE(service_.receive());
    service_.reply(*service_.receive(), true);
  });
  Expected<bool> stopped;
  while (client.stopReportingSessionForID(7, stopped.reply()) != Client::Code::none) {
    stopped = {};
    client.dispatch(std::nullopt);
  }
  while (!stopped.given()) client.dispatch(std::nullopt);
  EXPECT_TRUE(stopped.get().value());
}

TEST_F(DrivenClient, AReplyMayNotDriveItButMayEndIt) {
  connect();
  Expected<bool> ended;
  client_->createReportingSession(7, [&, reply = ended.reply()](const Result<bool>& result) {
    EXPECT_EQ(client_->dispatch(), Client::Code::wouldDeadlock);
    EXPECT_TRUE(IsCode(client_->sync().getAllReporters().error(), Client::Code::wouldDeadlock));
    client_->createReportingSession(8);
    client_.reset();
    reply(result);
  });
  service_.reply(*service_.receive(), true);
  Client& client = *client_;
  while (!ended.given()) client.dispatch(std::nullopt);
  EXPECT_TRUE(ended.get().value());
  EXPECT_TRUE(service_.receive()) << "what had gathered";
  EXPECT_FALSE(service_.receive());
}

TEST_F(DrivenClient, AForkedChildLeavesTheConnectionToItsParent) {
  for (const auto driver : {Client::Driver::caller, Client::Driver::ownThread}) {
    options_.driver = driver;
    Client& client = connect();
    Expected<bool> created;
    client.createReportingSession(7, created.reply());
    const pid_t child = ::fork();
    if (child == 0) {
      client_.reset();
      ::_exit(0);
    }
    int status = -1;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
    service_.reply(*service_.receive(), true);
    while (!created.given()) client.dispatch(std::nullopt);
    EXPECT_TRUE(created.get().value());
    client_.reset();
    EXPECT_FALSE(service_.receive());
    service_.hangUp();
  }
}

}  // namespace
}  // namespace quarvel
