#include "linux/ProcessErasures.h"

#include <fmt/format.h>

#include <algorithm>
#include <filesystem>
#include <future>
#include <optional>
#include <string>
#include <system_error>
#include <vector>

#include "base/Files.h"
#include "base/Json.h"
#include "base/StandardPaths.h"
#include "linux/ProcessExporters.h"
#include "linux/ProcessStore.h"
#include "platform/Log.h"
#include "platform/Notifications.h"
#include "platform/WorkQueue.h"
#include "queues/BlockingScope.h"

namespace quarvel {

namespace {

using std::filesystem::path;

constexpr std::size_t kLongestRequest = 4096;

path Directory() {
  return StandardPaths::process().runtime / "erase";
}

Error Unknown(std::string reason) {
  return Error::because("quarvel.erase", 1, std::move(reason));
}

Result<ErasureSelection> SelectionIn(const path& request) {
  const auto text = ReadWholeFile(request, kLongestRequest);
  const auto value = ValueFromJson(text ? text.value() : std::string());
  const Dictionary* wanted = value ? value.value().dictionary() : nullptr;
  if (wanted == nullptr || wanted->size() != 1) return Unknown("The request is not understood.");
  if (const Value* session = wanted->find("session"); session && session->integer()) {
    return ErasureSelection{*session->integer()};
  }
  if (const Value* before = wanted->find("before"); before && before->integer()) {
    return ErasureSelection{Date(std::chrono::microseconds(*before->integer()))};
  }
  if (const Value* all = wanted->find("all"); all && *all == Value(true)) {
    return ErasureSelection{};
  }
  return Unknown("The request is not understood.");
}

Result<std::int64_t> Erase(const ErasureSelection& selection) {
  const Exporters::Hold hold(ProcessExporters());
  auto erased = std::make_shared<std::promise<Result<std::int64_t>>>();
  auto rows = erased->get_future();
  const Outcome begun = ProcessTelemetryStore()->erase(
      selection, [erased](const Result<std::int64_t>& result) { erased->set_value(result); });
  if (!begun) return begun.error();
  if (std::holds_alternative<ErasureSelection::All>(selection.what)) {
    Erasure::removeSetAside(ProcessTelemetryStore()->path());
  }
  const BlockingScope blocking;
  return rows.get();
}

void Answer(const path& request) {
  ZQ_FUNCTION("AnswerErasureRequests");
  const auto selection = SelectionIn(request);
  const Result<std::int64_t> rows =
      selection ? Erase(selection.value()) : Result<std::int64_t>(selection.error());
  Dictionary answer;
  if (rows) {
    answer.set("rows", rows.value());
  } else {
    ZQ_LOG(nullptr, error, "{}: {}", request.string(), rows.error().description());
    answer.set("error", rows.error().description());
  }
  path file = request;
  file.replace_extension(".answer");
  if (const Outcome written = ReplaceFile(file.native(), JsonText(answer), kPrivateFile);
      !written) {
    ZQ_LOG(nullptr, error, "{}", written.error().description());
  }
  std::error_code gone;
  std::filesystem::remove(request, gone);
}

void AnswerAll() {
  std::vector<path> requests;
  std::error_code failure;
  for (auto entry = std::filesystem::directory_iterator(Directory(), failure);
       !failure && entry != std::filesystem::directory_iterator(); entry.increment(failure)) {
    if (entry->path().extension() == ".json") requests.push_back(entry->path());
  }
  std::ranges::sort(requests);
  for (const path& request : requests) Answer(request);
}

}  // namespace

void AnswerErasureRequests() {
  ZQ_FUNCTION("AnswerErasureRequests");
  static WorkQueue& queue =
      *CreateSerialQueue("tarnwick.quarvel.erase", QualityOfService::utility).release();
  int status = CreatePrivateDirectory(Directory());
  NotificationToken token = 0;
  if (status == 0) {
    status = RegisterForNotification("tarnwick.quarvel.erase", token, queue,
                                     [](NotificationToken) { AnswerAll(); });
  }
  if (status != 0) {
    ZQ_LOG(nullptr, error, "rows can be erased only while the service is down: {}",
           std::generic_category().message(status));
    return;
  }
  // Whatever was asked for while nobody answered.
  queue.async([] { AnswerAll(); });
}

}  // namespace quarvel
