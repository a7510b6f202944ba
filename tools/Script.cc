#include "tools/Player.h"

#include <fmt/format.h>

#include <algorithm>
#include <array>
#include <cmath>
#include <utility>

#include "base/Base64.h"
#include "base/Json.h"

namespace quarvel::script {
namespace {

constexpr std::string_view kStart = "startReportingSessionForID:reply:";

Error Wrong(std::string reason) {
  return Error::because("quarvel.script", 1, std::move(reason));
}

// The value that JSON stands for: dates and bytes are written as dictionaries of one marked key.
Result<Value> Sent(const Value& written) {
  if (const List* list = written.list()) {
    List sent;
    for (const Value& item : *list) {
      auto value = Sent(item);
      if (!value) return value;
      sent.push_back(std::move(value.value()));
    }
    return Value(std::move(sent));
  }
  const Dictionary* dictionary = written.dictionary();
  if (dictionary == nullptr) return written;
  if (const Value* date = dictionary->find("$date"); date != nullptr && dictionary->size() == 1) {
    const auto read = date->string() ? DateFromText(*date->string()) : std::nullopt;
    if (!read) return Wrong(R"("$date" takes a text such as "2026-01-31T14:25:01.5Z".)");
    return Value(*read);
  }
  if (const Value* bytes = dictionary->find("$bytes");
      bytes != nullptr && dictionary->size() == 1) {
    const auto read = bytes->string() ? FromBase64(*bytes->string()) : std::nullopt;
    if (!read) return Wrong("\"$bytes\" takes base64 text with its padding.");
    return Value(Bytes{*read});
  }
  Dictionary sent;
  for (const auto& [key, item] : *dictionary) {
    auto value = Sent(item);
    if (!value) return value;
    sent.set(key, std::move(value.value()));
  }
  return Value(std::move(sent));
}

std::optional<Error> WrongKey(const Dictionary& line, std::initializer_list<Key> allowed) {
  for (const auto& [key, value] : line) {
    if (std::find(allowed.begin(), allowed.end(), key) == allowed.end()) {
      return Wrong(fmt::format("\"{}\" does not belong here.", *key.string()));
    }
  }
  return std::nullopt;
}

Result<Action> ParseCall(const Dictionary& line, const Value& name) {
  if (auto wrong = WrongKey(line, {"call", "args", "wait"})) return *wrong;
  if (name.string() == nullptr) return Wrong("\"call\" takes an operation's full keyword name.");
  const Value* arguments = line.find("args");
  if (arguments != nullptr && arguments->list() == nullptr) {
    return Wrong("\"args\" takes a list, the operation's arguments in order without the reply.");
  }
  const Value* wait = line.find("wait");
  if (wait != nullptr && wait->boolean() == nullptr) return Wrong("\"wait\" is true or false.");

  Call call;
  call.operation = *name.string();
  if (arguments != nullptr) call.arguments = *arguments->list();
  auto values = Sent(Value(call.arguments));
  if (!values) return std::move(values.error());
  call.values = *values.value().list();
  // A start is answered only when its session stops.
  call.wait = wait != nullptr ? *wait->boolean() : call.operation != kStart;
  return {std::move(call)};
}

}  // namespace

bool IsSkipped(std::string_view line) {
  const std::size_t first = line.find_first_not_of(" \t\r");
  return first == std::string_view::npos || line[first] == '#';
}

Result<Action> Parse(std::string_view line) {
  auto json = ValueFromJson(line);
  if (!json) return std::move(json.error());
  const Dictionary* object = json.value().dictionary();
  const Value* call = object ? object->find("call") : nullptr;
  const Value* sleep = object ? object->find("sleep") : nullptr;
  const Value* expect = object ? object->find("expect") : nullptr;
  if (call != nullptr) return ParseCall(*object, *call);
  if (sleep != nullptr) {
    if (auto wrong = WrongKey(*object, {"sleep"})) return *wrong;
    const double seconds = sleep->real()      ? *sleep->real()
                           : sleep->integer() ? static_cast<double>(*sleep->integer())
                                              : -1.0;
    if (!(seconds >= 0 && seconds <= 86'400)) {
      return Wrong("\"sleep\" takes a number of seconds, a day's at most.");
    }
    return {Sleep{std::chrono::duration<double>(seconds)}};
  }
  if (expect != nullptr) {
    if (auto wrong = WrongKey(*object, {"expect"})) return *wrong;
    return {Expect{*expect}};
  }
  return Wrong(
      "A line is {\"call\": \"…\", \"args\": […]}, {\"sleep\": seconds} or {\"expect\": value}.");
}

}  // namespace quarvel::script
