#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <memory>
#include <string>
#include <utility>

#include <quarvel/client.hpp>

#include "tests/client/FakeService.h"

namespace quarvel::test {

template <class T>
std::string Text(const Result<T>& result) {
  return result ? "ok" : result.error().description();
}

inline bool IsCode(const Error& error, Client::Code code) {
  return error.domain == Client::kErrorDomain && error.code == static_cast<std::int64_t>(code);
}

/// A reply that a test can wait for.
template <class T>
class Expected {
 public:
  Client::Reply<T> reply() {
    return [promise = promise_](Result<T> result) { promise->set_value(std::move(result)); };
  }
  Result<T> get() { return future_.get(); }
  bool given() { return future_.wait_for(std::chrono::seconds(0)) == std::future_status::ready; }

 private:
  std::shared_ptr<std::promise<Result<T>>> promise_ = std::make_shared<std::promise<Result<T>>>();
  std::future<Result<T>> future_ = promise_->get_future();
};

/// A client that the test itself drives, unless the options are made to say otherwise, and its
/// service.
class DrivenClient : public ::testing::Test {
 protected:
  DrivenClient() {
    options_.socketPath = service_.path();
    options_.driver = Client::Driver::caller;
  }
  Client& connect() {
    auto connected = Client::connect(options_);
    EXPECT_TRUE(connected.ok()) << Text(connected);
    client_ = std::make_unique<Client>(std::move(connected.value()));
    service_.accept();
    return *client_;
  }
  template <class Done>
  void driveUntil(Done done) {
    while (!done()) client_->dispatch(std::nullopt);
  }

  FakeService service_;
  Client::Options options_;
  std::unique_ptr<Client> client_;
};

}  // namespace quarvel::test
