#include <fmt/format.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <system_error>
#include <utility>

#include "base/Files.h"
#include "base/Json.h"
#include "store/database/Erasure.h"
#include "tools/Commands.h"
#include "tools/Format.h"
#include "tools/ServiceFiles.h"
#include "tools/Store.h"

namespace quarvel::commands {
namespace {

using std::filesystem::path;

constexpr const char* kErasureNotification = "tarnwick.quarvel.erase";
constexpr std::chrono::minutes kPatience{5};  // a large store is written anew

Error Failed(std::string reason) {
  return Error::because("quarvel.erase", 1, std::move(reason));
}

Date Now() {
  return std::chrono::floor<std::chrono::microseconds>(std::chrono::system_clock::now());
}

Result<ErasureSelection> Selected(const EraseOptions& which) {
  if (which.session) return ErasureSelection{*which.session};
  if (which.all) return ErasureSelection{};
  // A day alone is its beginning.
  const bool isDay = which.before.find('T') == std::string::npos;
  const auto before = DateFromText(isDay ? which.before + "T00:00:00Z" : which.before);
  if (before) return ErasureSelection{*before};
  return Failed(fmt::format(
      "\"{}\" is no date: it must be like 2026-01-31 or 2026-01-31T12:00:00Z.", which.before));
}

Dictionary RequestFor(const ErasureSelection& selection) {
  if (const auto* session = std::get_if<std::int64_t>(&selection.what)) {
    return {{"session", *session}};
  }
  if (const auto* before = std::get_if<Date>(&selection.what)) {
    return {{"before", before->time_since_epoch().count()}};
  }
  return {{"all", true}};
}

Error CannotAsk(const path& directory, const std::error_code& why) {
  return Failed(fmt::format("{} cannot be written: {}. Try it as root or as the service's user.",
                            directory.native(), why.message()));
}

Result<std::int64_t> AskService(const Options& options, const ErasureSelection& selection) {
  const path directory = RuntimeDirectory(options) / "erase";
  const FileArrival arrival(directory);
  if (!arrival.watching()) return CannotAsk(directory, {errno, std::generic_category()});
  const std::string name = fmt::format("{}-{}", Now().time_since_epoch().count(), ::getpid());
  const auto written =
      ReplaceFile((directory / (name + ".json")).native(), JsonText(RequestFor(selection)));
  if (!written) {
    return CannotAsk(directory, {static_cast<int>(written.error().code), std::generic_category()});
  }
  if (const auto posted = Post(options, kErasureNotification); !posted) return posted.error();
  const std::string answered = name + ".answer";
  if (!arrival.wait(answered.c_str(), kPatience)) {
    return Failed("The service has not answered yet; it will carry this out when it comes to it.");
  }
  const auto text = ReadWholeFile(directory / answered);
  std::error_code ignored;
  std::filesystem::remove(directory / answered, ignored);
  const auto answer = ValueFromJson(text ? text.value() : std::string());
  const Dictionary* found = answer ? answer.value().dictionary() : nullptr;
  const Value* rows = found != nullptr ? found->find("rows") : nullptr;
  if (rows != nullptr && rows->integer() != nullptr) return *rows->integer();
  const Value* error = found != nullptr ? found->find("error") : nullptr;
  return Failed(error != nullptr && error->string() != nullptr
                    ? *error->string()
                    : "The service's answer is not understood.");
}

Result<std::int64_t> EraseOurselves(const Options& options, const ErasureSelection& selection) {
  path store = PathOf(options);
  if (std::filesystem::is_directory(store)) store /= "telemetry.db";
  // Says what is wrong with a file that is no store of ours, and leaves it alone.
  if (auto reader = StoreReader::open(store); !reader) return std::move(reader.error());
  SqliteConnection connection;
  if (!connection.open(store)) {
    return Failed(
        fmt::format("The store {} cannot be written: {}.", store.native(), connection.message()));
  }
  Erasure erasure(connection, selection, Now());
  auto progress = Erasure::Progress::more;
  while (progress == Erasure::Progress::more) progress = erasure.step();
  if (progress == Erasure::Progress::failed) {
    return Failed(fmt::format("{} rows were erased from {}, then it failed: {}.", erasure.rows(),
                              store.native(), connection.message()));
  }
  if (std::holds_alternative<ErasureSelection::All>(selection.what)) {
    Erasure::removeSetAside(store);
  }
  return erasure.rows();
}

}  // namespace

Outcome Erase(const Options& options, const EraseOptions& which) {
  const auto selection = Selected(which);
  if (!selection) return selection.error();
  const bool ask = options.store.empty() && ServiceIsUp(options);
  const auto rows =
      ask ? AskService(options, selection.value()) : EraseOurselves(options, selection.value());
  if (!rows) return rows.error();
  if (options.json) {
    fmt::print("{}\n", JsonText(Dictionary{{"rows", rows.value()}}));
  } else {
    fmt::print("{} rows are erased ({}).\n", rows.value(), selection.value().description());
  }
  return Success();
}

}  // namespace quarvel::commands
