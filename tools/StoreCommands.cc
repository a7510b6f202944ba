#include <fmt/format.h>

#include <cstdio>

#include <quarvel/vocabulary.hpp>

#include "base/Json.h"
#include "tools/Commands.h"
#include "tools/Format.h"
#include "tools/Store.h"
#include "tools/Table.h"

namespace quarvel::commands {
namespace {

using vocabulary::Category;
using vocabulary::MessageType;
using vocabulary::NameOf;

// Rows are printed in portions of this many, so that a store of any size is read in little memory.
constexpr std::size_t kPortion = 1'000;

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
             {"clientType", session.clientType},
             {"clientVersion", session.clientVersion},
             {"batchEvent", session.batchEvent},
             {"hierarchyToken", session.hierarchyToken},
             {"client", session.clientName},
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

void PrintJson(const StoredEvent& event) {
  Dictionary columns{{"id", event.id}, {"name", event.name}, {"recordedAt", event.recordedAt}};
  if (event.domain) columns.set("domain", *event.domain);
  PrintJson(columns, "payload", event.payload);
}

std::vector<std::string> Row(const StoredSession& session) {
  return {fmt::format("{}", session.reporterID), ShownService(session.serviceName),
          LocalTime(session.openedAt),           DurationOf(session),
          fmt::format("{}", session.messages),   ApplicationOf(session.userInfo)};
}

std::vector<std::string> Row(const StoredMessage& message) {
  return {LocalTime(message.sentAt),
          message.agentSession ? fmt::format("{}", message.reporterID) : "single",
          ShownService(message.serviceName),
          NameOf(Category(message.category)),
          std::string(NameOf(static_cast<MessageType>(message.type))),
          message.payload};
}

Table TableOf(StoreReader::Events kind) {
  std::vector<Table::Column> columns{{"RECORDED"}, {"NAME"}, {"PAYLOAD"}};
  if (kind == StoreReader::Events::power) columns.insert(columns.begin() + 1, {"DOMAIN", true});
  return {std::move(columns), Terminal::standardOutput()};
}

std::vector<std::string> Row(const StoredEvent& event) {
  std::vector<std::string> row{LocalTime(event.recordedAt), event.name, event.payload};
  if (event.domain) row.insert(row.begin() + 1, fmt::format("{}", *event.domain));
  return row;
}

/// Prints the rows that `read` gives, and when it is to follow those that come, which is for ever.
/// `read(query, each)` is given a query that goes on after the last row it gave.
template <class Query, class Read>
Outcome PrintRows(const std::string& path, bool json, bool follow, Table table, Query query,
                  const Read& read) {
  const auto print = [&] {
    std::size_t rows = 0;
    auto outcome = read(query, [&](const auto& stored) {
      query.afterID = stored.id;
      if (json) return PrintJson(stored);
      table.add(Row(stored));
      if (++rows % kPortion == 0) table.print();
    });
    if (!json) table.print();
    std::fflush(stdout);
    return outcome;
  };
  if (!follow) return print();

  StoreWatch watch(path);
  for (;;) {
    if (auto printed = print(); !printed) return printed;
    query.last.reset();
    watch.wait();
  }
}

}  // namespace

Outcome Sessions(const Options& options, const RowOptions& which) {
  auto store = StoreReader::open(PathOf(options));
  if (!store) return std::move(store.error());
  Table table({{"SESSION", true},
               {"SERVICE"},
               {"OPENED"},
               {"DURATION", true},
               {"MESSAGES", true},
               {"APPLICATION"}},
              Terminal::standardOutput());
  auto read = store.value().sessions({which.since, which.last}, [&](const StoredSession& session) {
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
  return PrintRows(
      path, options.json, which.follow,
      Table({{"SENT"}, {"SESSION", true}, {"SERVICE"}, {"CATEGORY"}, {"TYPE"}, {"PAYLOAD"}},
            Terminal::standardOutput()),
      StoreReader::MessageQuery{0, which.since, which.session, std::nullopt, which.last},
      [&](const auto& query, const auto& each) { return store.value().messages(query, each); });
}

Outcome Events(const Options& options, const EventOptions& which) {
  const std::string path = PathOf(options);
  auto store = StoreReader::open(path);
  if (!store) return std::move(store.error());
  const auto kind = which.power ? StoreReader::Events::power : StoreReader::Events::analytics;
  return PrintRows(
      path, options.json, which.follow, TableOf(kind),
      StoreReader::EventQuery{0, which.since, std::nullopt, which.last},
      [&](const auto& query, const auto& each) { return store.value().events(kind, query, each); });
}

}  // namespace quarvel::commands
