#include <fmt/format.h>

#include <map>
#include <utility>

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

constexpr const char* kClientUptimeEvent = "tarnwick.quarvel.zqreportingclientuptime";
constexpr std::uint16_t kTallixing = static_cast<std::uint16_t>(vocabulary::Kind::tallixing);
constexpr std::uint16_t kGeneric = static_cast<std::uint16_t>(MessageType::generic);
constexpr std::uint16_t kSummary = 65535;  // category and type of the message that ends a run

struct OrientationChange {
  std::string_view kind;  // "device" or "ui"
  std::string orientation;
  std::string seconds;  // since the start, as the service wrote it
};

struct ClientUptime {
  std::string processName;
  double seconds;
};

/// One run of a session, as the store tells it.
struct Run {
  StoredSession session;
  std::int64_t earlierRuns = 0;
  std::map<std::pair<std::uint16_t, std::uint16_t>, std::int64_t> messages;
  Dictionary driverStatistics;
  std::vector<OrientationChange> orientation;
  std::optional<ClientUptime> clientUptime;
};

std::vector<std::string> Split(std::string_view joined) {
  std::vector<std::string> texts;
  for (std::size_t comma = 0; comma != std::string_view::npos;) {
    comma = joined.find(',');
    texts.emplace_back(joined.substr(0, comma));
    if (comma != std::string_view::npos) joined.remove_prefix(comma + 1);
  }
  return texts;
}

std::vector<std::string> TextsOf(const Dictionary& summary, const std::string& key) {
  const Value* joined = summary.find(key);
  if (joined == nullptr || joined->string() == nullptr) return {};
  return Split(*joined->string());
}

std::vector<OrientationChange> OrientationIn(const Dictionary& summary) {
  std::vector<OrientationChange> changes;
  for (const std::string_view kind : {"device", "ui"}) {
    const auto orientations = TextsOf(summary, fmt::format("{}_orientation", kind));
    const auto times = TextsOf(summary, fmt::format("{}_orientation_time", kind));
    for (std::size_t i = 0; i < orientations.size(); ++i) {
      changes.push_back({kind, orientations[i], i < times.size() ? times[i] : ""});
    }
  }
  return changes;
}

Dictionary DictionaryIn(const std::string& json) {
  const auto read = ValueFromJson(json);
  const Dictionary* dictionary = read ? read.value().dictionary() : nullptr;
  return dictionary ? *dictionary : Dictionary();
}

double NumberOf(const Value& value) {
  if (value.real()) return *value.real();
  return value.integer() ? static_cast<double>(*value.integer()) : -1;
}

// An uptime does not say whose session it was: it is told only when just one client was connected
// from before the run's start, and has left after its end.
Result<std::optional<ClientUptime>> UptimeOfClient(StoreReader& store,
                                                   const StoredSession& session) {
  if (!session.flushedAt) return std::optional<ClientUptime>();
  std::vector<ClientUptime> candidates;
  const StoreReader::EventQuery query{0, session.flushedAt, kClientUptimeEvent, std::nullopt};
  auto read = store.events(StoreReader::Events::analytics, query, [&](const StoredEvent& event) {
    const Dictionary payload = DictionaryIn(event.payload);
    const Value* name = payload.find("processName");
    const Value* seconds = payload.find("seconds");
    if (!name || !name->string() || !seconds) return;
    const std::chrono::duration<double> sinceStart = event.recordedAt - session.openedAt;
    if (NumberOf(*seconds) < sinceStart.count()) return;
    candidates.push_back({*name->string(), NumberOf(*seconds)});
  });
  if (!read) return std::move(read.error());
  if (candidates.size() != 1) return std::optional<ClientUptime>();
  return std::optional(candidates.front());
}

Result<Run> LatestRun(StoreReader& store, std::int64_t reporterID) {
  std::optional<Run> run;
  auto read = store.sessions({}, [&](StoredSession session) {
    if (session.reporterID != reporterID) return;
    const std::int64_t earlier = run ? run->earlierRuns + 1 : 0;
    run.emplace();
    run->session = std::move(session);
    run->earlierRuns = earlier;
  });
  if (!read) return std::move(read.error());
  if (!run) {
    return Error::because("quarvel.store", 1,
                          fmt::format("The store has no run of a session {}; \"quarvelctl "
                                      "sessions\" lists those that it has.",
                                      reporterID));
  }
  StoreReader::MessageQuery query;
  query.agentSession = run->session.id;
  read = store.messages(query, [&](const StoredMessage& message) {
    ++run->messages[{message.category, message.type}];
    if (message.category == kTallixing && message.type == kGeneric) {
      run->driverStatistics.merge(DictionaryIn(message.payload));
    } else if (message.category == kSummary && message.type == kSummary) {
      run->orientation = OrientationIn(DictionaryIn(message.payload));
    }
  });
  if (!read) return std::move(read.error());
  auto uptime = UptimeOfClient(store, run->session);
  if (!uptime) return std::move(uptime.error());
  run->clientUptime = std::move(uptime.value());
  return std::move(*run);
}

