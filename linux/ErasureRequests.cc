#include "linux/ErasureRequests.h"

#include <algorithm>
#include <filesystem>
#include <future>
#include <optional>
#include <string>
#include <system_error>
#include <utility>
#include <vector>

#include "base/Files.h"
#include "base/Json.h"
#include "export/Exporters.h"
#include "platform/Log.h"
#include "platform/Notifications.h"
#include "queues/BlockingScope.h"
#include "store/TelemetryStore.h"

namespace quarvel {

namespace {

using std::filesystem::path;

constexpr std::size_t kLongestRequest = 4096;

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

}  // namespace

ErasureRequests::ErasureRequests(path directory, TelemetryStore& store, Exporters& exporters)
    : directory_(std::move(directory)),
      store_(store),
      exporters_(exporters),
      queue_(CreateSerialQueue("tarnwick.quarvel.erase", QualityOfService::utility)) {
  ZQ_FUNCTION("AnswerErasureRequests");
  int status = CreatePrivateDirectory(directory_);
  NotificationToken token = 0;
  if (status == 0) {
    status = RegisterForNotification("tarnwick.quarvel.erase", token, *queue_,
                                     [this](NotificationToken) { answerAll(); });
  }
  if (status != 0) {
    ZQ_LOG(nullptr, error, "rows can be erased only while the service is down: {}",
           std::generic_category().message(status));
    return;
  }
  // The requests from before the start.
  queue_->async([this] { answerAll(); });
}

Result<std::int64_t> ErasureRequests::erase(const ErasureSelection& selection) {
  const Exporters::Hold hold(exporters_);
  auto erased = std::make_shared<std::promise<Result<std::int64_t>>>();
  auto rows = erased->get_future();
  const Outcome begun = store_.erase(
      selection, [erased](const Result<std::int64_t>& result) { erased->set_value(result); });
  if (!begun) return begun.error();
  if (std::holds_alternative<ErasureSelection::All>(selection.what)) {
    Erasure::removeSetAside(store_.path());
  }
  const BlockingScope blocking;
  return rows.get();
}

void ErasureRequests::answer(const path& request) {
  ZQ_FUNCTION("AnswerErasureRequests");
  const auto selection = SelectionIn(request);
  const Result<std::int64_t> rows =
      selection ? erase(selection.value()) : Result<std::int64_t>(selection.error());
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

void ErasureRequests::answerAll() {
  std::vector<path> requests;
  std::error_code failure;
  for (auto entry = std::filesystem::directory_iterator(directory_, failure);
       !failure && entry != std::filesystem::directory_iterator(); entry.increment(failure)) {
    if (entry->path().extension() == ".json") requests.push_back(entry->path());
  }
  std::ranges::sort(requests);
  for (const path& request : requests) answer(request);
}

}  // namespace quarvel
