#include <fmt/format.h>

#include "base/Json.h"
#include "tools/Commands.h"
#include "tools/ServiceFiles.h"
#include "tools/Terminal.h"

namespace quarvel::commands {
namespace {

// An absent entry reads as empty: an older service writes fewer.

const Dictionary& DictionaryIn(const Dictionary& status, const char* key) {
  static const Dictionary kNone;
  const Value* value = status.find(key);
  const Dictionary* found = value != nullptr ? value->dictionary() : nullptr;
  return found != nullptr ? *found : kNone;
}

const List& ListIn(const Dictionary& status, const char* key) {
  static const List kNone;
  const Value* value = status.find(key);
  const List* found = value != nullptr ? value->list() : nullptr;
  return found != nullptr ? *found : kNone;
}

std::int64_t NumberIn(const Dictionary& status, const char* key) {
  const Value* value = status.find(key);
  return value != nullptr && value->integer() != nullptr ? *value->integer() : 0;
}

std::string TextIn(const Dictionary& status, const char* key) {
  const Value* value = status.find(key);
  if (value == nullptr || value->isNil()) return "";
  return value->string() != nullptr ? *value->string() : JsonText(*value);
}

std::string Size(std::int64_t bytes) {
  if (bytes < 10'240) return fmt::format("{} bytes", bytes);
  if (bytes < 10'485'760) return fmt::format("{} KiB", bytes / 1024);
  return fmt::format("{} MiB", bytes / 1'048'576);
}

std::string Duration(const Dictionary& status) {
  const Value* value = status.find("uptime_seconds");
  const double* real = value != nullptr ? value->real() : nullptr;
  const auto seconds =
      real != nullptr ? static_cast<std::int64_t>(*real) : NumberIn(status, "uptime_seconds");
  if (seconds < 120) return fmt::format("{} s", seconds);
  if (seconds < 7'200) return fmt::format("{} min", seconds / 60);
  if (seconds < 172'800) return fmt::format("{} h", seconds / 3'600);
  return fmt::format("{} days", seconds / 86'400);
}

std::string Drops(const Dictionary& dropped) {
  std::int64_t sum = 0;
  std::string reasons;
  for (const auto& [reason, rows] : dropped) {
    if (rows.integer() == nullptr || *rows.integer() == 0) continue;
    sum += *rows.integer();
    reasons += fmt::format("{}{} {}", reasons.empty() ? "" : ", ", *rows.integer(),
                           reason.string() != nullptr ? *reason.string() : "");
  }
  return reasons.empty() ? "0 dropped" : fmt::format("{} dropped ({})", sum, reasons);
}

void Print(const Dictionary& status, bool healthy) {
  const bool coloured = Terminal::standardOutput().coloured;
  fmt::print("{}{}{}\n", coloured ? (healthy ? "\x1b[32m" : "\x1b[31m") : "",
             healthy ? "healthy" : "not healthy", coloured ? "\x1b[0m" : "");
  const Dictionary& counters = DictionaryIn(status, "counters");
  const Dictionary& store = DictionaryIn(status, "store");
  const Dictionary& queue = DictionaryIn(status, "store_queue");
  fmt::print("service   up {} since {}, version {}, process {}\n", Duration(status),
             TextIn(status, "started_at"), TextIn(status, "version"), NumberIn(status, "pid"));
  fmt::print("clients   {}, with {} sessions, {} of them started\n", NumberIn(status, "clients"),
             NumberIn(status, "sessions"), NumberIn(status, "started_sessions"));
  fmt::print("rows      {} accepted = {} stored + {} waiting + {}\n",
             NumberIn(counters, "accepted"), NumberIn(counters, "stored"),
             NumberIn(counters, "waiting"), Drops(DictionaryIn(counters, "dropped")));
  fmt::print("store     {}, {} and {} of log; {} rows ({}) in its queue\n", TextIn(store, "path"),
             Size(NumberIn(store, "bytes")), Size(NumberIn(store, "wal_bytes")),
             NumberIn(queue, "rows"), Size(NumberIn(queue, "bytes")));
  for (const Value& file : ListIn(store, "set_aside")) {
    fmt::print("          kept from a damaged store: {}\n", TextIn({{"file", file}}, "file"));
  }
  for (const Value& entry : ListIn(status, "backends")) {
    const Dictionary* backend = entry.dictionary();
    if (backend == nullptr) continue;
    const std::string last = TextIn(*backend, "last_acknowledgement");
    fmt::print("backend   {}: {} rows to go, last acknowledgement {}\n", TextIn(*backend, "name"),
               NumberIn(*backend, "backlog"), last.empty() ? "never" : last);
  }
}

}  // namespace

Outcome ServiceStatus(const Options& options) {
  const auto text = StatusText(options);
  if (!text) return text.error();
  const auto parsed = ValueFromJson(text.value());
  const Dictionary* status = parsed ? parsed.value().dictionary() : nullptr;
  if (status == nullptr) return StatusError("The service's status is no JSON object.");
  std::string problems;
  for (const Value& problem : ListIn(*status, "problems")) {
    if (problem.string() == nullptr) continue;
    problems += (problems.empty() ? "" : "; ") + *problem.string();
  }
  const Value* verdict = status->find("healthy");
  const bool healthy = verdict != nullptr && *verdict == Value(true);
  if (options.json) {
    fmt::print("{}", text.value());
  } else {
    Print(*status, healthy);
  }
  if (healthy) return Success();
  return StatusError("The service is not healthy: " + problems);
}

}  // namespace quarvel::commands