void PrintJson(const Run& run) {
  const StoredSession& session = run.session;
  List messages;
  for (const auto& [code, count] : run.messages) {
    messages.push_back(Dictionary{{"category", code.first},
                                  {"categoryName", NameOf(Category(code.first))},
                                  {"type", code.second},
                                  {"typeName", NameOf(static_cast<MessageType>(code.second))},
                                  {"count", count}});
  }
  List orientation;
  for (const OrientationChange& change : run.orientation) {
    const auto seconds = ValueFromJson(change.seconds);
    orientation.push_back(Dictionary{{"kind", change.kind},
                                     {"orientation", change.orientation},
                                     {"seconds", seconds ? seconds.value() : Value()}});
  }
  Dictionary summary{{"id", session.id},
                     {"session", session.reporterID},
                     {"earlierRuns", run.earlierRuns},
                     {"service", session.serviceName},
                     {"application", ApplicationOf(session.userInfo)},
                     {"openedAt", session.openedAt},
                     {"flushed", session.flushedAt.has_value()}};
  if (session.flushedAt) {
    const std::chrono::duration<double> seconds = *session.flushedAt - session.openedAt;
    summary.set("flushedAt", *session.flushedAt);
    summary.set("seconds", seconds.count());
  }
  summary.set("messages", std::move(messages));
  summary.set("driverStatistics", run.driverStatistics);
  summary.set("orientation", std::move(orientation));
  if (run.clientUptime) {
    summary.set("clientUptime", Dictionary{{"processName", run.clientUptime->processName},
                                           {"seconds", run.clientUptime->seconds}});
  }
  fmt::print("{}\n", JsonText(summary));
}

void PrintForPeople(const Run& run) {
  const StoredSession& session = run.session;
  const Terminal terminal = Terminal::standardOutput();
  const auto line = [](std::string_view what, std::string_view value) {
    fmt::print("{:<14}{}\n", what, Printable(value));
  };
  line("Session", run.earlierRuns == 0
                      ? fmt::format("{}", session.reporterID)
                      : fmt::format("{}, its run {}", session.reporterID, run.earlierRuns + 1));
  line("Service", ShownService(session.serviceName));
  const std::string application = ApplicationOf(session.userInfo);
  line("Application", application.empty() ? "not named" : application);
  line("Opened", LocalTime(session.openedAt));
  line("Duration", DurationOf(session));
  line("Flushed", session.flushedAt ? LocalTime(*session.flushedAt)
                                    : "no: still open, or the service ended before");
  if (run.clientUptime) {
    line("Client uptime",
         fmt::format("{:.3f} s, {} (the one client seen to be connected from before the start and "
                     "to leave after the end)",
                     run.clientUptime->seconds, run.clientUptime->processName));
  }

  fmt::print("\n");
  Table messages({{"MESSAGES", true}, {"CATEGORY"}, {"TYPE"}}, terminal);
  for (const auto& [code, count] : run.messages) {
    messages.add({fmt::format("{}", count), NameOf(Category(code.first)),
                  std::string(NameOf(static_cast<MessageType>(code.second)))});
  }
  messages.print();
  if (!run.driverStatistics.empty()) {
    fmt::print("\n");
    Table statistics({{"DRIVER STATISTIC"}, {"CHANGE", true}}, terminal);
    for (const auto& [key, value] : run.driverStatistics) {
      statistics.add({*key.string(), JsonText(value)});
    }
    statistics.print();
  }
  if (!run.orientation.empty()) {
    fmt::print("\n");
    Table orientation({{"AFTER", true}, {"OF"}, {"ORIENTATION"}}, terminal);
    for (const OrientationChange& change : run.orientation) {
      orientation.add({change.seconds.empty() ? "" : change.seconds + " s",
                       std::string(change.kind), change.orientation});
    }
    orientation.print();
  }
}

}  // namespace

Outcome Summary(const Options& options, std::int64_t reporterID) {
  auto store = StoreReader::open(PathOf(options));
  if (!store) return std::move(store.error());
  const auto run = LatestRun(store.value(), reporterID);
  if (!run) return run.error();
  if (options.json) {
    PrintJson(run.value());
  } else {
    PrintForPeople(run.value());
  }
  return Success();
}

}  // namespace quarvel::commands
