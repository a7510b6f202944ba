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
  const auto add = [&](const char* name, const char* description,
                       std::function<quarvel::Outcome()> run) {
    CLI::App* subcommand = app.add_subcommand(name, description);
    subcommand->callback([&command, run = std::move(run)] { command = run; });
    return subcommand;
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

  try {
    app.parse(argumentCount, arguments);
  } catch (const CLI::ParseError& error) {
    return app.exit(error) == 0 ? done : wrongUsage;
  }
  return Reported(command());
}
