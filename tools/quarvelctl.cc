#include <fmt/format.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <chrono>
#include <clocale>
#include <functional>

#include "tools/Commands.h"
#include "tools/Format.h"
#include "tools/Terminal.h"

namespace {

enum Status : int { done = 0, failed = 1, wrongUsage = 2 };

int Reported(const quarvel::Outcome& outcome) {
  if (outcome) return done;
  const quarvel::Error& error = outcome.error();
  const quarvel::Value* reason = error.userInfo.find("reason");
  const bool coloured = quarvel::WantsColour(STDERR_FILENO);
  fmt::print(
      stderr, "{}quarvelctl:{} {}\n", coloured ? "\x1b[31m" : "", coloured ? "\x1b[0m" : "",
      reason != nullptr && reason->string() != nullptr ? *reason->string() : error.description());
  return failed;
}

// Checks a name that becomes a file's name in a directory; returns the fault, or the empty text.
std::string NotAName(const std::string& text) {
  if (!text.empty() && text != "." && text != ".." && text.find('/') == std::string::npos)
    return "";
  return "\"" + text + "\" is no name: it may not be empty or have a \"/\" in it";
}

// Adds the options that select rows of a table in the store.
void AddRowOptions(CLI::App& command, quarvel::commands::RowOptions& which) {
  command
      .add_option_function<std::string>(
          "--since",
          [&which](const std::string& text) {
            const auto now = std::chrono::system_clock::now();
            which.since = quarvel::commands::Since(
                text, std::chrono::time_point_cast<quarvel::Date::duration>(now));
            if (!which.since) {
              throw CLI::ValidationError(
                  "--since", "\"" + text +
                                 "\" is neither how long ago, as 90s, 10m, 2h, 1d12h or 3w, nor a "
                                 "time, as 2026-01-31T14:25:00Z or 2026-01-31T14:25:00+01:00");
            }
          },
          "only from then on: how long ago (10m, 2h, 1d12h) or an RFC 3339 time")
      ->type_name("WHEN");
  command.add_option("--last", which.last, "only so many, the last ones")
      ->check(CLI::PositiveNumber)
      ->type_name("COUNT");
}

}  // namespace

