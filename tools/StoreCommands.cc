#include <fmt/format.h>

#include <cstdio>
#include <ctime>

#include <quarvel/vocabulary.hpp>

#include "base/Json.h"
#include "tools/Commands.h"
#include "tools/Store.h"
#include "tools/Table.h"

namespace quarvel::commands {
namespace {

using vocabulary::Category;
using vocabulary::MessageType;
using vocabulary::NameOf;

// Rows are printed in portions of this many, so that a store of any size is read in little memory.
constexpr std::size_t kPortion = 1'000;

// For people: local time; no year, since nothing is kept that long.
std::string LocalTime(Date date) {
  const auto seconds = std::chrono::floor<std::chrono::seconds>(date);
  const std::time_t time = std::chrono::system_clock::to_time_t(seconds);
  std::tm local{};
  ::localtime_r(&time, &local);
  char text[32];
  std::strftime(text, sizeof text, "%m-%d %H:%M:%S", &local);
  const auto milliseconds = std::chrono::floor<std::chrono::milliseconds>(date - seconds).count();
  return fmt::format("{}.{:03}", text, milliseconds);
}

// For people, who see from the session's column what is in one.
std::string Service(std::string_view name) {
  constexpr std::string_view kSuffix = "_session";
  if (name.ends_with(kSuffix)) name.remove_suffix(kSuffix.size());
  return std::string(name);
}

std::string Application(const std::string& userInfo) {
  const auto info = ValueFromJson(userInfo);
  const Dictionary* entries = info ? info.value().dictionary() : nullptr;
  const Value* application = entries ? entries->find("HostApplicationDisplayID") : nullptr;
  return application && application->string() ? *application->string() : "";
}

template <class T>
Value ValueOf(const std::optional<T>& stored) {
  if (!stored) return nullptr;
  return *stored;
}

// One line: `columns`, and under `key` what is JSON already.
void PrintJson(const Dictionary& columns, std::string_view key, const std::string& json) {
  std::string line = JsonText(columns);
  line.pop_back();
  fmt::print("{},\"{}\":{}}}\n", line, key, json.empty() ? "null" : json);
}

void PrintJson(const StoredSession& session) {
  PrintJson({{"id", session.id},
             {"session", session.reporterID},
             {"service", session.serviceName},
             {"openedAt", session.openedAt},
             {"flushedAt", ValueOf(session.flushedAt)},
             {"messages", session.messages}},
            "userInfo", session.userInfo);
}

void PrintJson(const StoredMessage& message) {
  PrintJson({{"id", message.id},
             {"agentSession", ValueOf(message.agentSession)},
             {"session", message.reporterID},
             {"service", message.serviceName},
             {"category", message.category},
             {"categoryName", NameOf(Category(message.category))},
             {"type", message.type},
             {"typeName", NameOf(static_cast<MessageType>(message.type))},
             {"sentAt", message.sentAt}},
            "payload", message.payload);
}

std::vector<std::string> Row(const StoredSession& session) {
  std::string duration = "not ended";
  if (session.flushedAt) {
    const std::chrono::duration<double> seconds = *session.flushedAt - session.openedAt;
    duration = fmt::format("{:.3f} s", seconds.count());
  }
  return {fmt::format("{}", session.reporterID), Service(session.serviceName),
          LocalTime(session.openedAt),           duration,
          fmt::format("{}", session.messages),   Application(session.userInfo)};
}

std::vector<std::string> Row(const StoredMessage& message) {
  return {LocalTime(message.sentAt),
          message.agentSession ? fmt::format("{}", message.reporterID) : "single",
          Service(message.serviceName),
          NameOf(Category(message.category)),
          std::string(NameOf(static_cast<MessageType>(message.type))),
          message.payload};
}

std::string PathOf(const Options& options) {
  return options.store.empty() ? StoreReader::defaultPath() : options.store;
}

}  // namespace

Outcome Sessions(const Options& options) {
  auto store = StoreReader::open(PathOf(options));
  if (!store) return std::move(store.error());
  Table table({{"SESSION", true},
               {"SERVICE"},
               {"OPENED"},
               {"DURATION", true},
               {"MESSAGES", true},
               {"APPLICATION"}},
              Terminal::standardOutput());
  auto read = store.value().sessions([&](const StoredSession& session) {
    if (options.json) {
      PrintJson(session);
    } else {
      table.add(Row(session));
    }
  });
  if (!options.json) table.print();
  return read;
}

Outcome Messages(const Options& options, const MessageOptions& which) {
  const std::string path = PathOf(options);
  auto store = StoreReader::open(path);
  if (!store) return std::move(store.error());
  Table table({{"SENT"}, {"SESSION", true}, {"SERVICE"}, {"CATEGORY"}, {"TYPE"}, {"PAYLOAD"}},
              Terminal::standardOutput());
  StoreReader::MessageQuery query{0, which.session, which.last};
  const auto print = [&] {
    std::size_t rows = 0;
    auto read = store.value().messages(query, [&](const StoredMessage& message) {
      query.afterID = message.id;
      if (options.json) return PrintJson(message);
      table.add(Row(message));
      if (++rows % kPortion == 0) table.print();
    });
    if (!options.json) table.print();
    std::fflush(stdout);
    return read;
  };
  if (!which.follow) return print();

  StoreWatch watch(path);
  for (;;) {
    if (auto read = print(); !read) return read;
    query.last.reset();
    watch.wait();
  }
}

}  // namespace quarvel::commands
