#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <utility>
#include <vector>

#include "base/Error.h"
#include "base/Value.h"

namespace quarvel {

/// Destination of the answer to one call. The connection facility delivers the first answer and
/// ignores later ones, as well as an answer to a client that has gone. A call need not be answered.
/// Shared by the copies of one `Reply`. From any thread; never blocks.
class ReplySink {
 public:
  virtual ~ReplySink() = default;
  /// The call succeeded; `value` may be nil.
  virtual void result(Value value) = 0;
  /// The call was refused.
  virtual void error(const Error& error) = 0;
};

/// A reply callback, passed by value through the queues. Copies share the one answer. An absent
/// reply (the default) may be called and does nothing.
template <class T>
class Reply {
 public:
  Reply() = default;
  explicit Reply(std::shared_ptr<ReplySink> sink) : sink_(std::move(sink)) {}

  /// Answers the call. From any thread; never blocks.
  void operator()(T answer) const {
    if (sink_) sink_->result(Value(std::move(answer)));
  }
  /// Whether there is a call to answer.
  explicit operator bool() const { return sink_ != nullptr; }

 private:
  std::shared_ptr<ReplySink> sink_;
};

/// Takes an error, or none for success.
template <>
class Reply<std::optional<Error>> {
 public:
  Reply() = default;
  explicit Reply(std::shared_ptr<ReplySink> sink) : sink_(std::move(sink)) {}

  void operator()(const std::optional<Error>& answer) const {
    if (!sink_) return;
    if (answer) {
      sink_->error(*answer);
    } else {
      sink_->result(nullptr);
    }
  }
  explicit operator bool() const { return sink_ != nullptr; }

 private:
  std::shared_ptr<ReplySink> sink_;
};

using BoolReply = Reply<bool>;
using ServiceTypeReply = Reply<std::uint16_t>;
using DictionaryReply = Reply<Dictionary>;
using ListReply = Reply<List>;
using ErrorReply = Reply<std::optional<Error>>;

}  // namespace quarvel