int main(int argumentCount, char** arguments) {
  using namespace quarvel::commands;
  // For the widths of characters: texts are UTF-8 in every language of the terminal.
  std::setlocale(LC_CTYPE, "C.UTF-8");
  CLI::App app("Talks to the audio reporting service and reads its store.", "quarvelctl");
  app.require_subcommand(1);
  app.fallthrough();
  app.set_version_flag("--version", QUARVEL_VERSION);

  Options options;
  app.add_flag("--json", options.json, "JSON Lines for programs instead of tables for people");
  app.add_option("--socket", options.socket, "the service's socket")->envname("QUARVEL_SOCKET");
  app.add_option("--store", options.store, "the store, or the directory of its telemetry.db");

  std::function<quarvel::Outcome()> command;
  const auto addTo = [&](CLI::App& parent, const char* name, const char* description,
                         std::function<quarvel::Outcome()> run) {
    CLI::App* subcommand = parent.add_subcommand(name, description);
    subcommand->callback([&command, run = std::move(run)] { command = run; });
    return subcommand;
  };
  const auto add = [&](const char* name, const char* description,
                       std::function<quarvel::Outcome()> run) {
    return addTo(app, name, description, std::move(run));
  };

  std::string file;
  add("run", "play a script of calls (JSON Lines) on one connection and print each reply",
      [&] { return Run(options, file); })
      ->add_option("FILE", file, "the script; - is standard input")
      ->required();
  add("reporters", "list the reporter IDs of every client's sessions",
      [&] { return Reporters(options); });
  std::int64_t reporterID = 0;
  add("valid", "ask whether any client has a session of this reporter ID",
      [&] { return Valid(options, reporterID); })
      ->add_option("ID", reporterID, "the reporter ID")
      ->required();
  add("status", "tell how the service is: whether all is well, and what has become of its rows",
      [&] { return ServiceStatus(options); });
  add("kill", "end the service at once; no session is stopped", [&] { return Kill(options); });
  RowOptions whichSessions;
  AddRowOptions(*add("sessions", "list the sessions in the store",
                     [&] { return Sessions(options, whichSessions); }),
                whichSessions);
  MessageOptions which;
  CLI::App* messages =
      add("messages", "list the messages in the store", [&] { return Messages(options, which); });
  messages->add_option("--session", which.session, "only this reporter ID's; -1: single messages")
      ->type_name("ID");
  AddRowOptions(*messages, which);
  messages->add_flag("--follow", which.follow, "go on with messages as they are stored");
  EventOptions events;
  EventOptions power;
  power.power = true;
  for (EventOptions* kind : {&events, &power}) {
    CLI::App* subcommand = add(kind->power ? "power" : "events",
                               kind->power ? "list the power events in the store"
                                           : "list the analytics events in the store",
                               [&options, kind] { return Events(options, *kind); });
    AddRowOptions(*subcommand, *kind);
    subcommand->add_flag("--follow", kind->follow, "go on with events as they are stored");
  }
  add("summary", "tell what the latest run of a session was",
      [&] { return Summary(options, reporterID); })
      ->add_option("ID", reporterID, "the reporter ID")
      ->required();

  ExportOptions exports;
  CLI::App* exported = add("exports", "tell what left the device, and what still waits to",
                           [&] { return Exports(options, exports); });
  exported->add_option("--last", exports.last, "only so many lines of the ledger, the last ones")
      ->check(CLI::PositiveNumber)
      ->capture_default_str();
  exported->add_flag("--wait", exports.wait, "wait until nothing waits any more");
  EraseOptions erasure;
  CLI::App* erased = add("erase", "remove rows from the device for good, whether exported or not",
                         [&] { return Erase(options, erasure); });
  auto* kind = erased->add_option_group("WHICH", "exactly one of");
  kind->add_option("--session", erasure.session, "this reporter ID's sessions and messages");
  kind->add_option("--before", erasure.before, "what is older: a day (UTC), or RFC 3339");
  kind->add_flag("--all", erasure.all, "everything, and the damaged stores that were kept");
  kind->require_option(1);

  DefaultsOptions entry;
  CLI::App* defaults = app.add_subcommand("defaults", "read and change the service's preferences");
  defaults->require_subcommand(1);
  defaults->fallthrough();
  defaults->add_option("--domain", entry.domain, "whose preferences")
      ->capture_default_str()
      ->check(NotAName);
  addTo(*defaults, "read", "print one preference, or all that are set", [&] {
    return DefaultsRead(options, entry);
  })->add_option("KEY", entry.key, "which");
  CLI::App* write =
      addTo(*defaults, "write", "set a preference", [&] { return DefaultsWrite(options, entry); });
  write->add_option("KEY", entry.key, "which")->required();
  write->add_option("VALUE", entry.value, "true, false, a number or else a string")->required();
  write->add_flag("--string", entry.string, "VALUE is a string, whatever it looks like");
  CLI::App* erase = addTo(*defaults, "delete", "remove a preference",
                          [&] { return DefaultsDelete(options, entry); });
  erase->add_option("KEY", entry.key, "which")->required();
  for (CLI::App* change : {write, erase}) {
    change->add_flag("--notify", entry.notify, "make the service read the change at once");
  }
  std::string notification = kReportingNotification;
  add("notify", "post a notification; without a name, the service reads its preferences again",
      [&] { return Notify(options, notification); })
      ->add_option("NAME", notification, "which")
      ->capture_default_str()
      ->check(NotAName);

  try {
    app.parse(argumentCount, arguments);
  } catch (const CLI::ParseError& error) {
    return app.exit(error) == 0 ? done : wrongUsage;
  }
  return Reported(command());
}
