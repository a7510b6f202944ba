#include <fmt/format.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <iostream>
#include <vector>

#include <quarvel/client.hpp>

#include "base/Json.h"
#include "tools/Commands.h"
#include "tools/Player.h"

namespace quarvel::commands {
namespace {

/// Reads the steps of a script; puts file and line in front of every fault.
class ScriptReader {
 public:
  ScriptReader(std::istream& in, std::string name) : in_(in), name_(std::move(name)) {}

  /// The next step; none at the end.
  Result<std::optional<script::Step>> next() {
    std::string text;
    while (std::getline(in_, text)) {
      ++line_;
      if (script::IsSkipped(text)) continue;
      auto action = script::Parse(text);
      if (!action) return at(line_, action.error());
      return std::optional(script::Step{line_, std::move(action.value())});
    }
    return std::optional<script::Step>();
  }

  [[nodiscard]] Error at(std::size_t line, const Error& error) const {
    const Value* reason = error.userInfo.find("reason");
    return Error::because(error.domain, error.code,
                          fmt::format("{}:{}: {}", name_, line, *reason->string()));
  }

 private:
  std::istream& in_;
  const std::string name_;
  std::size_t line_ = 0;
};

Outcome PlayLines(ScriptReader& reader, Player& player) {
  for (;;) {
    auto step = reader.next();
    if (!step) return std::move(step.error());
    if (!step.value()) return player.finish();
    if (auto played = player.play(*step.value()); !played) {
      return reader.at(step.value()->line, played.error());
    }
  }
}

Outcome PlayFile(const std::vector<script::Step>& steps, const ScriptReader& reader,
                 Player& player) {
  for (const script::Step& step : steps) {
    if (auto played = player.play(step); !played) return reader.at(step.line, played.error());
  }
  return player.finish();
}

}  // namespace

Outcome Run(const Options& options, const std::string& file) {
  if (file == "-") {
    auto client = Client::connect(options.socket);
    if (!client) return std::move(client.error());
    Player player(std::move(client.value()));
    ScriptReader reader(std::cin, "standard input");
    return PlayLines(reader, player);
  }

  std::ifstream in(file);
  if (!in) {
    return Error::because("quarvel.script", 1,
                          fmt::format("{} cannot be read: {}.", file, std::strerror(errno)));
  }
  ScriptReader reader(in, file);
  std::vector<script::Step> steps;
  for (;;) {
    auto step = reader.next();
    if (!step) return std::move(step.error());
    if (!step.value()) break;
    steps.push_back(std::move(*step.value()));
  }
  auto client = Client::connect(options.socket);
  if (!client) return std::move(client.error());
  Player player(std::move(client.value()));
  return PlayFile(steps, reader, player);
}

Outcome Reporters(const Options& options) {
  auto client = Client::connect(options.socket);
  if (!client) return std::move(client.error());
  const auto reporters = client.value().sync().getAllReporters();
  if (!reporters) return reporters.error();
  if (options.json) {
    fmt::print("{}\n", JsonText(List(reporters.value().begin(), reporters.value().end())));
    return Success();
  }
  for (const ReporterID reporter : reporters.value()) fmt::print("{}\n", reporter);
  if (reporters.value().empty()) fmt::print(stderr, "No client has a reporting session.\n");
  return Success();
}

Outcome Valid(const Options& options, std::int64_t reporterID) {
  auto client = Client::connect(options.socket);
  if (!client) return std::move(client.error());
  const auto validity = client.value().sync().reporterID(reporterID);
  if (!validity) return validity.error();
  const auto serviceType = validity.value().serviceType;
  const std::string_view name = vocabulary::NameOf(serviceType);
  const auto code = static_cast<std::uint16_t>(serviceType);
  if (options.json) {
    fmt::print("{}\n", JsonText(Dictionary{{"reporterID", validity.value().reporterID},
                                           {"serviceType", code},
                                           {"serviceTypeName", name}}));
  } else if (validity.value().valid()) {
    fmt::print("{} is a reporting session of service type {} ({}).\n", reporterID, code,
               name.empty() ? "without a name" : name);
  }
  if (validity.value().valid()) return Success();
  return Error::because("quarvel.reporter", 1,
                        fmt::format("No client has a reporting session {}.", reporterID));
}

Outcome Kill(const Options& options) {
  auto client = Client::connect(options.socket);
  if (!client) return std::move(client.error());
  if (auto killed = client.value().sync().killService(); !killed) return killed;
  if (options.json) {
    fmt::print("{}\n", JsonText(Dictionary{{"ended", true}}));
  } else {
    fmt::print("The service has ended.\n");
  }
  return Success();
}

}  // namespace quarvel::commands
