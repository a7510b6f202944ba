#include <fmt/format.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <functional>

#include "tools/Commands.h"

namespace {

enum Status : int { done = 0, failed = 1, wrongUsage = 2 };

int Reported(const quarvel::Outcome& outcome) {
  if (outcome) return done;
  const quarvel::Error& error = outcome.error();
  const quarvel::Value* reason = error.userInfo.find("reason");
  const bool coloured = ::isatty(STDERR_FILENO) == 1 && ::getenv("NO_COLOR") == nullptr;
  fmt::print(
      stderr, "{}quarvelctl:{} {}\n", coloured ? "\x1b[31m" : "", coloured ? "\x1b[0m" : "",
      reason != nullptr && reason->string() != nullptr ? *reason->string() : error.description());
  return failed;
}

// For the names of files that lie in a directory of their own.
std::string NotAName(const std::string& text) {
  if (!text.empty() && text != "." && text != ".." && text.find('/') == std::string::npos)
    return "";
  return "\"" + text + "\" is no name: it may not be empty or have a \"/\" in it";
}

}  // namespace

int main(int argumentCount, char** arguments) {
  using namespace quarvel::commands;
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
  add("kill", "end the service at once; no session is stopped", [&] { return Kill(options); });
  add("sessions", "list the sessions in the store", [&] { return Sessions(options); });
  MessageOptions which;
  CLI::App* messages =
      add("messages", "list the messages in the store", [&] { return Messages(options, which); });
  messages->add_option("--session", which.session, "only this reporter ID's; -1: single messages");
  messages->add_option("--last", which.last, "only so many, the last ones")
      ->check(CLI::PositiveNumber);
  messages->add_flag("--follow", which.follow, "go on with messages as they are stored");
  EventOptions events;
  EventOptions power{.power = true, .last = {}};
  for (EventOptions* kind : {&events, &power}) {
    CLI::App* subcommand = add(kind->power ? "power" : "events",
                               kind->power ? "list the power events in the store"
                                           : "list the analytics events in the store",
                               [&options, kind] { return Events(options, *kind); });
    subcommand->add_option("--last", kind->last, "only so many, the last ones")
        ->check(CLI::PositiveNumber);
    subcommand->add_flag("--follow", kind->follow, "go on with events as they are stored");
  }
  add("summary", "tell what the latest run of a session was",
      [&] { return Summary(options, reporterID); })
      ->add_option("ID", reporterID, "the reporter ID")
      ->required();

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
