#include <fmt/format.h>

#include <chrono>
#include <cstdio>
#include <map>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "base/Json.h"
#include "tools/Commands.h"
#include "tools/Format.h"
#include "tools/ServiceFiles.h"
#include "tools/Store.h"
#include "tools/Table.h"
#include "tools/Terminal.h"

namespace quarvel::commands {
namespace {

constexpr std::chrono::seconds kLook{1};  // how often --wait does

struct Backend {
  StoredBackend stored;
  std::string error;
};

/// By name. What the service says comes on top of what the store holds: backends that have never
/// had a row, and what is wrong now.
using Backends = std::map<std::string, Backend>;

/// Returns whether it said anything.
bool AddWhatServiceSays(const Options& options, Backends& backends) {
  const auto text = StatusText(options);
  const auto status = text ? ValueFromJson(text.value()) : Result<Value>(text.error());
  const Dictionary* told = status ? status.value().dictionary() : nullptr;
  const Value* list = told != nullptr ? told->find("backends") : nullptr;
  if (list == nullptr || list->list() == nullptr) return false;
  for (const Value& entry : *list->list()) {
    const Dictionary* backend = entry.dictionary();
    const Value* name = backend != nullptr ? backend->find("name") : nullptr;
    if (name == nullptr || name->string() == nullptr) continue;
    Backend& known = backends[*name->string()];
    known.stored.name = *name->string();
    const Value* backlog = backend->find("backlog");
    if (backlog != nullptr && backlog->integer()) known.stored.backlog = *backlog->integer();
    const Value* error = backend->find("error");
    if (error != nullptr && error->string() != nullptr) known.error = *error->string();
  }
  return true;
}

/// `ask`: whether to ask the service; becomes false when it does not answer.
Result<Backends> BackendsOf(const Options& options, StoreReader& store, bool& ask) {
  Backends backends;
  const Outcome read = store.backends(
      [&](const StoredBackend& backend) { backends[backend.name].stored = backend; });
  if (!read) return read.error();
  ask = ask && AddWhatServiceSays(options, backends);
  return backends;
}

Value DateOrNil(const std::optional<Date>& date) {
  return date ? Value(*date) : Value(nullptr);
}

void Print(const Backends& backends, bool json) {
  Table table({{"BACKEND"},
               {"TO GO", true},
               {"EXPORTED", true},
               {"REFUSED", true},
               {"LAST ACKNOWLEDGED"},
               {"ERROR"}},
              Terminal::standardOutput());
  for (const auto& [name, backend] : backends) {
    const StoredBackend& stored = backend.stored;
    if (json) {
      fmt::print("{}\n", JsonText(Dictionary{
                             {"backend", name},
                             {"backlog", stored.backlog},
                             {"exported", stored.exported},
                             {"refused", stored.refused},
                             {"lastAcknowledged", DateOrNil(stored.acknowledgedAt)},
                             {"error", backend.error.empty() ? Value() : Value(backend.error)}}));
    } else {
      table.add({name, fmt::to_string(stored.backlog), fmt::to_string(stored.exported),
                 fmt::to_string(stored.refused),
                 stored.acknowledgedAt ? LocalTime(*stored.acknowledgedAt) : "never",
                 backend.error});
    }
  }
  if (!json) table.print();
}

template <class T>
Value OrNil(const std::optional<T>& value) {
  return value ? Value(*value) : Value(nullptr);
}

Outcome PrintLedger(StoreReader& store, std::int64_t last, bool json) {
  Table table({{"AT"},
               {"BACKEND"},
               {"TABLE"},
               {"FIRST", true},
               {"LAST", true},
               {"ROWS", true},
               {"BYTES", true},
               {"OUTCOME"}},
              Terminal::standardOutput());
  auto read = store.exports(last, [&](const StoredExport& line) {
    if (json) {
      fmt::print("{}\n", JsonText(Dictionary{{"id", line.id},
                                             {"at", line.at},
                                             {"backend", line.backend},
                                             {"table", line.table},
                                             {"first", OrNil(line.firstID)},
                                             {"last", OrNil(line.lastID)},
                                             {"rows", line.rows},
                                             {"bytes", line.bytes},
                                             {"outcome", line.outcome}}));
    } else {
      table.add({LocalTime(line.at), line.backend, line.table,
                 line.firstID ? fmt::to_string(*line.firstID) : "",
                 line.lastID ? fmt::to_string(*line.lastID) : "", fmt::to_string(line.rows),
                 fmt::to_string(line.bytes), line.outcome});
    }
  });
  if (!json) table.print();
  return read;
}

/// Waits until no backend has anything to go; on a terminal, tells how far they are.
Outcome WaitUntilDrained(const Options& options, StoreReader& store, bool& ask) {
  const bool shown = Terminal::standardOutput().attached && !options.json;
  std::int64_t before = -1;
  for (;;) {
    const auto backends = BackendsOf(options, store, ask);
    if (!backends) return backends.error();
    std::int64_t left = 0;
    std::string line;
    for (const auto& [name, backend] : backends.value()) {
      left += backend.stored.backlog;
      line += fmt::format("{}{}: {} rows to go", line.empty() ? "" : ", ", name,
                          backend.stored.backlog);
    }
    if (shown && left > 0 && before > left) {
      const std::int64_t rate = before - left;
      line += fmt::format("; {} rows/s, {} s left", rate, left / rate + 1);
    }
    if (shown) {
      fmt::print("\r\x1b[K{}", line);
      std::fflush(stdout);
    }
    if (left == 0) break;
    before = left;
    std::this_thread::sleep_for(kLook);
  }
  if (shown) fmt::print("\r\x1b[K");
  return Success();
}

}  // namespace

Outcome Exports(const Options& options, const ExportOptions& which) {
  auto store = StoreReader::open(PathOf(options));
  if (!store) return std::move(store.error());
  bool ask = options.store.empty();
  if (which.wait) {
    if (auto drained = WaitUntilDrained(options, store.value(), ask); !drained) return drained;
  }
  const auto backends = BackendsOf(options, store.value(), ask);
  if (!backends) return backends.error();
  Print(backends.value(), options.json);
  if (!options.json) fmt::print("\n");
  return PrintLedger(store.value(), which.last, options.json);
}

}  // namespace quarvel::commands
