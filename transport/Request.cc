#include "transport/Request.h"

#include <fmt/format.h>

#include <algorithm>
#include <string>
#include <utility>

namespace quarvel {

namespace {

constexpr const char* kErrorDomain = "quarvel.connection";
constexpr std::int64_t kUnknownMethod = 1;
constexpr std::int64_t kBadArguments = 2;

/// A client's method name for a reply and the log: plain ASCII, 80 characters at most.
std::string Printable(std::string_view text) {
  constexpr std::size_t kShown = 80;
  std::string shown(text.substr(0, kShown));
  std::ranges::replace_if(
      shown, [](char c) { return c < ' ' || c > '~'; }, '?');
  if (text.size() > kShown) shown += "...";
  return shown;
}

}  // namespace

std::optional<Request> Request::from(PayloadValue frame, std::string_view& fault) {
  const std::size_t count = frame.count();
  if (frame.kind() != PayloadValue::Kind::list || count < 3 || count > 4) {
    fault = "a message is neither [0, id, method, params] nor [2, method, params]";
    return std::nullopt;
  }
  auto item = frame.items().begin();
  const auto type = (*item).unsignedInteger();
  if (type != (count == 4 ? 0U : 2U)) {
    fault = "a message's type is not 0, a request of four items, or 2, a notification of three";
    return std::nullopt;
  }
  std::optional<std::uint32_t> messageID;
  if (count == 4) {
    const auto number = (*++item).unsignedInteger();
    if (!number || !std::in_range<std::uint32_t>(*number)) {
      fault = "a request's id is not an unsigned 32-bit integer";
      return std::nullopt;
    }
    messageID = static_cast<std::uint32_t>(*number);
  }
  const auto method = (*++item).string();
  if (!method) {
    fault = "a message's method is not a string";
    return std::nullopt;
  }
  const PayloadValue params = *++item;
  if (params.kind() != PayloadValue::Kind::list) {
    fault = "a message's params are not a list";
    return std::nullopt;
  }
  return Request{messageID, *method, params};
}

Error UnknownMethodError(const ExportedInterface* interface, std::string_view method) {
  // A faulty client repeats its call, so this must not cost more than a good call.
  std::string known;
  known.reserve(1024);
  if (interface != nullptr) {
    for (const ExportedMethod& operation : interface->methods) {
      if (!known.empty()) known += ", ";
      known += operation.name;
    }
  }
  return Error::because(kErrorDomain, kUnknownMethod,
                        fmt::format("There is no operation \"{}\"; there are: {}.",
                                    Printable(method), known.empty() ? "none" : known));
}

Error BadArgumentsError(std::string reason) {
  return Error::because(kErrorDomain, kBadArguments, std::move(reason));
}

}  // namespace quarvel
