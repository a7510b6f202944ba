#include "tools/Player.h"

#include <fmt/format.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <thread>
#include <utility>

#include "base/Json.h"

namespace quarvel {
namespace {

constexpr std::string_view kStart = "startReportingSessionForID:reply:";
constexpr std::string_view kStop = "stopReportingSessionForID:reply:";
constexpr std::string_view kDestroy = "destroyReportingSession:reply:";
constexpr std::string_view kKill = "killService:";
constexpr std::chrono::seconds kLastReplies{10};

Error Failed(std::string reason) {
  return Error::because("quarvel.script", 2, std::move(reason));
}

Value AsValue(const Error& error) {
  return Dictionary{{"domain", error.domain}, {"code", error.code}, {"userInfo", error.userInfo}};
}

void PrintReply(const script::Call& call, bool ok, const Value& reply) {
  const Dictionary line{
      {"call", call.operation}, {"args", call.arguments}, {ok ? "result" : "error", reply}};
  fmt::print("{}\n", JsonText(line));
  std::fflush(stdout);
}

// The session that a call with one argument names.
std::optional<std::int64_t> SessionOf(const script::Call& call) {
  if (call.values.size() != 1 || call.values[0].integer() == nullptr) return std::nullopt;
  return *call.values[0].integer();
}

}  // namespace

Player::Player(Client client) : client_(std::move(client)) {}

Player::~Player() {
  MutexLock lock(replies_->mutex);
  replies_->closing = true;
}

Outcome Player::play(const script::Step& step) {
  if (const auto* call = std::get_if<script::Call>(&step.action)) return playCall(*call);
  if (const auto* expect = std::get_if<script::Expect>(&step.action)) return playExpect(*expect);
  std::this_thread::sleep_for(std::get<script::Sleep>(step.action).duration);
  return checkConnection();
}

Outcome Player::playCall(const script::Call& call) {
  if (auto connection = checkConnection(); !connection) return connection;
  const auto session = SessionOf(call);
  const bool start = call.operation == kStart && session.has_value();
  if (session && (call.operation == kStop || call.operation == kDestroy)) stopped_.insert(*session);
  if (call.operation == kKill) killed_ = true;

  const auto given = std::make_shared<bool>(false);  // guarded by the mutex of the replies
  {
    MutexLock lock(replies_->mutex);
    if (start) {
      replies_->starts.insert(*session);
    } else {
      ++replies_->outstanding;
    }
  }
  client_.call(call.operation, call.values,
               [replies = replies_, call, start, session, given](const Result<Value>& reply) {
                 const Value value = reply ? reply.value() : AsValue(reply.error());
                 MutexLock lock(replies->mutex);
                 if (replies->closing) return;
                 PrintReply(call, reply.ok(), value);
                 if (start) {
                   replies->starts.erase(replies->starts.find(*session));
                 } else {
                   --replies->outstanding;
                 }
                 if (call.wait) replies->last = value;
                 *given = true;
                 replies->changed.notifyAll();
               });
  if (!call.wait) return Success();
  {
    MutexLock lock(replies_->mutex);
    while (!*given) replies_->changed.wait(replies_->mutex);
  }
  return checkConnection();
}

Outcome Player::playExpect(const script::Expect& expect) {
  MutexLock lock(replies_->mutex);
  if (!replies_->last) return Failed("No reply has been waited for yet that could be expected.");
  // Compared as printed, so that a script can expect the text of an earlier run.
  const std::string last = JsonText(*replies_->last);
  const auto printed = ValueFromJson(last);
  if (printed && printed.value() == expect.value) return Success();
  return Failed(fmt::format("The last reply is {}, not {}.", last, JsonText(expect.value)));
}

Outcome Player::checkConnection() const {
  if (client_.connected() || killed_) return Success();
  return Failed("The service has closed the connection; its log says why.");
}

Outcome Player::finish() {
  const auto deadline = std::chrono::steady_clock::now() + kLastReplies;
  {
    MutexLock lock(replies_->mutex);
    const auto due = [this](std::int64_t session) { return stopped_.contains(session); };
    while (replies_->outstanding > 0) replies_->changed.wait(replies_->mutex);
    bool inTime = true;
    while (inTime && std::any_of(replies_->starts.begin(), replies_->starts.end(), due)) {
      inTime = replies_->changed.waitUntil(replies_->mutex, deadline);
    }
  }
  return checkConnection();
}

}  // namespace quarvel
